// The library's interface as a program written from its description declares it, without the
// library's own headers: the credential record is an opaque structure reached through the
// store's functions, and KOVA::CredRequestUtil has the exported statics m_jsData and m_errCode
// (a plain signed 32-bit int) beside its static operations.
#ifndef FOREIGN_CALLER_DESCRIBED_H
#define FOREIGN_CALLER_DESCRIBED_H

#include <stdint.h>

#include <string>

#include <json/value.h>

typedef struct _tag_kova_cred_ KOVA_CRED;

KOVA_CRED *KOVACredAlloc(void);
int KOVACredFree(KOVA_CRED *pCred);
int KOVACredItemSetID(KOVA_CRED *pCred, int32_t val);
int KOVACredItemSetPort(KOVA_CRED *pCred, int32_t val);
int KOVACredItemSetHost(KOVA_CRED *pCred, const char *szVal);
int KOVACredItemSetProtocol(KOVA_CRED *pCred, const char *szVal);

namespace KOVA {

class CredRequestUtil {
  public:
    static Json::Value m_jsData;
    static int m_errCode;

    static bool TestURL(const std::string &url);
    static bool GetWebAPIDesc(const KOVA_CRED *cred);
};

}  // namespace KOVA

#endif  // FOREIGN_CALLER_DESCRIBED_H
