// Setters of the KOVA_CRED members. Each returns 0, or -1 on a null argument after logging
// "Invaild Argument" and recording error 3328 with this header's name and the setter's number.
// String setters copy szVal (checked before the record); "" empties the member.
//
// Concurrency: separate records may be used on separate threads at once; one record is used
// by one thread at a time.
#ifndef KOVACREDENTIAL_KOVACREDSETTER_H
#define KOVACREDENTIAL_KOVACREDSETTER_H

#include <stddef.h>
#include <stdint.h>

#include "kovacred.h"

KOVA_EXPORT int KOVACredItemSetID(KOVA_CRED *pCred, int32_t val);                   // 1
KOVA_EXPORT int KOVACredItemSetCreateTime(KOVA_CRED *pCred, int32_t val);           // 2
KOVA_EXPORT int KOVACredItemSetModifyTime(KOVA_CRED *pCred, int32_t val);           // 3
KOVA_EXPORT int KOVACredItemSetOwner(KOVA_CRED *pCred, int32_t val);                // 4
KOVA_EXPORT int KOVACredItemSetPort(KOVA_CRED *pCred, int32_t val);                 // 5
KOVA_EXPORT int KOVACredItemSetHost(KOVA_CRED *pCred, const char *szVal);           // 6
KOVA_EXPORT int KOVACredItemSetApplication(KOVA_CRED *pCred, const char *szVal);    // 7
KOVA_EXPORT int KOVACredItemSetRemoteAccount(KOVA_CRED *pCred, const char *szVal);  // 8
KOVA_EXPORT int KOVACredItemSetRemotePasswd(KOVA_CRED *pCred, const char *szVal);   // 9
KOVA_EXPORT int KOVACredItemSetProtocol(KOVA_CRED *pCred, const char *szVal);       // 10
KOVA_EXPORT int KOVACredItemSetExtraInfo(KOVA_CRED *pCred, const char *szVal);      // 11

#endif  // KOVACREDENTIAL_KOVACREDSETTER_H
