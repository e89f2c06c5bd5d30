// Connection candidates: the direct addresses (LAN interfaces, external address, DDNS name)
// and the relay endpoints of a server, probed in order until one proves to be the server.
#include <memory>
#include <new>
#include <vector>

#include "platform/json_text.h"
#include "request/cred_request_farlink_p.h"

namespace KOVA {

// Line of this file's exception-guard records.
constexpr int kLineConnException = 140;

namespace {

const char kProbePath[] = "/webman/pingpong.cgi";
// Direct addresses are often dead (another LAN, a stale DDNS record); short time-outs pass
// over them quickly. Relay probes keep the request defaults.
const long kDirectResponseTimeout = 5;
const long kDirectDefaultTimeout = 10;

bool Has(const Json::Value &object, const char *name) {
    return object.isObject() && object.isMember(name);
}

// The integer member `name` of an object, 0 when missing or not a number.
int IntMember(const Json::Value &object, const char *name) {
    if (!Has(object, name)) {
        return 0;
    }
    const Json::Value &value = object[name];
    return value.isConvertibleTo(Json::intValue) ? value.asInt() : 0;
}

std::string StringMember(const Json::Value &object, const char *name) {
    if (!Has(object, name)) {
        return "";
    }
    const Json::Value &value = object[name];
    return value.isString() ? value.asString() : std::string();
}

Json::Value Candidate(const std::string &protocol, const Json::Value &host, int port) {
    Json::Value candidate(Json::objectValue);
    candidate["protocol"] = protocol;
    candidate["host"] = host;
    candidate["port"] = port;
    return candidate;
}

const std::string kRelayHttpsProtocol = "https";

}  // namespace

bool CredRequestFarlinkPrivate::ProbeCandidates(const std::vector<ProbeTarget> &targets,
                                                bool direct, Json::Value &candidate) {
    candidate = Json::Value();
    for (const ProbeTarget &target : targets) {
        std::unique_ptr<CredRequest> probe(new (std::nothrow) CredRequest());
        if (!probe) {
            continue;
        }
        probe->SetURL(*target.protocol, target.host->isString() ? target.host->asString() : "",
                      target.port, kProbePath);
        if (!BoundRequest(*probe, direct ? kDirectResponseTimeout : 0,
                          direct ? kDirectDefaultTimeout : 0)) {
            break;
        }
        if (probe->Process(true, 0) && IsProbeAnswer(probe->GetResponse())) {
            candidate = Candidate(*target.protocol, *target.host, target.port);
            break;
        }
        if (DeadlineExpired()) {
            break;
        }
    }
    // A failed probe sets no error; running out of time does.
    if (candidate.empty() && DeadlineExpired()) {
        SetError(CRED_REQ_ERR_TIMEOUT, Json::Value());
    }
    return !candidate.empty();
}

bool CredRequestFarlinkPrivate::IsProbeAnswer(const std::string &text) const {
    Json::Value answer;
    return kova::JsonFromString(text, answer) && answer.isObject() && answer.isMember("ezid") &&
           answer["ezid"] == Json::Value(serverIdMd5);
}

bool CredRequestFarlinkPrivate::GetAvailableDirectConnInfo(const Json::Value &serverInfo,
                                                           Json::Value &candidate) {
    std::vector<ProbeTarget> targets;
    return DirectCandidates(serverInfo, targets) && ProbeCandidates(targets, true, candidate);
}

bool CredRequestFarlinkPrivate::DirectCandidates(const Json::Value &serverInfo,
                                                 std::vector<ProbeTarget> &targets) {
    targets.clear();
    if (!Has(serverInfo, "server") || !Has(serverInfo, "service")) {
        return false;
    }
    const Json::Value &server = serverInfo["server"];
    const Json::Value &service = serverInfo["service"];
    SetServerId(StringMember(server, "serverID"));
    const int port = IntMember(service, "port");
    const int extPort = IntMember(service, "ext_port");
    if (port <= 0 && extPort <= 0) {
        SetError(CRED_REQ_ERR_NO_PORT, Json::Value());
        return false;
    }

    // LAN interfaces in the directory's order, then the external address, then DDNS.
    if (Has(server, "interface") && port > 0 && server["interface"].isArray()) {
        for (const Json::Value &nic : server["interface"]) {
            targets.push_back({&serviceProtocol,
                               Has(nic, "ip") ? &nic["ip"] : &Json::Value::nullSingleton(), port});
        }
    }
    if (Has(server, "external") && extPort > 0) {
        const Json::Value &external = server["external"];
        targets.push_back({&serviceProtocol,
                           Has(external, "ip") ? &external["ip"] : &Json::Value::nullSingleton(),
                           extPort});
    }
    if (Has(server, "ddns") && extPort > 0) {
        targets.push_back({&serviceProtocol, &server["ddns"], extPort});
    }
    return !targets.empty();
}

bool CredRequestFarlinkPrivate::GetAvailableRelayConnInfo(const Json::Value &tunnelAnswer,
                                                          Json::Value &candidate) {
    std::vector<ProbeTarget> targets;
    return RelayCandidates(tunnelAnswer, targets) && ProbeCandidates(targets, false, candidate);
}

bool CredRequestFarlinkPrivate::RelayCandidates(const Json::Value &tunnelAnswer,
                                                std::vector<ProbeTarget> &targets) {
    targets.clear();
    if (!Has(tunnelAnswer, "service") || !Has(tunnelAnswer, "server")) {
        return false;
    }
    const Json::Value &server = tunnelAnswer["server"];
    const Json::Value &service = tunnelAnswer["service"];
    SetServerId(StringMember(server, "serverID"));

    // Relay address, relay host name on the same port, then the relay's HTTPS endpoint, which
    // is always "https" whatever the service protocol.
    if (Has(service, "relay_ip") && Has(service, "relay_port")) {
        const int relayPort = IntMember(service, "relay_port");
        targets.push_back({&serviceProtocol, &service["relay_ip"], relayPort});
        if (Has(service, "relay_dn")) {
            targets.push_back({&serviceProtocol, &service["relay_dn"], relayPort});
        }
    }
    if (Has(service, "https_ip") && Has(service, "https_port")) {
        targets.push_back(
            {&kRelayHttpsProtocol, &service["https_ip"], IntMember(service, "https_port")});
    }
    return !targets.empty();
}

bool CredRequestFarlink::GetAvailableConnInfo(const Json::Value &serverInfo,
                                              Json::Value &candidate) {
    return kova::GuardedOn(kFarlinkGuardUnit, kLineConnException, d, false,
                           [&](CredRequestFarlinkPrivate &) -> bool {
                               if (!Has(serverInfo, "server") || !Has(serverInfo, "service")) {
                                   d->SetError(CRED_REQ_ERR_NO_CONN_INFO, serverInfo);
                                   return false;
                               }
                               CredRequestFarlinkPrivate::DeadlineScope scope(*d);
                               if (d->GetAvailableDirectConnInfo(serverInfo, candidate)) {
                                   return true;
                               }
                               if (d->DeadlineExpired()) {
                                   d->SetError(CRED_REQ_ERR_TIMEOUT, Json::Value());
                                   return false;
                               }
                               // The tunnel is asked of the site that gave the server information.
                               Json::Value tunnelAnswer;
                               if (!RequestTunnel(tunnelAnswer)) {
                                   return false;
                               }
                               return d->GetAvailableRelayConnInfo(tunnelAnswer, candidate);
                           });
}

bool CredRequestFarlinkPrivate::Resolve(const std::string &serverId, const char *httpsService,
                                        const char *plainService, Json::Value &candidate,
                                        Json::Value *errors, long milliseconds) {
    return kova::Guarded(kFarlinkGuardUnit, kLineConnException, false, [&]() -> bool {
        CredRequestFarlink client;
        if (client.d == nullptr) {
            if (errors != nullptr) {
                *errors = client.GetErrors();
            }
            return false;
        }
        CredRequestFarlinkPrivate &d = *client.d;
        // One deadline for the whole look-up, both services included.
        DeadlineScope scope(d, milliseconds);
        if (serverId.empty()) {
            d.SetError(CRED_REQ_ERR_NO_SERVER_ID, Json::Value());
        } else {
            d.SetServerId(serverId);
            for (const char *service : {httpsService, plainService}) {
                d.SetServiceId(service);
                Json::Value info;
                if (client.GetAvailableServerInfo(info) &&
                    client.GetAvailableConnInfo(info, candidate)) {
                    return true;
                }
                if (d.DeadlineExpired()) {
                    d.SetError(CRED_REQ_ERR_TIMEOUT, Json::Value());
                    break;
                }
            }
        }
        if (errors != nullptr) {
            *errors = d.GetErrors();
        }
        return false;
    });
}

bool CredRequestFarlink::GetConnInfo(const std::string &serverId, Json::Value &candidate,
                                     Json::Value *errors) {
    return GetConnInfo(serverId, candidate, errors, 0);
}

bool CredRequestFarlink::GetConnInfoPortal(const std::string &serverId, Json::Value &candidate,
                                           Json::Value *errors) {
    return GetConnInfoPortal(serverId, candidate, errors, 0);
}

bool CredRequestFarlink::GetConnInfo(const std::string &serverId, Json::Value &candidate,
                                     Json::Value *errors, long timeoutMilliseconds) {
    return CredRequestFarlinkPrivate::Resolve(serverId, "zon_https", "zon", candidate, errors,
                                              timeoutMilliseconds);
}

bool CredRequestFarlink::GetConnInfoPortal(const std::string &serverId, Json::Value &candidate,
                                           Json::Value *errors, long timeoutMilliseconds) {
    return CredRequestFarlinkPrivate::Resolve(serverId, "zon_portal_https", "zon_portal", candidate,
                                              errors, timeoutMilliseconds);
}

}  // namespace KOVA
