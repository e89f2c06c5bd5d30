// Parameter encoding of KOVA::CredRequest: query strings, form bodies and multipart fields, the
// RSA and AES envelopes around them, and the cookie string.
#include "kovacredential/cred_request_util.h"
#include "kovacredential/kovaplatform.h"
#include "platform/json_text.h"
#include "platform/kova_log.h"
#include "platform/webapi_util.h"
#include "request/cred_request_p.h"

namespace KOVA {

namespace {

constexpr const char kUnit[] = "cred_request";

// Field names of the AES envelope, as the servers expect them.
constexpr const char kAesTextName[] = "__tXeTrEhPiC";
constexpr const char kAesTokenName[] = "__nEkOtReHpIc";
constexpr size_t kAesTokenSize = 36;
constexpr size_t kAesKeySize = 33;

const Json::Value kNull;

}  // namespace

namespace {
// Encryption mode of the document: 0 (plain) when "Crypto" is absent, not a number, or a number
// no mode can be (asInt would throw on a value beyond int).
int CryptoMode(const CredRequestPrivate &p) {
    const Json::Value &mode = p.Setting("Crypto");
    return mode.isInt() ? mode.asInt() : 0;
}

bool IsJsonFormat(const CredRequestPrivate &p) {
    const Json::Value &format = p.Setting("Format");
    return format.isString() && format.asString() == "JSON";
}
}  // namespace

constexpr int kLineParamStringRsaFail = 61;
constexpr int kLineParamStringAesFail = 72;
constexpr int kLineParamStringPairFail = 78;

std::string CredRequestPrivate::GetParamString(const Json::Value &params) {
    const int mode = CryptoMode(*this);
    // The CSRF token is never encrypted or pair-encoded: it is appended in clear at the end.
    Json::Value copy = params;
    std::string token;
    bool hasToken = false;
    if (copy.isObject() && copy.isMember("KovaToken")) {
        const Json::Value &value = copy["KovaToken"];
        token = value.isString() ? value.asString() : kova::JsonToString(value);
        hasToken = true;
        copy.removeMember("KovaToken");
    }
    jsonFormat = IsJsonFormat(*this);

    std::string result;
    if (mode == CRED_REQ_CRYPTO_RSA) {
        std::string name;
        std::string value;
        if (!GetRSAEncParam(copy, name, value)) {
            kova::Log("%s:%d GetRSAEncParamString Fail", kUnit, kLineParamStringRsaFail);
            return "";
        }
        result = name + "=" + WebAPIUtil::URLEncode(value);
    } else if (mode == CRED_REQ_CRYPTO_AES) {
        std::string textName;
        std::string text;
        std::string tokenName;
        std::string aesToken;
        if (!GetAESEncParam(copy, textName, text, tokenName, aesToken)) {
            kova::Log("%s:%d GetAESEncParam Fail", kUnit, kLineParamStringAesFail);
            return "";
        }
        result = textName + "=\"" + WebAPIUtil::URLEncode(text) + "\"&" + tokenName + "=\"" +
                 WebAPIUtil::URLEncode(aesToken) + "\"";
    } else if (!WebAPIUtil::JsonObjTostrPair(copy, result, true, jsonFormat)) {
        kova::Log("%s:%d JsonObjTostrPair Fail", kUnit, kLineParamStringPairFail);
        return result;
    }
    if (hasToken && !token.empty()) {
        result += "&KovaToken=";
        result += token;
    }
    return result;
}

constexpr int kLineParamJsonRsaFail = 105;
constexpr int kLineParamJsonAesFail = 112;

Json::Value CredRequestPrivate::GetParamJsonObj(const Json::Value &params) {
    Json::Value result;
    const int mode = CryptoMode(*this);
    jsonFormat = IsJsonFormat(*this);
    if (mode == CRED_REQ_CRYPTO_RSA) {
        std::string name;
        std::string value;
        if (!GetRSAEncParam(params, name, value)) {
            kova::Log("%s:%d GetRSAEncParamString Fail", kUnit, kLineParamJsonRsaFail);
            return Json::Value();
        }
        result[name] = value;
    } else if (mode == CRED_REQ_CRYPTO_AES) {
        std::string textName;
        std::string text;
        std::string tokenName;
        std::string token;
        if (!GetAESEncParam(params, textName, text, tokenName, token)) {
            kova::Log("%s:%d GetAESEncParam Fail", kUnit, kLineParamJsonAesFail);
            return Json::Value();
        }
        result[textName] = text;
        result[tokenName] = token;
    } else {
        result = params;
    }
    return result;
}

constexpr int kLineRsaNoEncUrl = 138;
constexpr int kLineRsaNoEncInfo = 143;
constexpr int kLineRsaPairFail = 151;
constexpr int kLineRsaEncStringFail = 157;

bool CredRequestPrivate::GetRSAEncParam(const Json::Value &params, std::string &name,
                                        std::string &value) {
    const Json::Value &encUrl = Setting("EncURL");
    if (!encUrl.isString()) {
        kova::Log("%s:%d Get encryption url fail", kUnit, kLineRsaNoEncUrl);
        return false;
    }
    Json::Value info;
    if (!CredRequestUtil::GetEncInfo(encUrl.asString(), info) || !info.isObject()) {
        kova::Log("%s:%d Get encryption information fail", kUnit, kLineRsaNoEncInfo);
        return false;
    }
    return GetRSAEncParam(params, info, name, value);
}

bool CredRequestPrivate::GetRSAEncParam(Json::Value copy, const Json::Value &info,
                                        std::string &name, std::string &value) {
    // The server time travels inside the envelope, under the name the server chose.
    const Json::Value &tokenName = info["ciphertoken"];
    if (copy.isNull()) {
        copy = Json::Value(Json::objectValue);
    }
    if (copy.isObject()) {
        copy[tokenName.isString() ? tokenName.asString() : std::string()] = info["server_time"];
    }
    std::string plain;
    if (!WebAPIUtil::JsonObjTostrPair(copy, plain, true, jsonFormat)) {
        kova::Log("%s:%d JsonObjTostrPair fail", kUnit, kLineRsaPairFail);
        return false;
    }
    const Json::Value &cipherKey = info["cipherkey"];
    const Json::Value &publicKey = info["public_key"];
    name = cipherKey.isString() ? cipherKey.asString() : std::string();
    if (!CredRequestUtil::GetEncString(publicKey.isString() ? publicKey.asString() : "", plain,
                                       value)) {
        kova::Log("%s:%d GetEncString fail", kUnit, kLineRsaEncStringFail);
        return false;
    }
    return true;
}

constexpr int kLineAesNoToken = 176;
constexpr int kLineAesPairFail = 183;
constexpr int kLineAesEncryptFail = 188;

bool CredRequestPrivate::GetAESEncParam(const Json::Value &params, std::string &textName,
                                        std::string &text, std::string &tokenName,
                                        std::string &token) {
    char tokenBuffer[kAesTokenSize] = {};
    char keyBuffer[kAesKeySize] = {};
    if (KOVACloudServiceHxtokenGetToken(tokenBuffer, sizeof(tokenBuffer), keyBuffer,
                                        sizeof(keyBuffer)) < 0) {
        kova::Log("%s:%d Get Token Fail", kUnit, kLineAesNoToken);
        return false;
    }
    tokenName = kAesTokenName;
    token = tokenBuffer;
    std::string plain;
    if (!WebAPIUtil::JsonObjTostrPair(params, plain, true, jsonFormat)) {
        kova::Log("%s:%d JsonObjTostrPair fail", kUnit, kLineAesPairFail);
        return false;
    }
    textName = kAesTextName;
    if (!CredRequestUtil::GetEncryptAESString(keyBuffer, plain, text)) {
        kova::Log("%s:%d GetEncryptAESString fail", kUnit, kLineAesEncryptFail);
        return false;
    }
    return true;
}

constexpr int kLineCookieFormat = 201;

std::string CredRequestPrivate::GetCookies() {
    const Json::Value &cookies = Setting("Cookie");
    if (!cookies.isConvertibleTo(Json::objectValue)) {
        kova::Log("%s:%d Invalid Cookie format", kUnit, kLineCookieFormat);
        return "";
    }
    // Each cookie replaces the one before, so only the name that sorts last is sent.
    std::string result;
    for (auto it = cookies.begin(); it != cookies.end(); ++it) {
        result =
            it.name() + "=" + (it->isString() ? it->asString() : kova::JsonToString(*it)) + ";";
    }
    if (!result.empty()) {
        result.pop_back();
    }
    return result;
}

}  // namespace KOVA
