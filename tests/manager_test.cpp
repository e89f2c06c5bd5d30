// The request manager with plain requests against loopback servers: ownership and slots,
// concurrent runs, set-up failures, silent and refusing servers, and the socket callback.

#include <arpa/inet.h>
#include <dlfcn.h>
#include <fcntl.h>
#include <netdb.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_mgr.h"
#include "simlib/fault_server.h"
#include "simlib/loopback_server.h"
#include "simlib/relay_sim.h"
#include "support/child.h"
#include "support/interpose.h"

// Name resolution of kStalledHost hangs (up to 30 s, or until released), as with a DNS server
// that never answers; every other name resolves as usual. The test program's definition takes
// the place of libc's for libcurl's resolver thread too.
namespace {

constexpr char kStalledHost[] = "stalled.invalid";
std::atomic<bool> gResolverStalled{false};
std::atomic<bool> gReleaseResolver{false};

}  // namespace

extern "C" int getaddrinfo(const char *node, const char *service, const struct addrinfo *hints,
                           struct addrinfo **res) {
    using Real = int (*)(const char *, const char *, const struct addrinfo *, struct addrinfo **);
    if (node != nullptr && strcmp(node, kStalledHost) == 0) {
        gResolverStalled = true;
        const struct timespec step = {0, 10 * 1000 * 1000};
        for (int i = 0; i < 3000 && !gReleaseResolver; ++i) {
            nanosleep(&step, nullptr);
        }
        gResolverStalled = false;
        return EAI_AGAIN;
    }
    static const Real real = reinterpret_cast<Real>(dlsym(RTLD_NEXT, "getaddrinfo"));
    return real(node, service, hints, res);
}

namespace {

using KOVA::CredRequest;
using KOVA::CredRequestMgr;

class ManagerTest : public ::testing::Test {
  protected:
    void SetUp() override {
        kovasim::LoopbackServer::Options options;
        options.threads = 32;
        server_ = std::make_unique<kovasim::LoopbackServer>(options);
        server_->Route("*", "/hello", [](const httplib::Request &, httplib::Response &res) {
            res.set_content("hello", "text/plain");
        });
        // Answers after 300 ms (or "ms" from the query) with "slow <n>", n from the query, and
        // notes how many answers were pending at once.
        server_->Route("*", "/slow", [this](const httplib::Request &req, httplib::Response &res) {
            const int pending = ++pending_;
            for (int seen = mostPending_; seen < pending;) {
                mostPending_.compare_exchange_weak(seen, pending);
            }
            const std::string ms = req.get_param_value("ms");
            std::this_thread::sleep_for(
                std::chrono::milliseconds(ms.empty() ? 300 : std::stoi(ms)));
            res.set_content("slow " + req.get_param_value("n"), "text/plain");
            --pending_;
        });
        ASSERT_TRUE(server_->Start()) << server_->Error();
        kova_test::ClearLog();
    }
    void TearDown() override { server_->Stop(); }

    std::string Url(const std::string &target) const { return server_->BaseUrl() + target; }

    // A new request for `url`, owned by the caller.
    static CredRequest *NewRequest(const std::string &url, long responseTimeout = -1) {
        auto *request = new CredRequest();
        EXPECT_TRUE(request->SetURL(url)) << url;
        if (responseTimeout >= 0) {
            request->SetResponseTimeout(responseTimeout);
        }
        return request;
    }

    std::unique_ptr<kovasim::LoopbackServer> server_;
    std::atomic<int> pending_{0};
    std::atomic<int> mostPending_{0};
};

TEST_F(ManagerTest, SlotsBadArgumentsAndTheSocketCallback) {
    CredRequestMgr mgr;
    EXPECT_TRUE(mgr.IsEmpty());
    EXPECT_TRUE(mgr.Run());
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, mgr.GetError());
    EXPECT_EQ(Json::Value(Json::arrayValue), mgr.GetAllResponse());

    CredRequest *requests[3];
    for (int i = 0; i < 3; ++i) {
        requests[i] = NewRequest(Url("/hello"));
        EXPECT_EQ(i, mgr.AddCredRequest(requests[i]));
    }
    EXPECT_FALSE(mgr.IsEmpty());

    const std::string host = "127.0.0.1";
    const int port = server_->Port();
    const auto add = [&](const std::string &protocol, const std::string &address, int number,
                         const std::string &api, int version, const std::string &method) {
        return mgr.AddCredRequest(protocol, address, number, "sid", api, version, method,
                                  Json::Value()) == -1;
    };
    const std::pair<const char *, std::function<bool()>> calls[] = {
        {"GetRequest(-1)", [&] { return mgr.GetRequest(-1) == nullptr; }},
        {"GetRequest(size)", [&] { return mgr.GetRequest(mgr.Size()) == nullptr; }},
        {"GetResponse(size)", [&] { return mgr.GetResponse(mgr.Size()).empty(); }},
        {"RemoveRequest(-1)", [&] { return mgr.RemoveRequest(-1) == nullptr; }},
        {"add nullptr",
         [&] { return mgr.AddCredRequest(static_cast<CredRequest *>(nullptr)) == -1; }},
        {"port -1", [&] { return add("http", host, -1, "KOVA.API.Info", 1, "query"); }},
        {"version 0", [&] { return add("http", host, port, "KOVA.API.Info", 0, "query"); }},
        {"empty protocol", [&] { return add("", host, port, "KOVA.API.Info", 1, "query"); }},
        {"empty host", [&] { return add("http", "", port, "KOVA.API.Info", 1, "query"); }},
        {"empty api", [&] { return add("http", host, port, "", 1, "query"); }},
        {"empty method", [&] { return add("http", host, port, "KOVA.API.Info", 1, ""); }}};
    for (const auto &call : calls) {
        SCOPED_TRACE(call.first);
        mgr.SetError(KOVA::CRED_REQ_ERR_NONE);
        EXPECT_TRUE(call.second());
        EXPECT_EQ(KOVA::CRED_REQ_ERR_BAD_PARAM, mgr.GetError());
    }
    // Bad calls change nothing, and the manager never clears its error by itself.
    for (int i = 0; i < 3; ++i) {
        EXPECT_EQ(requests[i], mgr.GetRequest(i));
    }
    EXPECT_EQ(3, mgr.Size());
    EXPECT_EQ(KOVA::CRED_REQ_ERR_BAD_PARAM, mgr.GetError());
    EXPECT_EQ(0u, server_->RequestCount());

    // The socket callback marks a held request when libcurl removes its socket; other events,
    // and a removal of a handle the manager does not hold, change nothing.
    ASSERT_TRUE(requests[1]->Process(false, 0));
    CURL *easy = requests[1]->GetCurlHandler();
    ASSERT_NE(nullptr, easy);
    for (int what : {CURL_POLL_NONE, CURL_POLL_IN, CURL_POLL_OUT, CURL_POLL_INOUT}) {
        EXPECT_EQ(0, CredRequestMgr::SocketCallback(easy, CURL_SOCKET_BAD, what, &mgr, nullptr));
        EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, requests[1]->GetError()) << what;
    }
    std::unique_ptr<CURL, void (*)(CURL *)> stranger(curl_easy_init(), curl_easy_cleanup);
    EXPECT_EQ(0, CredRequestMgr::SocketCallback(stranger.get(), CURL_SOCKET_BAD, CURL_POLL_REMOVE,
                                                &mgr, nullptr));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, requests[1]->GetError());
    EXPECT_EQ(
        0, CredRequestMgr::SocketCallback(easy, CURL_SOCKET_BAD, CURL_POLL_REMOVE, &mgr, nullptr));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_TIMEOUT, requests[1]->GetError());
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, requests[2]->GetError());
    EXPECT_EQ(KOVA::CRED_REQ_ERR_BAD_PARAM, mgr.GetError());

    mgr.Clear();
    EXPECT_TRUE(mgr.IsEmpty());
    EXPECT_EQ(0, mgr.Size());
    EXPECT_EQ(0, mgr.AddCredRequest(NewRequest(Url("/hello"))));
}

// One run drives every held request at once, each answer in its slot: a removed slot is neither
// run nor answered, a request whose set-up fails is left out, a refused connection ends only its
// own transfer (with the error Process gives it), and response time-outs are lifted (the
// limited request's answer comes 0.5 s after its own limit). A second run, under a deadline it
// does not reach, starts from empty responses.
TEST_F(ManagerTest, RunDrivesEveryHeldRequestAtOnce) {
    constexpr int kSlow = 8;
    kovasim::RefusedPort refused;
    ASSERT_NE(0, refused.Port());
    CredRequestMgr mgr;
    for (int i = 0; i < kSlow; ++i) {
        ASSERT_EQ(i, mgr.AddCredRequest(NewRequest(Url("/slow?n=" + std::to_string(i)))));
    }
    CredRequest *removed = NewRequest(Url("/hello"));
    auto *noUrl = new CredRequest();
    CredRequest *limited = NewRequest(Url("/slow?n=L&ms=1500"), 1);
    for (CredRequest *request :
         {removed, noUrl, NewRequest("http://127.0.0.1:" + std::to_string(refused.Port())),
          limited}) {
        mgr.AddCredRequest(request);
    }
    ASSERT_EQ(kSlow + 4, mgr.Size());
    std::unique_ptr<CredRequest> removedOwner(mgr.RemoveRequest(kSlow));
    EXPECT_EQ(removed, removedOwner.get());
    EXPECT_EQ(nullptr, mgr.GetRequest(kSlow));
    mgr.SetError(KOVA::CRED_REQ_ERR_NONE);

    for (int run = 0; run < 2; ++run) {
        SCOPED_TRACE("run " + std::to_string(run));
        EXPECT_TRUE(run == 0 ? mgr.Run() : mgr.Run(60000)) << kova_test::LogDump();
        Json::Value all = mgr.GetAllResponse();
        ASSERT_EQ(static_cast<Json::ArrayIndex>(kSlow + 4), all.size());
        for (int i = 0; i < kSlow; ++i) {
            EXPECT_EQ("slow " + std::to_string(i), all[i].asString());
            EXPECT_EQ("slow " + std::to_string(i), mgr.GetResponse(i));
            // libcurl does not call the socket callback from a perform-driven loop, so nothing
            // marks the requests.
            EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, mgr.GetRequest(i)->GetError());
        }
        EXPECT_EQ("", all[kSlow].asString());
        EXPECT_EQ("", removed->GetResponse());
        EXPECT_EQ("", all[kSlow + 1].asString());
        if (run == 0) {
            EXPECT_EQ(KOVA::CRED_REQ_ERR_NO_URL, noUrl->GetError());
        }
        EXPECT_EQ("", all[kSlow + 2].asString());
        long status = -1;
        ASSERT_NE(nullptr, mgr.GetRequest(kSlow + 2)->GetCurlHandler());
        curl_easy_getinfo(mgr.GetRequest(kSlow + 2)->GetCurlHandler(), CURLINFO_RESPONSE_CODE,
                          &status);
        EXPECT_EQ(0, status);
        EXPECT_EQ(KOVA::CRED_REQ_ERR_CONNECT, mgr.GetRequest(kSlow + 2)->GetError());
        EXPECT_EQ(CURLE_COULDNT_CONNECT, mgr.GetRequest(kSlow + 2)->GetCurlCode());
        EXPECT_EQ(CURLE_OK, mgr.GetRequest(0)->GetCurlCode());
        EXPECT_EQ("1.1", mgr.GetRequest(0)->GetTransferInfo()["httpVersion"].asString());
        EXPECT_EQ("slow L", all[kSlow + 3].asString());
        EXPECT_EQ(0, limited->GetResponseTimeout());
    }
    EXPECT_EQ(2u * (kSlow + 1), server_->RequestCount());
    EXPECT_GT(mostPending_, 1) << "the requests ran one after another";
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, mgr.GetError());
}

TEST_F(ManagerTest, SilentServerEndsRunThroughTimeout) {
    // Connections complete and then hear nothing until the client gives up.
    kovasim::RawServer silent([](kovasim::RawServer::Connection &c) { c.WaitForClose(5000); });
    ASSERT_TRUE(silent.Start());
    CredRequestMgr mgr;
    ASSERT_EQ(0, mgr.AddCredRequest(NewRequest(silent.BaseUrl() + "/never", 1)));
    ASSERT_EQ(1, mgr.AddCredRequest(NewRequest(silent.BaseUrl() + "/never", 2)));
    // A request without a time-out of its own counts as 120 s, so this one gets one too.
    ASSERT_EQ(2, mgr.AddCredRequest(NewRequest(Url("/hello"), 1)));

    EXPECT_FALSE(mgr.Run());
    EXPECT_EQ(KOVA::CRED_REQ_ERR_TIMEOUT, mgr.GetError());
    // The wait is the largest response time-out of the requests.
    EXPECT_EQ(1u,
              kova_test::LogCount("cred_request_mgr:339 curlHandlerProcess select timeout(2): "))
        << kova_test::LogDump();
    EXPECT_FALSE(kova_test::LogHas("Exceed max retries times!"));
    // The answering server was served in the same run.
    EXPECT_EQ("hello", mgr.GetResponse(2));
    EXPECT_EQ("", mgr.GetResponse(0));
}

// Requests that cannot run are left out, each with its own error, and a run with nothing left
// to run ends at once with true: a handle libcurl will not take (it is in another multi handle
// already) leaves its request with error 8, and a URL libcurl cannot parse fails its transfer
// with the error Process gives. A run that waited for nothing would end after the wait of 1 s
// asked for, with the time-out.
TEST_F(ManagerTest, HandleLibcurlWillNotTakeAndNothingLeftToRun) {
    std::unique_ptr<CURLM, CURLMcode (*)(CURLM *)> other(curl_multi_init(), curl_multi_cleanup);
    CredRequestMgr mgr;
    CredRequest *taken = NewRequest(Url("/hello"), 1);
    ASSERT_TRUE(taken->Process(false, 0));
    ASSERT_EQ(CURLM_OK, curl_multi_add_handle(other.get(), taken->GetCurlHandler()));
    ASSERT_EQ(0, mgr.AddCredRequest(taken));
    ASSERT_EQ(1, mgr.AddCredRequest(NewRequest("http://bad url/", 1)));
    ASSERT_EQ(2, mgr.AddCredRequest(NewRequest(Url("/hello"), 1)));
    delete mgr.RemoveRequest(2);

    EXPECT_TRUE(mgr.Run()) << kova_test::LogDump();
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, mgr.GetError());
    EXPECT_EQ(KOVA::CRED_REQ_ERR_CURL_INTERNAL, taken->GetError());
    EXPECT_EQ(1u, kova_test::LogCount("cred_request_mgr:262 CURL Error(7): "))
        << kova_test::LogDump();
    EXPECT_EQ(KOVA::CRED_REQ_ERR_CURL_OTHER, mgr.GetRequest(1)->GetError());
    EXPECT_EQ(0u, server_->RequestCount());
    curl_multi_remove_handle(other.get(), taken->GetCurlHandler());

    // With every slot emptied the default wait is 120 s; the child's alarm comes long before.
    const std::string hello = Url("/hello");
    const auto body = [&] {
        CredRequestMgr emptied;
        emptied.AddCredRequest(NewRequest(hello));
        delete emptied.RemoveRequest(0);
        return emptied.Run() && emptied.GetError() == KOVA::CRED_REQ_ERR_NONE ? 0 : 1;
    };
    EXPECT_EQ(kova_test::RunInChild(20, body), "exit 0");
}

// A response held in memory may reach the cap exactly; one byte more, or a gzip body that
// decodes past it, fails that request's transfer with the error Process gives for it, while the
// run itself succeeds.
TEST_F(ManagerTest, ResponsesPastTheInMemoryCapFailTheirRequest) {
    constexpr size_t kCap = size_t{64} << 20;
    const std::string bomb = kovasim::GzipBomb(uint64_t{kCap} * 2);
    kovasim::RawServer server([&](kovasim::RawServer::Connection &c) {
        const std::string &head = c.Head();
        if (head.find(" /bomb ") != std::string::npos) {
            c.Send("HTTP/1.1 200 OK\r\nContent-Encoding: gzip\r\nContent-Length: " +
                   std::to_string(bomb.size()) + "\r\n\r\n" + bomb);
            return;
        }
        const size_t size = head.find(" /over ") != std::string::npos ? kCap + 1 : kCap;
        if (!c.Send("HTTP/1.1 200 OK\r\nContent-Length: " + std::to_string(size) + "\r\n\r\n")) {
            return;
        }
        const std::string block(size_t{1} << 20, 'c');
        for (size_t sent = 0; sent < size; sent += block.size()) {
            if (!c.Send(block.data(), std::min(block.size(), size - sent))) {
                return;  // the client gave up
            }
        }
    });
    ASSERT_TRUE(server.Start());
    const struct {
        const char *path;
        KOVA::_tag_CRED_REQ_ERR error;
    } cases[] = {{"/cap", KOVA::CRED_REQ_ERR_NONE},
                 {"/over", KOVA::CRED_REQ_ERR_CURL_OTHER},
                 {"/bomb", KOVA::CRED_REQ_ERR_CURL_OTHER}};
    for (const auto &c : cases) {
        SCOPED_TRACE(c.path);
        CredRequestMgr mgr;
        CredRequest *request = NewRequest(server.BaseUrl() + c.path);
        request->SetEncoding(true);
        ASSERT_EQ(0, mgr.AddCredRequest(request));
        EXPECT_TRUE(mgr.Run()) << kova_test::LogDump();
        EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, mgr.GetError());
        EXPECT_EQ(c.error, request->GetError());
        long status = 0;
        curl_easy_getinfo(request->GetCurlHandler(), CURLINFO_RESPONSE_CODE, &status);
        EXPECT_EQ(200, status);
        const size_t got = request->GetResponse().size();
        if (c.error == KOVA::CRED_REQ_ERR_NONE) {
            EXPECT_EQ(kCap, got);
        } else {
            EXPECT_LE(got, kCap);
        }
    }
}

// A deadline for the whole run stops a transfer that trickles on (a byte a second keeps it
// inside every quiet wait, and the manager lifts the low-speed limit) and one whose host name
// never resolves with the time-out, while a request that answered in time keeps its answer.
TEST_F(ManagerTest, DeadlineStopsTheRunAndItsUnfinishedRequests) {
    constexpr int kDripBytes = 60;
    kovasim::RawServer drip([](kovasim::RawServer::Connection &c) {
        if (!c.Send("HTTP/1.1 200 OK\r\nContent-Length: " + std::to_string(kDripBytes) +
                    "\r\n\r\n")) {
            return;
        }
        for (int i = 0; i < kDripBytes && c.Send("d"); ++i) {
            c.Pause(1000);
        }
    });
    ASSERT_TRUE(drip.Start());
    CredRequestMgr mgr;
    ASSERT_EQ(0, mgr.AddCredRequest(NewRequest(drip.BaseUrl() + "/drip")));
    ASSERT_EQ(1, mgr.AddCredRequest(NewRequest(Url("/hello"))));
    ASSERT_EQ(2, mgr.AddCredRequest(NewRequest(std::string("http://") + kStalledHost + "/")));
    EXPECT_FALSE(mgr.Run(-1));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_BAD_PARAM, mgr.GetError());
    EXPECT_EQ(0u, server_->RequestCount());

    mgr.SetError(KOVA::CRED_REQ_ERR_NONE);
    EXPECT_FALSE(mgr.Run(2000));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_TIMEOUT, mgr.GetError());
    EXPECT_EQ(KOVA::CRED_REQ_ERR_TIMEOUT, mgr.GetRequest(0)->GetError());
    EXPECT_LT(mgr.GetResponse(0).size(), static_cast<size_t>(kDripBytes));
    EXPECT_EQ("hello", mgr.GetResponse(1));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, mgr.GetRequest(1)->GetError());
    // The run did not wait for the resolver that never answers.
    EXPECT_EQ(KOVA::CRED_REQ_ERR_TIMEOUT, mgr.GetRequest(2)->GetError());
    EXPECT_TRUE(gResolverStalled);
    gReleaseResolver = true;
}

// A large raw body makes libcurl ask for "100 Continue"; a server that never sends it is waited
// for only as long as libcurl's own timer, not for the manager's whole wait.
TEST_F(ManagerTest, WakesForLibcurlsOwnTimer) {
    const size_t size = 2u << 20;
    kovasim::RawServer server([size](kovasim::RawServer::Connection &c) {
        const std::string got = std::to_string(c.ReadBody(size, 10000).size());
        c.Send("HTTP/1.1 200 OK\r\nContent-Length: " + std::to_string(got.size()) + "\r\n\r\n" +
               got);
    });
    ASSERT_TRUE(server.Start());
    CredRequestMgr mgr;
    CredRequest *request = NewRequest(server.BaseUrl() + "/upload", 5);
    ASSERT_TRUE(request->AddRawParam(std::string(size, 'x')));
    ASSERT_EQ(0, mgr.AddCredRequest(request));
    EXPECT_TRUE(mgr.Run()) << kova_test::LogDump();
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, mgr.GetError());
    EXPECT_EQ(std::to_string(size), mgr.GetResponse(0));
}

// With more descriptors open than a select set holds, a fast server is answered at once and a
// silent one ends the run with the time-out, both within the child's alarm.
TEST_F(ManagerTest, DescriptorsBeyondTheSelectLimit) {
    kovasim::RawServer silent([](kovasim::RawServer::Connection &c) { c.WaitForClose(10000); });
    ASSERT_TRUE(silent.Start());
    const std::string fast = Url("/hello");
    const std::string never = silent.BaseUrl() + "/never";
    const auto body = [&] {
        struct rlimit limit;
        getrlimit(RLIMIT_NOFILE, &limit);
        limit.rlim_cur = limit.rlim_max;
        setrlimit(RLIMIT_NOFILE, &limit);
        for (int i = 0; i < 1100; ++i) {
            if (open("/dev/null", O_RDONLY) < 0) {
                return 2;
            }
        }
        CredRequestMgr answered;
        answered.AddCredRequest(NewRequest(fast));
        const bool ok = answered.Run() && answered.GetResponse(0) == "hello";
        CredRequestMgr quiet;
        quiet.AddCredRequest(NewRequest(never, 2));
        const bool timedOut = !quiet.Run() && quiet.GetError() == KOVA::CRED_REQ_ERR_TIMEOUT;
        fprintf(stderr, "answered %d timed out %d\n", ok, timedOut);
        return ok && timedOut ? 0 : 1;
    };
    EXPECT_EQ(kova_test::RunInChild(60, body), "exit 0");
}

void IgnoreSignal(int) {}

// Forks a process that sends `sig` to this one every `ms` milliseconds, at most `count` times
// and only while this process lives.
pid_t StartSignaller(int sig, long ms, int count) {
    const pid_t runner = getpid();
    const pid_t signaller = fork();
    if (signaller == 0) {
        const struct timespec pause = {0, ms * 1000 * 1000};
        for (int i = 0; i < count && getppid() == runner; ++i) {
            kill(runner, sig);
            nanosleep(&pause, nullptr);
        }
        _exit(0);
    }
    return signaller;
}

void StopSignaller(pid_t signaller) {
    kill(signaller, SIGKILL);
    waitpid(signaller, nullptr, 0);
}

// A signal that interrupts the wait does not end the run. A process of its own sends them, so
// that the runner stays the only thread (under qemu-user on i386 a thread that signalled
// another can no longer be joined).
TEST_F(ManagerTest, SignalsDuringTheWaitAreRidden) {
    const std::string slow = Url("/slow?n=1");
    const auto body = [&] {
        struct sigaction action = {};
        action.sa_handler = IgnoreSignal;  // no SA_RESTART
        sigaction(SIGUSR1, &action, nullptr);
        CredRequestMgr mgr;
        mgr.AddCredRequest(NewRequest(slow));
        const pid_t signaller = StartSignaller(SIGUSR1, 50, 600);
        const bool ok = mgr.Run();
        StopSignaller(signaller);
        fprintf(stderr, "run %d error %d response %s\n", ok, mgr.GetError(),
                mgr.GetResponse(0).c_str());
        return ok && mgr.GetResponse(0) == "slow 1" ? 0 : 1;
    };
    EXPECT_EQ(kova_test::RunInChild(30, body), "exit 0");
}

// A loopback port whose accept queue is full: a new connection to it stays in its handshake,
// where libcurl keeps no timer but the connect time-out (120 s), so nothing wakes a run.
class FullAcceptQueue {
  public:
    FullAcceptQueue() {
        listener_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
        struct sockaddr_in address = {};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t length = sizeof(address);
        if (listener_ < 0 || bind(listener_, reinterpret_cast<sockaddr *>(&address), length) != 0 ||
            listen(listener_, 0) != 0 ||
            getsockname(listener_, reinterpret_cast<sockaddr *>(&address), &length) != 0) {
            return;
        }
        // Connections that are never accepted fill the queue.
        for (int i = 0; i < 4; ++i) {
            const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
            connect(fd, reinterpret_cast<sockaddr *>(&address), length);
            fillers_.push_back(fd);
        }
        port_ = ntohs(address.sin_port);
    }
    ~FullAcceptQueue() {
        for (int fd : fillers_) {
            close(fd);
        }
        close(listener_);
    }
    FullAcceptQueue(const FullAcceptQueue &) = delete;
    FullAcceptQueue &operator=(const FullAcceptQueue &) = delete;
    std::string Url() const { return "http://127.0.0.1:" + std::to_string(port_) + "/never"; }
    int Port() const { return port_; }

  private:
    int listener_ = -1;
    std::vector<int> fillers_;
    int port_ = 0;
};

std::atomic<CredRequestMgr *> gCancelTarget{nullptr};

void CancelTarget(int) {
    if (CredRequestMgr *mgr = gCancelTarget.load()) {
        mgr->Cancel();
    }
}

// Cancel ends a run at its next wake-up as an interrupted wait ends it (17, logged so), its
// unfinished request stopped with 17 too, whether it comes from another thread (Cancel wakes
// the wait itself) or from a signal handler; the connection that never completes would hold
// the run for its whole wait of 30 s, past the children's alarms. A Cancel while no run is in
// progress changes nothing.
TEST_F(ManagerTest, CancelEndsTheRunFromAnotherThreadOrASignalHandler) {
    const FullAcceptQueue queue;
    ASSERT_NE(0, queue.Port());
    const std::string never = queue.Url();

    CredRequestMgr mgr;
    ASSERT_EQ(0, mgr.AddCredRequest(NewRequest(Url("/hello"))));
    mgr.Cancel();
    EXPECT_TRUE(mgr.Run()) << kova_test::LogDump();
    EXPECT_EQ("hello", mgr.GetResponse(0));

    // From another thread, in a child whose alarm comes long before the run's whole wait ends.
    const auto fromThread = [&] {
        mgr.AddCredRequest(NewRequest(never, 30));
        std::thread canceller([&] {
            // Most likely the run sleeps in its wait by then; Cancel ends it wherever it is.
            std::this_thread::sleep_for(std::chrono::milliseconds(500));
            mgr.Cancel();
        });
        const bool ok = mgr.Run();
        canceller.join();
        const size_t logged = kova_test::LogCount(
            "cred_request_mgr:320 curlHandlerProcess select error: Interrupted system call[4]");
        fprintf(stderr, "run %d error %d request error %d logged %zu\n", ok, mgr.GetError(),
                mgr.GetRequest(1)->GetError(), logged);
        return !ok && mgr.GetError() == KOVA::CRED_REQ_ERR_SELECT &&
                       mgr.GetRequest(1)->GetError() == KOVA::CRED_REQ_ERR_SELECT && logged == 1
                   ? 0
                   : 1;
    };
    EXPECT_EQ(kova_test::RunInChild(15, fromThread), "exit 0");

    // The signals come from a process of its own, as in the test above; the first may come
    // before the run begins.
    const auto body = [&] {
        struct sigaction action = {};
        action.sa_handler = CancelTarget;
        sigaction(SIGUSR2, &action, nullptr);
        CredRequestMgr signalled;
        signalled.AddCredRequest(NewRequest(never, 30));
        gCancelTarget = &signalled;
        const pid_t signaller = StartSignaller(SIGUSR2, 100, 300);
        const bool ok = signalled.Run();
        StopSignaller(signaller);
        gCancelTarget = nullptr;
        fprintf(stderr, "run %d error %d request error %d\n", ok, signalled.GetError(),
                signalled.GetRequest(0)->GetError());
        return !ok && signalled.GetError() == KOVA::CRED_REQ_ERR_SELECT &&
                       signalled.GetRequest(0)->GetError() == KOVA::CRED_REQ_ERR_SELECT
                   ? 0
                   : 1;
    };
    EXPECT_EQ(kova_test::RunInChild(20, body), "exit 0");
}

}  // namespace
