// Logging a request in: with a stored credential before the transfer (ProcessWithLogin), or
// with an account given at run time against the server of the request's URL (Login), logging
// that session out again, and asking whether the server offers an API.
#include <exception>
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

}  // namespace

constexpr int kLineLoginException = 35;

bool CredRequest::ProcessWithLogin(long credId, bool perform, int retries) {
    return kova::Guarded(kUnit, kLineLoginException, false, [&] {
        KOVA_CRED_SESS session;
        if (!CredRequestUtil::Login(credId, &session)) {
            SetError(CRED_REQ_ERR_LOGIN_FAIL);
            return false;
        }
        if (!AddPostParam("_sid", session.access_token)) {
            return false;
        }
        if (!session.csrf_token.empty() && !AddPostParam("KovaToken", session.csrf_token)) {
            return false;
        }
        return Process(perform, retries);
    });
}

constexpr int kLineLoginToken = 82;

bool CredRequest::Login(const std::string &account, const std::string &password,
                        const std::string &url) {
    return kova::GuardedOn(kUnit, kLineLoginException, d, false, [&](CredRequestPrivate &) {
        const std::string target = url.empty() ? GetURL() : url;
        if (!d->buildCredByURL(target)) {
            SetError(CRED_REQ_ERR_LOGIN_PARAM);
            return false;
        }
        if (account.empty() || password.empty() ||
            KOVACredItemSetRemoteAccount(d->Cred(), account.c_str()) < 0 ||
            KOVACredItemSetRemotePasswd(d->Cred(), password.c_str()) < 0) {
            SetError(CRED_REQ_ERR_LOGIN_PARAM);
            return false;
        }
        if (d->Sess() == nullptr ||
            !CredRequestUtil::LoginWithOTP(d->Cred(), "", d->Sess(), nullptr) ||
            d->Sess()->access_token.empty()) {
            SetError(CRED_REQ_ERR_LOGIN_SESSION);
            return false;
        }
        const std::string sid = d->Sess()->access_token;
        if (!AddCookie("id", sid) || !AddGetParam("_sid", sid)) {
            SetError(CRED_REQ_ERR_LOGIN_SESSION);
            return false;
        }
        if (!d->Sess()->csrf_token.empty() && !AddGetParam("KovaToken", d->Sess()->csrf_token)) {
            kova::Log("%s:%d Add csrf_token fail", kUnit, kLineLoginToken);
            SetError(CRED_REQ_ERR_LOGIN_SESSION);
            return false;
        }
        return true;
    });
}

bool CredRequest::Logout() {
    return kova::GuardedOn(kUnit, kLineLoginException, d, false, [&](CredRequestPrivate &) {
        if (d->Cred() == nullptr || d->Sess() == nullptr || d->Cred()->host.empty() ||
            d->Cred()->protocol.empty() || d->Sess()->access_token.empty()) {
            return false;
        }
        return CredRequestUtil::Logout(d->Cred(), d->Sess());
    });
}

bool CredRequest::isAPIValid(const std::string &api) {
    return kova::GuardedOn(kUnit, kLineLoginException, d, false, [&](CredRequestPrivate &) {
        if (!d->buildCredByURL(GetURL())) {
            return false;
        }
        return !CredRequestUtil::GetWebAPIPath(d->Cred(), api).empty();
    });
}

}  // namespace KOVA
