// kovacred commands over the WebAPI layer: login, logout, call and apis, each for a stored
// credential.
#include <errno.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include <json/json.h>

#include <kovacredential/kovacredential.h>

#include "commands.h"

namespace kovacred {
namespace {

using KOVA::CredRequest;
using KOVA::CredRequestUtil;

// What a few answer codes of the WebAPI's login mean; other codes are shown as numbers only.
// These are the server's codes, not the library's.
std::string LoginCodeText(int code) {
    static const std::map<int, std::string> kTexts = {
        {400, "wrong account or password"},
        {403, "one-time code required"},
        {404, "wrong one-time code"},
    };
    auto it = kTexts.find(code);
    return it == kTexts.end() ? "" : it->second;
}

int ErrorCodeOf(const Json::Value &answer) {
    if (answer.isObject() && answer["error"].isObject() && answer["error"]["code"].isInt()) {
        return answer["error"]["code"].asInt();
    }
    return 0;
}

// Loads credential `id`; prints the failure line when there is no database or no such
// credential.
bool LoadCred(const std::string &what, int id, KOVA_CRED &cred) {
    if (!CheckDatabase(DatabaseUse::kExisting)) {
        return false;
    }
    VLIBCErrSetEx(0, "", 0);
    if (KOVACredGetByID(id, &cred) < 0) {
        FailStore(what + ": reading credential " + std::to_string(id));
        return false;
    }
    if (cred.filled == 0) {
        FailText(what + " failed: no credential with id " + std::to_string(id));
        return false;
    }
    return true;
}

// The credential's API description for a command (see the other FetchDescription), after
// readying the transport for its server; false after the failure line.
bool FetchDescription(const std::string &what, const KOVA_CRED &cred, Transport &transport,
                      Json::Value &desc) {
    std::string failure;
    long code = 0;
    if (!PrepareTransport(what, transport, cred.protocol, cred.host, cred.port)) {
        return false;
    }
    if (!FetchDescription(cred, transport, desc, failure, code)) {
        fprintf(stderr, "kovacred: %s failed %s\n", what.c_str(), failure.c_str());
        gExitCode = code >= 1 && code <= 255 ? static_cast<int>(code) : 1;
        return false;
    }
    return true;
}

struct LoginOptions {
    int id = 0;
    std::string otp;
    Transport transport;
};

}  // namespace

bool LogIn(KOVA_CRED &cred, const std::string &otp, const Transport &transport,
           std::string &failure, long &code) {
    KOVA_CRED_SESS sess;
    Json::Value answer;
    CredRequest via;
    ApplyTransport(transport, via);
    CredRequestUtil::m_errCode = 0;
    if (CredRequestUtil::LoginWithOTP(&cred, otp, &sess, &answer, &via)) {
        return true;
    }
    code = ErrorCodeOf(answer);
    if (code != 0) {
        const std::string text = LoginCodeText(static_cast<int>(code));
        failure = "(server error " + std::to_string(code) + (text.empty() ? "" : ": " + text) + ")";
        return false;
    }
    if (via.GetError() != KOVA::CRED_REQ_ERR_NONE) {
        code = via.GetError();
        failure = TransferFailure(via, &transport);
        return false;
    }
    code = answer.isObject()                 ? KOVA::CRED_REQ_ERR_INVALID_RESPONSE
           : CredRequestUtil::m_errCode != 0 ? CredRequestUtil::m_errCode
                                             : KOVA::CRED_REQ_ERR_LOGIN_SESSION;
    failure = "(" + ErrorText(code) + ")";
    return false;
}

bool FetchDescription(const KOVA_CRED &cred, const Transport &transport, Json::Value &desc,
                      std::string &failure, long &code) {
    CredRequest via;
    ApplyTransport(transport, via);
    if (!CredRequestUtil::GetWebAPIDesc(&cred, &via)) {
        if (via.GetError() != KOVA::CRED_REQ_ERR_NONE) {
            code = via.GetError();
            failure = TransferFailure(via, &transport);
        } else {
            code = KOVA::CRED_REQ_ERR_QUERY_FAIL;
            failure = "(" + ErrorText(code) + "): the server's API description is not usable";
        }
        return false;
    }
    desc = CredRequestUtil::m_jsData["webapiDesc"][std::to_string(cred.id)];
    return true;
}

namespace {

// The session of credential `id` the library's factory will use: the stored one, or one a
// login gets now (a failed login is reported as "login" reports it). False after the line.
bool HaveSession(const std::string &what, KOVA_CRED &cred, const Transport &transport) {
    KOVA_CRED_SESS sess;
    if (KOVACredSessGetByID(cred.id, &sess) == 0 && sess.filled != 0) {
        return true;
    }
    std::string failure;
    long code = 0;
    if (LogIn(cred, "", transport, failure, code)) {
        return true;
    }
    fprintf(stderr, "kovacred: %s failed: login failed %s\n", what.c_str(), failure.c_str());
    gExitCode = code >= 1 && code <= 255 ? static_cast<int>(code) : 1;
    return false;
}

void RunLogin(LoginOptions &opts) {
    KOVA_CRED cred;
    if (!LoadCred("login", opts.id, cred)) {
        return;
    }
    if (!PrepareTransport("login", opts.transport, cred.protocol, cred.host, cred.port)) {
        return;
    }
    std::string failure;
    long code = 0;
    if (!LogIn(cred, opts.otp, opts.transport, failure, code)) {
        fprintf(stderr, "kovacred: login failed %s\n", failure.c_str());
        gExitCode = code >= 1 && code <= 255 ? static_cast<int>(code) : 1;
        return;
    }
    printf("logged in to %s://%s:%d as %s; session stored for credential %d\n",
           cred.protocol.c_str(), cred.host.c_str(), cred.port, cred.remote_account.c_str(),
           opts.id);
}

struct LogoutOptions {
    int id = 0;
    Transport transport;
};

void RunLogout(LogoutOptions &opts) {
    const int id = opts.id;
    KOVA_CRED cred;
    if (!LoadCred("logout", id, cred)) {
        return;
    }
    KOVA_CRED_SESS sess;
    if (KOVACredSessGetByID(id, &sess) < 0 || sess.filled == 0) {
        FailText("logout failed: no stored session for credential " + std::to_string(id));
        return;
    }
    if (!PrepareTransport("logout", opts.transport, cred.protocol, cred.host, cred.port)) {
        return;
    }
    CredRequest via;
    ApplyTransport(opts.transport, via);
    if (!CredRequestUtil::Logout(&cred, sess.access_token, &via)) {
        if (via.GetError() != KOVA::CRED_REQ_ERR_NONE) {
            FailTransfer("logout", via, &opts.transport);
        } else {
            Fail("logout", KOVA::CRED_REQ_ERR_INVALID_RESPONSE);
        }
        return;
    }
    KOVACredSessRemoveByID(id);
    printf("logged out; session of credential %d removed\n", id);
}

struct CallOptions {
    int id = 0;
    std::string api;
    int version = 0;
    std::string method;
    std::vector<std::string> pairs;
    std::string params;
    std::vector<std::string> files;
    bool json = false;
    bool timing = false;
    Transport transport;
};

void RunCall(CallOptions &opts) {
    Json::Value params(Json::objectValue);
    if (!opts.params.empty()) {
        if (!ParseJson(opts.params, params) || !params.isObject()) {
            FailText("call failed: --params needs a JSON object");
            return;
        }
    }
    for (const auto &pair : opts.pairs) {
        size_t eq = pair.find('=');
        if (eq == std::string::npos || eq == 0) {
            FailText("call failed: parameter \"" + pair + "\" is not name=value");
            return;
        }
        params[pair.substr(0, eq)] = pair.substr(eq + 1);
    }
    KOVA_CRED cred;
    if (!LoadCred("call", opts.id, cred)) {
        return;
    }
    for (const auto &file : opts.files) {
        const size_t eq = file.find('=');
        if (eq != std::string::npos && access(file.c_str() + eq + 1, R_OK) != 0) {
            FailText("call failed: cannot read " + file.substr(eq + 1) + ": " + strerror(errno));
            return;
        }
    }
    const std::string what = "call " + opts.api;
    Json::Value desc;
    if (!FetchDescription(what, cred, opts.transport, desc) ||
        !HaveSession(what, cred, opts.transport)) {
        return;
    }
    KOVA_CRED_SESS sess;
    if (KOVACredSessGetByID(opts.id, &sess) < 0 || sess.filled == 0) {
        FailText(what + " failed: no session for credential " + std::to_string(opts.id));
        return;
    }
    CredRequestUtil::m_errCode = 0;
    std::unique_ptr<CredRequest> request(new CredRequest());
    if (!CredRequest::CreateWebAPIRequest(request.get(), &cred, &sess, opts.api, opts.version,
                                          opts.method, params)) {
        Fail(what, CredRequestUtil::m_errCode != 0 ? CredRequestUtil::m_errCode
                                                   : static_cast<long>(request->GetError()));
        return;
    }
    ApplyTransport(opts.transport, *request);
    for (const auto &file : opts.files) {
        size_t eq = file.find('=');
        if (eq == std::string::npos || eq == 0 ||
            !request->SetUploadFile(file.substr(0, eq).c_str(), file.substr(eq + 1).c_str())) {
            FailText("call failed: --file needs FIELD=PATH");
            return;
        }
    }
    const bool done = request->Process(true, 0);
    if (opts.timing) {
        PrintTiming(*request);
    }
    if (!done) {
        FailTransfer(what, *request, &opts.transport);
        return;
    }
    Json::Value answer;
    if (!ParseJson(request->GetResponse(), answer)) {
        FailText("call " + opts.api + " failed: the answer is not JSON");
        return;
    }
    if (!answer.isObject() || !answer["success"].isBool() || !answer["success"].asBool()) {
        FailServer("call " + opts.api, ErrorCodeOf(answer), "the server refused the call");
        return;
    }
    // A server may echo the request's parameters, the session among them.
    Secrets secrets;
    secrets.AddCredential(opts.id);
    answer = secrets.Hide(answer);
    if (opts.json) {
        printf("%s\n", JsonText(answer, false).c_str());
    } else {
        PrintJson(answer.isMember("data") ? answer["data"] : answer);
    }
}

struct ApisOptions {
    int id = 0;
    bool json = false;
    Transport transport;
};

void RunApis(ApisOptions &opts) {
    KOVA_CRED cred;
    if (!LoadCred("apis", opts.id, cred)) {
        return;
    }
    Json::Value desc;
    if (!FetchDescription("apis", cred, opts.transport, desc)) {
        return;
    }
    const bool json = opts.json;
    if (!desc.isObject()) {
        FailText("apis failed: the server's description is not an object");
        return;
    }
    if (json) {
        PrintJson(desc);
        return;
    }
    size_t width = 3;
    for (const auto &name : desc.getMemberNames()) {
        width = std::max(width, name.size());
    }
    printf("%-*s  %-20s  %-8s  %s\n", static_cast<int>(width), "API", "PATH", "VERSIONS", "FORMAT");
    for (const auto &name : desc.getMemberNames()) {
        const Json::Value &api = desc[name];
        if (!api.isObject()) {
            continue;
        }
        std::string versions =
            api.get("minVersion", "").asString() + "-" + api.get("maxVersion", "").asString();
        printf("%-*s  %-20s  %-8s  %s\n", static_cast<int>(width), name.c_str(),
               api.get("path", "").asString().c_str(), versions.c_str(),
               api.get("requestFormat", "").asString().c_str());
    }
}

void RegisterWebApi(CLI::App &app) {
    auto login = std::make_shared<LoginOptions>();
    CLI::App *loginCmd = app.add_subcommand(
        "login", "log in with a stored credential and store the session it gets");
    AddIdArgument(loginCmd, &login->id);
    loginCmd->add_option("--otp", login->otp, "one-time code");
    AddTransportOptions(loginCmd, &login->transport);
    loginCmd->callback([login] { RunLogin(*login); });

    auto logout = std::make_shared<LogoutOptions>();
    CLI::App *logoutCmd =
        app.add_subcommand("logout", "log the stored session out and remove it from the store");
    AddIdArgument(logoutCmd, &logout->id);
    AddTransportOptions(logoutCmd, &logout->transport);
    logoutCmd->callback([logout] { RunLogout(*logout); });

    auto call = std::make_shared<CallOptions>();
    CLI::App *callCmd = app.add_subcommand(
        "call", "call a WebAPI method with a stored credential and print the JSON answer");
    AddIdArgument(callCmd, &call->id);
    callCmd->add_option("api", call->api, "API name, e.g. KOVA.API.Info")->required();
    callCmd->add_option("version", call->version, "API version")
        ->required()
        ->check(CLI::PositiveNumber);
    callCmd->add_option("method", call->method, "method name")->required();
    callCmd->add_option("params", call->pairs, "parameters as name=value");
    callCmd->add_option("--params", call->params, "parameters as a JSON object");
    callCmd->add_option("--file", call->files, "upload a file as FIELD=PATH")
        ->allow_extra_args(false);
    AddJsonFlag(callCmd, &call->json);
    callCmd->add_flag("--timing", call->timing, "show the call's timing on standard error");
    AddTransportOptions(callCmd, &call->transport);
    callCmd->callback([call] { RunCall(*call); });

    auto apis = std::make_shared<ApisOptions>();
    CLI::App *apisCmd = app.add_subcommand("apis", "list the APIs the credential's server offers");
    AddIdArgument(apisCmd, &apis->id);
    AddJsonFlag(apisCmd, &apis->json);
    AddTransportOptions(apisCmd, &apis->transport);
    apisCmd->callback([apis] { RunApis(*apis); });
}

const Registrar kWebApiCommands(RegisterWebApi);

}  // namespace
}  // namespace kovacred
