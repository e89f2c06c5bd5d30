// WebAPI request factories: a ready KOVA::CredRequest for calling one method of one API on the
// server of a credential, with the session id ("_sid" and cookie "id") and the anti-forgery
// token ("KovaToken") attached; and the fill-in of a request's own credential from a URL.
#include <stdlib.h>

#include <exception>
#include <memory>
#include <new>
#include <string>

#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_util.h"
#include "kovacredential/kovacred.h"
#include "kovacredential/kovacredsetter.h"
#include "platform/kova_log.h"
#include "request/cred_request_p.h"

namespace KOVA {

namespace {

const char kUnit[] = "cred_request";

bool WebApiArgsValid(const std::string &api, int version, const std::string &method) {
    return !api.empty() && version > 0 && !method.empty();
}

}  // namespace

constexpr int kLineFactoryException = 45;
constexpr int kLineSetBadParam = 50;
constexpr int kLineSetUrl = 54;
constexpr int kLineSetFormat = 59;
constexpr int kLineSetParams = 65;

bool CredRequest::SetWebAPIRequest(const std::string &api, int version, const std::string &method,
                                   const Json::Value &params) {
    return kova::GuardedOn(kUnit, kLineFactoryException, d, false, [&](CredRequestPrivate &) {
        if (!WebApiArgsValid(api, version, method)) {
            kova::Log("%s:%d Bad parameters", kUnit, kLineSetBadParam);
            return false;
        }
        if (!CredRequestUtil::SetWebAPIURL(d->Cred(), api, version, method, this)) {
            kova::Log("%s:%d SetWebAPIURL fail", kUnit, kLineSetUrl);
            return false;
        }
        std::string format;
        if (!CredRequestUtil::GetWebAPIRequestFormat(d->Cred(), api, format)) {
            kova::Log("%s:%d GetWebAPIRequestFormat fail[%s]", kUnit, kLineSetFormat, api.c_str());
            return false;
        }
        SetRequestFormat(format);
        if (!params.empty() && !AddPostParam(params)) {
            kova::Log("%s:%d Bad parameters", kUnit, kLineSetParams);
            return false;
        }
        return true;
    });
}

constexpr int kLineFillNoRequest = 80;
constexpr int kLineFillBadParam = 87;
constexpr int kLineFillUrl = 91;
constexpr int kLineFillFormat = 96;
constexpr int kLineFillParams = 102;
constexpr int kLineFillSession = 107;
constexpr int kLineFillToken = 115;

bool CredRequest::CreateWebAPIRequest(KOVA::CredRequest *request, const KOVA_CRED *cred,
                                      const KOVA_CRED_SESS *sess, const std::string &api,
                                      int version, const std::string &method,
                                      const Json::Value &params) {
    return kova::Guarded(kUnit, kLineFactoryException, false, [&] {
        if (request == nullptr) {
            kova::Log("%s:%d Bad parameters", kUnit, kLineFillNoRequest);
            return false;
        }
        // The request counts as failed until it is completely filled.
        request->SetError(CRED_REQ_ERR_UNKNOWN);
        if (cred == nullptr || sess == nullptr || !WebApiArgsValid(api, version, method)) {
            request->SetError(CRED_REQ_ERR_BAD_PARAM);
            kova::Log("%s:%d Bad parameters", kUnit, kLineFillBadParam);
            return false;
        }
        if (!CredRequestUtil::SetWebAPIURL(cred, api, version, method, request)) {
            kova::Log("%s:%d SetWebAPIURL fail", kUnit, kLineFillUrl);
            return false;
        }
        std::string format;
        if (!CredRequestUtil::GetWebAPIRequestFormat(cred, api, format)) {
            kova::Log("%s:%d GetWebAPIRequestFormat fail[%s]", kUnit, kLineFillFormat, api.c_str());
            return false;
        }
        request->SetRequestFormat(format);
        if (!params.empty() && !request->AddPostParam(params)) {
            kova::Log("%s:%d Bad parameters", kUnit, kLineFillParams);
            return false;
        }
        // "_sid" is sent even when empty; the cookie and the token only when there is one.
        if (!request->AddPostParam("_sid", sess->access_token)) {
            kova::Log("%s:%d Add session fail", kUnit, kLineFillSession);
            return false;
        }
        if (!sess->access_token.empty()) {
            request->AddCookie("id", sess->access_token);
        }
        if (!sess->csrf_token.empty() && !request->AddGetParam("KovaToken", sess->csrf_token)) {
            kova::Log("%s:%d Add csrf_token fail", kUnit, kLineFillToken);
            return false;
        }
        request->SetError(CRED_REQ_ERR_NONE);
        return true;
    });
}

constexpr int kLineNewFail = 130;
constexpr int kLineNewCreate = 135;

KOVA::CredRequest *CredRequest::CreateWebAPIRequest(const KOVA_CRED *cred,
                                                    const KOVA_CRED_SESS *sess,
                                                    const std::string &api, int version,
                                                    const std::string &method,
                                                    const Json::Value &params) {
    return kova::Guarded(
        kUnit, kLineFactoryException, static_cast<CredRequest *>(nullptr), [&]() -> CredRequest * {
            std::unique_ptr<CredRequest> request(new (std::nothrow) CredRequest());
            if (!request) {
                kova::Log("%s:%d New CredRequest fail", kUnit, kLineNewFail);
                return nullptr;
            }
            if (!CreateWebAPIRequest(request.get(), cred, sess, api, version, method, params)) {
                kova::Log("%s:%d Create CredRequest fail", kUnit, kLineNewCreate);
                return nullptr;
            }
            return request.release();
        });
}

constexpr int kLineIdBadParam = 155;
constexpr int kLineIdInvalid = 160;
constexpr int kLineIdToken = 164;
constexpr int kLineIdCreate = 170;

KOVA::CredRequest *CredRequest::CreateWebAPIRequest(long credId, const std::string &api,
                                                    int version, const std::string &method,
                                                    const Json::Value &params) {
    return kova::Guarded(
        kUnit, kLineFactoryException, static_cast<CredRequest *>(nullptr), [&]() -> CredRequest * {
            KOVA_CRED cred;
            KOVA_CRED_SESS sess;
            if (!WebApiArgsValid(api, version, method)) {
                kova::Log("%s:%d Bad parameters", kUnit, kLineIdBadParam);
                return nullptr;
            }
            if (KOVACredGetByID(credId, &cred) < 0 || cred.id == 0) {
                kova::Log("%s:%d CredId is invalid", kUnit, kLineIdInvalid);
                return nullptr;
            }
            if (!CredRequestUtil::GetAccessToken(&cred, &sess)) {
                kova::Log("%s:%d GetAccessToken fail", kUnit, kLineIdToken);
                return nullptr;
            }
            CredRequest *request = CreateWebAPIRequest(&cred, &sess, api, version, method, params);
            if (request == nullptr) {
                kova::Log("%s:%d Create CredRequest fail", kUnit, kLineIdCreate);
            }
            return request;
        });
}

constexpr int kLineRelayBadParam = 190;
constexpr int kLineRelayInvalid = 197;
constexpr int kLineRelayHeaders = 207;

KOVA::CredRequest *CredRequest::CreateRelayRequest(long credId, const std::string &api, int version,
                                                   const std::string &method,
                                                   const Json::Value &headers, FILE *in,
                                                   FILE *out) {
    return kova::Guarded(kUnit, kLineFactoryException, static_cast<CredRequest *>(nullptr),
                         [&]() -> CredRequest * {
                             KOVA_CRED cred;
                             if (!WebApiArgsValid(api, version, method)) {
                                 kova::Log("%s:%d Bad parameters", kUnit, kLineRelayBadParam);
                                 return nullptr;
                             }
                             // Lenient by design: only a load that reports nothing and leaves id 0
                             // counts as invalid; the credential-id factory below loads it again.
                             const int loaded = KOVACredGetByID(credId, &cred);
                             if (loaded <= 0 && cred.id == 0) {
                                 kova::Log("%s:%d CredId is invalid", kUnit, kLineRelayInvalid);
                                 return nullptr;
                             }
                             std::unique_ptr<CredRequest> request(
                                 CreateWebAPIRequest(credId, api, version, method, Json::Value()));
                             if (!request) {
                                 return nullptr;
                             }
                             if (!headers.empty() && !request->AddHeader(headers)) {
                                 kova::Log("%s:%d Bad parameters", kUnit, kLineRelayHeaders);
                                 return nullptr;
                             }
                             // Both streams feed the request body; given both, `out` wins.
                             if (in != nullptr) {
                                 request->SetReqStream(in);
                             }
                             if (out != nullptr) {
                                 request->SetReqStream(out);
                             }
                             return request.release();
                         });
}

constexpr int kLineBuildParse = 235;

bool CredRequestPrivate::buildCredByURL(const std::string &url) {
    return kova::Guarded(kUnit, kLineFactoryException, false, [&] {
        if (url.empty()) {
            error = CRED_REQ_ERR_LOGIN_PARAM;
            return false;
        }
        std::string protocol;
        std::string host;
        std::string port;
        if (!CredRequestUtil::ParseURL(url, protocol, host, port)) {
            kova::Log("%s:%d parseURL Failed: %s", kUnit, kLineBuildParse,
                      kova::UrlForLog(url).c_str());
            error = CRED_REQ_ERR_LOGIN_PARAM;
            return false;
        }
        KOVA_CRED *built = Cred();
        if (built == nullptr || KOVACredItemSetProtocol(built, protocol.c_str()) < 0 ||
            KOVACredItemSetPort(built, static_cast<int32_t>(strtol(port.c_str(), nullptr, 10))) <
                0 ||
            KOVACredItemSetHost(built, host.c_str()) < 0) {
            error = CRED_REQ_ERR_LOGIN_PARAM;
            return false;
        }
        return true;
    });
}

}  // namespace KOVA
