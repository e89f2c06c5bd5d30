// kovacred resolve: turns a server id into the address where the server answers, through the
// relay directory (kovacredential_farlink_server / kovacredential_farlink_global choose the
// directory hosts).
#include <stdio.h>

#include <memory>
#include <string>

#include <json/value.h>

#include "commands.h"
#include "kovacredential/cred_request_farlink.h"

namespace kovacred {

namespace {

struct ResolveOptions {
    std::string serverId;
    bool portal = false;
    bool json = false;
    Transport transport;  // only --max-time applies to the directory's requests
};

// Which of the server information's addresses the candidate is, by host and port: the LAN
// interfaces answer on the service's "port", the external address and the DDNS name on its
// "ext_port". Anything else came through the tunnel.
std::string CandidateKind(const Json::Value &info, const Json::Value &candidate) {
    const Json::Value &server = info["server"];
    const Json::Value &service = info["service"];
    const std::string host = candidate["host"].asString();
    const int port = candidate["port"].asInt();
    auto servicePort = [&service](const char *name) {
        return service.isObject() && service[name].isIntegral() ? service[name].asInt() : 0;
    };
    if (port > 0 && port == servicePort("port") && server["interface"].isArray()) {
        for (const auto &nic : server["interface"]) {
            if (nic.isObject() && nic["ip"].isString() && nic["ip"].asString() == host) {
                return "LAN";
            }
        }
    }
    if (port > 0 && port == servicePort("ext_port")) {
        if (server["external"].isObject() && server["external"]["ip"].isString() &&
            server["external"]["ip"].asString() == host) {
            return "external";
        }
        if (server["ddns"].isString() && server["ddns"].asString() == host) {
            return "DDNS";
        }
    }
    return "relay";
}

// The whole look-up of CredRequestFarlink::GetConnInfo (the HTTPS service first, then the
// plain one, each with a fresh site list), done step by step so that the server information
// that gave the candidate is at hand to name its kind.
bool Resolve(const ResolveOptions &options, Json::Value &candidate, std::string &kind,
             Json::Value &errors) {
    KOVA::CredRequestFarlink client;
    if (options.serverId.empty()) {
        client.SetError(KOVA::CRED_REQ_ERR_NO_SERVER_ID);
        errors = client.GetErrors();
        return false;
    }
    client.SetServerId(options.serverId);
    for (const char *service : options.portal
                                   ? std::vector<const char *>{"zon_portal_https", "zon_portal"}
                                   : std::vector<const char *>{"zon_https", "zon"}) {
        client.SetServiceId(service);
        // Each operation of the client has its deadline afresh: it is given what is left.
        auto bounded = [&] {
            client.SetTotalTimeout(options.transport.MaxTimeMs());
            return true;
        };
        Json::Value info;
        if (bounded() && client.GetAvailableServerInfo(info) && bounded() &&
            client.GetAvailableConnInfo(info, candidate)) {
            kind = CandidateKind(info, candidate);
            return true;
        }
    }
    errors = client.GetErrors();
    return false;
}

// Prints "SERVER_ID  URL  (KIND)", or with --json the candidate {"protocol", "host", "port"};
// on failure --json prints the client's error document {"code", "error"} on standard output.
void RunResolve(const ResolveOptions &options) {
    Json::Value candidate;
    std::string kind;
    Json::Value errors;
    if (Resolve(options, candidate, kind, errors)) {
        if (options.json) {
            printf("%s\n", JsonText(candidate, false).c_str());
        } else {
            printf("%s  %s://%s:%d  (%s)\n", options.serverId.c_str(),
                   candidate["protocol"].asString().c_str(), candidate["host"].asString().c_str(),
                   candidate["port"].asInt(), kind.c_str());
        }
        return;
    }
    if (options.json) {
        printf("%s\n", JsonText(errors, false).c_str());
        fflush(stdout);
    }
    Fail("resolve " + options.serverId, errors["code"].isIntegral() ? errors["code"].asInt() : 1);
}

Registrar registerResolve([](CLI::App &app) {
    auto options = std::make_shared<ResolveOptions>();
    CLI::App *resolve = app.add_subcommand(
        "resolve", "find where a server answers (LAN, external, DDNS or relay) by its server id");
    resolve->add_option("SERVER_ID", options->serverId, "the server id to look up")->required();
    resolve->add_flag("--portal", options->portal,
                      "look up the portal service instead of the WebAPI service");
    AddJsonFlag(resolve, &options->json);
    resolve
        ->add_option("--max-time", options->transport.maxTime, "seconds the whole look-up may take")
        ->check(CLI::PositiveNumber);
    resolve->callback([options] { RunResolve(*options); });
});

}  // namespace

}  // namespace kovacred
