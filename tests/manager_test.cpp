// The request manager with plain requests against loopback servers: ownership and slots,
// concurrent runs, set-up failures, silent and refusing servers, and the socket callback.

#include <fcntl.h>
#include <pthread.h>
#include <signal.h>
#include <sys/resource.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <thread>

#include <gtest/gtest.h>

#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_mgr.h"
#include "simlib/loopback_server.h"
#include "simlib/relay_sim.h"
#include "support/child.h"
#include "support/interpose.h"

namespace {

using KOVA::CredRequest;
using KOVA::CredRequestMgr;
using Clock = std::chrono::steady_clock;

class ManagerTest : public ::testing::Test {
  protected:
    void SetUp() override {
        kovasim::LoopbackServer::Options options;
        options.threads = 32;
        server_ = std::make_unique<kovasim::LoopbackServer>(options);
        server_->Route("*", "/hello", [](const httplib::Request &, httplib::Response &res) {
            res.set_content("hello", "text/plain");
        });
        // Answers after 300 ms (or "ms" from the query) with "slow <n>", n from the query.
        server_->Route("*", "/slow", [](const httplib::Request &req, httplib::Response &res) {
            const std::string ms = req.get_param_value("ms");
            std::this_thread::sleep_for(
                std::chrono::milliseconds(ms.empty() ? 300 : std::stoi(ms)));
            res.set_content("slow " + req.get_param_value("n"), "text/plain");
        });
        ASSERT_TRUE(server_->Start()) << server_->Error();
        kova_test::ClearLog();
    }
    void TearDown() override { server_->Stop(); }

    std::string Url(const std::string &target) const { return server_->BaseUrl() + target; }

    // A new request for `url`, owned by the caller.
    static CredRequest *NewRequest(const std::string &url) {
        auto *request = new CredRequest();
        EXPECT_TRUE(request->SetURL(url)) << url;
        return request;
    }

    std::unique_ptr<kovasim::LoopbackServer> server_;
};

TEST_F(ManagerTest, ConsecutiveIndexesBadIndexesAndClear) {
    CredRequestMgr mgr;
    EXPECT_TRUE(mgr.IsEmpty());
    EXPECT_TRUE(mgr.Run());
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, mgr.GetError());
    EXPECT_EQ(Json::Value(Json::arrayValue), mgr.GetAllResponse());
    EXPECT_EQ(0u, server_->RequestCount());

    CredRequest *requests[3];
    for (int i = 0; i < 3; ++i) {
        requests[i] = NewRequest(Url("/hello"));
        EXPECT_EQ(i, mgr.AddCredRequest(requests[i]));
    }
    EXPECT_EQ(3, mgr.Size());
    EXPECT_FALSE(mgr.IsEmpty());

    const std::pair<const char *, std::function<bool()>> calls[] = {
        {"GetRequest(-1)", [&] { return mgr.GetRequest(-1) == nullptr; }},
        {"GetRequest(size)", [&] { return mgr.GetRequest(mgr.Size()) == nullptr; }},
        {"GetResponse(size)", [&] { return mgr.GetResponse(mgr.Size()).empty(); }},
        {"RemoveRequest(-1)", [&] { return mgr.RemoveRequest(-1) == nullptr; }}};
    for (const auto &call : calls) {
        SCOPED_TRACE(call.first);
        mgr.SetError(KOVA::CRED_REQ_ERR_NONE);
        EXPECT_TRUE(call.second());
        EXPECT_EQ(KOVA::CRED_REQ_ERR_BAD_PARAM, mgr.GetError());
    }
    // Bad indexes change nothing, and the manager never clears its error by itself.
    for (int i = 0; i < 3; ++i) {
        EXPECT_EQ(requests[i], mgr.GetRequest(i));
    }
    EXPECT_EQ(3, mgr.Size());
    EXPECT_EQ(KOVA::CRED_REQ_ERR_BAD_PARAM, mgr.GetError());

    mgr.Clear();
    EXPECT_TRUE(mgr.IsEmpty());
    EXPECT_EQ(0, mgr.Size());
    EXPECT_EQ(0, mgr.AddCredRequest(NewRequest(Url("/hello"))));
}

TEST_F(ManagerTest, RemoveRequestKeepsSizeAndIndexes) {
    CredRequestMgr mgr;
    CredRequest *first = NewRequest(Url("/hello"));
    CredRequest *second = NewRequest(Url("/slow?n=2"));
    ASSERT_EQ(0, mgr.AddCredRequest(first));
    ASSERT_EQ(1, mgr.AddCredRequest(second));

    std::unique_ptr<CredRequest> removed(mgr.RemoveRequest(0));
    EXPECT_EQ(first, removed.get());
    EXPECT_EQ(2, mgr.Size());
    EXPECT_EQ(nullptr, mgr.GetRequest(0));
    EXPECT_EQ(second, mgr.GetRequest(1));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, mgr.GetError());

    // The removed request is not run; the one still held is.
    EXPECT_TRUE(mgr.Run());
    EXPECT_EQ(1u, server_->RequestCount());
    EXPECT_EQ("slow 2", mgr.GetResponse(1));
    EXPECT_EQ("", removed->GetResponse());
    Json::Value all = mgr.GetAllResponse();
    ASSERT_EQ(2u, all.size());
    EXPECT_EQ("", all[0].asString());
    EXPECT_EQ("slow 2", all[1].asString());
}

TEST_F(ManagerTest, InvalidAddFormsCreateNoRequest) {
    CredRequestMgr mgr;
    EXPECT_EQ(-1, mgr.AddCredRequest(static_cast<CredRequest *>(nullptr)));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_BAD_PARAM, mgr.GetError());

    std::string host = "127.0.0.1";
    int port = server_->Port();
    struct Case {
        const char *what;
        std::string protocol, host;
        int port;
        std::string api;
        int version;
        std::string method;
    } cases[] = {
        {"port -1", "http", host, -1, "KOVA.API.Info", 1, "query"},
        {"version 0", "http", host, port, "KOVA.API.Info", 0, "query"},
        {"empty protocol", "", host, port, "KOVA.API.Info", 1, "query"},
        {"empty host", "http", "", port, "KOVA.API.Info", 1, "query"},
        {"empty api", "http", host, port, "", 1, "query"},
        {"empty method", "http", host, port, "KOVA.API.Info", 1, ""},
    };
    for (const Case &c : cases) {
        mgr.SetError(KOVA::CRED_REQ_ERR_NONE);
        EXPECT_EQ(-1, mgr.AddCredRequest(c.protocol, c.host, c.port, "sid", c.api, c.version,
                                         c.method, Json::Value()))
            << c.what;
        EXPECT_EQ(KOVA::CRED_REQ_ERR_BAD_PARAM, mgr.GetError()) << c.what;
    }
    EXPECT_EQ(0, mgr.Size());
    EXPECT_EQ(0u, server_->RequestCount());
}

TEST_F(ManagerTest, DelayedRequestsRunConcurrentlyInAddingOrder) {
    constexpr int kCount = 10;
    CredRequestMgr mgr;
    for (int i = 0; i < kCount; ++i) {
        ASSERT_EQ(i, mgr.AddCredRequest(NewRequest(Url("/slow?n=" + std::to_string(i)))));
    }
    auto start = Clock::now();
    EXPECT_TRUE(mgr.Run()) << kova_test::LogDump();
    double seconds = std::chrono::duration<double>(Clock::now() - start).count();
    // One after another they would take 3 s.
    EXPECT_LT(seconds, 2.0);
    EXPECT_EQ(static_cast<size_t>(kCount), server_->CountPath("/slow"));

    Json::Value all = mgr.GetAllResponse();
    ASSERT_TRUE(all.isArray());
    ASSERT_EQ(static_cast<Json::ArrayIndex>(kCount), all.size());
    for (int i = 0; i < kCount; ++i) {
        EXPECT_EQ("slow " + std::to_string(i), all[i].asString());
        EXPECT_EQ("slow " + std::to_string(i), mgr.GetResponse(i));
        // libcurl does not call the socket callback from a perform-driven loop, so nothing
        // marks the requests.
        EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, mgr.GetRequest(i)->GetError());
    }
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, mgr.GetError());
}

// Run lifts every request's response time-out: a request allowed 1 s of silence still gets its
// answer after 2 s, although the other request's answer after 1.5 s makes libcurl look at it.
TEST_F(ManagerTest, RunLiftsResponseTimeouts) {
    CredRequestMgr mgr;
    CredRequest *limited = NewRequest(Url("/slow?n=1&ms=2000"));
    limited->SetResponseTimeout(1);
    CredRequest *other = NewRequest(Url("/slow?n=2&ms=1500"));
    ASSERT_EQ(0, mgr.AddCredRequest(limited));
    ASSERT_EQ(1, mgr.AddCredRequest(other));
    EXPECT_TRUE(mgr.Run()) << kova_test::LogDump();
    EXPECT_EQ("slow 1", mgr.GetResponse(0));
    EXPECT_EQ("slow 2", mgr.GetResponse(1));
    EXPECT_EQ(0, limited->GetResponseTimeout());
    EXPECT_EQ(0, other->GetResponseTimeout());
}

// A request whose set-up fails is left out; a refused connection ends only its own transfer.
TEST_F(ManagerTest, FailedSetUpOrRefusedConnectionDoesNotStopTheOthers) {
    kovasim::RefusedPort refused;
    ASSERT_NE(0, refused.Port());
    CredRequestMgr mgr;
    ASSERT_EQ(0, mgr.AddCredRequest(NewRequest(Url("/hello"))));
    auto *noUrl = new CredRequest();
    ASSERT_EQ(1, mgr.AddCredRequest(noUrl));
    ASSERT_EQ(2, mgr.AddCredRequest(
                     NewRequest("http://127.0.0.1:" + std::to_string(refused.Port()) + "/")));
    ASSERT_EQ(3, mgr.AddCredRequest(NewRequest(Url("/slow?n=3"))));

    EXPECT_TRUE(mgr.Run()) << kova_test::LogDump();
    // A second run starts from empty responses.
    EXPECT_TRUE(mgr.Run()) << kova_test::LogDump();
    EXPECT_EQ(4u, server_->RequestCount());
    EXPECT_EQ("hello", mgr.GetResponse(0));
    EXPECT_EQ("", mgr.GetResponse(1));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NO_URL, noUrl->GetError());
    EXPECT_EQ("", mgr.GetResponse(2));
    long status = -1;
    ASSERT_NE(nullptr, mgr.GetRequest(2)->GetCurlHandler());
    curl_easy_getinfo(mgr.GetRequest(2)->GetCurlHandler(), CURLINFO_RESPONSE_CODE, &status);
    EXPECT_EQ(0, status);
    EXPECT_EQ("slow 3", mgr.GetResponse(3));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, mgr.GetError());
}

TEST_F(ManagerTest, SilentServerEndsRunThroughTimeout) {
    // Connections complete and then hear nothing until the client gives up.
    kovasim::RawServer silent([](kovasim::RawServer::Connection &c) { c.WaitForClose(5000); });
    ASSERT_TRUE(silent.Start());
    std::string silentUrl = "http://127.0.0.1:" + std::to_string(silent.Port()) + "/never";
    CredRequestMgr mgr;
    CredRequest *quick = NewRequest(silentUrl);
    quick->SetResponseTimeout(1);
    CredRequest *longer = NewRequest(silentUrl);
    longer->SetResponseTimeout(2);
    ASSERT_EQ(0, mgr.AddCredRequest(quick));
    ASSERT_EQ(1, mgr.AddCredRequest(longer));
    // A request without a time-out of its own counts as 120 s, so this one gets one too.
    CredRequest *answered = NewRequest(Url("/hello"));
    answered->SetResponseTimeout(1);
    ASSERT_EQ(2, mgr.AddCredRequest(answered));

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

TEST_F(ManagerTest, SocketCallbackMarksOnlyTheRemovedHeldRequest) {
    CredRequestMgr mgr;
    CredRequest *first = NewRequest(Url("/hello"));
    CredRequest *second = NewRequest(Url("/hello"));
    ASSERT_EQ(0, mgr.AddCredRequest(first));
    ASSERT_EQ(1, mgr.AddCredRequest(second));
    ASSERT_TRUE(first->Process(false, 0));
    ASSERT_TRUE(second->Process(false, 0));
    CURL *easy = second->GetCurlHandler();
    ASSERT_NE(nullptr, easy);

    // Other events, and a removal of a handle the manager does not hold, change nothing.
    for (int what : {CURL_POLL_NONE, CURL_POLL_IN, CURL_POLL_OUT, CURL_POLL_INOUT}) {
        EXPECT_EQ(0, CredRequestMgr::SocketCallback(easy, CURL_SOCKET_BAD, what, &mgr, nullptr));
        EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, second->GetError()) << what;
    }
    std::unique_ptr<CURL, void (*)(CURL *)> stranger(curl_easy_init(), curl_easy_cleanup);
    ASSERT_TRUE(stranger);
    EXPECT_EQ(0, CredRequestMgr::SocketCallback(stranger.get(), CURL_SOCKET_BAD, CURL_POLL_REMOVE,
                                                &mgr, nullptr));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, second->GetError());

    EXPECT_EQ(
        0, CredRequestMgr::SocketCallback(easy, CURL_SOCKET_BAD, CURL_POLL_REMOVE, &mgr, nullptr));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_TIMEOUT, second->GetError());
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, first->GetError());
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, mgr.GetError());
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
    CredRequest *request = NewRequest(server.BaseUrl() + "/upload");
    ASSERT_TRUE(request->AddRawParam(std::string(size, 'x')));
    request->SetResponseTimeout(5);
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
    EXPECT_EQ(kova_test::RunInChild(
                  60,
                  [&] {
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
                      CredRequest *request = NewRequest(never);
                      request->SetResponseTimeout(2);
                      quiet.AddCredRequest(request);
                      const bool timedOut =
                          !quiet.Run() && quiet.GetError() == KOVA::CRED_REQ_ERR_TIMEOUT;
                      fprintf(stderr, "answered %d timed out %d\n", ok, timedOut);
                      return ok && timedOut ? 0 : 1;
                  }),
              "exit 0");
}

void IgnoreSignal(int) {}

// A signal that interrupts the wait does not end the run.
TEST_F(ManagerTest, SignalsDuringTheWaitAreRidden) {
    const std::string slow = Url("/slow?n=1");
    EXPECT_EQ(kova_test::RunInChild(30,
                                    [&] {
                                        struct sigaction action = {};
                                        action.sa_handler = IgnoreSignal;  // no SA_RESTART
                                        sigaction(SIGUSR1, &action, nullptr);
                                        const pthread_t runner = pthread_self();
                                        std::atomic<bool> done{false};
                                        std::thread signaller([&] {
                                            while (!done) {
                                                std::this_thread::sleep_for(
                                                    std::chrono::milliseconds(50));
                                                pthread_kill(runner, SIGUSR1);
                                            }
                                        });
                                        CredRequestMgr mgr;
                                        mgr.AddCredRequest(NewRequest(slow));
                                        const bool ok = mgr.Run();
                                        done = true;
                                        signaller.join();
                                        fprintf(stderr, "run %d error %d response %s\n", ok,
                                                mgr.GetError(), mgr.GetResponse(0).c_str());
                                        return ok && mgr.GetResponse(0) == "slow 1" ? 0 : 1;
                                    }),
              "exit 0");
}

}  // namespace
