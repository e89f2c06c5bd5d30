// Listing every session, newest first, through an optional filter.
#include "credential/cred_internal.h"
#include "kovacredential/kovacred.h"
#include "platform/kova_log.h"

namespace {

constexpr const char kUnit[] = "cred_sess_list";
constexpr int kLineArg = 14;
constexpr int kLineOpen = 19;

}  // namespace

int KOVACredSessListGet(KOVA_CRED_SESS **ppSessList, KOVA_CRED_SESS_FILTER filter, void *pArg) {
    if (ppSessList == nullptr) {
        return kova::ArgInvalid(kUnit, kLineArg, "__null != pSessList");
    }
    kova::cred::Database db = kova::cred::OpenDatabase(kUnit, kLineOpen);
    if (!db) {
        return -1;
    }
    KOVA_CRED_SESS *head = KOVACredSessDBRecordGetList(db.get(), nullptr, nullptr, 0);
    db.reset();
    int kept = 0;
    for (KOVA_CRED_SESS **link = &head; *link != nullptr;) {
        KOVA_CRED_SESS *rec = *link;
        if (filter != nullptr && filter(rec, pArg) == 0) {
            *link = rec->next;
            KOVACredSessFree(rec);
        } else {
            ++kept;
            link = &rec->next;
        }
    }
    if (kept > 0) {
        *ppSessList = head;
    }
    return kept;
}
