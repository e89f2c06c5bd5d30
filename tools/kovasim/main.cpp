// kovasim: a loopback simulator of the remote servers the library talks to. It serves plain
// HTTP and HTTPS on 127.0.0.1, prints one line per listener ("http 127.0.0.1:PORT",
// "https 127.0.0.1:PORT") and runs until SIGINT or SIGTERM, or for --duration seconds.
//
// Roles are configured from a JSON file whose top-level members name them; "webapi"
// configures the WebAPI role (tools/simlib/webapi_sim.h) and "relay" the relay-directory role:
//
//   "relay": {
//     "hosts": ["127.0.0.2", "127.0.0.3"],  // loopback addresses serving "/Serv.php"
//     "port": 80,                           // directory port (clients use 80, or 443 for TLS)
//     "serverId": "S1",                     // the WebAPI listeners answer the probe
//                                           // "/webman/pingpong.cgi" as this server
//     "directory": { ... }                  // the directory's contents (simlib/relay_sim.h)
//   }
//
// In "directory", the texts "$http_port" and "$https_port" stand for the ports the WebAPI
// listeners got, so a configuration can point the directory at them before they are known.
// Each directory host prints "relay HOST:PORT".
//
// --fault MODE serves one hostile peer instead of the roles (tools/simlib/fault_server.h):
// silent, reset-headers, reset-body, garbage-status, many-headers, huge-header, bad-chunk,
// plain-on-tls, tls-on-plain, huge-body. It prints "https 127.0.0.1:PORT" for plain-on-tls
// (clients are to use TLS there; --https-port picks the port) and "http 127.0.0.1:PORT" for
// the others (--http-port).
//
// `kovasim link --listen PORT --to HOST:PORT --rtt MS` serves no roles: it relays TCP from
// 127.0.0.1:PORT (0 picks a free one) to HOST:PORT with a set round-trip time
// (tools/simlib/link_relay.h), prints "link 127.0.0.1:PORT", and prints
// "connections N up BYTES down BYTES" on SIGUSR1 and once more when it stops.
#include <pthread.h>
#include <signal.h>
#include <stdio.h>
#include <time.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include <CLI/CLI.hpp>
#include <json/reader.h>
#include <json/value.h>

#include "common/tool_version.h"
#include "simlib/fault_server.h"
#include "simlib/link_relay.h"
#include "simlib/loopback_server.h"
#include "simlib/relay_sim.h"
#include "simlib/webapi_sim.h"

namespace {

constexpr size_t kWorkerStackSize = 512 * 1024;

struct Settings {
    std::string configPath;
    int httpPort = 0;
    int httpsPort = 0;
    int threads = 256;
    double duration = 0;  // seconds; 0 runs until a signal
    bool redirectHttp = false;
    bool noHttp = false;
    bool noHttps = false;
    std::string fault;
};

bool LoadConfig(const std::string &path, Json::Value &config, std::string &error) {
    if (path.empty()) {
        config = Json::Value(Json::objectValue);
        return true;
    }
    std::ifstream in(path);
    if (!in) {
        error = "cannot read " + path;
        return false;
    }
    Json::CharReaderBuilder builder;
    if (!Json::parseFromStream(builder, in, &config, &error)) {
        error = path + ": " + error;
        return false;
    }
    if (!config.isObject()) {
        error = path + ": the configuration must be a JSON object";
        return false;
    }
    return true;
}

std::unique_ptr<kovasim::LoopbackServer> MakeServer(bool https, int port, int threads) {
    kovasim::LoopbackServer::Options options;
    options.https = https;
    options.port = port;
    options.threads = threads;
    return std::make_unique<kovasim::LoopbackServer>(options);
}

// Blocks until SIGINT or SIGTERM arrives, or until `duration` seconds have passed when it is
// above 0. The signals are blocked in every thread (see main), so only this wait takes them.
void WaitForStop(const sigset_t &stopSignals, double duration) {
    if (duration <= 0) {
        int sig = 0;
        sigwait(&stopSignals, &sig);
        return;
    }
    struct timespec limit;
    limit.tv_sec = static_cast<time_t>(duration);
    limit.tv_nsec = static_cast<long>((duration - static_cast<double>(limit.tv_sec)) * 1e9);
    sigtimedwait(&stopSignals, nullptr, &limit);
}

// Replaces the port placeholders in a directory configuration by the listeners' ports.
Json::Value FillPorts(const Json::Value &value, int httpPort, int httpsPort) {
    if (value.isString()) {
        if (value.asString() == "$http_port") {
            return Json::Value(httpPort);
        }
        if (value.asString() == "$https_port") {
            return Json::Value(httpsPort);
        }
        return value;
    }
    Json::Value out = value;
    if (value.isObject()) {
        for (const auto &name : value.getMemberNames()) {
            out[name] = FillPorts(value[name], httpPort, httpsPort);
        }
    } else if (value.isArray()) {
        for (Json::ArrayIndex i = 0; i < value.size(); ++i) {
            out[i] = FillPorts(value[i], httpPort, httpsPort);
        }
    }
    return out;
}

// The relay-directory role: one RelaySim served on every configured host.
struct RelayRole {
    kovasim::RelaySim sim;
    std::vector<std::unique_ptr<kovasim::LoopbackServer>> hosts;
    std::string serverId;
    int port = 80;

    bool Configure(const Json::Value &config, std::string &error) {
        if (config.isNull()) {
            return true;
        }
        if (!config.isObject() || !config["hosts"].isArray() || config["hosts"].empty()) {
            error = "\"relay\" needs a non-empty array \"hosts\"";
            return false;
        }
        port = config.get("port", 80).asInt();
        serverId = config.get("serverId", "").asString();
        for (const auto &host : config["hosts"]) {
            kovasim::LoopbackServer::Options options;
            options.host = host.asString();
            options.port = port;
            options.threads = 8;
            hosts.push_back(std::make_unique<kovasim::LoopbackServer>(options));
            sim.Install(*hosts.back());
        }
        return sim.Configure(config.get("directory", Json::Value(Json::objectValue)), &error);
    }

    bool Start(const Json::Value &config, int httpPort, int httpsPort, std::string &error) {
        if (hosts.empty()) {
            return true;
        }
        if (!sim.Configure(FillPorts(config.get("directory", Json::Value(Json::objectValue)),
                                     httpPort, httpsPort),
                           &error)) {
            return false;
        }
        for (auto &host : hosts) {
            if (!host->Start()) {
                error = host->Error();
                return false;
            }
        }
        return true;
    }
};

struct LinkSettings {
    int listen = 0;
    std::string to;
    int rttMs = 50;
};

void PrintLinkStats(const kovasim::LinkRelay &link) {
    printf("connections %d up %lld down %lld\n", link.ConnectionCount(), link.BytesUp(),
           link.BytesDown());
    fflush(stdout);
}

// Relays until SIGINT or SIGTERM (or --duration), printing the counts on SIGUSR1.
int RunLink(const LinkSettings &settings, double duration) {
    const size_t colon = settings.to.rfind(':');
    kovasim::LinkRelay::Options options;
    options.listenPort = settings.listen;
    options.rttMs = settings.rttMs;
    try {
        options.toHost = settings.to.substr(0, colon);
        options.toPort = std::stoi(settings.to.substr(colon + 1));
    } catch (const std::exception &) {
        options.toPort = 0;
    }
    if (colon == std::string::npos || options.toHost.empty() || options.toPort <= 0 ||
        options.toPort > 65535) {
        fprintf(stderr, "kovasim: link: --to needs HOST:PORT\n");
        return 2;
    }
    if (options.toHost.size() > 2 && options.toHost.front() == '[' &&
        options.toHost.back() == ']') {
        options.toHost = options.toHost.substr(1, options.toHost.size() - 2);
    }
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGINT);
    sigaddset(&signals, SIGTERM);
    sigaddset(&signals, SIGUSR1);
    pthread_sigmask(SIG_BLOCK, &signals, nullptr);
    signal(SIGPIPE, SIG_IGN);

    kovasim::LinkRelay link(options);
    if (!link.Start()) {
        fprintf(stderr, "kovasim: link: %s\n", link.Error().c_str());
        return 1;
    }
    printf("link 127.0.0.1:%d\n", link.Port());
    fflush(stdout);
    const auto stopAt = std::chrono::steady_clock::now() +
                        std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                            std::chrono::duration<double>(duration));
    for (;;) {
        int sig = 0;
        if (duration > 0) {
            const auto left = stopAt - std::chrono::steady_clock::now();
            if (left <= std::chrono::steady_clock::duration::zero()) {
                break;
            }
            const auto ns = std::chrono::duration_cast<std::chrono::nanoseconds>(left).count();
            struct timespec limit;
            limit.tv_sec = static_cast<time_t>(ns / 1000000000);
            limit.tv_nsec = static_cast<long>(ns % 1000000000);
            sig = sigtimedwait(&signals, nullptr, &limit);
        } else {
            sigwait(&signals, &sig);
        }
        if (sig != SIGUSR1) {
            if (sig > 0 || duration <= 0) {
                break;
            }
            continue;
        }
        PrintLinkStats(link);
    }
    link.Stop();
    PrintLinkStats(link);
    return 0;
}

}  // namespace

int main(int argc, char **argv) {
    CLI::App app{"kovasim: loopback WebAPI and relay-directory simulator"};
    app.set_version_flag(
        "--version", [] { return kova_tools::VersionText("kovasim"); },
        "print the versions of kovasim and the libraries it runs with");
    Settings settings;
    app.add_option("--config", settings.configPath, "JSON configuration file")
        ->check(CLI::ExistingFile);
    app.add_option("--http-port", settings.httpPort, "plain HTTP port (0 picks a free one)");
    app.add_option("--https-port", settings.httpsPort, "HTTPS port (0 picks a free one)");
    app.add_option("--threads", settings.threads, "worker threads per listener")
        ->check(CLI::Range(1, 4096));
    app.add_option("--duration", settings.duration, "stop after this many seconds");
    app.add_flag("--redirect-http", settings.redirectHttp,
                 "answer every plain-HTTP request with a 302 to the HTTPS listener");
    app.add_flag("--no-http", settings.noHttp, "do not serve plain HTTP");
    app.add_flag("--no-https", settings.noHttps, "do not serve HTTPS");
    std::vector<std::string> faultNames;
    for (kovasim::Fault fault : kovasim::AllFaults()) {
        faultNames.push_back(kovasim::FaultName(fault));
    }
    app.add_option("--fault", settings.fault, "serve one hostile peer instead of the roles")
        ->check(CLI::IsMember(faultNames));
    LinkSettings link;
    CLI::App *linkCommand = app.add_subcommand(
        "link", "relay TCP from a loopback port to HOST:PORT with a set round-trip time");
    linkCommand->add_option("--listen", link.listen, "loopback port to listen on (0 picks one)")
        ->check(CLI::Range(0, 65535));
    linkCommand->add_option("--to", link.to, "HOST:PORT to relay to")->required();
    linkCommand->add_option("--rtt", link.rttMs, "round-trip time in milliseconds (default 50)")
        ->check(CLI::Range(0, 60000));
    linkCommand->add_option("--duration", settings.duration, "stop after this many seconds");
    CLI11_PARSE(app, argc, argv);
    if (*linkCommand) {
        return RunLink(link, settings.duration);
    }
    if (settings.redirectHttp && (settings.noHttp || settings.noHttps)) {
        fprintf(stderr, "kovasim: --redirect-http needs both listeners\n");
        return 2;
    }

    Json::Value config;
    std::string error;
    if (!LoadConfig(settings.configPath, config, error)) {
        fprintf(stderr, "kovasim: %s\n", error.c_str());
        return 2;
    }
    kovasim::WebApiSim webapi;
    if (!webapi.Configure(config["webapi"], &error)) {
        fprintf(stderr, "kovasim: webapi: %s\n", error.c_str());
        return 2;
    }
    RelayRole relay;
    if (!relay.Configure(config["relay"], error)) {
        fprintf(stderr, "kovasim: relay: %s\n", error.c_str());
        return 2;
    }

    // A worker needs far less than the default stack of 8 MiB; two pools of 256 workers with
    // that stack would not even fit a 32-bit address space.
    pthread_attr_t workerAttr;
    pthread_attr_init(&workerAttr);
    pthread_attr_setstacksize(&workerAttr, kWorkerStackSize);
    pthread_setattr_default_np(&workerAttr);
    pthread_attr_destroy(&workerAttr);

    // Worker threads inherit this mask, so the stop signals reach only WaitForStop.
    sigset_t stopSignals;
    sigemptyset(&stopSignals);
    sigaddset(&stopSignals, SIGINT);
    sigaddset(&stopSignals, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &stopSignals, nullptr);
    signal(SIGPIPE, SIG_IGN);

    kovasim::Fault fault;
    if (kovasim::FaultFromName(settings.fault, &fault)) {
        kovasim::FaultServer server(
            fault, "127.0.0.1",
            fault == kovasim::Fault::kPlainOnTls ? settings.httpsPort : settings.httpPort);
        if (!server.Start()) {
            fprintf(stderr, "kovasim: fault %s: %s\n", settings.fault.c_str(),
                    server.Error().c_str());
            return 1;
        }
        printf("%s 127.0.0.1:%d\n", server.ClientUsesTls() ? "https" : "http", server.Port());
        fflush(stdout);
        WaitForStop(stopSignals, settings.duration);
        fflush(stdout);
        _exit(0);
    }

    std::unique_ptr<kovasim::LoopbackServer> https;
    std::unique_ptr<kovasim::LoopbackServer> http;
    if (!settings.noHttps) {
        https = MakeServer(true, settings.httpsPort, settings.threads);
        webapi.Install(*https);
        if (!relay.serverId.empty()) {
            kovasim::InstallPingPong(*https, relay.serverId);
        }
        if (!https->Start()) {
            fprintf(stderr, "kovasim: https: %s\n", https->Error().c_str());
            return 1;
        }
    }
    if (!settings.noHttp) {
        http = MakeServer(false, settings.httpPort, settings.threads);
        if (settings.redirectHttp) {
            kovasim::WebApiSim::InstallRedirect(*http, https->Port());
        } else {
            webapi.Install(*http);
            if (!relay.serverId.empty()) {
                kovasim::InstallPingPong(*http, relay.serverId);
            }
        }
        if (!http->Start()) {
            fprintf(stderr, "kovasim: http: %s\n", http->Error().c_str());
            return 1;
        }
    }
    if (!relay.Start(config["relay"], http ? http->Port() : 0, https ? https->Port() : 0, error)) {
        fprintf(stderr, "kovasim: relay: %s\n", error.c_str());
        return 1;
    }
    if (http) {
        printf("http %s:%d\n", http->Host().c_str(), http->Port());
    }
    if (https) {
        printf("https %s:%d\n", https->Host().c_str(), https->Port());
    }
    for (const auto &host : relay.hosts) {
        printf("relay %s:%d\n", host->Host().c_str(), host->Port());
    }
    fflush(stdout);

    WaitForStop(stopSignals, settings.duration);
    // The process ends here, so the listeners are not stopped one by one: stopping a
    // cpp-httplib server sometimes leaves its accept loop blocked, which would keep kovasim
    // alive after the signal.
    fflush(stdout);
    fflush(stderr);
    _exit(0);
}
