// Setters of the credential record's members. Messages name the declaring header and the accessor's
// number in it.
#include "kovacredential/kovacredsetter.h"

#include "credential/cred_internal.h"

namespace {

constexpr const char kHeader[] = "../include/kovacredential/kovacredsetter.h";
constexpr const char kRecordCheckInt[] = "__null != pCred";
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

int KOVACredItemSetID(KOVA_CRED *pCred, int32_t val) {
    return SetIntMember(pCred, &KOVA_CRED::id, val, kHeader, kLineID, kRecordCheckInt);
}

int KOVACredItemSetCreateTime(KOVA_CRED *pCred, int32_t val) {
    return SetIntMember(pCred, &KOVA_CRED::ctime, val, kHeader, kLineCreateTime, kRecordCheckInt);
}

int KOVACredItemSetModifyTime(KOVA_CRED *pCred, int32_t val) {
    return SetIntMember(pCred, &KOVA_CRED::mtime, val, kHeader, kLineModifyTime, kRecordCheckInt);
}

int KOVACredItemSetOwner(KOVA_CRED *pCred, int32_t val) {
    return SetIntMember(pCred, &KOVA_CRED::owner, val, kHeader, kLineOwner, kRecordCheckInt);
}

int KOVACredItemSetPort(KOVA_CRED *pCred, int32_t val) {
    return SetIntMember(pCred, &KOVA_CRED::port, val, kHeader, kLinePort, kRecordCheckInt);
}

int KOVACredItemSetHost(KOVA_CRED *pCred, const char *szVal) {
    return SetStringMember(pCred, &KOVA_CRED::host, szVal, kHeader, kLineHost, kRecordCheck);
}

int KOVACredItemSetApplication(KOVA_CRED *pCred, const char *szVal) {
    return SetStringMember(pCred, &KOVA_CRED::application, szVal, kHeader, kLineApplication,
                           kRecordCheck);
}

int KOVACredItemSetRemoteAccount(KOVA_CRED *pCred, const char *szVal) {
    return SetStringMember(pCred, &KOVA_CRED::remote_account, szVal, kHeader, kLineRemoteAccount,
                           kRecordCheck);
}

int KOVACredItemSetRemotePasswd(KOVA_CRED *pCred, const char *szVal) {
    return SetStringMember(pCred, &KOVA_CRED::remote_passwd, szVal, kHeader, kLineRemotePasswd,
                           kRecordCheck);
}

int KOVACredItemSetProtocol(KOVA_CRED *pCred, const char *szVal) {
    return SetStringMember(pCred, &KOVA_CRED::protocol, szVal, kHeader, kLineProtocol,
                           kRecordCheck);
}

int KOVACredItemSetExtraInfo(KOVA_CRED *pCred, const char *szVal) {
    return SetStringMember(pCred, &KOVA_CRED::extra_info, szVal, kHeader, kLineExtraInfo,
                           kRecordCheck);
}
