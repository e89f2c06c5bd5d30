// kovacred commands over the WebAPI layer: login, logout, call and apis, each for a stored
// credential.
#include <stdio.h>

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

// Loads credential `id`; prints the failure line when there is none.
bool LoadCred(const std::string &what, int id, KOVA_CRED &cred) {
    if (KOVACredGetByID(id, &cred) < 0 || cred.filled == 0) {
        FailText(what + " failed: no credential with id " + std::to_string(id));
        return false;
    }
    return true;
}

struct LoginOptions {
    int id = 0;
    std::string otp;
};

void RunLogin(const LoginOptions &opts) {
    KOVA_CRED cred;
    if (!LoadCred("login", opts.id, cred)) {
        return;
    }
    KOVA_CRED_SESS sess;
    Json::Value answer;
    CredRequestUtil::m_errCode = 0;
    if (!CredRequestUtil::LoginWithOTP(&cred, opts.otp, &sess, &answer)) {
        const int code = ErrorCodeOf(answer);
        if (code != 0) {
            FailServer("login", code, LoginCodeText(code));
        } else if (answer.isObject()) {
            Fail("login", KOVA::CRED_REQ_ERR_INVALID_RESPONSE);
        } else {
            Fail("login", CredRequestUtil::m_errCode != 0 ? CredRequestUtil::m_errCode
                                                          : KOVA::CRED_REQ_ERR_QUERY_FAIL);
        }
        return;
    }
    printf("logged in to %s://%s:%d as %s; session stored for credential %d\n",
           cred.protocol.c_str(), cred.host.c_str(), cred.port, cred.remote_account.c_str(),
           opts.id);
}

void RunLogout(int id) {
    KOVA_CRED cred;
    if (!LoadCred("logout", id, cred)) {
        return;
    }
    KOVA_CRED_SESS sess;
    if (KOVACredSessGetByID(id, &sess) < 0 || sess.filled == 0) {
        FailText("logout failed: no stored session for credential " + std::to_string(id));
        return;
    }
    if (!CredRequestUtil::Logout(&cred, &sess)) {
        Fail("logout", KOVA::CRED_REQ_ERR_INVALID_RESPONSE);
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
};

void RunCall(const CallOptions &opts) {
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
    CredRequestUtil::m_errCode = 0;
    std::unique_ptr<CredRequest> request(
        CredRequest::CreateWebAPIRequest(opts.id, opts.api, opts.version, opts.method, params));
    if (!request) {
        Fail("call " + opts.api, CredRequestUtil::m_errCode != 0 ? CredRequestUtil::m_errCode
                                                                 : KOVA::CRED_REQ_ERR_UNKNOWN);
        return;
    }
    for (const auto &file : opts.files) {
        size_t eq = file.find('=');
        if (eq == std::string::npos || eq == 0 ||
            !request->SetUploadFile(file.substr(0, eq).c_str(), file.substr(eq + 1).c_str())) {
            FailText("call failed: --file needs FIELD=PATH");
            return;
        }
    }
    if (!request->Process(true, 0)) {
        Fail("call " + opts.api, request->GetError());
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

void RunApis(int id, bool json) {
    KOVA_CRED cred;
    if (!LoadCred("apis", id, cred)) {
        return;
    }
    CredRequestUtil::m_errCode = 0;
    if (!CredRequestUtil::GetWebAPIDesc(&cred)) {
        Fail("apis", CredRequestUtil::m_errCode != 0 ? CredRequestUtil::m_errCode
                                                     : KOVA::CRED_REQ_ERR_QUERY_FAIL);
        return;
    }
    const Json::Value &desc = CredRequestUtil::m_jsData["webapiDesc"][std::to_string(id)];
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

CLI::Option *AddId(CLI::App *cmd, int *id) {
    return cmd->add_option("id", *id, "credential id")->required()->check(CLI::PositiveNumber);
}

void RegisterWebApi(CLI::App &app) {
    auto login = std::make_shared<LoginOptions>();
    CLI::App *loginCmd = app.add_subcommand(
        "login", "log in with a stored credential and store the session it gets");
    AddId(loginCmd, &login->id);
    loginCmd->add_option("--otp", login->otp, "one-time code");
    loginCmd->callback([login] { RunLogin(*login); });

    auto logoutId = std::make_shared<int>(0);
    CLI::App *logoutCmd =
        app.add_subcommand("logout", "log the stored session out and remove it from the store");
    AddId(logoutCmd, logoutId.get());
    logoutCmd->callback([logoutId] { RunLogout(*logoutId); });

    auto call = std::make_shared<CallOptions>();
    CLI::App *callCmd = app.add_subcommand(
        "call", "call a WebAPI method with a stored credential and print the JSON answer");
    AddId(callCmd, &call->id);
    callCmd->add_option("api", call->api, "API name, e.g. KOVA.API.Info")->required();
    callCmd->add_option("version", call->version, "API version")
        ->required()
        ->check(CLI::PositiveNumber);
    callCmd->add_option("method", call->method, "method name")->required();
    callCmd->add_option("params", call->pairs, "parameters as name=value");
    callCmd->add_option("--params", call->params, "parameters as a JSON object");
    callCmd->add_option("--file", call->files, "upload a file as FIELD=PATH");
    AddJsonFlag(callCmd, &call->json);
    callCmd->callback([call] { RunCall(*call); });

    auto apis = std::make_shared<std::pair<int, bool>>(0, false);
    CLI::App *apisCmd = app.add_subcommand("apis", "list the APIs the credential's server offers");
    AddId(apisCmd, &apis->first);
    AddJsonFlag(apisCmd, &apis->second);
    apisCmd->callback([apis] { RunApis(apis->first, apis->second); });
}

const Registrar kWebApiCommands(RegisterWebApi);

}  // namespace
}  // namespace kovacred
