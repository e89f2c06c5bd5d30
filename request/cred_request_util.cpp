// Process-wide state of KOVA::CredRequestUtil: the API description cache and the last error.
#include "kovacredential/cred_request_util.h"

namespace KOVA {

Json::Value CredRequestUtil::m_jsData;
int CredRequestUtil::m_errCode = CRED_REQ_ERR_NONE;

}  // namespace KOVA
