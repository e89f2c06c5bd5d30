// The discovery answer on arbitrary text and the cache look-ups on it: a stored answer's "data"
// is what the look-ups read, an API it describes answers with its "path" and "requestFormat"
// texts, and an API it does not describe fails without a cache entry of its own. The
// credential's scheme is one libcurl does not speak, so a look-up that queries the server
// again fails at once without any network use.
#include <stddef.h>
#include <stdint.h>
#include <stdlib.h>

#include <string>
#include <vector>

#include "kovacredential/cred_request_util.h"
#include "platform/json_text.h"
#include "request/cred_request_util_p.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    const std::string text(reinterpret_cast<const char *>(data), size);
    KOVA_CRED cred;
    cred.id = 7;
    cred.protocol = "kova-fuzz";
    cred.host = "127.0.0.1";
    cred.port = 1;

    const bool stored = KOVA::StoreWebAPIDescAnswer("7", text);
    Json::Value answer;
    const bool success = kova::JsonFromString(text, answer) && kova::JsonIsSuccess(answer);
    if (stored != success || stored != KOVA::CredRequestUtil::IsCredIdCached(7)) {
        abort();
    }
    if (!stored) {
        return 0;
    }
    const Json::Value desc = answer["data"];
    if (!(KOVA::CredRequestUtil::m_jsData["webapiDesc"]["7"] == desc)) {
        abort();
    }
    std::vector<std::string> apis{"KOVA.API.Missing"};
    if (desc.isObject()) {
        for (const std::string &name : desc.getMemberNames()) {
            if (apis.size() < 5) {
                apis.push_back(name);
            }
        }
    }
    for (const std::string &api : apis) {
        const Json::Value entry = desc.isObject() ? desc.get(api, Json::Value()) : Json::Value();
        const std::string path = KOVA::CredRequestUtil::GetWebAPIPath(&cred, api);
        std::string format = "unset";
        const bool formatFound = KOVA::CredRequestUtil::GetWebAPIRequestFormat(&cred, api, format);
        if (entry.empty()) {
            // Not described: the look-ups query the server again, which fails.
            if (!path.empty() || formatFound) {
                abort();
            }
            continue;
        }
        const Json::Value none;
        const Json::Value &pathValue = entry.isObject() ? entry["path"] : none;
        const Json::Value &formatValue = entry.isObject() ? entry["requestFormat"] : none;
        if (path != kova::JsonText(pathValue) || !formatFound ||
            format != kova::JsonText(formatValue)) {
            abort();
        }
    }
    KOVA::CredRequestUtil::RemoveWebAPIDesc(&cred);
    if (KOVA::CredRequestUtil::IsCredIdCached(7)) {
        abort();
    }
    return 0;
}
