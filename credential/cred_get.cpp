// Reading one credential by id, and the look-up of a credential by its application tag.
#include <string.h>

#include "credential/cred_internal.h"
#include "kovacredential/kovacred.h"
#include "platform/kova_log.h"

namespace {

constexpr const char kUnit[] = "cred_get";
constexpr int kLineGetArg = 10;
constexpr int kLineGetOpen = 15;
constexpr int kLineGetRead = 19;
constexpr int kLineByApplicationArg = 44;

}  // namespace

int KOVACredGetByID(long id, KOVA_CRED *pCred) {
    if (pCred == nullptr) {
        return kova::ArgInvalid(kUnit, kLineGetArg, "__null != pCred");
    }
    kova::cred::Database db = kova::cred::OpenDatabase(kUnit, kLineGetOpen);
    if (!db) {
        return -1;
    }
    if (KOVACredDBRecordGet(db.get(), id, pCred) < 0) {
        kova::LogInnerFailure(kUnit, kLineGetRead, "Get Cred record failed. id:[%ld]", id);
        return -1;
    }
    return 0;
}

int KOVACredIDGetByApplication(const char *szApplication) {
    if (szApplication == nullptr) {
        return kova::ArgInvalid(kUnit, kLineByApplicationArg, "__null != szApplication");
    }
    // What the head of KOVACredListGet's list filtered by KOVACredKeepByApplication would be,
    // without a record for every row.
    return kova::cred::ListNewestCredIdByApplication(szApplication);
}

int KOVACredKeepByApplication(KOVA_CRED *pCred, void *pArg) {
    if (pCred == nullptr || pArg == nullptr) {
        return 0;
    }
    return strcmp(pCred->application.c_str(), static_cast<const char *>(pArg)) == 0 ? 1 : 0;
}
