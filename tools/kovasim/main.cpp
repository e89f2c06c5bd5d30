// kovasim: a loopback simulator of the remote servers the library talks to. It serves plain
// HTTP and HTTPS on 127.0.0.1, prints one line per listener ("http 127.0.0.1:PORT",
// "https 127.0.0.1:PORT") and runs until SIGINT or SIGTERM, or for --duration seconds.
//
// Roles are configured from a JSON file whose top-level members name them; "webapi"
// configures the WebAPI role (tools/simlib/webapi_sim.h).
#include <signal.h>
#include <stdio.h>
#include <time.h>
#include <unistd.h>

#include <fstream>
#include <memory>
#include <sstream>
#include <string>

#include <CLI/CLI.hpp>
#include <json/reader.h>
#include <json/value.h>

#include "simlib/loopback_server.h"
#include "simlib/webapi_sim.h"

namespace {

struct Settings {
    std::string configPath;
    int httpPort = 0;
    int httpsPort = 0;
    int threads = 256;
    double duration = 0;  // seconds; 0 runs until a signal
    bool redirectHttp = false;
    bool noHttp = false;
    bool noHttps = false;
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

}  // namespace

int main(int argc, char **argv) {
    CLI::App app{"kovasim: loopback WebAPI simulator"};
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
    CLI11_PARSE(app, argc, argv);
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

    // Worker threads inherit this mask, so the stop signals reach only WaitForStop.
    sigset_t stopSignals;
    sigemptyset(&stopSignals);
    sigaddset(&stopSignals, SIGINT);
    sigaddset(&stopSignals, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &stopSignals, nullptr);
    signal(SIGPIPE, SIG_IGN);

    std::unique_ptr<kovasim::LoopbackServer> https;
    std::unique_ptr<kovasim::LoopbackServer> http;
    if (!settings.noHttps) {
        https = MakeServer(true, settings.httpsPort, settings.threads);
        webapi.Install(*https);
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
        }
        if (!http->Start()) {
            fprintf(stderr, "kovasim: http: %s\n", http->Error().c_str());
            return 1;
        }
    }
    if (http) {
        printf("http %s:%d\n", http->Host().c_str(), http->Port());
    }
    if (https) {
        printf("https %s:%d\n", https->Host().c_str(), https->Port());
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
