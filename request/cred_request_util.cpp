// State of KOVA::CredRequestUtil: the process-wide API description cache and last error.
#include "kovacredential/cred_request_util.h"

#include "request/cred_request_util_p.h"

namespace KOVA {

Json::Value CredRequestUtil::m_jsData;
// A plain int, as programs built against soname 6 expect; the library reaches it only through
// the atomic accessors below.
int CredRequestUtil::m_errCode = CRED_REQ_ERR_NONE;

void SetUtilError(int code) {
    __atomic_store_n(&CredRequestUtil::m_errCode, code, __ATOMIC_RELAXED);
}

int UtilError() {
    return __atomic_load_n(&CredRequestUtil::m_errCode, __ATOMIC_RELAXED);
}

}  // namespace KOVA
