// Weak stand-ins for the few credential-store entry points the request layer calls, so that
// this layer links on its own. The credential store's definitions replace them at link time
// wherever the store is built in; this file can go once both always ship together.
#include <new>

#include "kovacredential/kovacred.h"

#define KOVA_WEAK __attribute__((weak))

KOVA_WEAK _tag_kova_cred_::_tag_kova_cred_() = default;
KOVA_WEAK _tag_kova_cred_::~_tag_kova_cred_() = default;
KOVA_WEAK _tag_kova_cred_sess_::_tag_kova_cred_sess_() = default;
KOVA_WEAK _tag_kova_cred_sess_::~_tag_kova_cred_sess_() = default;

KOVA_WEAK KOVA_CRED *KOVACredAlloc(void) {
    return new (std::nothrow) KOVA_CRED();
}

KOVA_WEAK int KOVACredFree(KOVA_CRED *pCred) {
    delete pCred;
    return 0;
}

KOVA_WEAK KOVA_CRED_SESS *KOVACredSessAlloc(void) {
    return new (std::nothrow) KOVA_CRED_SESS();
}

KOVA_WEAK int KOVACredSessFree(KOVA_CRED_SESS *pSess) {
    delete pSess;
    return 0;
}

// Without the store no credential can be loaded.
KOVA_WEAK int KOVACredGetByID(long, KOVA_CRED *) {
    return -1;
}
