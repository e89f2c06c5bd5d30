// KOVA::CredRequest settings: the request settings document, its low-level operations and the
// public setters and getters built on them.
#include <string.h>

#include <utility>

#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_util.h"
#include "platform/kova_log.h"
#include "request/cred_request_p.h"
#include "request/cred_request_pool.h"

namespace KOVA {

std::atomic<bool> CredRequestPrivate::reqStreamLimited{false};
std::atomic<uint32_t> CredRequestPrivate::reqStreamRemaining{0};
std::atomic<bool> CredRequestPrivate::headerMessageShown{false};

namespace {

const Json::Value kNull;

constexpr char kUnit[] = "cred_request";
// Line of the settings' exception-guard records.
constexpr int kLineSettingsException = 30;
// Line of the record of a request whose construction failed.
constexpr int kLineConstructException = 25;

}  // namespace

CredRequestPrivate::CredRequestPrivate(CredRequest *ownerRequest) : owner(ownerRequest) {
    reqStreamLimited = false;
}

KOVA_CRED *CredRequestPrivate::Cred() {
    if (cred == nullptr) {
        cred = KOVACredAlloc();
    }
    return cred;
}

KOVA_CRED_SESS *CredRequestPrivate::Sess() {
    if (sess == nullptr) {
        sess = KOVACredSessAlloc();
    }
    return sess;
}

CredRequestPrivate::~CredRequestPrivate() {
    if (headers != nullptr) {
        curl_slist_free_all(headers);
        headers = nullptr;
    }
    if (curl != nullptr) {
        CredRequestPool::Release(curl, handleLent ? std::string() : poolKey, poolGeneration);
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

const Json::Value &CredRequestPrivate::Setting(const char *key) const {
    static const Json::Value kNone;
    const Json::Value *slot = settings.find(key, key + strlen(key));
    return slot != nullptr ? *slot : kNone;
}

bool CredRequestPrivate::HasData(const char *key) const {
    return settings.find(key, key + strlen(key)) != nullptr;
}

bool CredRequestPrivate::HasRawData(const std::string &key) const {
    return settings.isMember(key);
}

bool CredRequestPrivate::HasData(const std::string &key, const std::string &name) const {
    const Json::Value *slot = settings.find(key.data(), key.data() + key.size());
    return slot != nullptr && slot->isObject() && slot->isMember(name);
}

// ---- KOVA::CredRequest ----

CredRequest::CredRequest()
    : d(kova::Guarded(kUnit, kLineConstructException, static_cast<CredRequestPrivate *>(nullptr),
                      [this] { return new CredRequestPrivate(this); })) {}

CredRequest::~CredRequest() {
    delete d;
}

namespace {

// Runs a body on the implementation object under the exception guard. A request whose
// construction failed has none; every operation on it fails.
template <typename Result, typename Body>
Result OnPrivate(CredRequestPrivate *d, Result failure, Body &&body) {
    return kova::GuardedOn(kUnit, kLineSettingsException, d, failure, std::forward<Body>(body));
}

std::string StringData(const CredRequestPrivate &p, const char *key) {
    const Json::Value &value = p.GetData(key, "", kNull);
    return value.isString() ? value.asString() : std::string();
}

}  // namespace

bool CredRequest::SetURL(const std::string &url) {
    return OnPrivate(d, false,
                     [&](CredRequestPrivate &p) { return p.SetRawData("URL", Json::Value(url)); });
}

bool CredRequest::SetURL(const std::string &scheme, const std::string &host, int port,
                         const std::string &path) {
    return OnPrivate(d, false, [&](CredRequestPrivate &) {
        return SetURL(CredRequestUtil::GetURL(scheme, host, port, path));
    });
}

bool CredRequest::SetEncURL(const std::string &url) {
    return OnPrivate(
        d, false, [&](CredRequestPrivate &p) { return p.SetRawData("EncURL", Json::Value(url)); });
}

std::string CredRequest::GetURL() {
    return OnPrivate(d, std::string(), [](CredRequestPrivate &p) { return StringData(p, "URL"); });
}

bool CredRequest::AddHeader(const Json::Value &headers) {
    return OnPrivate(d, false, [&](CredRequestPrivate &p) { return p.SetData("Header", headers); });
}

bool CredRequest::AddHeader(const std::string &name, const std::string &value) {
    return OnPrivate(d, false,
                     [&](CredRequestPrivate &p) { return p.SetData("Header", name, value); });
}

bool CredRequest::AddCookie(const std::string &name, const std::string &value) {
    return OnPrivate(d, false,
                     [&](CredRequestPrivate &p) { return p.SetData("Cookie", name, value); });
}

bool CredRequest::AddGetParam(const Json::Value &params) {
    return OnPrivate(d, false,
                     [&](CredRequestPrivate &p) { return p.SetData("GetParam", params); });
}

bool CredRequest::AddGetParam(const std::string &name, const std::string &value) {
    return OnPrivate(d, false,
                     [&](CredRequestPrivate &p) { return p.SetData("GetParam", name, value); });
}

bool CredRequest::AddPostParam(const Json::Value &params) {
    return OnPrivate(d, false,
                     [&](CredRequestPrivate &p) { return p.SetData("PostParam", params); });
}

bool CredRequest::AddPostParam(const std::string &name, const std::string &value) {
    return OnPrivate(d, false,
                     [&](CredRequestPrivate &p) { return p.SetData("PostParam", name, value); });
}

bool CredRequest::AddRawParam(const std::string &body) {
    return OnPrivate(d, false, [&](CredRequestPrivate &p) {
        return p.SetRawData("RawParam", Json::Value(body));
    });
}

bool CredRequest::SetReqStream(FILE *stream) {
    return OnPrivate(d, false, [&](CredRequestPrivate &p) {
        if (stream == nullptr) {
            p.error = CRED_REQ_ERR_BAD_PARAM;
            return false;
        }
        p.reqStream = stream;
        return true;
    });
}

bool CredRequest::SetReqStreamSize(unsigned int size) {
    CredRequestPrivate::reqStreamRemaining = size;
    CredRequestPrivate::reqStreamLimited = true;
    return true;
}

bool CredRequest::SetUploadFile(const char *field, const char *path) {
    return OnPrivate(d, false, [&](CredRequestPrivate &p) {
        if (field == nullptr || path == nullptr) {
            p.error = CRED_REQ_ERR_BAD_PARAM;
            return false;
        }
        // Once both are given the call reports success; an empty field name is still refused
        // by the document (CRED_REQ_ERR_BAD_PARAM, nothing stored).
        p.SetData("File", field, path);
        return true;
    });
}

void CredRequest::SetSSLVerify(void (*fn)(void *, void *, void *), void *data) {
    OnPrivate(d, false, [&](CredRequestPrivate &p) {
        p.sslCtxFn = fn;
        p.sslCtxData = data;
        return true;
    });
}

void CredRequest::SetHTTPSVerify(bool verify) {
    OnPrivate(d, false, [&](CredRequestPrivate &p) {
        return p.SetRawData("VerifySSL", Json::Value(verify));
    });
}

bool CredRequest::SetRespHeaderToJsonValue(bool on) {
    return OnPrivate(d, false, [&](CredRequestPrivate &p) {
        return p.SetData("RespHeader", "MODE", on ? "JSON" : "");
    });
}

bool CredRequest::SetRespHeaderToStdout(bool on, const std::string &message) {
    return OnPrivate(d, false, [&](CredRequestPrivate &p) {
        if (!message.empty() && !p.SetData("RespHeader", "MESSAGE", message)) {
            return false;
        }
        return p.SetData("RespHeader", "MODE", on ? "STDOUT" : "");
    });
}

bool CredRequest::SetRespStream(FILE *stream, size_t (*fn)(char *, size_t, size_t, void *)) {
    return OnPrivate(d, false, [&](CredRequestPrivate &p) {
        if (stream == nullptr) {
            p.error = CRED_REQ_ERR_BAD_PARAM;
            return false;
        }
        p.respStream = stream;
        if (fn != nullptr) {
            p.respWriteFn = fn;
        }
        return true;
    });
}

void CredRequest::SetRequestFormat(const std::string &format) {
    OnPrivate(d, false,
              [&](CredRequestPrivate &p) { return p.SetRawData("Format", Json::Value(format)); });
}

std::string CredRequest::GetRequestFormat() {
    return OnPrivate(d, std::string(),
                     [](CredRequestPrivate &p) { return StringData(p, "Format"); });
}

bool CredRequest::SetDefaultTimeout(long seconds) {
    return OnPrivate(d, false, [&](CredRequestPrivate &p) {
        if (seconds <= 0) {
            return false;
        }
        p.defaultTimeout = seconds;
        return true;
    });
}

long CredRequest::GetDefaultTimeout() const {
    return d != nullptr ? d->defaultTimeout : 0;
}

bool CredRequest::SetResponseTimeout(long seconds) {
    return OnPrivate(d, false, [&](CredRequestPrivate &p) {
        return p.SetRawData("RespTime", Json::Value(static_cast<Json::Int64>(seconds)));
    });
}

long CredRequest::GetResponseTimeout() {
    constexpr long kUnsetResponseTimeout = 120;
    return OnPrivate(d, kUnsetResponseTimeout, [&](CredRequestPrivate &p) {
        const Json::Value &value = p.Setting("RespTime");
        if (!value.isIntegral()) {
            return kUnsetResponseTimeout;
        }
        return static_cast<long>(value.asInt64());
    });
}

bool CredRequest::SetEncryptParam(bool /*encrypt*/) {
    // Selects the RSA envelope whatever the argument; SetEncryptMode(0) switches back.
    return OnPrivate(d, false, [&](CredRequestPrivate &p) {
        return p.SetRawData("Crypto", Json::Value(static_cast<int>(CRED_REQ_CRYPTO_RSA)));
    });
}

bool CredRequest::SetEncryptMode(KOVA::_tag_CRED_REQ_CRYPTO mode) {
    return OnPrivate(d, false, [&](CredRequestPrivate &p) {
        if (static_cast<int>(mode) > CRED_REQ_CRYPTO_AES) {
            return false;
        }
        return p.SetRawData("Crypto", Json::Value(static_cast<int>(mode)));
    });
}

void CredRequest::SetFollowLocation(bool follow) {
    OnPrivate(d, false, [&](CredRequestPrivate &p) {
        p.followLocation = follow;
        return true;
    });
}

void CredRequest::SetEncoding(bool encoding) {
    OnPrivate(d, false, [&](CredRequestPrivate &p) {
        p.encoding = encoding;
        return true;
    });
}

bool CredRequest::SetTotalTimeout(long milliseconds) {
    return OnPrivate(d, false, [&](CredRequestPrivate &p) {
        if (milliseconds < 0) {
            p.error = CRED_REQ_ERR_BAD_PARAM;
            return false;
        }
        p.totalTimeoutMs = milliseconds;
        return true;
    });
}

long CredRequest::GetTotalTimeout() const {
    return d != nullptr ? d->totalTimeoutMs : 0;
}

void CredRequest::SetMaxResponseSize(size_t bytes) {
    OnPrivate(d, false, [&](CredRequestPrivate &p) {
        p.maxResponseBytes = bytes;
        return true;
    });
}

size_t CredRequest::GetMaxResponseSize() const {
    return d != nullptr ? d->maxResponseBytes : CredRequestPrivate::kMaxResponseBytes;
}

bool CredRequest::SetCAFile(const std::string &path) {
    return OnPrivate(d, false, [&](CredRequestPrivate &p) {
        if (path.empty()) {
            p.error = CRED_REQ_ERR_BAD_PARAM;
            return false;
        }
        p.caFile = path;
        return true;
    });
}

bool CredRequest::SetPinnedPublicKey(const std::string &pin) {
    return OnPrivate(d, false, [&](CredRequestPrivate &p) {
        if (pin.empty()) {
            p.error = CRED_REQ_ERR_BAD_PARAM;
            return false;
        }
        p.pinnedPublicKey = pin;
        return true;
    });
}

KOVA::_tag_CRED_REQ_ERR CredRequest::GetError() {
    // A request whose construction failed reports the generic failure.
    return d != nullptr ? d->error : CRED_REQ_ERR_UNKNOWN;
}

void CredRequest::SetError(KOVA::_tag_CRED_REQ_ERR error) {
    if (d != nullptr) {
        d->error = error;
    }
}

void CredRequest::CloseIdleConnections() {
    CredRequestPool::CloseIdle();
}

CURL *CredRequest::GetCurlHandler() {
    if (d == nullptr) {
        return nullptr;
    }
    d->handleLent = d->handleLent || d->curl != nullptr;
    return d->curl;
}

std::string CredRequest::GetResponse() {
    return OnPrivate(d, std::string(), [](CredRequestPrivate &p) { return p.response; });
}

const Json::Value &CredRequest::GetResponseHeader() {
    return d != nullptr ? d->GetResponseHeader() : kNull;
}

int CredRequest::GetCurlCode() {
    return d != nullptr ? static_cast<int>(d->curlCode) : static_cast<int>(CURLE_OK);
}

std::string CredRequest::GetCurlErrorText() {
    return OnPrivate(d, std::string(), [](CredRequestPrivate &p) { return p.curlErrorText; });
}

Json::Value CredRequest::GetTransferInfo() {
    return OnPrivate(d, Json::Value(), [](CredRequestPrivate &p) { return p.TransferInfo(); });
}

}  // namespace KOVA
