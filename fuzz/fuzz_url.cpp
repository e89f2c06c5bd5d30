// URL splitting, joining and masking on arbitrary text: ParseURL must split or refuse, never
// read out of bounds, GetURL must accept whatever ParseURL produced, and UrlForLog must leave a
// URL without secrets as it is.
#include "fuzz_target.h"
#include "kovacredential/cred_request_util.h"
#include "platform/kova_log.h"

KOVA_FUZZ_TARGET(url) {
    // The URL a log record shows: a URL without user information, query or fragment is kept.
    const std::string shown = kova::UrlForLog(url);
    Require(url.find_first_of("@?#") != std::string::npos || shown == url);

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
