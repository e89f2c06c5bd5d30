// A link-time stand-in with the library's soname: it defines what described.h declares, so
// that the programs link without the real library, which they load when they run. Its
// operations do nothing useful; a program that ran against it would fail its checks.
#include "described.h"

KOVA_CRED *KOVACredAlloc(void) {
    return nullptr;
}
int KOVACredFree(KOVA_CRED *) {
    return -1;
}
int KOVACredItemSetID(KOVA_CRED *, int32_t) {
    return -1;
}
int KOVACredItemSetPort(KOVA_CRED *, int32_t) {
    return -1;
}
int KOVACredItemSetHost(KOVA_CRED *, const char *) {
    return -1;
}
int KOVACredItemSetProtocol(KOVA_CRED *, const char *) {
    return -1;
}

namespace KOVA {

Json::Value CredRequestUtil::m_jsData;
int CredRequestUtil::m_errCode = 0;

bool CredRequestUtil::TestURL(const std::string &) {
    return true;
}
bool CredRequestUtil::GetWebAPIDesc(const KOVA_CRED *) {
    return false;
}

}  // namespace KOVA
