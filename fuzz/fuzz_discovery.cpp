// The discovery answer on arbitrary text and the cache look-ups on it: a stored answer's "data"
// is what the look-ups read, an API it describes answers with its "path" and "requestFormat"
// texts, and an API it does not describe fails without a cache entry of its own. The
// credential's scheme is one libcurl does not speak, so a look-up that queries the server
// again fails at once without any network use.
#include <vector>

#include "fuzz_target.h"
#include "kovacredential/cred_request_util.h"
#include "platform/json_text.h"
#include "request/cred_request_util_p.h"

KOVA_FUZZ_TARGET(text) {
    KOVA_CRED cred;
    cred.id = 7;
    cred.protocol = "kova-fuzz";
    cred.host = "127.0.0.1";
    cred.port = 1;

    const bool stored = KOVA::StoreWebAPIDescAnswer("7", text);
    Json::Value answer;
    const bool success = kova::JsonFromString(text, answer) && kova::JsonIsSuccess(answer);
    Require(stored == success && stored == KOVA::CredRequestUtil::IsCredIdCached(7));
    if (!stored) {
        return;
    }
    const Json::Value desc = answer["data"];
    Require(KOVA::CredRequestUtil::m_jsData["webapiDesc"]["7"] == desc);
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
            Require(path.empty() && !formatFound);
            continue;
        }
        const Json::Value none;
        Require(path == kova::JsonText(entry.isObject() ? entry["path"] : none) && formatFound &&
                format == kova::JsonText(entry.isObject() ? entry["requestFormat"] : none));
    }
    KOVA::CredRequestUtil::RemoveWebAPIDesc(&cred);
    Require(!KOVA::CredRequestUtil::IsCredIdCached(7));
}
