// Session records: construction, release, clearing and list walking.
#include <new>

#include "credential/cred_internal.h"
#include "kovacredential/kovacred.h"
#include "platform/kova_log.h"

namespace {

constexpr const char kUnit[] = "cred_sess_alloc";
constexpr int kLineAllocLog = 9;
constexpr int kLineAllocError = 10;
constexpr int kLineFreeArg = 19;

}  // namespace

_tag_kova_cred_sess_::_tag_kova_cred_sess_() = default;

// The string members go in reverse order of declaration; `next` is never followed.
_tag_kova_cred_sess_::~_tag_kova_cred_sess_() = default;

namespace kova {
namespace cred {

void ResetSess(KOVA_CRED_SESS *pSess) {
    pSess->next = nullptr;
    pSess->filled = 0;
    pSess->id = -1;
    pSess->access_token.clear();
    pSess->csrf_token.clear();
    pSess->extra_info.clear();
}

}  // namespace cred
}  // namespace kova

KOVA_CRED_SESS *KOVACredSessAlloc(void) {
    KOVA_CRED_SESS *pSess = new (std::nothrow) KOVA_CRED_SESS();
    if (pSess == nullptr) {
        kova::Log("%s:%d Allocate KOVA_CRED_SESS failed. %m", kUnit, kLineAllocLog);
        VLIBCErrSetEx(KOVA_ERR_OUT_OF_MEMORY, kUnit, kLineAllocError);
    }
    return pSess;
}

int KOVACredSessFree(KOVA_CRED_SESS *pSess) {
    if (pSess == nullptr) {
        return kova::ArgInvalid(kUnit, kLineFreeArg, "__null != pSess");
    }
    delete pSess;
    return 0;
}

int KOVACredSessClear(KOVA_CRED_SESS *pSess) {
    if (pSess == nullptr) {
        return -1;
    }
    if (pSess->next != nullptr) {
        KOVACredSessListFree(&pSess->next);
    }
    kova::cred::ResetSess(pSess);
    return 0;
}

void KOVACredSessListFree(KOVA_CRED_SESS **ppSessList) {
    while (*ppSessList != nullptr) {
        KOVA_CRED_SESS *head = *ppSessList;
        *ppSessList = head->next;
        KOVACredSessFree(head);
    }
}

KOVA_CRED_SESS *KOVACredSessNext(const KOVA_CRED_SESS *pSess) {
    return pSess != nullptr ? pSess->next : nullptr;
}
