// Writing the session of a credential (replacing any earlier one), verified by reading it back.
#include "credential/cred_internal.h"
#include "kovacredential/kovacred.h"
#include "platform/kova_log.h"

namespace {

constexpr const char kUnit[] = "cred_sess_set";
constexpr int kLineArg = 10;
constexpr int kLineOpen = 15;
constexpr int kLineUpdate = 19;

}  // namespace

int KOVACredSessSetByID(long id, const KOVA_CRED_SESS *pSess) {
    if (pSess == nullptr) {
        return kova::ArgInvalid(kUnit, kLineArg, "__null != pSess");
    }
    kova::cred::Database db = kova::cred::OpenDatabase(kUnit, kLineOpen);
    if (!db) {
        return -1;
    }
    if (KOVACredSessDBRecordUpdate(db.get(), id, pSess) != 0) {
        kova::LogInnerFailure(kUnit, kLineUpdate, "Set Cred record failed. id:[%ld]", id);
        return -1;
    }
    return 0;
}
