// The directory commands of KOVA::CredRequestFarlink: server information, site list (from the
// global directory host), the first site that knows the server, and the relay tunnel.
#include <memory>

#include "request/cred_request_farlink_p.h"

namespace KOVA {

namespace {

const int kProtocolVersion = 1;

// {"version": 1, "command": command} plus "serverID" and "id" when a server is named.
Json::Value Command(const char *command) {
    Json::Value document(Json::objectValue);
    document["version"] = kProtocolVersion;
    document["command"] = command;
    return document;
}

Json::Value ServerCommand(const char *command, const std::string &serverId,
                          const std::string &serviceId) {
    Json::Value document = Command(command);
    document["serverID"] = serverId;
    document["id"] = serviceId;
    return document;
}

}  // namespace

CredRequest *CredRequestFarlink::GetServerInfo() {
    if (d->GetServerId().empty()) {
        d->SetError(CRED_REQ_ERR_NO_SERVER_ID, Json::Value());
        return nullptr;
    }
    Json::Value document = ServerCommand("get_server_info", d->GetServerId(), d->GetServiceId());
    CredRequest *request = d->CreateFarlinkRequest(document);
    if (request == nullptr) {
        d->SetError(CRED_REQ_ERR_UNKNOWN, document);
    }
    return request;
}

bool CredRequestFarlink::GetServerInfo(Json::Value &info) {
    std::unique_ptr<CredRequest> request(GetServerInfo());
    if (!request) {
        d->SetError(CRED_REQ_ERR_UNKNOWN, Json::Value());
        return false;
    }
    if (!request->Process(true, 0)) {
        d->SetError(CRED_REQ_ERR_UNKNOWN, static_cast<int>(request->GetError()));
        return false;
    }
    std::string text = request->GetResponse();
    if (!d->CheckResponse(text, &info)) {
        d->SetError(CRED_REQ_ERR_SERVER_ERRNO, text);
        return false;
    }
    return true;
}

bool CredRequestFarlink::GetSiteList(Json::Value &answer) {
    // The site list always comes from the global directory host; the configured server name
    // is put back on every path.
    const std::string kept = d->GetServerName();
    d->SetServerName(CredRequestFarlinkPrivate::GlobalServerName());
    Json::Value document = Command("get_site_list");
    bool ok = false;
    if (!d->SendFarlinkRequest(document, answer)) {
        d->SetError(CRED_REQ_ERR_UNKNOWN, document);
    } else if (!CredRequestFarlinkPrivate::IsSuccessAnswer(answer)) {
        d->SetError(CRED_REQ_ERR_SERVER_ERRNO, answer);
    } else {
        ok = true;
    }
    d->SetServerName(kept);
    return ok;
}

bool CredRequestFarlink::GetAvailableServerInfo(Json::Value &info) {
    Json::Value list;
    if (!GetSiteList(list)) {
        return false;
    }
    const Json::Value *sites = list.find("sites", "sites" + 5);
    if (sites == nullptr || !sites->isArray()) {
        return false;
    }
    info = Json::Value();
    for (const Json::Value &site : *sites) {
        // A failing site leaves its error recorded until a later one overwrites it; the
        // server name stays at the site that answered so that a tunnel goes there too.
        d->SetServerName(site.isString() ? site.asString() : std::string());
        Json::Value candidate;
        if (GetServerInfo(candidate)) {
            info.swap(candidate);
            break;
        }
    }
    return !info.empty();
}

bool CredRequestFarlink::RequestTunnel(Json::Value &answer) {
    if (d->GetServerId().empty()) {
        d->SetError(CRED_REQ_ERR_BAD_PARAM, Json::Value());
        return false;
    }
    Json::Value document = ServerCommand("request_tunnel", d->GetServerId(), d->GetServiceId());
    if (!d->SendFarlinkRequest(document, answer)) {
        d->SetError(CRED_REQ_ERR_UNKNOWN, document);
        return false;
    }
    if (!CredRequestFarlinkPrivate::IsSuccessAnswer(answer)) {
        d->SetError(CRED_REQ_ERR_SERVER_ERRNO, answer);
        return false;
    }
    return true;
}

}  // namespace KOVA
