// Reading the session of one credential.
#include "credential/cred_internal.h"
#include "kovacredential/kovacred.h"
#include "platform/kova_log.h"

namespace {

constexpr const char kUnit[] = "cred_sess_get";
constexpr int kLineGetArg = 10;
constexpr int kLineGetOpen = 15;
constexpr int kLineGetRead = 20;

}  // namespace

int KOVACredSessGetByID(long id, KOVA_CRED_SESS *pSess) {
    if (pSess == nullptr) {
        return kova::ArgInvalid(kUnit, kLineGetArg, "__null != pSess");
    }
    kova::cred::Database db = kova::cred::OpenDatabase(kUnit, kLineGetOpen);
    if (!db) {
        return -1;
    }
    if (KOVACredSessDBRecordGet(db.get(), id, pSess) < 0) {
        kova::LogInnerFailure(kUnit, kLineGetRead, "Get Cred_sess record failed. id:[%ld]", id);
        return -1;
    }
    return 0;
}
