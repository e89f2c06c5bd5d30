// The request manager side by side with a reference loop over curl_multi_poll driving the same
// easy handles, in three runs, each a median over alternating rounds:
//   1. 100 requests that the server answers after 200 ms (plus one serial pass through Process,
//      for the speed-up);
//   2. 1,000 concurrent WebAPI calls against the simulator;
//   3. the 100-request run of (1) with 1,100 extra descriptors open in the process, against the
//      same run without them;
// and the memory of (2): the peak resident set of the 1,000 calls made through the manager,
// against the same transfers (URL, POST body, each answer kept in a string) made through plain
// libcurl easy handles in one multi handle. Each side runs in a fresh process of this program
// (started with --rss), so that neither the simulator's threads nor the other side's heap count;
// both sides load the same program and libraries, so their peaks differ only by what their
// transfers take. --memory runs the memory comparison alone.
#include <fcntl.h>
#include <spawn.h>
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
#include <thread>
#include <vector>

#include <curl/curl.h>

#include "bench_support.h"
#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_mgr.h"
#include "platform/json_text.h"
#include "simlib/loopback_server.h"
#include "simlib/webapi_sim.h"

extern char **environ;

namespace {

using kova_bench::Median;
using kova_bench::StatusKb;

using Clock = std::chrono::steady_clock;
using Requests = std::vector<std::unique_ptr<KOVA::CredRequest>>;

constexpr int kDelayedRequests = 100;
constexpr int kDelayMs = 200;
constexpr int kConcurrentCalls = 1000;
constexpr int kExtraDescriptors = 1100;
constexpr int kRounds = 9;
constexpr int kRssRounds = 5;

double Since(Clock::time_point start) {
    return std::chrono::duration<double>(Clock::now() - start).count();
}

// A batch of requests and the answer each must bring back.
struct Batch {
    std::function<Requests()> make;
    std::function<bool(int, const std::string &)> good;
    int size;
};

Batch DelayedBatch(const std::string &base) {
    return {[base] {
                Requests requests;
                for (int i = 0; i < kDelayedRequests; ++i) {
                    requests.push_back(std::make_unique<KOVA::CredRequest>());
                    requests.back()->SetURL(base + "/delay?n=" + std::to_string(i));
                }
                return requests;
            },
            [](int i, const std::string &body) { return body == "answer " + std::to_string(i); },
            kDelayedRequests};
}

// The POST parameters of call `i` of the WebAPI batch.
Json::Value WebApiParams(int i) {
    Json::Value params(Json::objectValue);
    params["api"] = "KOVA.Demo.Echo";
    params["version"] = "1";
    params["method"] = "echo";
    params["n"] = std::to_string(i);
    return params;
}

bool GoodEcho(int i, const std::string &body) {
    Json::Value answer;
    return kova::JsonFromString(body, answer) &&
           answer["data"]["params"]["n"].asString() == std::to_string(i);
}

Batch WebApiBatch(const std::string &base) {
    return {[base] {
                Requests requests;
                for (int i = 0; i < kConcurrentCalls; ++i) {
                    requests.push_back(std::make_unique<KOVA::CredRequest>());
                    requests.back()->SetURL(base + "/webapi/entry.cgi");
                    requests.back()->AddPostParam(WebApiParams(i));
                }
                return requests;
            },
            GoodEcho, kConcurrentCalls};
}

// Seconds of one manager run over the batch; `good` counts the right answers.
double RunManager(const Batch &batch, int *good, bool *ok) {
    KOVA::CredRequestMgr mgr;
    for (auto &request : batch.make()) {
        mgr.AddCredRequest(request.release());
    }
    const auto start = Clock::now();
    *ok = mgr.Run();
    const double seconds = Since(start);
    *good = 0;
    for (int i = 0; i < batch.size; ++i) {
        *good += batch.good(i, mgr.GetResponse(i)) ? 1 : 0;
    }
    // Every round starts without kept connections, as the reference's do: kept ones would let
    // later manager rounds skip their connects and hold the simulator's threads while the
    // reference runs.
    KOVA::CredRequest::CloseIdleConnections();
    return seconds;
}

// The loop libcurl's own documentation suggests: perform, then poll, until no transfer runs.
void DriveToTheEnd(CURLM *multi) {
    int running = 0;
    do {
        if (curl_multi_perform(multi, &running) != CURLM_OK) {
            break;
        }
        if (running > 0 && curl_multi_poll(multi, nullptr, 0, 1000, nullptr) != CURLM_OK) {
            break;
        }
    } while (running > 0);
}

// That loop over handles set up exactly as Run sets them up, in a multi handle that keeps as
// many idle connections as the manager's does (libcurl's default, four per handle added, keeps
// every finished connection open and with it a simulator thread, so that the last transfers
// wait for the simulator's keep-alive time-out).
double RunReference(const Batch &batch, int *good) {
    Requests requests = batch.make();
    std::unique_ptr<CURLM, CURLMcode (*)(CURLM *)> multi(curl_multi_init(), curl_multi_cleanup);
    curl_multi_setopt(multi.get(), CURLMOPT_MAXCONNECTS, 64L);
    // Run sets up its handles within its time, so this side's set-up counts too.
    const auto start = Clock::now();
    for (auto &request : requests) {
        request->SetResponseTimeout(0);
        if (request->Process(false, 0)) {
            curl_multi_add_handle(multi.get(), request->GetCurlHandler());
        }
    }
    DriveToTheEnd(multi.get());
    const double seconds = Since(start);
    *good = 0;
    for (int i = 0; i < batch.size; ++i) {
        curl_multi_remove_handle(multi.get(), requests[i]->GetCurlHandler());
        *good += batch.good(i, requests[i]->GetResponse()) ? 1 : 0;
    }
    return seconds;
}

double RunSerial(const Batch &batch, int *good) {
    Requests requests = batch.make();
    const auto start = Clock::now();
    for (auto &request : requests) {
        request->Process(true, 0);
    }
    const double seconds = Since(start);
    *good = 0;
    for (int i = 0; i < batch.size; ++i) {
        *good += batch.good(i, requests[i]->GetResponse()) ? 1 : 0;
    }
    return seconds;
}

// Descriptors held open for the object's lifetime, numbered above FD_SETSIZE once enough are.
class ExtraDescriptors {
  public:
    explicit ExtraDescriptors(int count) {
        for (int i = 0; i < count; ++i) {
            const int fd = open("/dev/null", O_RDONLY | O_CLOEXEC);
            if (fd >= 0) {
                fds_.push_back(fd);
            }
        }
    }
    ~ExtraDescriptors() {
        for (int fd : fds_) {
            close(fd);
        }
    }
    int Count() const { return static_cast<int>(fds_.size()); }

  private:
    std::vector<int> fds_;
};

struct Figures {
    std::vector<double> a, b;
    int badRounds = 0;
};

// Alternates `first` and `second` for kRounds rounds; each reports its seconds and whether its
// answers were all right.
Figures Alternate(const std::function<double(bool *)> &first,
                  const std::function<double(bool *)> &second) {
    Figures figures;
    for (int round = 0; round < kRounds; ++round) {
        bool okA = false;
        bool okB = false;
        figures.a.push_back(first(&okA));
        figures.b.push_back(second(&okB));
        figures.badRounds += (okA && okB) ? 0 : 1;
    }
    return figures;
}

void Report(const char *title, const char *nameA, const char *nameB, const Figures &f,
            double target) {
    const double a = Median(f.a);
    const double b = Median(f.b);
    printf("%s (median of %d alternating rounds)\n", title, kRounds);
    printf("  %-36s %8.3f s\n", nameA, a);
    printf("  %-36s %8.3f s\n", nameB, b);
    printf("  ratio                                %8.2f   (target <= %.2f)%s\n", a / b, target,
           f.badRounds > 0 ? "  SOME ANSWERS WRONG" : "");
}

// ---- Memory

size_t AppendToString(char *data, size_t size, size_t nmemb, void *out) {
    static_cast<std::string *>(out)->append(data, size * nmemb);
    return size * nmemb;
}

// The batch of WebApiBatch through plain easy handles: the same URL and POST body (the pair
// text the manager's requests send), each answer appended to a string of its own, all driven
// by one multi handle. Returns the right answers.
int RawTransfers(const std::string &base) {
    struct Transfer {
        CURL *easy = nullptr;
        std::string answer;
    };
    std::vector<Transfer> transfers(kConcurrentCalls);
    std::unique_ptr<CURLM, CURLMcode (*)(CURLM *)> multi(curl_multi_init(), curl_multi_cleanup);
    const std::string url = base + "/webapi/entry.cgi";
    for (int i = 0; i < kConcurrentCalls; ++i) {
        Transfer &t = transfers[i];
        t.easy = curl_easy_init();
        const std::string body =
            "api=KOVA.Demo.Echo&method=echo&n=" + std::to_string(i) + "&version=1";
        curl_easy_setopt(t.easy, CURLOPT_URL, url.c_str());
        curl_easy_setopt(t.easy, CURLOPT_COPYPOSTFIELDS, body.c_str());
        curl_easy_setopt(t.easy, CURLOPT_NOSIGNAL, 1L);
        curl_easy_setopt(t.easy, CURLOPT_WRITEFUNCTION, AppendToString);
        curl_easy_setopt(t.easy, CURLOPT_WRITEDATA, &t.answer);
        curl_multi_add_handle(multi.get(), t.easy);
    }
    DriveToTheEnd(multi.get());
    int good = 0;
    for (int i = 0; i < kConcurrentCalls; ++i) {
        good += GoodEcho(i, transfers[i].answer) ? 1 : 0;
        curl_multi_remove_handle(multi.get(), transfers[i].easy);
        curl_easy_cleanup(transfers[i].easy);
    }
    return good;
}

int ManagerTransfers(const std::string &base) {
    int good = 0;
    bool ok = false;
    RunManager(WebApiBatch(base), &good, &ok);
    return ok ? good : 0;
}

// The child of MeasureRss: prints the resident set before the batch, its peak, and the right
// answers, all in kB.
int RunRssChild(const std::string &side, const std::string &base) {
    struct rlimit limit;
    if (getrlimit(RLIMIT_NOFILE, &limit) == 0) {
        limit.rlim_cur = limit.rlim_max;
        setrlimit(RLIMIT_NOFILE, &limit);
    }
    curl_global_init(CURL_GLOBAL_ALL);
    const long before = StatusKb("VmRSS");
    const int good = side == "manager" ? ManagerTransfers(base) : RawTransfers(base);
    printf("%ld %ld %d\n", before, StatusKb("VmHWM"), good);
    return good == kConcurrentCalls ? 0 : 1;
}

struct Rss {
    long before = 0;  // kB
    long peak = 0;
    bool good = false;
};

// One side's memory, measured in a fresh process of this program.
Rss MeasureRss(const char *side, const std::string &base) {
    Rss rss;
    const std::string self = std::filesystem::read_symlink("/proc/self/exe").string();
    const char *argv[] = {self.c_str(), "--rss", side, base.c_str(), nullptr};
    int out[2];
    if (pipe(out) != 0) {
        return rss;
    }
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, out[1], STDOUT_FILENO);
    posix_spawn_file_actions_addclose(&actions, out[0]);
    pid_t pid = 0;
    const bool started =
        posix_spawn(&pid, self.c_str(), &actions, nullptr, const_cast<char **>(argv), environ) == 0;
    posix_spawn_file_actions_destroy(&actions);
    close(out[1]);
    std::string text;
    char buffer[256];
    for (ssize_t n; started && (n = read(out[0], buffer, sizeof(buffer))) > 0;) {
        text.append(buffer, static_cast<size_t>(n));
    }
    close(out[0]);
    int status = 0;
    if (!started || waitpid(pid, &status, 0) != pid) {
        return rss;
    }
    int good = 0;
    std::istringstream(text) >> rss.before >> rss.peak >> good;
    rss.good = WIFEXITED(status) && WEXITSTATUS(status) == 0 && good == kConcurrentCalls;
    return rss;
}

void ReportRss(const std::string &base, bool *allGood) {
    std::vector<double> managerPeak, rawPeak, peakRatios, growthRatios;
    std::vector<double> managerGrowth, rawGrowth;
    int badRounds = 0;
    for (int round = 0; round < kRssRounds; ++round) {
        const Rss manager = MeasureRss("manager", base);
        const Rss raw = MeasureRss("raw", base);
        badRounds += manager.good && raw.good ? 0 : 1;
        managerPeak.push_back(manager.peak / 1024.0);
        rawPeak.push_back(raw.peak / 1024.0);
        managerGrowth.push_back((manager.peak - manager.before) / 1024.0);
        rawGrowth.push_back((raw.peak - raw.before) / 1024.0);
        peakRatios.push_back(managerPeak.back() / rawPeak.back());
        growthRatios.push_back(managerGrowth.back() / rawGrowth.back());
    }
    printf(
        "4. peak resident set of the 1,000 calls of (2), each side in a fresh process "
        "(median of %d alternating rounds)\n",
        kRssRounds);
    printf("  %-36s %8.1f MB   grew by %6.1f MB\n", "CredRequestMgr::Run", Median(managerPeak),
           Median(managerGrowth));
    printf("  %-36s %8.1f MB   grew by %6.1f MB\n", "plain easy handles, one multi handle",
           Median(rawPeak), Median(rawGrowth));
    printf("  ratio of the peaks                   %8.2f   (target <= 1.20)%s\n",
           Median(peakRatios), badRounds > 0 ? "  SOME ANSWERS WRONG" : "");
    printf("  ratio of the growths                 %8.2f\n", Median(growthRatios));
    *allGood = *allGood && badRounds == 0;
}

}  // namespace

int main(int argc, char **argv) {
    if (argc == 4 && strcmp(argv[1], "--rss") == 0) {
        return RunRssChild(argv[2], argv[3]);
    }
    const bool memoryOnly = argc == 2 && strcmp(argv[1], "--memory") == 0;
    if (argc > 1 && !memoryOnly) {
        fprintf(stderr, "usage: manager_bench [--memory]\n");
        return 2;
    }
    // 1,000 client sockets and as many on the server side need more than the usual 1,024.
    struct rlimit limit;
    if (getrlimit(RLIMIT_NOFILE, &limit) == 0) {
        limit.rlim_cur = limit.rlim_max;
        setrlimit(RLIMIT_NOFILE, &limit);
    }

    kovasim::LoopbackServer::Options options;
    options.threads = 256;
    kovasim::LoopbackServer server(options);
    kovasim::WebApiSim sim;
    sim.Install(server);
    server.Route("*", "/delay", [](const httplib::Request &req, httplib::Response &res) {
        std::this_thread::sleep_for(std::chrono::milliseconds(kDelayMs));
        res.set_content("answer " + req.get_param_value("n"), "text/plain");
    });
    if (!server.Start()) {
        fprintf(stderr, "manager_bench: cannot start the loopback server: %s\n",
                server.Error().c_str());
        return 1;
    }
    const Batch delayed = DelayedBatch(server.BaseUrl());
    const Batch calls = WebApiBatch(server.BaseUrl());
    bool allGood = true;
    if (memoryOnly) {
        ReportRss(server.BaseUrl(), &allGood);
        server.Stop();
        return allGood ? 0 : 1;
    }

    const auto manager = [](const Batch &batch) {
        return [&batch](bool *good) {
            int count = 0;
            bool ok = false;
            const double seconds = RunManager(batch, &count, &ok);
            *good = ok && count == batch.size;
            return seconds;
        };
    };
    const auto reference = [](const Batch &batch) {
        return [&batch](bool *good) {
            int count = 0;
            const double seconds = RunReference(batch, &count);
            *good = count == batch.size;
            return seconds;
        };
    };

    printf("manager_bench: %d rounds per run, %d server threads\n", kRounds, options.threads);
    Figures first = Alternate(manager(delayed), reference(delayed));
    Report("1. 100 requests answered after 200 ms", "together (CredRequestMgr::Run)",
           "together (curl_multi_poll loop)", first, 1.10);
    int goodSerial = 0;
    const double serial = RunSerial(delayed, &goodSerial);
    printf("  one after another (Process, once)    %8.3f s   speed-up of the manager %.0fx\n",
           serial, serial / Median(first.a));
    allGood = allGood && first.badRounds == 0 && goodSerial == kDelayedRequests;

    Figures second = Alternate(manager(calls), reference(calls));
    Report("2. 1,000 concurrent WebAPI calls", "together (CredRequestMgr::Run)",
           "together (curl_multi_poll loop)", second, 1.10);
    allGood = allGood && second.badRounds == 0;

    int opened = 0;
    Figures third = Alternate(
        [&](bool *good) {
            ExtraDescriptors extra(kExtraDescriptors);
            opened = extra.Count();
            return manager(delayed)(good);
        },
        manager(delayed));
    char title[96];
    snprintf(title, sizeof(title), "3. the 100-request run with %d extra descriptors open", opened);
    Report(title, "with the extra descriptors", "without them", third, 1.10);
    allGood = allGood && third.badRounds == 0;

    ReportRss(server.BaseUrl(), &allGood);

    server.Stop();
    return allGood ? 0 : 1;
}
