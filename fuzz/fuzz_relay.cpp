// Relay directory answers on arbitrary JSON: the site list's hosts, server information turned
// into direct candidates, a tunnel answer turned into relay candidates, and the probe answer
// that proves a candidate is the wanted server.
#include <vector>

#include "fuzz_target.h"
#include "kovacredential/cred_request_farlink.h"
#include "platform/json_text.h"
#include "request/cred_request_farlink_p.h"

namespace {

// Every address is probed over "http" or "https"; a direct one on a port above 0.
void CheckCandidates(const std::vector<KOVA::CredRequestFarlinkPrivate::ProbeTarget> &targets,
                     bool direct) {
    Require(!targets.empty());
    for (const auto &target : targets) {
        Require((*target.protocol == "http" || *target.protocol == "https") &&
                target.host != nullptr && (!direct || target.port > 0));
    }
}

}  // namespace

KOVA_FUZZ_TARGET(text) {
    KOVA::CredRequestFarlink owner;
    KOVA::CredRequestFarlinkPrivate client(&owner);
    client.SetServerId("S1");
    Json::Value answer;
    const bool parsed = kova::JsonFromString(text, answer);

    Require(
        !client.IsProbeAnswer(text) ||
        (parsed && answer.isObject() && answer["ezid"] == Json::Value(client.GetServerIdMd5())));
    if (!parsed) {
        return;
    }
    std::vector<std::string> hosts;
    Require(!KOVA::CredRequestFarlinkPrivate::SiteHosts(answer, hosts) ||
            hosts.size() == answer["sites"].size());
    std::vector<KOVA::CredRequestFarlinkPrivate::ProbeTarget> list;
    if (client.DirectCandidates(answer, list)) {
        CheckCandidates(list, true);
    }
    client.SetServiceId("zon_https");
    if (client.RelayCandidates(answer, list)) {
        CheckCandidates(list, false);
    }
}
