// Getters of the credential record's members. Messages name the declaring header and the accessor's
// number in it.
#include "kovacredential/kovacredgetter.h"

#include "credential/cred_internal.h"

namespace {

constexpr const char kHeader[] = "../include/kovacredential/kovacredgetter.h";
constexpr const char kRecordCheck[] = "NULL != pCred";

constexpr int kLineID = 1;
constexpr int kLineCreateTime = 2;
constexpr int kLineModifyTime = 3;
constexpr int kLineOwner = 4;
constexpr int kLinePort = 5;
constexpr int kLineHost = 6;
constexpr int kLineApplication = 7;
constexpr int kLineRemoteAccount = 8;
constexpr int kLineRemotePasswd = 9;
constexpr int kLineProtocol = 10;
constexpr int kLineExtraInfo = 11;

}  // namespace

using namespace kova::cred;

int KOVACredItemGetID(int32_t *pVal, const KOVA_CRED *pCred) {
    return GetIntMember(pVal, pCred, &KOVA_CRED::id, kHeader, kLineID, kRecordCheck);
}

int KOVACredItemGetCreateTime(int32_t *pVal, const KOVA_CRED *pCred) {
    return GetIntMember(pVal, pCred, &KOVA_CRED::ctime, kHeader, kLineCreateTime, kRecordCheck);
}

int KOVACredItemGetModifyTime(int32_t *pVal, const KOVA_CRED *pCred) {
    return GetIntMember(pVal, pCred, &KOVA_CRED::mtime, kHeader, kLineModifyTime, kRecordCheck);
}

int KOVACredItemGetOwner(int32_t *pVal, const KOVA_CRED *pCred) {
    return GetIntMember(pVal, pCred, &KOVA_CRED::owner, kHeader, kLineOwner, kRecordCheck);
}

int KOVACredItemGetPort(int32_t *pVal, const KOVA_CRED *pCred) {
    return GetIntMember(pVal, pCred, &KOVA_CRED::port, kHeader, kLinePort, kRecordCheck);
}

int KOVACredItemGetHost(char *szBuf, size_t cbBuf, const KOVA_CRED *pCred) {
    return GetStringMember(szBuf, cbBuf, pCred, &KOVA_CRED::host, kHeader, kLineHost, kRecordCheck);
}

int KOVACredItemGetApplication(char *szBuf, size_t cbBuf, const KOVA_CRED *pCred) {
    return GetStringMember(szBuf, cbBuf, pCred, &KOVA_CRED::application, kHeader, kLineApplication,
                           kRecordCheck);
}

int KOVACredItemGetRemoteAccount(char *szBuf, size_t cbBuf, const KOVA_CRED *pCred) {
    return GetStringMember(szBuf, cbBuf, pCred, &KOVA_CRED::remote_account, kHeader,
                           kLineRemoteAccount, kRecordCheck);
}

int KOVACredItemGetRemotePasswd(char *szBuf, size_t cbBuf, const KOVA_CRED *pCred) {
    return GetStringMember(szBuf, cbBuf, pCred, &KOVA_CRED::remote_passwd, kHeader,
                           kLineRemotePasswd, kRecordCheck);
}

int KOVACredItemGetProtocol(char *szBuf, size_t cbBuf, const KOVA_CRED *pCred) {
    return GetStringMember(szBuf, cbBuf, pCred, &KOVA_CRED::protocol, kHeader, kLineProtocol,
                           kRecordCheck);
}

int KOVACredItemGetExtraInfo(char *szBuf, size_t cbBuf, const KOVA_CRED *pCred) {
    return GetStringMember(szBuf, cbBuf, pCred, &KOVA_CRED::extra_info, kHeader, kLineExtraInfo,
                           kRecordCheck);
}
