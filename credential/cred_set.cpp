// Writing a credential over an existing row, verified by reading it back.
#include "credential/cred_internal.h"
#include "kovacredential/kovacred.h"
#include "platform/kova_log.h"

namespace {

constexpr const char kUnit[] = "cred_set";
constexpr int kLineArg = 10;
constexpr int kLineOpen = 15;
constexpr int kLineUpdate = 19;

}  // namespace

int KOVACredSetByID(long id, const KOVA_CRED *pCred) {
    if (pCred == nullptr) {
        return kova::ArgInvalid(kUnit, kLineArg, "__null != pCred");
    }
    kova::cred::Database db = kova::cred::OpenDatabase(kUnit, kLineOpen);
    if (!db) {
        return -1;
    }
    if (KOVACredDBRecordUpdate(db.get(), id, pCred) != 0) {
        kova::LogInnerFailure(kUnit, kLineUpdate, "Set Cred record failed. id:[%ld]", id);
        return -1;
    }
    return 0;
}
