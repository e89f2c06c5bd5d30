// Listing every credential, newest first, through an optional filter, and finding the newest
// of an application by the same read.
#include "credential/cred_internal.h"
#include "kovacredential/kovacred.h"
#include "platform/kova_log.h"

namespace {

constexpr const char kUnit[] = "cred_list";
constexpr int kLineArg = 14;
constexpr int kLineOpen = 19;

}  // namespace

int KOVACredListGet(KOVA_CRED **ppCredList, KOVA_CRED_FILTER filter, void *pArg) {
    if (ppCredList == nullptr) {
        return kova::ArgInvalid(kUnit, kLineArg, "__null != pCredList");
    }
    kova::cred::Database db = kova::cred::OpenDatabase(kUnit, kLineOpen);
    if (!db) {
        return -1;
    }
    KOVA_CRED *head = KOVACredDBRecordGetList(db.get(), nullptr, nullptr, 0);
    db.reset();
    int kept = 0;
    for (KOVA_CRED **link = &head; *link != nullptr;) {
        KOVA_CRED *rec = *link;
        if (filter != nullptr && filter(rec, pArg) == 0) {
            *link = rec->next;
            KOVACredFree(rec);
        } else {
            ++kept;
            link = &rec->next;
        }
    }
    if (kept > 0) {
        *ppCredList = head;
    }
    return kept;
}

int kova::cred::ListNewestCredIdByApplication(const char *application) {
    kova::cred::Database db = kova::cred::OpenDatabase(kUnit, kLineOpen);
    if (!db) {
        return -1;
    }
    return NewestCredIdByApplication(db.get(), application);
}
