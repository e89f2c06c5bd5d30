// The encryption answer on arbitrary text and the envelopes built from it: the answer's "data"
// becomes the RSA envelope of a login's parameters (cipher field name, server time member and
// public key all from the answer), and the AES envelope is made with a token and key from the
// answer too, and must decrypt to the pair text it wraps.
#include <stdio.h>
#include <string.h>

#include "fuzz_target.h"
#include "kovacredential/cred_request_util.h"
#include "kovacredential/kovaplatform.h"
#include "platform/json_text.h"
#include "platform/webapi_util.h"
#include "request/cred_request_p.h"
#include "request/cred_request_util_p.h"

namespace {

// Token and key the platform token service hands out for the current input.
std::string gToken;
std::string gKey;

int FuzzTokens(char *token, size_t tokenSize, char *key, size_t keySize) {
    snprintf(token, tokenSize, "%s", gToken.c_str());
    snprintf(key, keySize, "%s", gKey.c_str());
    return gToken == "fail" ? -1 : 0;
}

}  // namespace

KOVA_FUZZ_TARGET(text) {
    Json::Value info;
    if (!KOVA::ReadEncInfoAnswer(text, info)) {
        return;
    }
    Json::Value root;
    Require(kova::JsonFromLenientText(text, root, false) && info == root["data"]);
    if (!info.isObject()) {
        return;  // the RSA envelope refuses such information before using it
    }

    KOVA::CredRequest request;
    KOVA::CredRequestPrivate p(&request);
    Json::Value params(Json::objectValue);
    params["account"] = "admin";
    params["passwd"] = "secret";
    params["format"] = "sid";
    std::string name, value;
    if (p.GetRSAEncParam(params, info, name, value)) {
        const Json::Value &cipherKey = info["cipherkey"];
        Require(name == (cipherKey.isString() ? cipherKey.asString() : std::string()) &&
                !value.empty());
    }

    gToken = kova::JsonText(info["token"]);
    gKey = kova::JsonText(info["key"]);
    KOVACloudServiceHxtokenSetProvider(FuzzTokens);
    std::string textName, cipher, tokenName, token;
    const bool aes = p.GetAESEncParam(info, textName, cipher, tokenName, token);
    KOVACloudServiceHxtokenSetProvider(nullptr);
    if (aes) {
        // The envelope opens with the key the token service gave, to the pairs it wraps (cut
        // at a NUL, as every decrypted text is).
        std::string pairs, plain;
        KOVA::WebAPIUtil::JsonObjTostrPair(info, pairs, true, false);
        const std::string key = gKey.substr(0, strnlen(gKey.c_str(), 32));
        Require(textName == "__tXeTrEhPiC" && tokenName == "__nEkOtReHpIc" &&
                KOVA::CredRequestUtil::GetDecryptAESString(key, cipher, plain) &&
                plain == pairs.substr(0, strnlen(pairs.c_str(), pairs.size())));
    }
}
