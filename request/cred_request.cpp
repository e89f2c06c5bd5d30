// KOVA::CredRequest settings: the request settings document, its low-level operations and the
// public setters and getters built on them.
#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_util.h"
#include "platform/kova_log.h"
#include "request/cred_request_p.h"

namespace KOVA {

bool CredRequestPrivate::reqStreamLimited = false;
uint32_t CredRequestPrivate::reqStreamRemaining = 0;
bool CredRequestPrivate::headerMessageShown = false;

namespace {

const Json::Value kNull;

constexpr char kUnit[] = "cred_request";
// Line of the settings' exception-guard records.
constexpr int kLineSettingsException = 30;

}  // namespace

CredRequestPrivate::CredRequestPrivate(CredRequest *ownerRequest)
    : cred(KOVACredAlloc()), sess(KOVACredSessAlloc()), owner(ownerRequest) {
    reqStreamLimited = false;
}

CredRequestPrivate::~CredRequestPrivate() {
    if (headers != nullptr) {
        curl_slist_free_all(headers);
        headers = nullptr;
    }
    if (curl != nullptr) {
        curl_easy_cleanup(curl);
        curl = nullptr;
    }
    if (form != nullptr) {
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wdeprecated-declarations"
        curl_formfree(form);  // the multipart form is built with the form API
#pragma GCC diagnostic pop
        form = nullptr;
    }
    if (cred != nullptr) {
        KOVACredFree(cred);
        cred = nullptr;
    }
    if (sess != nullptr) {
        KOVACredSessFree(sess);
        sess = nullptr;
    }
}

Json::Value *CredRequestPrivate::ObjectSlot(const std::string &key) {
    Json::Value &slot = settings[key];
    if (slot.isNull()) {
        slot = Json::Value(Json::objectValue);
    } else if (!slot.isObject()) {
        error = CRED_REQ_ERR_BAD_PARAM;
        return nullptr;
    }
    return &slot;
}

bool CredRequestPrivate::SetData(const std::string &key, const std::string &name,
                                 const std::string &value) {
    if (key.empty() || name.empty()) {
        error = CRED_REQ_ERR_BAD_PARAM;
        return false;
    }
    Json::Value *slot = ObjectSlot(key);
    if (slot == nullptr) {
        return false;
    }
    (*slot)[name] = value;
    return true;
}

bool CredRequestPrivate::SetData(const std::string &key, const Json::Value &members) {
    if (key.empty() || !members.isObject()) {
        error = CRED_REQ_ERR_BAD_PARAM;
        return false;
    }
    if (members.empty()) {
        return true;
    }
    Json::Value *slot = ObjectSlot(key);
    if (slot == nullptr) {
        return false;
    }
    for (auto it = members.begin(); it != members.end(); ++it) {
        (*slot)[it.name()] = *it;
    }
    return true;
}

bool CredRequestPrivate::SetRawData(const std::string &key, const Json::Value &value) {
    if (key.empty() || value.empty()) {
        error = CRED_REQ_ERR_BAD_PARAM;
        return false;
    }
    settings[key] = value;
    return true;
}

const Json::Value &CredRequestPrivate::GetData(const std::string &key, const std::string &name,
                                               const Json::Value &fallback) const {
    if (key.empty()) {
        return settings;
    }
    const Json::Value *slot = settings.find(key.data(), key.data() + key.size());
    if (slot == nullptr) {
        return fallback;
    }
    if (name.empty()) {
        return *slot;
    }
    if (!slot->isObject()) {
        return fallback;
    }
    const Json::Value *member = slot->find(name.data(), name.data() + name.size());
    return member != nullptr ? *member : fallback;
}

bool CredRequestPrivate::HasData(const std::string &key) const {
    return settings.isMember(key);
}

bool CredRequestPrivate::HasRawData(const std::string &key) const {
    return settings.isMember(key);
}

bool CredRequestPrivate::HasData(const std::string &key, const std::string &name) const {
    const Json::Value *slot = settings.find(key.data(), key.data() + key.size());
    return slot != nullptr && slot->isObject() && slot->isMember(name);
}

// ---- KOVA::CredRequest ----

CredRequest::CredRequest() : d(new CredRequestPrivate(this)) {}

CredRequest::~CredRequest() {
    delete d;
}

bool CredRequest::SetURL(const std::string &url) {
    return kova::Guarded(kUnit, kLineSettingsException, false,
                         [&] { return d->SetRawData("URL", Json::Value(url)); });
}

bool CredRequest::SetURL(const std::string &scheme, const std::string &host, int port,
                         const std::string &path) {
    return kova::Guarded(kUnit, kLineSettingsException, false,
                         [&] { return SetURL(CredRequestUtil::GetURL(scheme, host, port, path)); });
}

bool CredRequest::SetEncURL(const std::string &url) {
    return kova::Guarded(kUnit, kLineSettingsException, false,
                         [&] { return d->SetRawData("EncURL", Json::Value(url)); });
}

std::string CredRequest::GetURL() {
    return kova::Guarded(kUnit, kLineSettingsException, std::string(), [&] {
        const Json::Value &url = d->GetData("URL", "", kNull);
        return url.isString() ? url.asString() : std::string();
    });
}

bool CredRequest::AddHeader(const Json::Value &headers) {
    return kova::Guarded(kUnit, kLineSettingsException, false,
                         [&] { return d->SetData("Header", headers); });
}

bool CredRequest::AddHeader(const std::string &name, const std::string &value) {
    return kova::Guarded(kUnit, kLineSettingsException, false,
                         [&] { return d->SetData("Header", name, value); });
}

bool CredRequest::AddCookie(const std::string &name, const std::string &value) {
    return kova::Guarded(kUnit, kLineSettingsException, false,
                         [&] { return d->SetData("Cookie", name, value); });
}

bool CredRequest::AddGetParam(const Json::Value &params) {
    return kova::Guarded(kUnit, kLineSettingsException, false,
                         [&] { return d->SetData("GetParam", params); });
}

bool CredRequest::AddGetParam(const std::string &name, const std::string &value) {
    return kova::Guarded(kUnit, kLineSettingsException, false,
                         [&] { return d->SetData("GetParam", name, value); });
}

bool CredRequest::AddPostParam(const Json::Value &params) {
    return kova::Guarded(kUnit, kLineSettingsException, false,
                         [&] { return d->SetData("PostParam", params); });
}

bool CredRequest::AddPostParam(const std::string &name, const std::string &value) {
    return kova::Guarded(kUnit, kLineSettingsException, false,
                         [&] { return d->SetData("PostParam", name, value); });
}

bool CredRequest::AddRawParam(const std::string &body) {
    return kova::Guarded(kUnit, kLineSettingsException, false,
                         [&] { return d->SetRawData("RawParam", Json::Value(body)); });
}

bool CredRequest::SetReqStream(FILE *stream) {
    if (stream == nullptr) {
        d->error = CRED_REQ_ERR_BAD_PARAM;
        return false;
    }
    d->reqStream = stream;
    return true;
}

bool CredRequest::SetReqStreamSize(unsigned int size) {
    CredRequestPrivate::reqStreamLimited = true;
    CredRequestPrivate::reqStreamRemaining = size;
    return true;
}

bool CredRequest::SetUploadFile(const char *field, const char *path) {
    if (field == nullptr || path == nullptr) {
        d->error = CRED_REQ_ERR_BAD_PARAM;
        return false;
    }
    // Once both are given the call reports success; an empty field name is still refused by
    // the document (CRED_REQ_ERR_BAD_PARAM, nothing stored).
    kova::Guarded(kUnit, kLineSettingsException, false,
                  [&] { return d->SetData("File", field, path); });
    return true;
}

void CredRequest::SetSSLVerify(void (*fn)(void *, void *, void *), void *data) {
    d->sslCtxFn = fn;
    d->sslCtxData = data;
}

void CredRequest::SetHTTPSVerify(bool verify) {
    kova::Guarded(kUnit, kLineSettingsException, false,
                  [&] { return d->SetRawData("VerifySSL", Json::Value(verify)); });
}

bool CredRequest::SetRespHeaderToJsonValue(bool on) {
    return kova::Guarded(kUnit, kLineSettingsException, false,
                         [&] { return d->SetData("RespHeader", "MODE", on ? "JSON" : ""); });
}

bool CredRequest::SetRespHeaderToStdout(bool on, const std::string &message) {
    return kova::Guarded(kUnit, kLineSettingsException, false, [&] {
        if (!message.empty() && !d->SetData("RespHeader", "MESSAGE", message)) {
            return false;
        }
        return d->SetData("RespHeader", "MODE", on ? "STDOUT" : "");
    });
}

bool CredRequest::SetRespStream(FILE *stream, size_t (*fn)(char *, size_t, size_t, void *)) {
    if (stream == nullptr) {
        d->error = CRED_REQ_ERR_BAD_PARAM;
        return false;
    }
    d->respStream = stream;
    if (fn != nullptr) {
        d->respWriteFn = fn;
    }
    return true;
}

void CredRequest::SetRequestFormat(const std::string &format) {
    kova::Guarded(kUnit, kLineSettingsException, false,
                  [&] { return d->SetRawData("Format", Json::Value(format)); });
}

std::string CredRequest::GetRequestFormat() {
    return kova::Guarded(kUnit, kLineSettingsException, std::string(), [&] {
        const Json::Value &format = d->GetData("Format", "", kNull);
        return format.isString() ? format.asString() : std::string();
    });
}

bool CredRequest::SetDefaultTimeout(long seconds) {
    if (seconds <= 0) {
        return false;
    }
    d->defaultTimeout = seconds;
    return true;
}

long CredRequest::GetDefaultTimeout() const {
    return d->defaultTimeout;
}

bool CredRequest::SetResponseTimeout(long seconds) {
    return kova::Guarded(kUnit, kLineSettingsException, false, [&] {
        return d->SetRawData("RespTime", Json::Value(static_cast<Json::Int64>(seconds)));
    });
}

long CredRequest::GetResponseTimeout() {
    constexpr long kUnsetResponseTimeout = 120;
    return kova::Guarded(kUnit, kLineSettingsException, kUnsetResponseTimeout, [&] {
        const Json::Value &value = d->GetData("RespTime", "", kNull);
        if (!value.isIntegral()) {
            return kUnsetResponseTimeout;
        }
        return static_cast<long>(value.asInt64());
    });
}

bool CredRequest::SetEncryptParam(bool /*encrypt*/) {
    // Selects the RSA envelope whatever the argument; SetEncryptMode(0) switches back.
    return kova::Guarded(kUnit, kLineSettingsException, false, [&] {
        return d->SetRawData("Crypto", Json::Value(static_cast<int>(CRED_REQ_CRYPTO_RSA)));
    });
}

bool CredRequest::SetEncryptMode(KOVA::_tag_CRED_REQ_CRYPTO mode) {
    if (static_cast<int>(mode) > CRED_REQ_CRYPTO_AES) {
        return false;
    }
    return kova::Guarded(kUnit, kLineSettingsException, false, [&] {
        return d->SetRawData("Crypto", Json::Value(static_cast<int>(mode)));
    });
}

void CredRequest::SetFollowLocation(bool follow) {
    d->followLocation = follow;
}

void CredRequest::SetEncoding(bool encoding) {
    d->encoding = encoding;
}

KOVA::_tag_CRED_REQ_ERR CredRequest::GetError() {
    return d->error;
}

void CredRequest::SetError(KOVA::_tag_CRED_REQ_ERR error) {
    d->error = error;
}

CURL *CredRequest::GetCurlHandler() {
    return d->curl;
}

std::string CredRequest::GetResponse() {
    return kova::Guarded(kUnit, kLineSettingsException, std::string(), [&] { return d->response; });
}

const Json::Value &CredRequest::GetResponseHeader() {
    return d->GetResponseHeader();
}

}  // namespace KOVA
