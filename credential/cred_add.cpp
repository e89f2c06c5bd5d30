// Inserting a credential as a new row.
#include "credential/cred_internal.h"
#include "kovacredential/kovacred.h"
#include "platform/kova_log.h"

namespace {

constexpr const char kUnit[] = "cred_add";
constexpr int kLineArg = 11;
constexpr int kLineOpen = 16;
constexpr int kLineInsert = 20;

}  // namespace

int KOVACredAdd(KOVA_CRED *pCred) {
    if (pCred == nullptr) {
        return kova::ArgInvalid(kUnit, kLineArg, "__null != pCred");
    }
    kova::cred::Database db = kova::cred::OpenDatabase(kUnit, kLineOpen);
    if (!db) {
        return -1;
    }
    int newId = -1;
    if (KOVACredDBRecordAdd(db.get(), pCred, &newId) != 0) {
        kova::LogInnerFailure(kUnit, kLineInsert, "Add Cred record failed. ");
        return -1;
    }
    pCred->id = newId;
    return 0;
}
