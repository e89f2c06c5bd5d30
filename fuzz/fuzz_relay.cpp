// Relay directory answers on arbitrary JSON: the site list's hosts, server information turned
// into direct candidates, a tunnel answer turned into relay candidates, and the probe answer
// that proves a candidate is the wanted server.
#include <stddef.h>
#include <stdint.h>
#include <stdlib.h>

#include <string>
#include <vector>

#include "kovacredential/cred_request_farlink.h"
#include "platform/json_text.h"
#include "request/cred_request_farlink_p.h"

namespace {

// Every address is probed over "http" or "https"; a direct one on a port above 0.
void CheckCandidates(const std::vector<KOVA::CredRequestFarlinkPrivate::ProbeTarget> &targets,
                     bool direct) {
    if (targets.empty()) {
        abort();
    }
    for (const auto &target : targets) {
        if ((*target.protocol != "http" && *target.protocol != "https") || target.host == nullptr ||
            (direct && target.port <= 0)) {
            abort();
        }
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    const std::string text(reinterpret_cast<const char *>(data), size);
    KOVA::CredRequestFarlink owner;
    KOVA::CredRequestFarlinkPrivate client(&owner);
    client.SetServerId("S1");
    Json::Value answer;
    const bool parsed = kova::JsonFromString(text, answer);

    if (client.IsProbeAnswer(text) &&
        !(parsed && answer.isObject() && answer["ezid"] == Json::Value(client.GetServerIdMd5()))) {
        abort();
    }
    if (!parsed) {
        return 0;
    }
    std::vector<std::string> hosts;
    if (KOVA::CredRequestFarlinkPrivate::SiteHosts(answer, hosts) &&
        hosts.size() != answer["sites"].size()) {
        abort();
    }
    std::vector<KOVA::CredRequestFarlinkPrivate::ProbeTarget> list;
    if (client.DirectCandidates(answer, list)) {
        CheckCandidates(list, true);
    }
    client.SetServiceId("zon_https");
    if (client.RelayCandidates(answer, list)) {
        CheckCandidates(list, false);
    }
    return 0;
}
