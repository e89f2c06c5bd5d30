// Setters of the session record's members. Messages name the declaring header and the accessor's
// number in it.
#include "kovacredential/kovacredsesssetter.h"

#include "credential/cred_internal.h"

namespace {

constexpr const char kHeader[] = "../include/kovacredential/kovacredsesssetter.h";
constexpr const char kRecordCheckInt[] = "__null != pSess";
constexpr const char kRecordCheck[] = "NULL != pSess";

constexpr int kLineID = 1;
constexpr int kLineAccessToken = 2;
constexpr int kLineCsrfToken = 3;
constexpr int kLineExtraInfo = 4;

}  // namespace

using namespace kova::cred;

int KOVACredSessItemSetID(KOVA_CRED_SESS *pSess, int32_t val) {
    return SetIntMember(pSess, &KOVA_CRED_SESS::id, val, kHeader, kLineID, kRecordCheckInt);
}

int KOVACredSessItemSetAccessToken(KOVA_CRED_SESS *pSess, const char *szVal) {
    return SetStringMember(pSess, &KOVA_CRED_SESS::access_token, szVal, kHeader, kLineAccessToken,
                           kRecordCheck);
}

int KOVACredSessItemSetCsrfToken(KOVA_CRED_SESS *pSess, const char *szVal) {
    return SetStringMember(pSess, &KOVA_CRED_SESS::csrf_token, szVal, kHeader, kLineCsrfToken,
                           kRecordCheck);
}

int KOVACredSessItemSetExtraInfo(KOVA_CRED_SESS *pSess, const char *szVal) {
    return SetStringMember(pSess, &KOVA_CRED_SESS::extra_info, szVal, kHeader, kLineExtraInfo,
                           kRecordCheck);
}
