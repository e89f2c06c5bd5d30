// The relay directory client's answer check on arbitrary text: a usable answer is a JSON object
// whose "errno" is 0; everything else must be refused cleanly.
#include "fuzz_target.h"
#include "kovacredential/cred_request_farlink.h"
#include "request/cred_request_farlink_p.h"

KOVA_FUZZ_TARGET(text) {
    KOVA::CredRequestFarlink owner;
    KOVA::CredRequestFarlinkPrivate client(&owner);
    Json::Value answer;
    Require(!client.CheckResponse(text, &answer) || answer.isObject());
    client.SetServerId(text);
    Require(client.GetServerIdMd5().size() == (text.empty() ? 0u : 32u) ||
            client.GetServerIdMd5().size() == 32u);
    client.SetServiceId(text);
    client.GetErrors();
}
