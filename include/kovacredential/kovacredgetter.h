// Getters of the KOVA_CRED members. Each returns 0, or -1 on a null argument or a zero cbBuf after
// logging "Invaild Argument" and recording error 3328 with this header's name and the getter's
// number. String getters write at most cbBuf - 1 bytes and always a terminating NUL; a longer
// value is cut without notice.
//
// Concurrency: separate records may be used on separate threads at once; one record is used
// by one thread at a time.
#ifndef KOVACREDENTIAL_KOVACREDGETTER_H
#define KOVACREDENTIAL_KOVACREDGETTER_H

#include <stddef.h>
#include <stdint.h>

#include "kovacred.h"

KOVA_EXPORT int KOVACredItemGetID(int32_t *pVal, const KOVA_CRED *pCred);                       // 1
KOVA_EXPORT int KOVACredItemGetCreateTime(int32_t *pVal, const KOVA_CRED *pCred);               // 2
KOVA_EXPORT int KOVACredItemGetModifyTime(int32_t *pVal, const KOVA_CRED *pCred);               // 3
KOVA_EXPORT int KOVACredItemGetOwner(int32_t *pVal, const KOVA_CRED *pCred);                    // 4
KOVA_EXPORT int KOVACredItemGetPort(int32_t *pVal, const KOVA_CRED *pCred);                     // 5
KOVA_EXPORT int KOVACredItemGetHost(char *szBuf, size_t cbBuf, const KOVA_CRED *pCred);         // 6
KOVA_EXPORT int KOVACredItemGetApplication(char *szBuf, size_t cbBuf, const KOVA_CRED *pCred);  // 7
KOVA_EXPORT int KOVACredItemGetRemoteAccount(char *szBuf, size_t cbBuf,
                                             const KOVA_CRED *pCred);  // 8
KOVA_EXPORT int KOVACredItemGetRemotePasswd(char *szBuf, size_t cbBuf,
                                            const KOVA_CRED *pCred);                          // 9
KOVA_EXPORT int KOVACredItemGetProtocol(char *szBuf, size_t cbBuf, const KOVA_CRED *pCred);   // 10
KOVA_EXPORT int KOVACredItemGetExtraInfo(char *szBuf, size_t cbBuf, const KOVA_CRED *pCred);  // 11

#endif  // KOVACREDENTIAL_KOVACREDGETTER_H
