// The directory commands of KOVA::CredRequestFarlink: server information, site list (from the
// global directory host), the first site that knows the server, and the relay tunnel.
#include <memory>
#include <string>
#include <vector>

#include "request/cred_request_farlink_p.h"

namespace KOVA {

// Line of this file's exception-guard records.
constexpr int kLineInfoException = 60;

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

// Sends one command and accepts only an object answer with "errno" 0: 22 with the document
// when it cannot be sent or its answer is not JSON, 23 with the answer otherwise.
bool SendCommand(CredRequestFarlinkPrivate &client, const Json::Value &document,
                 Json::Value &answer) {
    if (!client.SendFarlinkRequest(document, answer)) {
        client.SetError(CRED_REQ_ERR_UNKNOWN, document);
        return false;
    }
    if (!CredRequestFarlinkPrivate::IsSuccessAnswer(answer)) {
        client.SetError(CRED_REQ_ERR_SERVER_ERRNO, answer);
        return false;
    }
    return true;
}

// Points the client at another directory host for the object's lifetime.
class ServerNameScope {
  public:
    ServerNameScope(CredRequestFarlinkPrivate &client, const std::string &name)
        : client_(client), kept_(client.GetServerName()) {
        client_.SetServerName(name);
    }
    ~ServerNameScope() { client_.serverName.swap(kept_); }
    ServerNameScope(const ServerNameScope &) = delete;
    ServerNameScope &operator=(const ServerNameScope &) = delete;

  private:
    CredRequestFarlinkPrivate &client_;
    std::string kept_;
};

}  // namespace

CredRequest *CredRequestFarlink::GetServerInfo() {
    return kova::GuardedOn(
        kFarlinkGuardUnit, kLineInfoException, d, static_cast<CredRequest *>(nullptr),
        [&](CredRequestFarlinkPrivate &) -> CredRequest * {
            CredRequestFarlinkPrivate::DeadlineScope scope(*d);
            if (d->GetServerId().empty()) {
                d->SetError(CRED_REQ_ERR_NO_SERVER_ID, Json::Value());
                return nullptr;
            }
            Json::Value document =
                ServerCommand("get_server_info", d->GetServerId(), d->GetServiceId());
            CredRequest *request = d->CreateFarlinkRequest(document);
            if (request == nullptr) {
                d->SetError(CRED_REQ_ERR_UNKNOWN, document);
            }
            return request;
        });
}

bool CredRequestFarlink::GetServerInfo(Json::Value &info) {
    return kova::GuardedOn(
        kFarlinkGuardUnit, kLineInfoException, d, false, [&](CredRequestFarlinkPrivate &) -> bool {
            CredRequestFarlinkPrivate::DeadlineScope scope(*d);
            std::unique_ptr<CredRequest> request(GetServerInfo());
            if (!request) {
                d->SetError(CRED_REQ_ERR_UNKNOWN, Json::Value());
                return false;
            }
            if (!request->Process(true, 0)) {
                d->SetError(CRED_REQ_ERR_UNKNOWN, static_cast<int>(request->GetError()));
                return false;
            }
            const std::string text = request->GetResponse();
            if (!d->CheckResponse(text, &info)) {
                d->SetError(CRED_REQ_ERR_SERVER_ERRNO, Json::Value(text));
                return false;
            }
            return true;
        });
}

bool CredRequestFarlink::GetSiteList(Json::Value &answer) {
    return kova::GuardedOn(
        kFarlinkGuardUnit, kLineInfoException, d, false, [&](CredRequestFarlinkPrivate &) -> bool {
            // The site list always comes from the global directory host; the configured
            // server name is put back on every path.
            CredRequestFarlinkPrivate::DeadlineScope scope(*d);
            ServerNameScope global(*d, CredRequestFarlinkPrivate::GlobalServerName());
            return SendCommand(*d, Command("get_site_list"), answer);
        });
}

bool CredRequestFarlink::GetAvailableServerInfo(Json::Value &info) {
    return kova::GuardedOn(kFarlinkGuardUnit, kLineInfoException, d, false,
                           [&](CredRequestFarlinkPrivate &) -> bool {
                               CredRequestFarlinkPrivate::DeadlineScope scope(*d);
                               Json::Value list;
                               if (!GetSiteList(list)) {
                                   return false;
                               }
                               std::vector<std::string> hosts;
                               if (!CredRequestFarlinkPrivate::SiteHosts(list, hosts)) {
                                   return false;
                               }
                               info = Json::Value();
                               for (const std::string &host : hosts) {
                                   // A failing site leaves its error recorded until a later one
                                   // overwrites it; the server name stays at the site that answered
                                   // so that a tunnel goes there too. An entry without text leaves
                                   // no server name, which fails with 22.
                                   d->SetServerName(host);
                                   Json::Value candidate;
                                   if (GetServerInfo(candidate)) {
                                       info.swap(candidate);
                                       break;
                                   }
                                   if (d->DeadlineExpired()) {
                                       d->SetError(CRED_REQ_ERR_TIMEOUT, Json::Value());
                                       break;
                                   }
                               }
                               return !info.empty();
                           });
}

bool CredRequestFarlinkPrivate::SiteHosts(const Json::Value &siteList,
                                          std::vector<std::string> &hosts) {
    const Json::Value *sites = siteList.isObject() ? siteList.find("sites", "sites" + 5) : nullptr;
    if (sites == nullptr || !sites->isArray()) {
        return false;
    }
    hosts.clear();
    for (const Json::Value &site : *sites) {
        // A number or flag counts as its text.
        hosts.push_back(site.isConvertibleTo(Json::stringValue) ? site.asString() : std::string());
    }
    return true;
}

bool CredRequestFarlink::RequestTunnel(Json::Value &answer) {
    return kova::GuardedOn(
        kFarlinkGuardUnit, kLineInfoException, d, false, [&](CredRequestFarlinkPrivate &) -> bool {
            CredRequestFarlinkPrivate::DeadlineScope scope(*d);
            if (d->GetServerId().empty()) {
                d->SetError(CRED_REQ_ERR_BAD_PARAM, Json::Value());
                return false;
            }
            return SendCommand(
                *d, ServerCommand("request_tunnel", d->GetServerId(), d->GetServiceId()), answer);
        });
}

}  // namespace KOVA
