// State of KOVA::CredRequestUtil: the process-wide API description cache and the per-thread
// last error.
#include "kovacredential/cred_request_util.h"

namespace KOVA {

Json::Value CredRequestUtil::m_jsData;
thread_local int CredRequestUtil::m_errCode = CRED_REQ_ERR_NONE;

}  // namespace KOVA
