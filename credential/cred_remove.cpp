// Removing a credential together with its session.
#include "credential/cred_internal.h"
#include "kovacredential/kovacred.h"
#include "platform/kova_log.h"

namespace {

constexpr const char kUnit[] = "cred_remove";
constexpr int kLineOpen = 14;
constexpr int kLineRemove = 18;

}  // namespace

int KOVACredRemoveByID(long id) {
    kova::cred::Database db = kova::cred::OpenDatabase(kUnit, kLineOpen);
    if (!db) {
        return -1;
    }
    if (KOVACredDBRecordRemove(db.get(), id) != 0) {
        kova::LogInnerFailure(kUnit, kLineRemove, "Remove Cred record failed. id:[%ld]", id);
        return -1;
    }
    return 0;
}
