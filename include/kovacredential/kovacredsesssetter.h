// Setters of the KOVA_CRED_SESS members. Each returns 0, or -1 on a null argument after logging
// "Invaild Argument" and recording error 3328 with this header's name and the setter's number.
// String setters copy szVal (checked before the record); "" empties the member.
//
// Concurrency: separate records may be used on separate threads at once; one record is used
// by one thread at a time.
#ifndef KOVACREDENTIAL_KOVACREDSESSSETTER_H
#define KOVACREDENTIAL_KOVACREDSESSSETTER_H

#include <stddef.h>
#include <stdint.h>

#include "kovacred.h"

KOVA_EXPORT int KOVACredSessItemSetID(KOVA_CRED_SESS *pSess, int32_t val);                 // 1
KOVA_EXPORT int KOVACredSessItemSetAccessToken(KOVA_CRED_SESS *pSess, const char *szVal);  // 2
KOVA_EXPORT int KOVACredSessItemSetCsrfToken(KOVA_CRED_SESS *pSess, const char *szVal);    // 3
KOVA_EXPORT int KOVACredSessItemSetExtraInfo(KOVA_CRED_SESS *pSess, const char *szVal);    // 4

#endif  // KOVACREDENTIAL_KOVACREDSESSSETTER_H
