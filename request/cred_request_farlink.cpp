// KOVA::CredRequestFarlink and the core of its implementation object: settings, service ids,
// the server id and its MD5, the error state, and one directory request to "/Serv.php".
#include "request/cred_request_farlink_p.h"

#include <limits.h>
#include <stdlib.h>

#include <algorithm>
#include <memory>
#include <new>

#include <openssl/evp.h>

#include "platform/json_text.h"
#include "platform/kova_env.h"
#include "platform/kova_log.h"

namespace KOVA {

// Line of this file's exception-guard records.
constexpr int kLineFarlinkException = 220;

namespace {

// The unit name that the client's log records carry.
const char kLogUnit[] = "cred_request_farlink_conn";
const char kDirectoryPath[] = "/Serv.php";
const long kDefaultTimeout = 5;

std::string HostFromEnv(const char *variable, const char *fallback) {
    // Ignored in setuid and setgid processes, so that whoever starts them cannot redirect
    // look-ups to a directory of their own.
    const char *value = kova::SecureEnv(variable);
    return (value != nullptr && value[0] != '\0') ? std::string(value) : std::string(fallback);
}

struct MdCtxDeleter {
    void operator()(EVP_MD_CTX *ctx) const { EVP_MD_CTX_free(ctx); }
};

// Lower-case hexadecimal MD5 of `text`; "" when the digest cannot be computed.
std::string Md5Hex(const std::string &text) {
    std::unique_ptr<EVP_MD_CTX, MdCtxDeleter> ctx(EVP_MD_CTX_new());
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned int length = 0;
    if (!ctx || EVP_DigestInit_ex(ctx.get(), EVP_md5(), nullptr) != 1 ||
        EVP_DigestUpdate(ctx.get(), text.data(), text.size()) != 1 ||
        EVP_DigestFinal_ex(ctx.get(), digest, &length) != 1) {
        return "";
    }
    // Two lower-case digits per byte, as "%02x" writes them.
    constexpr char kDigits[] = "0123456789abcdef";
    std::string hex;
    for (unsigned int i = 0; i < length && i < 32; ++i) {
        hex += kDigits[digest[i] >> 4];
        hex += kDigits[digest[i] & 0x0F];
    }
    return hex;
}

}  // namespace

// ---- CredRequestFarlinkPrivate: settings.

CredRequestFarlinkPrivate::CredRequestFarlinkPrivate(CredRequestFarlink *ownerObject)
    : owner(ownerObject), serverName(DefaultServerName()) {}

CredRequestFarlinkPrivate::~CredRequestFarlinkPrivate() = default;

std::string CredRequestFarlinkPrivate::DefaultServerName() {
    return HostFromEnv("kovacredential_farlink_server", KOVA_DEFAULT_FARLINK_SERVER);
}

std::string CredRequestFarlinkPrivate::GlobalServerName() {
    return HostFromEnv("kovacredential_farlink_global", KOVA_DEFAULT_FARLINK_GLOBAL);
}

// Line number carried by the record of an unsupported service id.
const int kUnsupportedServiceIdLine = 64;

void CredRequestFarlinkPrivate::SetServiceId(const std::string &id) {
    // The id is kept even when it is not supported: later requests send it as it stands.
    serviceId = id;
    if (id == "zon" || id == "zon_portal") {
        serviceProtocol = "http";
    } else if (id == "zon_https" || id == "zon_portal_https") {
        serviceProtocol = "https";
    } else {
        kova::Log("%s:%d Service id[%s] is not supported", kLogUnit, kUnsupportedServiceIdLine,
                  id.c_str());
    }
}

void CredRequestFarlinkPrivate::SetHTTPS(bool https, bool verify) {
    useHTTPS = https;
    verifyHTTPS = verify;
}

void CredRequestFarlinkPrivate::SetServerName(const std::string &name) {
    serverName = name;
}

void CredRequestFarlinkPrivate::SetTimeout(long seconds) {
    timeout = seconds;
}

void CredRequestFarlinkPrivate::SetServerId(const std::string &id) {
    if (id == serverId) {
        return;
    }
    serverId = id;
    SetServerIdMd5(id);
}

void CredRequestFarlinkPrivate::SetServerIdMd5(const std::string &id) {
    if (id.empty()) {
        SetError(CRED_REQ_ERR_NO_SERVER_ID, Json::Value());
        serverIdMd5.clear();
        return;
    }
    serverIdMd5 = Md5Hex(id);
}

void CredRequestFarlinkPrivate::Clear() {
    serverName = DefaultServerName();
    useHTTPS = false;
    verifyHTTPS = false;
    timeout = kDefaultTimeout;
}

// ---- Deadline of one operation.

void CredRequestFarlinkPrivate::SetTotalTimeout(long milliseconds) {
    totalTimeout = std::max(milliseconds, 0L);
}

CredRequestFarlinkPrivate::DeadlineScope::DeadlineScope(CredRequestFarlinkPrivate &client,
                                                        long milliseconds)
    : client_(client), started_(!client.deadline.IsSet() && milliseconds > 0) {
    if (started_) {
        client_.deadline = kova::Deadline::After(milliseconds);
    }
}

CredRequestFarlinkPrivate::DeadlineScope::~DeadlineScope() {
    if (started_) {
        client_.deadline = kova::Deadline();
    }
}

bool CredRequestFarlinkPrivate::DeadlineExpired() const {
    return deadline.Expired();
}

bool CredRequestFarlinkPrivate::BoundRequest(CredRequest &request, long responseTimeout,
                                             long defaultTimeout) {
    if (responseTimeout > 0) {
        request.SetResponseTimeout(responseTimeout);
    }
    if (defaultTimeout > 0) {
        request.SetDefaultTimeout(defaultTimeout);
    }
    if (!deadline.IsSet()) {
        return true;
    }
    // Plus the 2 ms that the request's and libcurl's whole-millisecond clocks may take off
    // what is left (libcurl rounds the time spent up), so that a request cut short by it ends
    // at or after the deadline and its failure is seen as the deadline's.
    constexpr long kClockRoundingMs = 2;
    const long left = deadline.LeftMs();
    if (left <= 0) {
        return false;
    }
    return request.SetTotalTimeout(left < LONG_MAX - kClockRoundingMs ? left + kClockRoundingMs
                                                                      : LONG_MAX);
}

// ---- Errors.

void CredRequestFarlinkPrivate::SetError(KOVA::_tag_CRED_REQ_ERR code, const Json::Value &detail) {
    if (DeadlineExpired()) {
        error = CRED_REQ_ERR_TIMEOUT;
        errorDetail = Json::Value();
        return;
    }
    error = code;
    errorDetail = detail;
}

Json::Value CredRequestFarlinkPrivate::GetErrors() const {
    Json::Value errors(Json::objectValue);
    errors["code"] = static_cast<int>(error);
    if (!errorDetail.empty()) {
        errors["error"] = errorDetail;
    }
    return errors;
}

// ---- Directory protocol.

bool CredRequestFarlinkPrivate::IsSuccessAnswer(const Json::Value &answer) {
    if (!answer.isObject()) {
        return false;
    }
    // A missing "errno" counts as 0; one that is no number cannot be 0.
    const Json::Value *errnoValue = answer.find("errno", "errno" + 5);
    if (errnoValue == nullptr || errnoValue->isNull()) {
        return true;
    }
    return errnoValue->isConvertibleTo(Json::intValue) && errnoValue->asInt() == 0;
}

bool CredRequestFarlinkPrivate::CheckResponse(const std::string &text, Json::Value *out) {
    Json::Value parsed;
    if (text.empty() || !kova::JsonFromString(text, parsed) || !IsSuccessAnswer(parsed)) {
        return false;
    }
    if (out != nullptr) {
        out->swap(parsed);
    }
    return true;
}

CredRequest *CredRequestFarlinkPrivate::CreateFarlinkRequest(const Json::Value &body) {
    if (serverName.empty()) {
        SetError(CRED_REQ_ERR_NO_SERVICE_ID, Json::Value());
        return nullptr;
    }
    if (body.empty()) {
        SetError(CRED_REQ_ERR_EMPTY_REQUEST, Json::Value());
        return nullptr;
    }
    std::unique_ptr<CredRequest> request(new (std::nothrow) CredRequest());
    if (!request) {
        SetError(CRED_REQ_ERR_UNKNOWN, Json::Value());
        return nullptr;
    }
    if (!request->SetURL(useHTTPS ? "https" : "http", serverName, useHTTPS ? 443 : 80,
                         kDirectoryPath)) {
        SetError(CRED_REQ_ERR_UNKNOWN, "SetURL fail");
        return nullptr;
    }
    request->SetHTTPSVerify(verifyHTTPS);
    if (timeout > 0 && !request->SetResponseTimeout(timeout)) {
        SetError(CRED_REQ_ERR_UNKNOWN, "Cannot set timeout");
        return nullptr;
    }
    if (!BoundRequest(*request, 0, 0)) {
        SetError(CRED_REQ_ERR_TIMEOUT, Json::Value());
        return nullptr;
    }
    if (!request->AddRawParam(kova::JsonToString(body))) {
        SetError(CRED_REQ_ERR_UNKNOWN, body);
        return nullptr;
    }
    return request.release();
}

bool CredRequestFarlinkPrivate::SendFarlinkRequest(const Json::Value &body, Json::Value &answer) {
    std::unique_ptr<CredRequest> request(CreateFarlinkRequest(body));
    if (!request) {
        SetError(CRED_REQ_ERR_UNKNOWN, body);
        return false;
    }
    if (!request->Process(true, 0)) {
        SetError(CRED_REQ_ERR_UNKNOWN, static_cast<int>(request->GetError()));
        return false;
    }
    const std::string text = request->GetResponse();
    if (!kova::JsonFromString(text, answer)) {
        SetError(CRED_REQ_ERR_SERVER_ERRNO, Json::Value(text));
        return false;
    }
    return true;
}

// ---- CredRequestFarlink: the public object owns one implementation object.

CredRequestFarlink::CredRequestFarlink()
    : d(kova::Guarded(kFarlinkGuardUnit, kLineFarlinkException,
                      static_cast<CredRequestFarlinkPrivate *>(nullptr),
                      [this] { return new CredRequestFarlinkPrivate(this); })) {}

CredRequestFarlink::~CredRequestFarlink() {
    delete d;
}

namespace {

// A setting on the implementation object; a client whose construction failed has none and
// ignores it.
template <typename Body>
void Configure(CredRequestFarlinkPrivate *d, Body &&body) {
    kova::GuardedOn(kFarlinkGuardUnit, kLineFarlinkException, d, false,
                    [&](CredRequestFarlinkPrivate &p) {
                        body(p);
                        return true;
                    });
}

}  // namespace

void CredRequestFarlink::SetHTTPS(bool https, bool verify) {
    Configure(d, [&](CredRequestFarlinkPrivate &p) { p.SetHTTPS(https, verify); });
}

void CredRequestFarlink::SetServerName(const std::string &name) {
    Configure(d, [&](CredRequestFarlinkPrivate &p) { p.SetServerName(name); });
}

void CredRequestFarlink::SetTimeout(long seconds) {
    Configure(d, [&](CredRequestFarlinkPrivate &p) { p.SetTimeout(seconds); });
}

void CredRequestFarlink::SetTotalTimeout(long milliseconds) {
    Configure(d, [&](CredRequestFarlinkPrivate &p) { p.SetTotalTimeout(milliseconds); });
}

void CredRequestFarlink::SetServerId(const std::string &serverId) {
    Configure(d, [&](CredRequestFarlinkPrivate &p) { p.SetServerId(serverId); });
}

void CredRequestFarlink::SetServiceId(const std::string &serviceId) {
    Configure(d, [&](CredRequestFarlinkPrivate &p) { p.SetServiceId(serviceId); });
}

KOVA::_tag_CRED_REQ_ERR CredRequestFarlink::GetError() {
    // A client whose construction failed reports the generic failure.
    return d != nullptr ? d->GetError() : CRED_REQ_ERR_UNKNOWN;
}

Json::Value CredRequestFarlink::GetErrors() {
    return kova::GuardedOn(kFarlinkGuardUnit, kLineFarlinkException, d, Json::Value(),
                           [](CredRequestFarlinkPrivate &p) { return p.GetErrors(); });
}

void CredRequestFarlink::SetError(KOVA::_tag_CRED_REQ_ERR error, const Json::Value &detail) {
    Configure(d, [&](CredRequestFarlinkPrivate &p) { p.SetError(error, detail); });
}

}  // namespace KOVA
