// Getters of the KOVA_CRED_SESS members. Each returns 0, or -1 on a null argument or a zero cbBuf
// after logging "Invaild Argument" and recording error 3328 with this header's name and the
// getter's number. String getters write at most cbBuf - 1 bytes and always a terminating NUL; a
// longer value is cut without notice.
//
// Concurrency: separate records may be used on separate threads at once; one record is used
// by one thread at a time.
#ifndef KOVACREDENTIAL_KOVACREDSESSGETTER_H
#define KOVACREDENTIAL_KOVACREDSESSGETTER_H

#include <stddef.h>
#include <stdint.h>

#include "kovacred.h"

KOVA_EXPORT int KOVACredSessItemGetID(int32_t *pVal, const KOVA_CRED_SESS *pSess);  // 1
KOVA_EXPORT int KOVACredSessItemGetAccessToken(char *szBuf, size_t cbBuf,
                                               const KOVA_CRED_SESS *pSess);  // 2
KOVA_EXPORT int KOVACredSessItemGetCsrfToken(char *szBuf, size_t cbBuf,
                                             const KOVA_CRED_SESS *pSess);  // 3
KOVA_EXPORT int KOVACredSessItemGetExtraInfo(char *szBuf, size_t cbBuf,
                                             const KOVA_CRED_SESS *pSess);  // 4

#endif  // KOVACREDENTIAL_KOVACREDSESSGETTER_H
