// Parameter, cookie, header and Base64 encoding on arbitrary input: a settings document built
// from fuzzed JSON goes through the request's encoders, a fuzzed header line through the header
// collector, and Base64 must round-trip.
#include <stddef.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>

#include <string>
#include <vector>

#include "platform/json_text.h"
#include "platform/vlibc.h"
#include "platform/webapi_util.h"
#include "request/cred_request_p.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    const std::string text(reinterpret_cast<const char *>(data), size);

    Json::Value headers(Json::objectValue);
    std::vector<char> line(text.begin(), text.end());
    if (KOVA::CredRequestPrivate::WriteHeaderToJsonValue(line.data(), 1, line.size(), &headers) !=
        line.size()) {
        abort();
    }

    std::vector<char> encoded((size + 2) / 3 * 4 + 1);
    if (!VLIBCBase64SzEncodeFull(data, size, encoded.data(), encoded.size(), 0)) {
        abort();
    }
    std::vector<unsigned char> decoded(size + 1);
    size_t decodedLength = decoded.size();
    if (!VLIBCBase64Decode(encoded.data(), strlen(encoded.data()), decoded.data(),
                           &decodedLength) ||
        decodedLength != size || (size > 0 && memcmp(decoded.data(), data, size) != 0)) {
        abort();
    }
    decodedLength = decoded.size();
    VLIBCBase64Decode(text.data(), text.size(), decoded.data(), &decodedLength);

    Json::Value document;
    if (!kova::JsonFromString(text, document)) {
        return 0;
    }
    std::string pairs;
    KOVA::WebAPIUtil::JsonObjTostrPair(document, pairs, true, false);
    KOVA::WebAPIUtil::JsonObjTostrPair(document, pairs, true, true);

    KOVA::CredRequest request;
    KOVA::CredRequestPrivate settings(&request);
    if (document.isObject()) {
        // No "EncURL" and no token provider: the envelopes fail without any network use.
        settings.SetData("GetParam", document);
        settings.SetData("Cookie", document);
        settings.SetRawData("Format", document.get("Format", "JSON"));
        settings.SetRawData("Crypto", document.get("Crypto", 0));
        settings.GetParamString(document);
        settings.GetParamJsonObj(document);
        settings.GetCookies();
    }
    return 0;
}
