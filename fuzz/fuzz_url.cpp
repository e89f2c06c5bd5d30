// URL splitting and joining on arbitrary text: ParseURL must split or refuse, never read out
// of bounds, and GetURL must accept whatever ParseURL produced.
#include "fuzz_target.h"
#include "kovacredential/cred_request_util.h"

KOVA_FUZZ_TARGET(url) {
    std::string scheme = "keep", host = "keep", port = "keep";
    if (!KOVA::CredRequestUtil::ParseURL(url, scheme, host, port)) {
        // An empty URL leaves the outputs untouched.
        Require(!url.empty() || (scheme == "keep" && host == "keep" && port == "keep"));
        return;
    }
    Require(scheme == "http" || scheme == "https");
    const std::string joined =
        KOVA::CredRequestUtil::GetURL(scheme, host, atoi(port.c_str()), "webapi/query.cgi");
    Require(joined.compare(0, scheme.size() + 3, scheme + "://") == 0);
}
