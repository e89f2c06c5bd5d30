// URL splitting and joining on arbitrary text: ParseURL must split or refuse, never read out
// of bounds, and GetURL must accept whatever ParseURL produced.
#include <stddef.h>
#include <stdint.h>
#include <stdlib.h>

#include <string>

#include "kovacredential/cred_request_util.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    const std::string url(reinterpret_cast<const char *>(data), size);
    std::string scheme = "keep", host = "keep", port = "keep";
    if (!KOVA::CredRequestUtil::ParseURL(url, scheme, host, port)) {
        if (url.empty() && (scheme != "keep" || host != "keep" || port != "keep")) {
            abort();  // an empty URL leaves the outputs untouched
        }
        return 0;
    }
    if (scheme != "http" && scheme != "https") {
        abort();
    }
    const std::string joined =
        KOVA::CredRequestUtil::GetURL(scheme, host, atoi(port.c_str()), "webapi/query.cgi");
    if (joined.compare(0, scheme.size() + 3, scheme + "://") != 0) {
        abort();
    }
    return 0;
}
