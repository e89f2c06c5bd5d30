// kovacred resolve: turns a server id into the address where the server answers, through the
// relay directory (kovacredential_farlink_server / kovacredential_farlink_global choose the
// directory hosts).
#include <stdio.h>

#include <memory>
#include <string>

#include <json/value.h>
#include <json/writer.h>

#include "commands.h"
#include "kovacredential/cred_request_farlink.h"

namespace kovacred {

namespace {

std::string CompactJson(const Json::Value &value) {
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "";
    return Json::writeString(builder, value);
}

struct ResolveOptions {
    std::string serverId;
    bool portal = false;
};

// Prints the candidate {"protocol", "host", "port"} on standard output; on failure prints the
// client's error document {"code", "error"} there instead and exits with the error code (1
// when it does not fit an exit status).
void RunResolve(const ResolveOptions &options) {
    Json::Value candidate;
    Json::Value errors;
    bool found =
        options.portal
            ? KOVA::CredRequestFarlink::GetConnInfoPortal(options.serverId, candidate, &errors)
            : KOVA::CredRequestFarlink::GetConnInfo(options.serverId, candidate, &errors);
    if (found) {
        printf("%s\n", CompactJson(candidate).c_str());
        return;
    }
    printf("%s\n", CompactJson(errors).c_str());
    fflush(stdout);
    Fail("resolve", errors["code"].isIntegral() ? errors["code"].asInt() : 1);
}

Registrar registerResolve([](CLI::App &app) {
    auto options = std::make_shared<ResolveOptions>();
    CLI::App *resolve = app.add_subcommand(
        "resolve", "find where a server answers (LAN, external, DDNS or relay) by its server id");
    resolve->add_option("SERVER_ID", options->serverId, "the server id to look up")->required();
    resolve->add_flag("--portal", options->portal,
                      "look up the portal service instead of the WebAPI service");
    resolve->callback([options] { RunResolve(*options); });
});

}  // namespace

}  // namespace kovacred
