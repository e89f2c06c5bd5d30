// Parameter, cookie, header and Base64 encoding on arbitrary input: a settings document built
// from fuzzed JSON goes through the request's encoders, a fuzzed header line through the header
// collector, and Base64 must round-trip.
#include <string.h>

#include <vector>

#include "fuzz_target.h"
#include "platform/json_text.h"
#include "platform/vlibc.h"
#include "platform/webapi_util.h"
#include "request/cred_request_p.h"

KOVA_FUZZ_TARGET(text) {
    Json::Value headers(Json::objectValue);
    std::vector<char> line(text.begin(), text.end());
    Require(KOVA::CredRequestPrivate::WriteHeaderToJsonValue(line.data(), 1, line.size(),
                                                             &headers) == line.size());

    const size_t size = text.size();
    std::vector<char> encoded((size + 2) / 3 * 4 + 1);
    Require(VLIBCBase64SzEncodeFull(reinterpret_cast<const unsigned char *>(text.data()), size,
                                    encoded.data(), encoded.size(), 0));
    std::vector<unsigned char> decoded(size + 1);
    size_t decodedLength = decoded.size();
    Require(
        VLIBCBase64Decode(encoded.data(), strlen(encoded.data()), decoded.data(), &decodedLength) &&
        decodedLength == size && (size == 0 || memcmp(decoded.data(), text.data(), size) == 0));
    decodedLength = decoded.size();
    VLIBCBase64Decode(text.data(), text.size(), decoded.data(), &decodedLength);

    Json::Value document;
    if (!kova::JsonFromString(text, document)) {
        return;
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
}
