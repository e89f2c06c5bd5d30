// What connections cost, side by side in one run against Debian's nginx (TLS, HTTP/2) started
// from the test harness, and through a loopback link that adds a round-trip time:
//   1. 200 sequential HTTPS GETs: a fresh CredRequest each, one reused raw easy handle, and
//      Python's requests.Session (a python3 child timing itself);
//   2. 1,000 concurrent HTTPS GETs: CredRequestMgr, and one curl multi handle multiplexing
//      over HTTP/2 (PIPEWAIT, at most 6 connections per host); each side runs in a fresh
//      process of this program, which reports its time and peak resident set;
//   3. 20 sequential GETs over a 50 ms link: the three clients of (1);
//   4. a login (discovery, encryption information, login) and 10 WebAPI calls over the 50 ms
//      link against the simulator's HTTPS listener: the connections and requests it took.
// Every figure also names the connections nginx (or the link) saw. The targets are printed
// next to the ratios; the benchmark fails only when answers are wrong or a peer is missing.
//
// Usage: connection_bench
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include <curl/curl.h>

#include "bench_support.h"
#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_mgr.h"
#include "kovacredential/kovacred.h"
#include "kovacredential/kovacredsetter.h"
#include "simlib/link_relay.h"
#include "simlib/loopback_server.h"
#include "simlib/webapi_sim.h"
#include "support/nginx_server.h"
#include "support/temp_dir.h"

namespace {

using kova_bench::Median;
using kova_bench::StatusKb;

using Clock = std::chrono::steady_clock;

constexpr int kSequential = 200;
constexpr int kConcurrent = 1000;
constexpr int kLinkCalls = 20;
constexpr int kLinkRttMs = 50;
constexpr int kWebApiCalls = 10;
// Rounds of (1): each takes a few milliseconds, so that one slow moment of the machine would
// decide the figure of a few.
constexpr int kRounds = 15;
// Rounds of (2), which side goes first alternating: each side runs in a process of its own and
// takes some tens of milliseconds.
constexpr int kConcurrentRounds = 7;
// Debian's interpreter, which python3-requests installs into (a python3 earlier on the PATH
// may bring a requests of its own, or none).
constexpr const char *kPython = "/usr/bin/python3";
constexpr long kMaxHostConnections = 6;
constexpr const char *kBody = "hello from nginx\n";

double Since(Clock::time_point start) {
    return std::chrono::duration<double>(Clock::now() - start).count();
}

size_t AppendBody(char *data, size_t size, size_t nmemb, void *out) {
    static_cast<std::string *>(out)->append(data, size * nmemb);
    return size * nmemb;
}

struct EasyCleanup {
    void operator()(CURL *c) const { curl_easy_cleanup(c); }
};
using Easy = std::unique_ptr<CURL, EasyCleanup>;
struct MultiCleanup {
    void operator()(CURLM *m) const { curl_multi_cleanup(m); }
};
using Multi = std::unique_ptr<CURLM, MultiCleanup>;

// An easy handle set up as a careful libcurl user would for these servers: their certificate
// is self-signed, and HTTP/2 is libcurl's default over TLS.
void SetUpEasy(CURL *easy, const std::string &url, std::string *body) {
    curl_easy_setopt(easy, CURLOPT_URL, url.c_str());
    curl_easy_setopt(easy, CURLOPT_SSL_VERIFYPEER, 0L);
    curl_easy_setopt(easy, CURLOPT_SSL_VERIFYHOST, 0L);
    curl_easy_setopt(easy, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(easy, CURLOPT_WRITEFUNCTION, AppendBody);
    curl_easy_setopt(easy, CURLOPT_WRITEDATA, body);
}

// ---- The sequential clients. Each returns its seconds for `n` GETs of `url`, or -1 when an
// answer was wrong.

double LibraryGets(const std::string &url, int n) {
    const auto start = Clock::now();
    for (int i = 0; i < n; ++i) {
        KOVA::CredRequest req;
        if (!req.SetURL(url) || !req.Process(true, 0) || req.GetResponse() != kBody) {
            return -1;
        }
    }
    return Since(start);
}

double RawHandleGets(const std::string &url, int n) {
    const auto start = Clock::now();
    Easy easy(curl_easy_init());
    for (int i = 0; i < n; ++i) {
        std::string body;
        SetUpEasy(easy.get(), url, &body);
        long status = 0;
        if (curl_easy_perform(easy.get()) != CURLE_OK ||
            curl_easy_getinfo(easy.get(), CURLINFO_RESPONSE_CODE, &status) != CURLE_OK ||
            status != 200 || body != kBody) {
            return -1;
        }
    }
    return Since(start);
}

// requests.Session in a python3 child, timed inside Python from the session's creation on.
double PythonSessionGets(const std::string &url, int n) {
    static const char *const kScript =
        "import sys, time, warnings\n"
        "import requests\n"
        "warnings.filterwarnings('ignore')\n"
        "url, n = sys.argv[1], int(sys.argv[2])\n"
        "start = time.perf_counter()\n"
        "s = requests.Session()\n"
        "for _ in range(n):\n"
        "    r = s.get(url, verify=False)\n"
        "    if r.status_code != 200 or r.text != 'hello from nginx\\n':\n"
        "        sys.exit(1)\n"
        "print(time.perf_counter() - start)\n";
    std::string out;
    const std::string command =
        std::string("python3 -c \"") + kScript + "\" '" + url + "' " + std::to_string(n) + " 2>&1";
    if (kova_test::RunCommand(command, &out) != 0) {
        fprintf(stderr, "connection_bench: requests.Session failed: %s", out.c_str());
        return -1;
    }
    return atof(out.c_str());
}

bool PythonRequestsPresent() {
    std::string out;
    return kova_test::RunCommand(std::string(kPython) + " -c 'import requests' 2>&1", &out) == 0;
}

struct Sequential {
    std::vector<double> library, raw, python;
    size_t libraryConnections = 0, rawConnections = 0, pythonConnections = 0;
    bool good = true;
};

// One client's run, with the connections it opened as seen by `count` (0 without one).
double Counted(const std::function<double()> &run, const std::function<size_t()> &count,
               size_t *connections, bool *good) {
    const double seconds = run();
    *good = *good && seconds >= 0;
    *connections = count ? count() : 0;
    return seconds;
}

void ReportSequential(const char *title, int rounds, const Sequential &s, bool withPython,
                      double pythonFactor) {
    const double lib = Median(s.library);
    const double raw = Median(s.raw);
    const double py = Median(s.python);
    if (rounds > 1) {
        printf("%s (median of %d alternating rounds)\n", title, rounds);
    } else {
        printf("%s (one round)\n", title);
    }
    printf("  %-40s %8.3f s  %5zu connections\n", "a fresh CredRequest each", lib,
           s.libraryConnections);
    printf("  %-40s %8.3f s  %5zu connections\n", "one reused raw libcurl handle", raw,
           s.rawConnections);
    if (withPython) {
        printf("  %-40s %8.3f s  %5zu connections\n", "Python requests.Session", py,
               s.pythonConnections);
    }
    printf("  speed of the library / the raw handle  %8.2f   (target >= 0.90)%s\n", raw / lib,
           s.good ? "" : "  SOME ANSWERS WRONG");
    if (withPython) {
        printf("  speed of the library / requests        %8.2f   (target >= %.2f)\n", py / lib,
               pythonFactor);
    }
}

// ---- 1,000 concurrent GETs, each side in a fresh process (--side NAME URL).

int ManagerSide(const std::string &url) {
    KOVA::CredRequestMgr mgr;
    for (int i = 0; i < kConcurrent; ++i) {
        auto *req = new KOVA::CredRequest();
        req->SetURL(url + "?n=" + std::to_string(i));
        mgr.AddCredRequest(req);
    }
    if (!mgr.Run()) {
        return 0;
    }
    int good = 0;
    for (int i = 0; i < kConcurrent; ++i) {
        good += mgr.GetResponse(i) == kBody ? 1 : 0;
    }
    return good;
}

int MultiSide(const std::string &url) {
    Multi multi(curl_multi_init());
    curl_multi_setopt(multi.get(), CURLMOPT_PIPELINING, CURLPIPE_MULTIPLEX);
    curl_multi_setopt(multi.get(), CURLMOPT_MAX_HOST_CONNECTIONS, kMaxHostConnections);
    std::vector<Easy> easies;
    std::vector<std::string> bodies(kConcurrent);
    for (int i = 0; i < kConcurrent; ++i) {
        easies.emplace_back(curl_easy_init());
        SetUpEasy(easies.back().get(), url + "?n=" + std::to_string(i), &bodies[i]);
        curl_easy_setopt(easies.back().get(), CURLOPT_PIPEWAIT, 1L);
        curl_multi_add_handle(multi.get(), easies.back().get());
    }
    int running = 0;
    do {
        if (curl_multi_perform(multi.get(), &running) != CURLM_OK) {
            break;
        }
        if (running > 0 && curl_multi_poll(multi.get(), nullptr, 0, 1000, nullptr) != CURLM_OK) {
            break;
        }
    } while (running > 0);
    int good = 0;
    for (int i = 0; i < kConcurrent; ++i) {
        good += bodies[i] == kBody ? 1 : 0;
        curl_multi_remove_handle(multi.get(), easies[i].get());
    }
    return good;
}

// The child: prints its seconds, peak resident set (kB) and right answers.
int RunSide(const std::string &side, const std::string &url) {
    curl_global_init(CURL_GLOBAL_ALL);
    const auto start = Clock::now();
    const int good = side == "manager" ? ManagerSide(url) : MultiSide(url);
    const double seconds = Since(start);
    printf("%.6f %ld %d\n", seconds, StatusKb("VmHWM"), good);
    return good == kConcurrent ? 0 : 1;
}

struct SideFigures {
    double seconds = -1;
    long peakKb = 0;
    bool good = false;
};

SideFigures MeasureSide(const char *side, const std::string &url) {
    SideFigures f;
    const std::string self = std::filesystem::read_symlink("/proc/self/exe").string();
    std::string out;
    const int status =
        kova_test::RunCommand("'" + self + "' --side " + side + " '" + url + "'", &out);
    int good = 0;
    std::istringstream(out) >> f.seconds >> f.peakKb >> good;
    f.good = status == 0 && good == kConcurrent;
    return f;
}

void RunConcurrent(const kova_test::NginxServer &nginx, bool *allGood) {
    const std::string url = nginx.BaseUrl() + "/small";
    std::vector<double> mgrSeconds, multiSeconds, mgrPeak, multiPeak;
    size_t mgrConnections = 0, multiConnections = 0;
    bool good = true;
    for (int round = 0; round < kConcurrentRounds; ++round) {
        const bool managerFirst = round % 2 == 0;
        for (const char *side :
             {managerFirst ? "manager" : "multi", managerFirst ? "multi" : "manager"}) {
            nginx.ClearLog();
            const SideFigures f = MeasureSide(side, url);
            good = good && f.good && nginx.WaitForRequests(kConcurrent);
            const bool mgr = strcmp(side, "manager") == 0;
            (mgr ? mgrSeconds : multiSeconds).push_back(f.seconds);
            (mgr ? mgrPeak : multiPeak).push_back(f.peakKb / 1024.0);
            (mgr ? mgrConnections : multiConnections) = nginx.ConnectionCount();
        }
    }
    const double mgr = Median(mgrSeconds);
    const double multi = Median(multiSeconds);
    printf("2. %d concurrent HTTPS GETs, each side in a fresh process (%d round%s)\n", kConcurrent,
           kConcurrentRounds, kConcurrentRounds == 1 ? "" : "s, medians");
    printf("  %-40s %8.3f s  %5zu connections  peak %6.1f MB\n", "CredRequestMgr::Run", mgr,
           mgrConnections, Median(mgrPeak));
    printf("  %-40s %8.3f s  %5zu connections  peak %6.1f MB\n",
           "curl multi, HTTP/2, PIPEWAIT, 6 per host", multi, multiConnections, Median(multiPeak));
    printf("  speed of the manager / the multi handle %7.2f   (target >= 0.90)%s\n", multi / mgr,
           good ? "" : "  SOME ANSWERS WRONG");
    printf("  peak of the manager / the multi handle  %7.2f   (target <= 1.20)\n",
           Median(mgrPeak) / Median(multiPeak));
    *allGood = *allGood && good;
}

// ---- 4. A login and WebAPI calls over the link against the simulator's HTTPS listener.

bool RunWebApiOverLink(bool *allGood) {
    kova_test::TempDatabase db;
    kovasim::LoopbackServer::Options options;
    options.https = true;
    options.threads = 16;
    kovasim::LoopbackServer server(options);
    kovasim::WebApiSim sim;
    sim.Install(server);
    if (!server.Start()) {
        fprintf(stderr, "connection_bench: cannot start the simulator: %s\n",
                server.Error().c_str());
        return false;
    }
    kovasim::LinkRelay::Options linkOptions;
    linkOptions.toPort = server.Port();
    linkOptions.rttMs = kLinkRttMs;
    kovasim::LinkRelay link(linkOptions);
    if (!link.Start()) {
        fprintf(stderr, "connection_bench: link: %s\n", link.Error().c_str());
        return false;
    }
    KOVA_CRED cred;
    cred.protocol = "https";
    cred.host = "127.0.0.1";
    cred.port = link.Port();
    cred.remote_account = "admin";
    cred.remote_passwd = "secret";
    if (KOVACredAdd(&cred) != 0) {
        fprintf(stderr, "connection_bench: cannot store the credential\n");
        return false;
    }
    const auto start = Clock::now();
    int good = 0;
    for (int i = 0; i < kWebApiCalls; ++i) {
        Json::Value params(Json::objectValue);
        params["n"] = std::to_string(i);
        std::unique_ptr<KOVA::CredRequest> req(
            KOVA::CredRequest::CreateWebAPIRequest(cred.id, "KOVA.Demo.Echo", 1, "echo", params));
        good += req && req->Process(true, 0) &&
                        req->GetResponse().find("\"n\":\"" + std::to_string(i) + "\"") !=
                            std::string::npos
                    ? 1
                    : 0;
    }
    const double seconds = Since(start);
    printf("4. a login and %d WebAPI calls over a %d ms link (HTTPS simulator)\n", kWebApiCalls,
           kLinkRttMs);
    printf("  %-40s %8.3f s  = %.1f round trips\n", "time", seconds, seconds * 1000.0 / kLinkRttMs);
    printf("  %-40s %8d\n", "connections opened", link.ConnectionCount());
    printf("  %-40s %8zu%s\n", "requests made", server.RequestCount(),
           good == kWebApiCalls ? "" : "  SOME ANSWERS WRONG");
    link.Stop();
    server.Stop();
    *allGood = *allGood && good == kWebApiCalls;
    return true;
}

}  // namespace

int main(int argc, char **argv) {
    if (argc == 4 && strcmp(argv[1], "--side") == 0) {
        return RunSide(argv[2], argv[3]);
    }
    if (argc > 1) {
        fprintf(stderr, "usage: connection_bench\n");
        return 2;
    }
    // 1,000 client sockets and as many on nginx's side need more than the usual 1,024.
    struct rlimit limit;
    if (getrlimit(RLIMIT_NOFILE, &limit) == 0) {
        limit.rlim_cur = limit.rlim_max;
        setrlimit(RLIMIT_NOFILE, &limit);
    }
    curl_global_init(CURL_GLOBAL_ALL);
    if (!PythonRequestsPresent()) {
        fprintf(stderr,
                "connection_bench: python3 with requests is missing "
                "(scripts/setup installs python3-requests)\n");
        return 1;
    }
    kova_test::NginxServer nginx;
    if (!nginx.Start()) {
        fprintf(stderr, "connection_bench: cannot start nginx: %s\n", nginx.Error().c_str());
        return 1;
    }
    const auto counter = [&nginx](size_t requests) {
        return [&nginx, requests] {
            nginx.WaitForRequests(requests);
            return nginx.ConnectionCount();
        };
    };
    bool allGood = true;

    const std::string url = nginx.BaseUrl() + "/small";
    Sequential first;
    for (int round = 0; round < kRounds; ++round) {
        const auto library = [&] {
            nginx.ClearLog();
            first.library.push_back(Counted([&] { return LibraryGets(url, kSequential); },
                                            counter(kSequential), &first.libraryConnections,
                                            &first.good));
        };
        const auto raw = [&] {
            nginx.ClearLog();
            first.raw.push_back(Counted([&] { return RawHandleGets(url, kSequential); },
                                        counter(kSequential), &first.rawConnections, &first.good));
        };
        // Which side goes first alternates, so that neither always meets a machine the
        // other has just warmed or loaded.
        if (round % 2 == 0) {
            library();
            raw();
        } else {
            raw();
            library();
        }
        nginx.ClearLog();
        first.python.push_back(Counted([&] { return PythonSessionGets(url, kSequential); },
                                       counter(kSequential), &first.pythonConnections,
                                       &first.good));
    }
    ReportSequential("1. 200 sequential HTTPS GETs (nginx, TLS, HTTP/2)", kRounds, first, true,
                     3.0);
    allGood = allGood && first.good;

    RunConcurrent(nginx, &allGood);

    kovasim::LinkRelay::Options linkOptions;
    linkOptions.toPort = nginx.Port();
    linkOptions.rttMs = kLinkRttMs;
    kovasim::LinkRelay link(linkOptions);
    if (!link.Start()) {
        fprintf(stderr, "connection_bench: link: %s\n", link.Error().c_str());
        return 1;
    }
    const std::string linkUrl = "https://127.0.0.1:" + std::to_string(link.Port()) + "/small";
    Sequential third;
    const auto linkCounter = [&link](int before) {
        return [&link, before] { return static_cast<size_t>(link.ConnectionCount() - before); };
    };
    int before = link.ConnectionCount();
    third.library.push_back(Counted([&] { return LibraryGets(linkUrl, kLinkCalls); },
                                    linkCounter(before), &third.libraryConnections, &third.good));
    before = link.ConnectionCount();
    third.raw.push_back(Counted([&] { return RawHandleGets(linkUrl, kLinkCalls); },
                                linkCounter(before), &third.rawConnections, &third.good));
    before = link.ConnectionCount();
    third.python.push_back(Counted([&] { return PythonSessionGets(linkUrl, kLinkCalls); },
                                   linkCounter(before), &third.pythonConnections, &third.good));
    char title[96];
    snprintf(title, sizeof(title), "3. %d sequential HTTPS GETs over a %d ms link", kLinkCalls,
             kLinkRttMs);
    ReportSequential(title, 1, third, true, 1.0);
    allGood = allGood && third.good;
    link.Stop();

    if (!RunWebApiOverLink(&allGood)) {
        return 1;
    }
    nginx.Stop();
    return allGood ? 0 : 1;
}
