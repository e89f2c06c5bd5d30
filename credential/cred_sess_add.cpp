// Inserting a session as a new row; SQLite picks its id, which must name an existing credential.
#include "credential/cred_internal.h"
#include "kovacredential/kovacred.h"
#include "platform/kova_log.h"

namespace {

constexpr const char kUnit[] = "cred_sess_add";
constexpr int kLineArg = 11;
constexpr int kLineOpen = 16;
constexpr int kLineInsert = 20;

}  // namespace

int KOVACredSessAdd(KOVA_CRED_SESS *pSess) {
    if (pSess == nullptr) {
        return kova::ArgInvalid(kUnit, kLineArg, "__null != pSess");
    }
    kova::cred::Database db = kova::cred::OpenDatabase(kUnit, kLineOpen);
    if (!db) {
        return -1;
    }
    int newId = -1;
    if (KOVACredSessDBRecordAdd(db.get(), pSess, &newId) != 0) {
        kova::LogInnerFailure(kUnit, kLineInsert, "Add Cred record failed. ");
        return -1;
    }
    pSess->id = newId;
    return 0;
}
