// Getters of the session record's members. Messages name the declaring header and the accessor's
// number in it.
#include "kovacredential/kovacredsessgetter.h"

#include "credential/cred_internal.h"

namespace {

constexpr const char kHeader[] = "../include/kovacredential/kovacredsessgetter.h";
constexpr const char kRecordCheck[] = "NULL != pSess";

constexpr int kLineID = 1;
constexpr int kLineAccessToken = 2;
constexpr int kLineCsrfToken = 3;
constexpr int kLineExtraInfo = 4;

}  // namespace

using namespace kova::cred;

int KOVACredSessItemGetID(int32_t *pVal, const KOVA_CRED_SESS *pSess) {
    return GetIntMember(pVal, pSess, &KOVA_CRED_SESS::id, kHeader, kLineID, kRecordCheck);
}

int KOVACredSessItemGetAccessToken(char *szBuf, size_t cbBuf, const KOVA_CRED_SESS *pSess) {
    return GetStringMember(szBuf, cbBuf, pSess, &KOVA_CRED_SESS::access_token, kHeader,
                           kLineAccessToken, kRecordCheck);
}

int KOVACredSessItemGetCsrfToken(char *szBuf, size_t cbBuf, const KOVA_CRED_SESS *pSess) {
    return GetStringMember(szBuf, cbBuf, pSess, &KOVA_CRED_SESS::csrf_token, kHeader,
                           kLineCsrfToken, kRecordCheck);
}

int KOVACredSessItemGetExtraInfo(char *szBuf, size_t cbBuf, const KOVA_CRED_SESS *pSess) {
    return GetStringMember(szBuf, cbBuf, pSess, &KOVA_CRED_SESS::extra_info, kHeader,
                           kLineExtraInfo, kRecordCheck);
}
