// Authentication flows of the WebAPI utilities: the URL set-up of a WebAPI call, the redirect
// probe of plain-HTTP credentials, login (with an optional one-time code) whose session is
// written back to the store, access tokens and logout.
#include <stdlib.h>
#include <strings.h>

#include <exception>
#include <string>

#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_util.h"
#include "kovacredential/kovacred.h"
#include "platform/json_text.h"
#include "platform/kova_log.h"
#include "request/cred_request_transport.h"
#include "request/cred_request_util_p.h"

namespace KOVA {

namespace {

const char kUnit[] = "cred_request_util";
const char kAuthApi[] = "KOVA.API.Auth";

// The response header `name`, compared without regard to case (servers differ in the case
// they send); null when absent.
Json::Value HeaderValue(const Json::Value &headers, const std::string &name) {
    if (!headers.isObject()) {
        return Json::Value();
    }
    if (headers.isMember(name)) {
        return headers[name];
    }
    for (const auto &member : headers.getMemberNames()) {
        if (strcasecmp(member.c_str(), name.c_str()) == 0) {
            return headers[member];
        }
    }
    return Json::Value();
}

}  // namespace

constexpr int kLineAuthException = 75;
constexpr int kLineUrlBadParam = 81;
constexpr int kLineUrlEncUrl = 87;
constexpr int kLineUrlNoPath = 94;
constexpr int kLineUrlSetUrl = 99;
constexpr int kLineUrlFormat = 104;

bool CredRequestUtil::SetWebAPIURL(const KOVA_CRED *cred, const std::string &api, int version,
                                   const std::string &method, KOVA::CredRequest *request) {
    return kova::Guarded(kUnit, kLineAuthException, false, [&] {
        if (cred == nullptr || api.empty() || version <= 0 || method.empty() ||
            request == nullptr) {
            kova::Log("%s:%d Bad parameters", kUnit, kLineUrlBadParam);
            return false;
        }
        if (!request->SetEncURL(
                GetURL(cred->protocol, cred->host, cred->port, "webapi/encryption.cgi"))) {
            kova::Log("%s:%d Set encryption url fail!", kUnit, kLineUrlEncUrl);
            return false;
        }
        const std::string path = GetWebAPIPath(cred, api);
        if (path.empty()) {
            request->SetError(static_cast<CRED_REQ_ERR>(UtilError()));
            kova::Log("%s:%d GetWebAPIPath fail![%s]", kUnit, kLineUrlNoPath, api.c_str());
            return false;
        }
        if (!request->SetURL(cred->protocol, cred->host, cred->port, "webapi/" + path)) {
            kova::Log("%s:%d Set URL fail!", kUnit, kLineUrlSetUrl);
            return false;
        }
        std::string format;
        if (!GetWebAPIRequestFormat(cred, api, format)) {
            kova::Log("%s:%d GetWebAPIRequestFormat fail![%s]", kUnit, kLineUrlFormat, api.c_str());
            return false;
        }
        request->SetRequestFormat(format);
        const std::string versionText = std::to_string(version);
        if (format == "JSON") {
            return request->AddGetParam("api", api) &&
                   request->AddGetParam("version", versionText) &&
                   request->AddGetParam("method", method);
        }
        return request->AddPostParam("api", api) && request->AddPostParam("version", versionText) &&
               request->AddPostParam("method", method);
    });
}

constexpr int kLineRedirBadParam = 131;
constexpr int kLineRedirSetUrl = 142;
constexpr int kLineRedirHeaderMode = 149;
constexpr int kLineRedirNoHeaders = 161;
constexpr int kLineRedirNoLocation = 166;
constexpr int kLineRedirBadLocation = 173;

bool ApplyRedirectLocation(KOVA_CRED *cred, const Json::Value &headers) {
    if (headers.empty()) {
        kova::Log("%s:%d GetResponseHeader failed", kUnit, kLineRedirNoHeaders);
        return false;
    }
    const Json::Value location = HeaderValue(headers, "Location");
    if (!location.isString() || location.asString().empty()) {
        kova::Log("%s:%d Return 302, but no Location in header.", kUnit, kLineRedirNoLocation);
        return false;
    }
    // Parsed as the server sent it.
    const std::string target = location.asString();
    std::string scheme;
    std::string host;
    std::string port;
    if (!CredRequestUtil::ParseURL(target, scheme, host, port)) {
        kova::Log("%s:%d Can not identify 302 Location: %s.", kUnit, kLineRedirBadLocation,
                  kova::UrlForLog(target).c_str());
        return false;
    }
    cred->protocol = scheme;
    cred->host = host;
    cred->port = static_cast<int32_t>(strtol(port.c_str(), nullptr, 10));
    return true;
}

bool CredRequestUtil::CheckRedirect(KOVA_CRED *cred) {
    return kova::Guarded(kUnit, kLineAuthException, false, [&] {
        if (cred == nullptr) {
            kova::Log("%s:%d Bad parameters", kUnit, kLineRedirBadParam);
            return false;
        }
        // Only plain-HTTP credentials can be moved to HTTPS by their server.
        if (strcasecmp(cred->protocol.c_str(), "http") != 0) {
            return true;
        }
        const std::string path = "webapi/query.cgi";
        CredRequest request;
        request.SetFollowLocation(false);
        if (!request.SetURL(cred->protocol, cred->host, cred->port, path)) {
            kova::Log("%s:%d SetURL failed. %s %s %ld %s", kUnit, kLineRedirSetUrl,
                      cred->protocol.c_str(), kova::UrlForLog(cred->host).c_str(),
                      static_cast<long>(cred->port), path.c_str());
            return false;
        }
        request.SetResponseTimeout(30);
        if (!request.SetRespHeaderToJsonValue(true)) {
            kova::Log("%s:%d SetRespHeaderToJsonValue to true failed.", kUnit,
                      kLineRedirHeaderMode);
            return false;
        }
        // Any failure but a redirect is left for the real request to report.
        if (ProcessWithTransport(request, false) || request.GetError() != CRED_REQ_ERR_REDIRECT) {
            return true;
        }
        return ApplyRedirectLocation(cred, request.GetResponseHeader());
    });
}

constexpr int kLineLoginBadParam = 196;
constexpr int kLineLoginRedirect = 200;
constexpr int kLineLoginSetUrl = 205;
constexpr int kLineLoginSend = 225;
constexpr int kLineLoginInvalid = 238;
constexpr int kLineLoginStore = 248;

bool ReadLoginAnswer(const std::string &body, Json::Value *response, KOVA_CRED_SESS &session) {
    // jsoncpp's lenient reader: comments and text behind the answer are tolerated.
    Json::Value answer;
    const bool parsed = kova::JsonFromLenientText(body, answer, true);
    if (response != nullptr) {
        *response = answer;
    }
    if (!parsed || !kova::JsonIsSuccess(answer) || !answer["data"].isObject()) {
        return false;
    }
    session.filled = 1;
    session.access_token = kova::JsonText(answer["data"]["sid"]);
    session.csrf_token = kova::JsonText(answer["data"]["kovatoken"]);
    return true;
}

bool CredRequestUtil::LoginWithOTP(KOVA_CRED *cred, const std::string &otpCode,
                                   KOVA_CRED_SESS *sess, Json::Value *response) {
    return LoginWithOTP(cred, otpCode, sess, response, nullptr);
}

bool CredRequestUtil::LoginWithOTP(KOVA_CRED *cred, const std::string &otpCode,
                                   KOVA_CRED_SESS *sess, Json::Value *response,
                                   KOVA::CredRequest *transport) {
    return kova::Guarded(kUnit, kLineAuthException, false, [&] {
        const TransportScope scope(transport);
        if (cred == nullptr) {
            kova::Log("%s:%d Bad parameters", kUnit, kLineLoginBadParam);
            return false;
        }
        if (!CheckRedirect(cred)) {
            kova::Log("%s:%d CheckRedirect failed.", kUnit, kLineLoginRedirect);
            return false;
        }
        CredRequest request;
        if (!SetWebAPIURL(cred, kAuthApi, 3, "login", &request)) {
            kova::Log("%s:%d Set URL fail!", kUnit, kLineLoginSetUrl);
            return false;
        }
        Json::Value params(Json::objectValue);
        params["account"] = cred->remote_account;
        params["passwd"] = cred->remote_passwd;
        params["format"] = "sid";
        if (!cred->application.empty()) {
            params["session"] = cred->application;
        }
        if (!otpCode.empty()) {
            params["otp_code"] = otpCode;
        }
        request.AddPostParam(params);
        request.SetEncryptParam(true);
        if (!ProcessWithTransport(request)) {
            kova::Log("%s:%d Send login request fail.[%d]", kUnit, kLineLoginSend,
                      static_cast<int>(request.GetError()));
            return false;
        }
        KOVA_CRED_SESS local;
        if (!ReadLoginAnswer(request.GetResponse(), response, local)) {
            request.SetError(CRED_REQ_ERR_INVALID_RESPONSE);
            kova::Log("%s:%d Login response is invalid", kUnit, kLineLoginInvalid);
            return false;
        }
        if (cred->id >= 0 && KOVACredSessSetByID(cred->id, &local) < 0) {
            kova::Log("%s:%d Set cred_sess fail. id=%ld", kUnit, kLineLoginStore,
                      static_cast<long>(cred->id));
            return false;
        }
        if (sess != nullptr) {
            sess->next = local.next;
            sess->filled = local.filled;
            sess->id = local.id;
            sess->access_token = local.access_token;
            sess->csrf_token = local.csrf_token;
            sess->extra_info = local.extra_info;
        }
        return true;
    });
}

bool CredRequestUtil::Login(KOVA_CRED *cred, KOVA_CRED_SESS *sess) {
    return LoginWithOTP(cred, "", sess, nullptr);
}

constexpr int kLineLoginIdMissing = 278;

bool CredRequestUtil::Login(long id, KOVA_CRED_SESS *sess) {
    return kova::Guarded(kUnit, kLineAuthException, false, [&] {
        KOVA_CRED cred;
        if (KOVACredGetByID(id, &cred) < 0 || cred.filled == 0) {
            kova::Log("%s:%d Cannot find id[%ld] in database", kUnit, kLineLoginIdMissing, id);
            return false;
        }
        return Login(&cred, sess);
    });
}

constexpr int kLineTokenBadParam = 292;
constexpr int kLineTokenNoSess = 297;
constexpr int kLineTokenLogin = 305;
constexpr int kLineTokenUnfilled = 312;

namespace {

// The stored session of credential `id` when there is one (trusted as it is: the server is not
// asked whether it still lives), else a fresh login through `login`.
template <typename LoginFn>
bool StoredSessionOrLogin(long id, KOVA_CRED_SESS *sess, LoginFn login) {
    if (KOVACredSessGetByID(id, sess) < 0) {
        kova::Log("%s:%d Cannot get access token from id=[%ld]", kUnit, kLineTokenNoSess, id);
        return false;
    }
    if (sess->filled) {
        return true;
    }
    if (!login()) {
        kova::Log("%s:%d Cannot get access token from id=[%ld]", kUnit, kLineTokenLogin, id);
        return false;
    }
    if (sess->filled) {
        return true;
    }
    kova::Log("%s:%d Cannot get access token from database", kUnit, kLineTokenUnfilled);
    return false;
}

}  // namespace

bool CredRequestUtil::GetAccessToken(long id, KOVA_CRED_SESS *sess) {
    return kova::Guarded(kUnit, kLineAuthException, false, [&] {
        if (sess == nullptr) {
            kova::Log("%s:%d Bad parameters", kUnit, kLineTokenBadParam);
            return false;
        }
        return StoredSessionOrLogin(id, sess, [&] { return Login(id, sess); });
    });
}

bool CredRequestUtil::GetAccessToken(KOVA_CRED *cred, KOVA_CRED_SESS *sess) {
    return kova::Guarded(kUnit, kLineAuthException, false, [&] {
        if (cred == nullptr || sess == nullptr) {
            kova::Log("%s:%d Bad parameters", kUnit, kLineTokenBadParam);
            return false;
        }
        return StoredSessionOrLogin(cred->id, sess, [&] { return Login(cred, sess); });
    });
}

constexpr int kLineLogoutBadParam = 350;
constexpr int kLineLogoutRedirect = 354;
constexpr int kLineLogoutSetUrl = 359;
constexpr int kLineLogoutSend = 368;
constexpr int kLineLogoutInvalid = 377;

bool IsLogoutAnswerOk(const std::string &body) {
    Json::Value answer;
    return kova::JsonFromString(body, answer) && kova::JsonIsSuccess(answer);
}

bool CredRequestUtil::Logout(KOVA_CRED *cred, const std::string &sid) {
    return Logout(cred, sid, nullptr);
}

bool CredRequestUtil::Logout(KOVA_CRED *cred, const std::string &sid,
                             KOVA::CredRequest *transport) {
    return kova::Guarded(kUnit, kLineAuthException, false, [&] {
        const TransportScope scope(transport);
        if (cred == nullptr || sid.empty()) {
            kova::Log("%s:%d Bad parameters", kUnit, kLineLogoutBadParam);
            return false;
        }
        if (!CheckRedirect(cred)) {
            kova::Log("%s:%d CheckRedirect failed.", kUnit, kLineLogoutRedirect);
            return false;
        }
        CredRequest request;
        if (!SetWebAPIURL(cred, kAuthApi, 1, "logout", &request)) {
            kova::Log("%s:%d Set URL fail!", kUnit, kLineLogoutSetUrl);
            return false;
        }
        Json::Value params(Json::objectValue);
        params["_sid"] = sid;
        request.AddPostParam(params);
        request.AddCookie("id", sid);
        if (!ProcessWithTransport(request)) {
            kova::Log("%s:%d Send logout request fail.[%d]", kUnit, kLineLogoutSend,
                      static_cast<int>(request.GetError()));
            return false;
        }
        if (IsLogoutAnswerOk(request.GetResponse())) {
            return true;
        }
        request.SetError(CRED_REQ_ERR_INVALID_RESPONSE);
        kova::Log("%s:%d Logout response is invalid", kUnit, kLineLogoutInvalid);
        return false;
    });
}

bool CredRequestUtil::Logout(KOVA_CRED *cred, KOVA_CRED_SESS *sess) {
    return kova::Guarded(kUnit, kLineAuthException, false, [&] {
        if (cred == nullptr || sess == nullptr) {
            kova::Log("%s:%d Bad parameters", kUnit, kLineLogoutBadParam);
            return false;
        }
        return Logout(cred, sess->access_token);
    });
}

constexpr int kLineLogoutNoCred = 398;
constexpr int kLineLogoutNoSess = 403;

bool CredRequestUtil::Logout(long id) {
    return kova::Guarded(kUnit, kLineAuthException, false, [&] {
        KOVA_CRED cred;
        if (KOVACredGetByID(id, &cred) < 0 || cred.filled == 0) {
            kova::Log("%s:%d Cannot find id[%ld] in cred", kUnit, kLineLogoutNoCred, id);
            return false;
        }
        KOVA_CRED_SESS sess;
        if (KOVACredSessGetByID(id, &sess) < 0 || sess.filled == 0) {
            kova::Log("%s:%d Cannot find id[%ld] in sess", kUnit, kLineLogoutNoSess, id);
            return false;
        }
        return Logout(&cred, &sess);
    });
}

}  // namespace KOVA
