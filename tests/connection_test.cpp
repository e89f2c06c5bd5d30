// Connections that outlive a request, judged from the server's side: the client port each
// request arrived from tells which connection it rode. Sequential and threaded reuse, every
// WebAPI path, the cases that must never reuse (verification, TLS context callbacks, cookies
// and headers, fork), a server that closes an idle connection, the bound on idle handles and
// the switch that turns reuse off.

#include <errno.h>
#include <poll.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_mgr.h"
#include "simlib/loopback_server.h"
#include "support/child.h"
#include "support/interpose.h"
#include "support/nginx_server.h"
#include "support/temp_dir.h"
#include "support/tls_certs.h"
#include "webapi_fixture.h"

namespace {

using KOVA::CredRequest;

// Runs a GET of `url` on a fresh request set up by `configure`; true for status 200.
bool Fetch(const std::string &url, const std::function<void(CredRequest &)> &configure = {}) {
    CredRequest req;
    if (!req.SetURL(url)) {
        return false;
    }
    if (configure) {
        configure(req);
    }
    return req.Process(true, 0);
}

std::vector<int> Ports(const kovasim::LoopbackServer &server) {
    std::vector<int> ports;
    for (const auto &r : server.Requests()) {
        ports.push_back(r.remotePort);
    }
    return ports;
}

// Plain and TLS loopback servers answering "/hello"; "/cookie" also sets a cookie. Every test
// starts with empty records and an empty pool, so that no connection is kept from another.
class ConnectionTest : public ::testing::Test {
  protected:
    static void SetUpTestSuite() {
        for (bool https : {false, true}) {
            kovasim::LoopbackServer::Options options;
            options.https = https;
            options.threads = 64;
            auto *server = new kovasim::LoopbackServer(options);
            server->Route("*", "/hello", [](const httplib::Request &, httplib::Response &res) {
                res.set_content("hello", "text/plain");
            });
            // Answers once `gathered_` requests are waiting here at once (at most after five
            // seconds), and notes the most that waited at once.
            server->Route("GET", "/gather", [](const httplib::Request &, httplib::Response &res) {
                std::unique_lock<std::mutex> lock(gatherMutex_);
                ++waiting_;
                mostWaiting_ = std::max(mostWaiting_, waiting_);
                gatherCv_.notify_all();
                gatherCv_.wait_for(lock, std::chrono::seconds(5),
                                   [] { return mostWaiting_ >= gathered_; });
                --waiting_;
                res.set_content("gathered", "text/plain");
            });
            server->Route("GET", "/cookie", [](const httplib::Request &, httplib::Response &res) {
                res.set_header("Set-Cookie", "id=from-server; Path=/");
                res.set_content("cookie", "text/plain");
            });
            ASSERT_TRUE(server->Start()) << server->Error();
            (https ? https_ : http_) = server;
        }
    }
    static void TearDownTestSuite() {
        CredRequest::CloseIdleConnections();
        delete http_;
        delete https_;
        http_ = https_ = nullptr;
    }
    void SetUp() override {
        CredRequest::CloseIdleConnections();
        http_->ClearRecords();
        https_->ClearRecords();
        kova_test::ClearLog();
    }
    void TearDown() override {
        unsetenv("kovacredential_no_reuse");
        CredRequest::CloseIdleConnections();
    }

    // The URL of `path` on the server, by name ("localhost", which its certificate names) or
    // by address.
    static std::string Url(const kovasim::LoopbackServer &server, const std::string &path,
                           bool byName = false) {
        return std::string(server.Https() ? "https://" : "http://") +
               (byName ? "localhost" : "127.0.0.1") + ":" + std::to_string(server.Port()) + path;
    }

    // Expects `count` requests to "/gather" at once from now on.
    static void Gather(int count) {
        std::lock_guard<std::mutex> lock(gatherMutex_);
        gathered_ = count;
        mostWaiting_ = 0;
    }
    static int MostWaiting() {
        std::lock_guard<std::mutex> lock(gatherMutex_);
        return mostWaiting_;
    }

    static kovasim::LoopbackServer *http_;
    static kovasim::LoopbackServer *https_;
    static std::mutex gatherMutex_;
    static std::condition_variable gatherCv_;
    static int gathered_;
    static int waiting_;
    static int mostWaiting_;
};

kovasim::LoopbackServer *ConnectionTest::http_ = nullptr;
kovasim::LoopbackServer *ConnectionTest::https_ = nullptr;
std::mutex ConnectionTest::gatherMutex_;
std::condition_variable ConnectionTest::gatherCv_;
int ConnectionTest::gathered_ = 0;
int ConnectionTest::waiting_ = 0;
int ConnectionTest::mostWaiting_ = 0;

// Fresh request objects one after another ride one connection, over plain HTTP and over TLS;
// while kovacredential_no_reuse is set each opens its own, and once it is gone they share again.
TEST_F(ConnectionTest, SequentialRequestsShareOneConnectionUnlessReuseIsOff) {
    for (bool reuse : {false, true}) {
        reuse ? unsetenv("kovacredential_no_reuse") : setenv("kovacredential_no_reuse", "1", 1);
        for (kovasim::LoopbackServer *server : {http_, https_}) {
            SCOPED_TRACE(server->BaseUrl() + (reuse ? "" : " without reuse"));
            server->ClearRecords();
            for (int i = 0; i < 4; ++i) {
                ASSERT_TRUE(Fetch(Url(*server, "/hello"))) << kova_test::LogDump();
            }
            EXPECT_EQ(server->RequestCount(), 4u);
            EXPECT_EQ(server->ConnectionCount(), reuse ? 1u : 4u);
        }
    }
}

// Threads take handles from the pool but never the same one at once: four threads making
// requests one after another open at most four connections between them.
TEST_F(ConnectionTest, ThreadsReuseWithoutSharingAHandle) {
    constexpr int kThreads = 4;
    constexpr int kEach = 10;
    std::atomic<int> ok{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&] {
            for (int i = 0; i < kEach; ++i) {
                ok += Fetch(Url(*https_, "/hello")) ? 1 : 0;
            }
        });
    }
    for (std::thread &t : threads) {
        t.join();
    }
    EXPECT_EQ(ok, kThreads * kEach) << kova_test::LogDump();
    EXPECT_EQ(https_->RequestCount(), static_cast<size_t>(kThreads * kEach));
    EXPECT_LE(https_->ConnectionCount(), static_cast<size_t>(kThreads));
}

// A request that verifies certificates never rides a connection made without verification,
// and the reverse, while each kind still reuses its own.
TEST_F(ConnectionTest, VerifiedAndUnverifiedConnectionsStayApart) {
    kova_test::TempDir dir;
    const std::string caFile = dir.File("ca.pem");
    {
        kova_test::File f(fopen(caFile.c_str(), "w"));
        ASSERT_TRUE(f);
        fputs(https_->CertificatePem().c_str(), f.get());
    }
    const std::string url = Url(*https_, "/hello", true);
    // Verification on, trusting the server's certificate through the handle.
    auto verified = [&](CredRequest &req) {
        req.SetHTTPSVerify(true);
        ASSERT_TRUE(req.SetCAFile(caFile));
    };

    ASSERT_TRUE(Fetch(url)) << kova_test::LogDump();
    // Verification against the system's trust fails, kept connection or not.
    EXPECT_FALSE(Fetch(url, [](CredRequest &req) { req.SetHTTPSVerify(true); }));
    EXPECT_TRUE(kova_test::LogHas("CURL Error(60)")) << kova_test::LogDump();
    ASSERT_TRUE(Fetch(url, verified)) << kova_test::LogDump();
    ASSERT_TRUE(Fetch(url)) << kova_test::LogDump();
    ASSERT_TRUE(Fetch(url, verified)) << kova_test::LogDump();

    const std::vector<int> ports = Ports(*https_);
    ASSERT_EQ(ports.size(), 4u);
    EXPECT_NE(ports[1], ports[0]);  // the verified request made its own connection
    EXPECT_EQ(ports[2], ports[0]);  // the unverified one came back to the unverified connection
    EXPECT_EQ(ports[3], ports[1]);
}

// A request with a TLS context callback gets a handshake of its own every time, so its
// callback sees every connection: fresh requests, and one request processed twice, never ride
// a kept connection, nor leave one for the next.
TEST_F(ConnectionTest, ContextCallbackGetsItsOwnHandshakeEveryTime) {
    const std::string url = Url(*https_, "/hello", true);
    kova_test::TrustedPem trust{https_->CertificatePem()};
    auto withCallback = [&](CredRequest &req) { req.SetSSLVerify(kova_test::TrustPem, &trust); };

    ASSERT_TRUE(Fetch(url)) << kova_test::LogDump();
    ASSERT_TRUE(Fetch(url, withCallback)) << kova_test::LogDump();
    ASSERT_TRUE(Fetch(url, withCallback)) << kova_test::LogDump();
    {
        CredRequest req;
        ASSERT_TRUE(req.SetURL(url));
        withCallback(req);
        ASSERT_TRUE(req.Process(true, 0)) << kova_test::LogDump();
        ASSERT_TRUE(req.Process(true, 0)) << kova_test::LogDump();
    }
    ASSERT_TRUE(Fetch(url)) << kova_test::LogDump();

    EXPECT_EQ(trust.calls, 4);
    const std::vector<int> ports = Ports(*https_);
    ASSERT_EQ(ports.size(), 6u);
    EXPECT_EQ(std::set<int>(ports.begin(), ports.end() - 1).size(), 5u);
    EXPECT_EQ(ports[5], ports[0]);  // the plain requests still share theirs
}

// Nothing of one request reaches the next on the same connection: not its headers or
// cookies, nor a cookie the server set. A handle the caller took (and set an option on) is not
// pooled at all: the next request opens a connection of its own and carries none of it.
TEST_F(ConnectionTest, NothingCarriesOverToTheNextRequest) {
    ASSERT_TRUE(Fetch(Url(*http_, "/cookie"), [](CredRequest &req) {
        req.AddCookie("id", "from-caller");
        req.AddHeader("X-Kova-Trace", "first");
    })) << kova_test::LogDump();
    ASSERT_TRUE(Fetch(Url(*http_, "/cookie"))) << kova_test::LogDump();
    ASSERT_TRUE(Fetch(Url(*http_, "/hello"), [](CredRequest &req) {
        ASSERT_TRUE(req.Process(false));
        ASSERT_EQ(curl_easy_setopt(req.GetCurlHandler(), CURLOPT_USERPWD, "user:secret"), CURLE_OK);
    })) << kova_test::LogDump();
    ASSERT_TRUE(Fetch(Url(*http_, "/hello"))) << kova_test::LogDump();

    const std::vector<kovasim::RecordedRequest> records = http_->Requests();
    ASSERT_EQ(records.size(), 4u);
    EXPECT_EQ(records[0].Header("Cookie"), "id=from-caller");
    EXPECT_EQ(records[0].Header("X-Kova-Trace"), "first");
    EXPECT_TRUE(records[2].HasHeader("Authorization"));
    EXPECT_EQ(records[1].remotePort, records[0].remotePort);
    EXPECT_EQ(records[2].remotePort, records[0].remotePort);
    EXPECT_NE(records[3].remotePort, records[0].remotePort);
    for (size_t i = 1; i < records.size(); ++i) {
        SCOPED_TRACE(i);
        EXPECT_FALSE(records[i].HasHeader("Cookie"));
        EXPECT_FALSE(records[i].HasHeader("X-Kova-Trace"));
        EXPECT_EQ(records[i].HasHeader("Authorization"), i == 2);
        EXPECT_FALSE(records[i].HasHeader("Referer"));
    }
}

// At most CredRequestPool's cap of handles waits in the pool: of 40 connections held at once
// and then given back, 32 are kept for the next 40 requests, which open 8 new ones.
TEST_F(ConnectionTest, IdleHandlesAreBounded) {
    constexpr size_t kHeld = 40;
    constexpr size_t kKept = 32;
    for (int round = 0; round < 2; ++round) {
        std::vector<std::unique_ptr<CredRequest>> held;
        for (size_t i = 0; i < kHeld; ++i) {
            held.push_back(std::make_unique<CredRequest>());
            ASSERT_TRUE(held.back()->SetURL(Url(*http_, "/hello")));
            ASSERT_TRUE(held.back()->Process(true, 0)) << kova_test::LogDump();
        }
    }
    EXPECT_EQ(http_->RequestCount(), 2 * kHeld);
    EXPECT_EQ(http_->ConnectionCount(), kHeld + (kHeld - kKept));
}

// The manager runs every transfer to an HTTP/1.1 server at once, over plain HTTP and over TLS
// (where it first learns the protocol from one transfer), and a later run on the same thread
// rides the connections of the first.
TEST_F(ConnectionTest, ManagerKeepsHttp1ParallelAndReusesConnectionsBetweenRuns) {
    constexpr int kAtOnce = 12;
    for (kovasim::LoopbackServer *server : {http_, https_}) {
        SCOPED_TRACE(server->BaseUrl());
        for (int run = 0; run < 2; ++run) {
            Gather(kAtOnce);
            KOVA::CredRequestMgr mgr;
            for (int i = 0; i < kAtOnce; ++i) {
                auto *req = new CredRequest();
                ASSERT_TRUE(req->SetURL(Url(*server, "/gather")));
                ASSERT_EQ(mgr.AddCredRequest(req), i);
            }
            EXPECT_TRUE(mgr.Run()) << kova_test::LogDump();
            for (int i = 0; i < kAtOnce; ++i) {
                EXPECT_EQ(mgr.GetResponse(i), "gathered") << i;
            }
            EXPECT_EQ(MostWaiting(), kAtOnce);
        }
        EXPECT_EQ(server->RequestCount(), 2u * kAtOnce);
        EXPECT_EQ(server->ConnectionCount(), static_cast<size_t>(kAtOnce));
    }
}

// The server closes a kept connection: when it was idle, the next request (a streamed POST)
// goes on a new connection; when the close meets the request, libcurl sends it again on a new
// one, the body rewound to where the stream stood. Either way the request succeeds without a
// retry of its own and the one answered copy of the body is whole.
TEST(IdleCloseTest, StreamedPostAfterTheServerClosedItsConnection) {
    enum Case { kClosedWhileIdle, kClosedAsTheRequestCame };
    const std::string body(100000, 'b');
    for (Case c : {kClosedWhileIdle, kClosedAsTheRequestCame}) {
        SCOPED_TRACE(c);
        CredRequest::CloseIdleConnections();
        std::atomic<int> firstDone{0};
        std::vector<std::string> bodies(2);  // what each connection received after its first head
        kovasim::RawServer server([&](kovasim::RawServer::Connection &conn) {
            const int i = conn.Index();
            if (i > 1) {
                return;
            }
            if (i == 0) {
                conn.Send("HTTP/1.1 200 OK\r\nContent-Length: 2\r\n\r\nok");
                if (c == kClosedAsTheRequestCame) {
                    bodies[0] = conn.ReadBody(1 << 20, 5000, "\r\n0\r\n\r\n");
                }
                ++firstDone;
                return;  // closed without an answer to anything more
            }
            bodies[1] = conn.ReadBody(1 << 20, 5000, "\r\n0\r\n\r\n");
            conn.Send("HTTP/1.1 200 OK\r\nContent-Length: 6\r\n\r\nstored");
        });
        ASSERT_TRUE(server.Start());
        const std::string url = server.BaseUrl() + "/upload";
        ASSERT_TRUE(Fetch(url)) << kova_test::LogDump();
        if (c == kClosedWhileIdle) {
            for (int i = 0; i < 500 && firstDone == 0; ++i) {
                usleep(10000);
            }
        }

        kova_test::File stream = kova_test::StreamWith("skipped" + body);
        ASSERT_EQ(fseek(stream.get(), 7, SEEK_SET), 0);
        CredRequest req;
        ASSERT_TRUE(req.SetURL(url));
        ASSERT_TRUE(req.AddHeader("X-Upload", "stream"));
        ASSERT_TRUE(req.SetReqStream(stream.get()));
        EXPECT_TRUE(req.Process(true, 0)) << kova_test::LogDump();
        EXPECT_EQ(req.GetResponse(), "stored");
        EXPECT_EQ(server.ConnectionCount(), 2);
        server.Stop();

        ASSERT_NE(bodies[1].find("\r\n\r\n"), std::string::npos) << bodies[1].substr(0, 200);
        EXPECT_EQ(kova_test::Dechunk(bodies[1]), body);
        if (c == kClosedWhileIdle) {
            EXPECT_EQ(bodies[0], "");
        }
    }
}

// An HTTPS server in a process of its own, answering "/port" with the client port it sees:
// the test process stays single-threaded, so that its fork is a real one under every build.
class ServerProcess {
  public:
    bool Start() {
        int portPipe[2];
        int stopPipe[2];
        if (pipe(portPipe) != 0 || pipe(stopPipe) != 0) {
            return false;
        }
        pid_ = fork();
        if (pid_ == 0) {
            close(portPipe[0]);
            close(stopPipe[1]);
            kovasim::LoopbackServer::Options options;
            options.https = true;
            options.threads = 8;
            kovasim::LoopbackServer server(options);
            server.Route("GET", "/port", [](const httplib::Request &req, httplib::Response &res) {
                res.set_content(std::to_string(req.remote_port), "text/plain");
            });
            int port = server.Start() ? server.Port() : 0;
            (void)!write(portPipe[1], &port, sizeof(port));
            char c;
            while (read(stopPipe[0], &c, 1) != 0 && errno == EINTR) {
            }
            server.Stop();
            _exit(0);
        }
        close(portPipe[1]);
        close(stopPipe[0]);
        stopFd_ = stopPipe[1];
        struct pollfd pfd = {portPipe[0], POLLIN, 0};
        const bool ready = pid_ > 0 && poll(&pfd, 1, 30000) == 1 &&
                           read(portPipe[0], &port_, sizeof(port_)) == sizeof(port_);
        close(portPipe[0]);
        return ready && port_ > 0;
    }
    ~ServerProcess() {
        if (stopFd_ >= 0) {
            close(stopFd_);
        }
        if (pid_ <= 0) {
            return;
        }
        int status = 0;
        for (int i = 0; i < 1000 && waitpid(pid_, &status, WNOHANG) == 0; ++i) {
            usleep(10000);
            if (i == 999) {
                kill(pid_, SIGKILL);
                waitpid(pid_, &status, 0);
            }
        }
    }
    std::string Url() const { return "https://127.0.0.1:" + std::to_string(port_) + "/port"; }

  private:
    pid_t pid_ = -1;
    int stopFd_ = -1;
    int port_ = 0;
};

// The client port of a GET of "/port" on `req`, 0 on failure.
int PortOf(CredRequest &req) {
    return req.Process(true, 0) ? atoi(req.GetResponse().c_str()) : 0;
}

int FreshPort(const std::string &url) {
    CredRequest req;
    return req.SetURL(url) ? PortOf(req) : 0;
}

// A child after fork opens connections of its own, for fresh requests and for a request it
// inherited, and never closes the parent's: the parent's held and pooled connections, both
// TLS, carry on after the child has exited.
TEST(ForkTest, ChildStartsWithAnEmptyPoolAndParentKeepsItsOwn) {
    CredRequest::CloseIdleConnections();
    ServerProcess server;
    ASSERT_TRUE(server.Start());
    CredRequest held;
    ASSERT_TRUE(held.SetURL(server.Url()));
    const int heldPort = PortOf(held);
    const int pooledPort = FreshPort(server.Url());
    ASSERT_GT(heldPort, 0) << kova_test::LogDump();
    ASSERT_GT(pooledPort, 0) << kova_test::LogDump();
    ASSERT_NE(heldPort, pooledPort);

    EXPECT_EQ(kova_test::RunInChild(30,
                                    [&] {
                                        const int fresh = FreshPort(server.Url());
                                        const int inherited = PortOf(held);
                                        const std::set<int> parents{heldPort, pooledPort};
                                        return fresh > 0 && inherited > 0 && fresh != inherited &&
                                                       parents.count(fresh) == 0 &&
                                                       parents.count(inherited) == 0
                                                   ? 0
                                                   : 1;
                                    }),
              "exit 0");
    EXPECT_EQ(PortOf(held), heldPort) << kova_test::LogDump();
    EXPECT_EQ(FreshPort(server.Url()), pooledPort) << kova_test::LogDump();
    CredRequest::CloseIdleConnections();
}

// Against a server that speaks HTTP/2 the manager multiplexes: hundreds of transfers started
// at once share one connection, in one run and the next, as nginx's access log shows.
TEST(Http2Test, ManagerMultiplexesOverOneConnection) {
    kova_test::NginxServer nginx;
    ASSERT_TRUE(nginx.Start()) << nginx.Error();
    size_t total = 0;
    for (int count : {300, 50}) {
        KOVA::CredRequestMgr mgr;
        for (int i = 0; i < count; ++i) {
            auto *req = new CredRequest();
            ASSERT_TRUE(req->SetURL(nginx.BaseUrl() + "/small"));
            ASSERT_EQ(mgr.AddCredRequest(req), i);
        }
        EXPECT_TRUE(mgr.Run()) << kova_test::LogDump();
        for (int i = 0; i < count; ++i) {
            ASSERT_EQ(mgr.GetResponse(i), "hello from nginx\n")
                << i << " error " << mgr.GetRequest(i)->GetError() << " curl "
                << mgr.GetRequest(i)->GetCurlCode() << " " << mgr.GetRequest(i)->GetCurlErrorText()
                << "\n"
                << kova_test::LogDump();
        }
        total += static_cast<size_t>(count);
    }
    ASSERT_TRUE(nginx.WaitForRequests(total));
    const auto log = nginx.AccessLog();
    EXPECT_EQ(log.front().protocol, "HTTP/2.0");
    EXPECT_EQ(nginx.ConnectionCount(), 1u);
    CredRequest::CloseIdleConnections();
}

// Every WebAPI path takes its handle from the pool: a factory's login (discovery, encryption
// information, login) and the calls after it share one connection.
class WebApiConnectionTest : public kova_test::WebApiTest {};

TEST_F(WebApiConnectionTest, LoginAndCallsShareOneConnection) {
    CredRequest::CloseIdleConnections();
    const int id = StoreCred();
    for (int i = 0; i < 3; ++i) {
        Json::Value params;
        params["text"] = "call " + std::to_string(i);
        std::unique_ptr<CredRequest> req(
            CredRequest::CreateWebAPIRequest(id, "KOVA.Demo.Echo", 1, "echo", params));
        ASSERT_TRUE(req) << kova_test::LogDump();
        Answer(*req);
    }
    EXPECT_GE(Server().RequestCount(), 5u);
    EXPECT_EQ(Server().ConnectionCount(), 1u);
    CredRequest::CloseIdleConnections();
}

}  // namespace
