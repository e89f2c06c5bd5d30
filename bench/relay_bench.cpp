// relay_bench: what a whole look-up by server id costs against the requests it is made of.
//
// A simulated directory (global host and one site, on port 80 of loopback addresses) knows a
// server that offers only the plain "zon" service, whose LAN addresses are k dead ones (refused
// ports) followed by the live one. One resolution is GetConnInfo: site list and server
// information for "zon_https" (refused by the directory), site list and server information for
// "zon", k refused probes and one probe that succeeds. The same requests are then sent one by
// one with plain CredRequests and timed alone, each answer read as the JSON document any client
// must read to take its next step; their sum is what a resolution should cost if it adds no
// waits of its own.
#include <stdio.h>
#include <stdlib.h>
#include <time.h>

#include <algorithm>
#include <chrono>
#include <memory>
#include <string>
#include <vector>

#include <json/reader.h>
#include <json/value.h>

#include "bench_support.h"
#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_farlink.h"
#include "platform/json_text.h"
#include "simlib/relay_sim.h"

namespace {

using kova_bench::Median;

using Clock = std::chrono::steady_clock;

double Millis(Clock::duration d) {
    return std::chrono::duration<double, std::milli>(d).count();
}

// Reads an answer as a JSON document with jsoncpp's own reader.
bool ReadAnswer(KOVA::CredRequest &request) {
    static const std::unique_ptr<Json::CharReader> reader(
        Json::CharReaderBuilder().newCharReader());
    const std::string text = request.GetResponse();
    Json::Value answer;
    std::string errors;
    return reader->parse(text.data(), text.data() + text.size(), &answer, &errors) &&
           answer.isObject();
}

// One directory command exactly as the client sends it, and its answer read.
bool DirectoryRequest(const std::string &host, const Json::Value &body) {
    KOVA::CredRequest request;
    request.SetURL("http", host, 80, "/Serv.php");
    request.SetHTTPSVerify(false);
    request.SetResponseTimeout(5);
    request.AddRawParam(kova::JsonToString(body));
    return request.Process(true, 0) && ReadAnswer(request);
}

// One direct probe exactly as the client sends it, and its answer read.
bool Probe(const std::string &host, int port) {
    KOVA::CredRequest request;
    request.SetURL("http", host, port, "/webman/pingpong.cgi");
    request.SetResponseTimeout(5);
    request.SetDefaultTimeout(10);
    return request.Process(true, 0) && ReadAnswer(request);
}

// CPU time of the calling thread.
double ThreadCpuMillis() {
    struct timespec now;
    clock_gettime(CLOCK_THREAD_CPUTIME_ID, &now);
    return 1e3 * static_cast<double>(now.tv_sec) + 1e-6 * static_cast<double>(now.tv_nsec);
}

template <typename Fn>
double Time(Fn fn) {
    auto start = Clock::now();
    fn();
    return Millis(Clock::now() - start);
}

}  // namespace

int main(int argc, char **argv) {
    const int rounds = argc > 1 ? atoi(argv[1]) : 200;
    if (rounds <= 0) {
        fprintf(stderr, "usage: %s [rounds]\n", argv[0]);
        return 2;
    }
    kovasim::RelayDirectory directory(2);
    if (!directory.Start()) {
        printf("relay_bench: skipped: the directory needs port 80 on loopback addresses (%s)\n",
               directory.Error().c_str());
        return directory.NotPermitted() ? 0 : 1;
    }
    const std::string global = directory.Host(0);
    const std::string site = directory.Host(1);
    setenv("kovacredential_farlink_global", global.c_str(), 1);
    setenv("kovacredential_farlink_server", site.c_str(), 1);

    kovasim::LoopbackServer::Options options;
    options.host = kovasim::ProcessLoopbackAddress(10);
    kovasim::LoopbackServer live(options);
    kovasim::InstallPingPong(live, "BENCH");
    if (!live.Start()) {
        fprintf(stderr, "relay_bench: cannot start the server: %s\n", live.Error().c_str());
        return 1;
    }
    const int port = live.Port();

    const int counts[] = {0, 4, 16};
    printf(
        "relay_bench: GetConnInfo with k refused candidates before the live one "
        "(medians of %d rounds, order alternating)\n",
        rounds);
    printf("%4s  %14s  %14s  %16s  %7s  %9s\n", "k", "resolution ms", "sum of parts",
           "(dir + probes)", "ratio", "cpu ratio");
    bool withinTarget = true;
    for (int k : counts) {
        // The dead addresses have nothing listening at the live server's port.
        Json::Value server(Json::objectValue);
        server["serverID"] = "BENCH";
        std::vector<std::string> dead;
        for (int i = 0; i < k; ++i) {
            dead.push_back(kovasim::ProcessLoopbackAddress(20 + i));
            server["interface"].append(Json::Value(Json::objectValue))["ip"] = dead.back();
        }
        server["interface"].append(Json::Value(Json::objectValue))["ip"] = options.host;
        server["services"]["zon"]["port"] = port;
        Json::Value config(Json::objectValue);
        config["sites"].append(site);
        config["servers"].append(server);
        directory.Sim().Configure(config);

        Json::Value siteList(Json::objectValue);
        siteList["version"] = 1;
        siteList["command"] = "get_site_list";
        Json::Value httpsInfo = siteList;
        httpsInfo["command"] = "get_server_info";
        httpsInfo["serverID"] = "BENCH";
        httpsInfo["id"] = "zon_https";
        Json::Value plainInfo = httpsInfo;
        plainInfo["id"] = "zon";

        std::vector<double> resolution, parts, directoryParts, probeParts, ratios, cpuRatios;
        for (int round = 0; round < rounds; ++round) {
            Json::Value candidate;
            Json::Value errors;
            bool ok = true;
            double resolutionCpu = 0;
            double partsCpu = 0;
            auto resolve = [&] {
                const double cpu = ThreadCpuMillis();
                const double ms = Time([&] {
                    ok = KOVA::CredRequestFarlink::GetConnInfo("BENCH", candidate, &errors);
                });
                resolutionCpu = ThreadCpuMillis() - cpu;
                return ms;
            };
            double dirMs = 0;
            double probeMs = 0;
            auto sendParts = [&] {
                const double cpu = ThreadCpuMillis();
                dirMs = Time([&] { DirectoryRequest(global, siteList); }) +
                        Time([&] { DirectoryRequest(site, httpsInfo); }) +
                        Time([&] { DirectoryRequest(global, siteList); }) +
                        Time([&] { DirectoryRequest(site, plainInfo); });
                probeMs = 0;
                for (const std::string &host : dead) {
                    probeMs += Time([&] { Probe(host, port); });
                }
                probeMs += Time([&] { Probe(options.host, port); });
                partsCpu = ThreadCpuMillis() - cpu;
            };
            double resolutionMs = 0;
            if (round % 2 == 0) {
                resolutionMs = resolve();
                sendParts();
            } else {
                sendParts();
                resolutionMs = resolve();
            }
            if (!ok || candidate["host"].asString() != options.host) {
                fprintf(stderr, "relay_bench: resolution failed: %s\n",
                        kova::JsonToString(errors).c_str());
                return 1;
            }
            resolution.push_back(resolutionMs);
            directoryParts.push_back(dirMs);
            probeParts.push_back(probeMs);
            parts.push_back(dirMs + probeMs);
            ratios.push_back(resolutionMs / (dirMs + probeMs));
            cpuRatios.push_back(resolutionCpu / partsCpu);
        }
        const double ratio = Median(ratios);
        char split[64];
        snprintf(split, sizeof(split), "%.3f + %.3f", Median(directoryParts), Median(probeParts));
        printf("%4d  %14.3f  %14.3f  %16s  %7.3f  %9.3f\n", k, Median(resolution), Median(parts),
               split, ratio, Median(cpuRatios));
        withinTarget = withinTarget && ratio <= 1.05;
    }
    printf("target: a resolution costs at most 1.05 times the sum of its parts: %s\n",
           withinTarget ? "met" : "NOT met");
    return 0;
}
