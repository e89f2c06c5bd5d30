// Many slow requests three ways: one after another through Process, together through
// CredRequestMgr::Run, and together through a reference loop over curl_multi_poll driving the
// same easy handles. Prints wall times and ratios.
#include <stdio.h>
#include <stdlib.h>

#include <chrono>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include <curl/curl.h>

#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_mgr.h"
#include "simlib/loopback_server.h"

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kRequests = 100;
constexpr int kDelayMs = 200;
constexpr int kServerThreads = 160;

double Since(Clock::time_point start) {
    return std::chrono::duration<double>(Clock::now() - start).count();
}

std::string Expected(int i) {
    return "answer " + std::to_string(i);
}

std::vector<std::unique_ptr<KOVA::CredRequest>> MakeRequests(const std::string &base) {
    std::vector<std::unique_ptr<KOVA::CredRequest>> requests;
    for (int i = 0; i < kRequests; ++i) {
        auto request = std::make_unique<KOVA::CredRequest>();
        request->SetURL(base + "/delay?n=" + std::to_string(i));
        requests.push_back(std::move(request));
    }
    return requests;
}

// Counts the answers that arrived whole; `get(i)` gives the body of request i.
template <typename Get>
int CountGood(Get get) {
    int good = 0;
    for (int i = 0; i < kRequests; ++i) {
        if (get(i) == Expected(i)) {
            ++good;
        }
    }
    return good;
}

double RunSerial(const std::string &base, int *good) {
    auto requests = MakeRequests(base);
    auto start = Clock::now();
    for (auto &request : requests) {
        request->Process(true, 0);
    }
    double seconds = Since(start);
    *good = CountGood([&](int i) { return requests[i]->GetResponse(); });
    return seconds;
}

double RunManager(const std::string &base, int *good, bool *ok) {
    KOVA::CredRequestMgr mgr;
    for (auto &request : MakeRequests(base)) {
        mgr.AddCredRequest(request.release());
    }
    auto start = Clock::now();
    *ok = mgr.Run();
    double seconds = Since(start);
    *good = CountGood([&](int i) { return mgr.GetResponse(i); });
    return seconds;
}

// The loop libcurl's own documentation suggests, over handles set up exactly as Run sets them
// up.
double RunReference(const std::string &base, int *good) {
    auto requests = MakeRequests(base);
    std::unique_ptr<CURLM, CURLMcode (*)(CURLM *)> multi(curl_multi_init(), curl_multi_cleanup);
    for (auto &request : requests) {
        request->SetResponseTimeout(0);
        if (request->Process(false, 0)) {
            curl_multi_add_handle(multi.get(), request->GetCurlHandler());
        }
    }
    auto start = Clock::now();
    int running = 0;
    do {
        if (curl_multi_perform(multi.get(), &running) != CURLM_OK) {
            break;
        }
        if (running > 0 && curl_multi_poll(multi.get(), nullptr, 0, 1000, nullptr) != CURLM_OK) {
            break;
        }
    } while (running > 0);
    double seconds = Since(start);
    for (auto &request : requests) {
        curl_multi_remove_handle(multi.get(), request->GetCurlHandler());
    }
    *good = CountGood([&](int i) { return requests[i]->GetResponse(); });
    return seconds;
}

}  // namespace

int main() {
    kovasim::LoopbackServer::Options options;
    options.threads = kServerThreads;
    kovasim::LoopbackServer server(options);
    server.Route("*", "/delay", [](const httplib::Request &req, httplib::Response &res) {
        std::this_thread::sleep_for(std::chrono::milliseconds(kDelayMs));
        res.set_content("answer " + req.get_param_value("n"), "text/plain");
    });
    if (!server.Start()) {
        fprintf(stderr, "manager_bench: cannot start the loopback server: %s\n",
                server.Error().c_str());
        return 1;
    }
    const std::string base = server.BaseUrl();
    printf("manager_bench: %d requests, %d ms answer delay, %d server threads\n", kRequests,
           kDelayMs, kServerThreads);

    int goodManager = 0;
    int goodReference = 0;
    int goodSerial = 0;
    bool managerOk = false;
    double manager = RunManager(base, &goodManager, &managerOk);
    double reference = RunReference(base, &goodReference);
    double serial = RunSerial(base, &goodSerial);
    server.Stop();

    printf("  one after another (Process)      %8.3f s  %3d/%d answers\n", serial, goodSerial,
           kRequests);
    printf("  together (CredRequestMgr::Run)   %8.3f s  %3d/%d answers  Run %s\n", manager,
           goodManager, kRequests, managerOk ? "true" : "false");
    printf("  together (curl_multi_poll loop)  %8.3f s  %3d/%d answers\n", reference, goodReference,
           kRequests);
    double managerToReference = manager / reference;
    double serialToManager = serial / manager;
    printf("  manager / reference loop         %8.2f   (target <= 1.20)\n", managerToReference);
    printf("  one after another / manager      %8.2f   (target >= 20)\n", serialToManager);

    bool allGood =
        goodManager == kRequests && goodReference == kRequests && goodSerial == kRequests;
    return allGood && managerOk ? 0 : 1;
}
