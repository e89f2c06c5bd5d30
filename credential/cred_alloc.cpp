// Credential records: construction, release, clearing and list walking.
#include <new>

#include "credential/cred_internal.h"
#include "kovacredential/kovacred.h"
#include "platform/kova_log.h"

namespace {

constexpr const char kUnit[] = "cred_alloc";
constexpr int kLineAllocLog = 9;
constexpr int kLineAllocError = 10;
constexpr int kLineFreeArg = 19;

}  // namespace

_tag_kova_cred_::_tag_kova_cred_() = default;

// The string members go in reverse order of declaration; `next` is never followed.
_tag_kova_cred_::~_tag_kova_cred_() = default;

namespace kova {
namespace cred {

void ResetCred(KOVA_CRED *pCred) {
    pCred->next = nullptr;
    pCred->filled = 0;
    pCred->id = -1;
    pCred->ctime = 0;
    pCred->mtime = 0;
    pCred->owner = -1;
    pCred->port = 0;
    pCred->host.clear();
    pCred->remote_account.clear();
    pCred->remote_passwd.clear();
    pCred->protocol.clear();
    pCred->application.clear();
    pCred->extra_info.clear();
}

}  // namespace cred
}  // namespace kova

KOVA_CRED *KOVACredAlloc(void) {
    KOVA_CRED *pCred = new (std::nothrow) KOVA_CRED();
    if (pCred == nullptr) {
        kova::Log("%s:%d Allocate KOVA_CRED failed. %m", kUnit, kLineAllocLog);
        VLIBCErrSetEx(KOVA_ERR_OUT_OF_MEMORY, kUnit, kLineAllocError);
    }
    return pCred;
}

int KOVACredFree(KOVA_CRED *pCred) {
    if (pCred == nullptr) {
        return kova::ArgInvalid(kUnit, kLineFreeArg, "__null != pCred");
    }
    delete pCred;
    return 0;
}

int KOVACredClear(KOVA_CRED *pCred) {
    if (pCred == nullptr) {
        return -1;
    }
    if (pCred->next != nullptr) {
        KOVACredListFree(&pCred->next);
    }
    kova::cred::ResetCred(pCred);
    return 0;
}

void KOVACredListFree(KOVA_CRED **ppCredList) {
    while (*ppCredList != nullptr) {
        KOVA_CRED *head = *ppCredList;
        *ppCredList = head->next;
        KOVACredFree(head);
    }
}

KOVA_CRED *KOVACredNext(const KOVA_CRED *pCred) {
    return pCred != nullptr ? pCred->next : nullptr;
}
