// The relay directory client's answer check on arbitrary text: a usable answer is a JSON object
// whose "errno" is 0; everything else must be refused cleanly.
#include <stddef.h>
#include <stdint.h>
#include <stdlib.h>

#include <string>

#include "kovacredential/cred_request_farlink.h"
#include "request/cred_request_farlink_p.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    const std::string text(reinterpret_cast<const char *>(data), size);
    KOVA::CredRequestFarlink owner;
    KOVA::CredRequestFarlinkPrivate client(&owner);
    Json::Value answer;
    if (client.CheckResponse(text, &answer) && !answer.isObject()) {
        abort();
    }
    client.SetServerId(text);
    if (client.GetServerIdMd5().size() != (text.empty() ? 0u : 32u) &&
        client.GetServerIdMd5().size() != 32u) {
        abort();
    }
    client.SetServiceId(text);
    client.GetErrors();
    return 0;
}
