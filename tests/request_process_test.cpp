// Process outcomes against loopback servers: statuses, redirects, libcurl failures, attempts
// and pauses, stalls, cut-off bodies, response streams, header modes and HTTPS.
#include <arpa/inet.h>
#include <net/if.h>
#include <netinet/in.h>
#include <sched.h>
#include <signal.h>
#include <stdint.h>
#include <stdio.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <fstream>
#include <limits>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_util.h"
#include "simlib/loopback_server.h"
#include "simlib/relay_sim.h"
#include "support/child.h"
#include "support/interpose.h"
#include "support/temp_dir.h"
#include "support/tls_certs.h"

namespace {

using kova_test::Dechunk;
using kova_test::File;
using kova_test::Pattern;
using kova_test::ReadAll;
using kova_test::StreamWith;

class ProcessTest : public ::testing::Test {
  protected:
    void SetUp() override {
        server_.Route("*", "/ok", [](const httplib::Request &, httplib::Response &res) {
            res.set_content("{\"success\":true}", "application/json");
        });
        server_.Route("*", R"(/status/(\d+))",
                      [](const httplib::Request &req, httplib::Response &res) {
                          res.status = std::stoi(req.matches[1]);
                          if (res.status >= 301 && res.status <= 303) {
                              res.set_header("Location", "/ok");
                          }
                      });
        ASSERT_TRUE(server_.Start()) << server_.Error();
        kova_test::ClearLog();
        kova_test::ClearSleeps();
    }
    std::string Url(const std::string &path) const { return server_.BaseUrl() + path; }

    kovasim::LoopbackServer server_;
};

// A set-up-only run makes the handle without a transfer; every later run reuses it as it was
// set up, so settings changed afterwards do not reach the wire. Without a URL nothing runs.
TEST_F(ProcessTest, SetUpOnlyThenOkTwiceOnTheSameHandle) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/ok")));
    EXPECT_EQ(req.GetCurlHandler(), nullptr);
    EXPECT_TRUE(req.Process(false, 0));
    CURL *handle = req.GetCurlHandler();
    ASSERT_NE(handle, nullptr);
    EXPECT_EQ(server_.RequestCount(), 0u);
    EXPECT_TRUE(req.GetTransferInfo().isNull());
    EXPECT_TRUE(req.Process(true, 0));
    EXPECT_EQ(req.GetResponse(), "{\"success\":true}");
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_NONE);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
    EXPECT_EQ(req.GetCurlCode(), CURLE_OK);
    EXPECT_EQ(req.GetCurlErrorText(), curl_easy_strerror(CURLE_OK));
    // The first run opens a connection, the second rides it.
    Json::Value info = req.GetTransferInfo();
    EXPECT_EQ(info["reused"], false);
    EXPECT_EQ(info["connects"], 1);
    EXPECT_EQ(info["httpVersion"], "1.1");
    EXPECT_EQ(info["remoteIp"], "127.0.0.1");
    EXPECT_EQ(info["remotePort"], server_.Port());
    EXPECT_GT(info["total"].asDouble(), 0.0);
    EXPECT_GE(info["total"].asDouble(), info["firstByte"].asDouble());
    EXPECT_GE(info["firstByte"].asDouble(), info["connect"].asDouble());
    EXPECT_EQ(info["tls"], 0.0);
    // The second run starts from an empty response and does not clear an earlier error.
    req.SetError(KOVA::CRED_REQ_ERR_TIMEOUT);
    ASSERT_TRUE(req.AddGetParam("late", "1"));
    EXPECT_TRUE(req.Process(true, 0));
    EXPECT_EQ(server_.Last().target, "/ok");
    EXPECT_EQ(req.GetCurlHandler(), handle);
    EXPECT_EQ(req.GetResponse(), "{\"success\":true}");
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_TIMEOUT);
    EXPECT_EQ(server_.CountPath("/ok"), 2u);
    info = req.GetTransferInfo();
    EXPECT_EQ(info["reused"], true);
    EXPECT_EQ(info["connects"], 0);

    // Without a URL the set-up itself fails; an empty one is handed to libcurl, which refuses it.
    KOVA::CredRequest none, empty;
    EXPECT_FALSE(none.Process(false, 0));
    ASSERT_TRUE(empty.SetURL(""));
    EXPECT_FALSE(empty.Process(true, 0));
    EXPECT_EQ((std::vector<int>{none.GetError(), empty.GetError()}),
              (std::vector<int>{KOVA::CRED_REQ_ERR_NO_URL, KOVA::CRED_REQ_ERR_CURL_OTHER}));
    EXPECT_EQ(kova_test::LogRecords().size(), 2u) << kova_test::LogDump();
    EXPECT_TRUE(kova_test::LogHas("InitCurlHandler failed") && kova_test::LogHas("CURL Error(3)"));
    EXPECT_EQ(server_.CountPath("/ok"), 2u);
}

// Without following redirects a status other than 200 maps to its error, logged from 400 on.
// Redirects are followed by default, and a POST stays a POST with its body on 301, 302 and 303,
// where libcurl on its own would turn it into a bodiless GET.
TEST_F(ProcessTest, StatusesMapToErrorsAndFollowedRedirectsKeepThePost) {
    struct Case {
        int status;
        KOVA::CRED_REQ_ERR error;
        bool logged;
    };
    const Case cases[] = {{204, KOVA::CRED_REQ_ERR_HTTP_UNEXPECTED, false},
                          {201, KOVA::CRED_REQ_ERR_HTTP_UNEXPECTED, false},
                          {301, KOVA::CRED_REQ_ERR_HTTP_UNEXPECTED, false},
                          {302, KOVA::CRED_REQ_ERR_REDIRECT, false},
                          {304, KOVA::CRED_REQ_ERR_NOT_MODIFIED, false},
                          {400, KOVA::CRED_REQ_ERR_HTTP_CLIENT, true},
                          {404, KOVA::CRED_REQ_ERR_HTTP_CLIENT, true},
                          {499, KOVA::CRED_REQ_ERR_HTTP_CLIENT, true},
                          {500, KOVA::CRED_REQ_ERR_HTTP_SERVER, true},
                          {503, KOVA::CRED_REQ_ERR_HTTP_SERVER, true}};
    for (const Case &c : cases) {
        SCOPED_TRACE(c.status);
        kova_test::ClearLog();
        server_.ClearRecords();
        KOVA::CredRequest req;
        req.SetFollowLocation(false);
        ASSERT_TRUE(req.SetURL(Url("/status/" + std::to_string(c.status))));
        EXPECT_FALSE(req.Process(true, 0));
        EXPECT_EQ(req.GetError(), c.error);
        EXPECT_EQ(kova_test::LogHas("HTTP Error(" + std::to_string(c.status) + ")"), c.logged)
            << kova_test::LogDump();
        EXPECT_EQ(server_.RequestCount(), 1u);
    }
    for (int status : {301, 302, 303}) {
        for (bool raw : {false, true}) {
            SCOPED_TRACE(std::to_string(status) + (raw ? " raw" : " form"));
            server_.ClearRecords();
            KOVA::CredRequest req;
            ASSERT_TRUE(req.SetURL(Url("/status/" + std::to_string(status))));
            ASSERT_TRUE(raw ? req.AddRawParam("{\"user\":\"alice\"}")
                            : req.AddPostParam("user", "alice"));
            EXPECT_TRUE(req.Process(true, 0)) << req.GetError();
            EXPECT_EQ(req.GetResponse(), "{\"success\":true}");
            const auto requests = server_.Requests();
            ASSERT_EQ(requests.size(), 2u);
            EXPECT_EQ(requests[1].path, "/ok");
            EXPECT_EQ(requests[1].method, "POST");
            EXPECT_EQ(requests[1].body, raw ? "{\"user\":\"alice\"}" : "user=alice");
        }
    }
}

// A refused connection is retried at once and logged; a host or proxy name that does not
// resolve (".invalid" never does, RFC 6761, and the resolver answers that at once) pauses one
// second between attempts and is not logged. Either way the response stream keeps what it held
// before Process. Fewer than one retry means a single attempt.
TEST_F(ProcessTest, ConnectFailuresRetryWithTheirOwnPauses) {
    kovasim::RefusedPort refused;
    const std::string refusedUrl = "http://127.0.0.1:" + std::to_string(refused.Port()) + "/";
    struct Case {
        std::string url;
        int retries;
        KOVA::CRED_REQ_ERR error;
        size_t pauses;
        size_t curlLogs;
        const char *stream;  // what is left of "kept" in the response stream, if checked
        int curlCode;
        std::string cause;  // in libcurl's text for the last attempt
        const char *proxy = nullptr;
    };
    const std::string unresolvable = "http://kova-test.invalid/";
    const std::string refusedText = "port " + std::to_string(refused.Port());
    const Case cases[] = {
        {refusedUrl, -5, KOVA::CRED_REQ_ERR_CONNECT, 0, 1, nullptr, 7, refusedText},
        {refusedUrl, 0, KOVA::CRED_REQ_ERR_CONNECT, 0, 1, nullptr, 7, "Couldn't connect"},
        {refusedUrl, 2, KOVA::CRED_REQ_ERR_CONNECT, 0, 1, "kept", 7, "127.0.0.1"},
        {refusedUrl, 2, KOVA::CRED_REQ_ERR_RESOLVE, 2, 0, nullptr, 5, "kova-proxy.invalid",
         "http://kova-proxy.invalid:3128"},
        {unresolvable, -5, KOVA::CRED_REQ_ERR_RESOLVE, 0, 0, nullptr, 6, "resolve host"},
        {unresolvable, 0, KOVA::CRED_REQ_ERR_RESOLVE, 0, 0, nullptr, 6, "kova-test.invalid"},
        {unresolvable, 2, KOVA::CRED_REQ_ERR_RESOLVE, 2, 0, "kept", 6, "kova-test.invalid"}};
    for (const Case &c : cases) {
        SCOPED_TRACE(c.url + " retries " + std::to_string(c.retries) + " proxy " +
                     (c.proxy ? c.proxy : "none"));
        kova_test::FakeSleepScope fake;
        kova_test::ClearLog();
        File out = StreamWith("kept", true);
        ASSERT_TRUE(out);
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL(c.url));
        if (c.stream != nullptr) {
            ASSERT_TRUE(req.SetRespStream(out.get()));
        }
        if (c.proxy != nullptr) {
            // The handle made by a set-up-only run is the one every later run uses.
            ASSERT_TRUE(req.Process(false, 0));
            ASSERT_EQ(curl_easy_setopt(req.GetCurlHandler(), CURLOPT_PROXY, c.proxy), CURLE_OK);
        }
        EXPECT_FALSE(req.Process(true, c.retries));
        EXPECT_EQ(req.GetError(), c.error);
        EXPECT_EQ(req.GetCurlCode(), c.curlCode);
        EXPECT_NE(req.GetCurlErrorText().find(c.cause), std::string::npos)
            << req.GetCurlErrorText();
        EXPECT_FALSE(req.GetTransferInfo()["reused"].asBool());
        EXPECT_EQ(kova_test::SleepCalls(), std::vector<unsigned>(c.pauses, 1u));
        EXPECT_EQ(kova_test::LogCount("CURL Error"), c.curlLogs) << kova_test::LogDump();
        if (c.curlLogs > 0) {
            EXPECT_TRUE(kova_test::LogHas("(pid=" + std::to_string(getpid()) + ")CURL Error(7)"));
        }
        if (c.stream != nullptr) {
            EXPECT_EQ(ReadAll(out.get()), c.stream);
        }
    }
}

// A body cut off mid-way is retried at once and logged once. Every attempt starts clean: the
// response string, and a response stream from where it stood when Process began, hold only the
// last attempt's body.
TEST_F(ProcessTest, CutOffBodyIsRetriedAndEachAttemptStartsClean) {
    std::atomic<int> cuts{0};
    kovasim::RawServer raw([&](kovasim::RawServer::Connection &c) {
        c.Send(cuts-- > 0 ? "HTTP/1.1 200 OK\r\nContent-Length: 100\r\n\r\npart-"
                          : "HTTP/1.1 200 OK\r\nContent-Length: 8\r\n\r\ncomplete");
    });
    ASSERT_TRUE(raw.Start());
    struct Case {
        int retries;
        int cuts;
        bool toStream;
        int attempts;
        const char *response;  // in the string, or behind "kept" in the stream
    };
    const Case cases[] = {{-5, 9, false, 1, "part-"},   {0, 9, false, 1, "part-"},
                          {2, 9, false, 3, "part-"},    {2, 9, true, 3, "part-"},
                          {2, 2, false, 3, "complete"}, {2, 2, true, 3, "complete"}};
    int before = 0;
    for (const Case &c : cases) {
        SCOPED_TRACE(std::to_string(c.retries) + " retries, " + std::to_string(c.cuts) +
                     " cuts, stream " + std::to_string(c.toStream));
        kova_test::FakeSleepScope fake;
        kova_test::ClearLog();
        cuts = c.cuts;
        File out = StreamWith("kept", true);
        ASSERT_TRUE(out);
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL(raw.BaseUrl() + "/cut"));
        if (c.toStream) {
            ASSERT_TRUE(req.SetRespStream(out.get()));
        }
        const bool whole = c.cuts < c.attempts;
        EXPECT_EQ(req.Process(true, c.retries), whole);
        EXPECT_EQ(raw.ConnectionCount() - before, c.attempts);
        before = raw.ConnectionCount();
        EXPECT_EQ(kova_test::LogCount("CURL Error(18)"), whole ? 0u : 1u) << kova_test::LogDump();
        EXPECT_TRUE(kova_test::SleepCalls().empty());
        if (!whole) {
            EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_CURL_OTHER);
        }
        EXPECT_EQ(req.GetResponse(), c.toStream ? "" : c.response);
        EXPECT_EQ(ReadAll(out.get()), c.toStream ? std::string("kept") + c.response : "kept");
    }
}

// A raw server that takes request bodies. For its connections, in order, it follows a plan:
// "reset" cuts the connection off after 4 KB of the body, a status such as "302" takes the
// whole body and redirects to /echo, "take" takes the whole body and answers 200. It keeps the
// request line and the body of the last connection it took.
class BodyServer {
  public:
    explicit BodyServer(std::vector<std::string> plan)
        : plan_(std::move(plan)), raw_([this](kovasim::RawServer::Connection &c) { Serve(c); }) {}
    bool Start() { return raw_.Start(); }
    std::string Url() const { return raw_.BaseUrl() + "/upload"; }
    int Connections() const { return raw_.ConnectionCount(); }
    std::string Taken() {
        std::lock_guard<std::mutex> lock(mutex_);
        return taken_;
    }
    std::string RequestLine() {
        std::lock_guard<std::mutex> lock(mutex_);
        return requestLine_;
    }

  private:
    void Serve(kovasim::RawServer::Connection &c) {
        if (c.Head().find("Expect: 100-continue") != std::string::npos) {
            c.Send("HTTP/1.1 100 Continue\r\n\r\n");
        }
        const std::string step = c.Index() < static_cast<int>(plan_.size()) ? plan_[c.Index()] : "";
        if (step == "reset") {
            c.ReadBody(4096, 5000);
            return;  // closing with unread data resets the connection
        }
        const std::string body = Dechunk(c.ReadBody(SIZE_MAX, 10000, "\r\n0\r\n\r\n"));
        if (step != "take") {
            c.Send("HTTP/1.1 " + step + " Moved\r\nLocation: /echo\r\nContent-Length: 0\r\n" +
                   "Connection: close\r\n\r\n");
            return;
        }
        std::lock_guard<std::mutex> lock(mutex_);
        taken_ = body;
        requestLine_ = c.Head().substr(0, c.Head().find("\r\n"));
        c.Send("HTTP/1.1 200 OK\r\nContent-Length: 2\r\n\r\nok");
    }

    const std::vector<std::string> plan_;
    std::mutex mutex_;
    std::string taken_;
    std::string requestLine_;
    kovasim::RawServer raw_;
};

// A request stream is sent from its start in every attempt (with the shared size limit as it
// was), and again for a redirect that keeps the POST. A pipe cannot be sent twice: once part of
// it has gone, the failure of that attempt is the result.
TEST_F(ProcessTest, RequestStreamIsSentWholeAfterResetsAndRedirects) {
    const std::string body = Pattern(1u << 20);
    struct Case {
        std::vector<std::string> plan;
        unsigned limit;
        int connections;
        const char *requestLine;
    };
    const Case cases[] = {{{"reset", "take"}, 0, 2, "POST /upload HTTP/1.1"},
                          {{"reset", "take"}, 600000, 2, "POST /upload HTTP/1.1"},
                          {{"302", "take"}, 0, 2, "POST /echo HTTP/1.1"},
                          {{"307", "take"}, 0, 2, "POST /echo HTTP/1.1"}};
    for (const Case &c : cases) {
        SCOPED_TRACE(c.plan[0] + " limit " + std::to_string(c.limit));
        BodyServer server(c.plan);
        ASSERT_TRUE(server.Start());
        // The body starts behind a prefix the caller has already read.
        File in = StreamWith("prefix" + body);
        ASSERT_TRUE(in);
        fseek(in.get(), 6, SEEK_SET);
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL(server.Url()));
        ASSERT_TRUE(req.SetReqStream(in.get()));
        if (c.limit > 0) {
            req.SetReqStreamSize(c.limit);
        }
        EXPECT_TRUE(req.Process(true, 2)) << req.GetError() << kova_test::LogDump();
        EXPECT_EQ(server.Connections(), c.connections);
        EXPECT_EQ(server.RequestLine(), c.requestLine);
        EXPECT_TRUE(server.Taken() == body.substr(0, c.limit > 0 ? c.limit : body.size()))
            << server.Taken().size() << " bytes";
    }

    // A pipe, fed by a thread, in a child: its request reaches the parent's server once.
    BodyServer server({"reset", "take"});
    ASSERT_TRUE(server.Start());
    auto pipeCase = [&] {
        signal(SIGPIPE, SIG_IGN);
        int fds[2];
        if (pipe(fds) != 0) {
            return 2;
        }
        std::thread writer([&] {
            // A blocking write to a pipe takes everything unless the reader goes.
            (void)!write(fds[1], body.data(), body.size());
            close(fds[1]);
        });
        FILE *in = fdopen(fds[0], "r");
        KOVA::CredRequest req;
        req.SetURL(server.Url());
        req.SetReqStream(in);
        const bool ok = req.Process(true, 2);
        const KOVA::CRED_REQ_ERR error = req.GetError();
        fclose(in);
        writer.join();
        const int curlCode = req.GetCurlCode();
        fprintf(stderr, "ok %d error %d curl %d\n", ok, error, curlCode);
        // The server drops the connection: libcurl meets that while sending (55), receiving
        // (56) or as an empty reply (52), whichever comes first.
        const bool dropped =
            error == KOVA::CRED_REQ_ERR_SEND || error == KOVA::CRED_REQ_ERR_CONNECT ||
            (error == KOVA::CRED_REQ_ERR_CURL_OTHER && curlCode == CURLE_GOT_NOTHING);
        return !ok && dropped ? 0 : 1;
    };
    EXPECT_EQ(kova_test::RunInChild(30, pipeCase), "exit 0");
    EXPECT_EQ(server.Connections(), 1);
}

// A stalled attempt times out (one second without data), is not logged, pauses one second and
// is cut off the response stream, which keeps what it held before Process. The first two
// connections stall; the third sends the whole body.
TEST_F(ProcessTest, StallTimesOutAndCutsTheResponseStreamBackBeforeTheNextAttempt) {
    // libcurl averages the speed over several seconds, so one byte is all the stall sends. The
    // first two connections stall, the third sends the whole body, later ones send the rest of
    // the body after a stall of 5 s.
    kovasim::RawServer raw([](kovasim::RawServer::Connection &c) {
        if (c.Index() != 2) {
            c.Send("HTTP/1.1 200 OK\r\nContent-Length: 8\r\n\r\nc");
            if (!c.WaitForClose(5000) && c.Index() > 2) {
                c.Send("omplete");
            }
        } else {
            c.Send("HTTP/1.1 200 OK\r\nContent-Length: 8\r\n\r\ncomplete");
        }
    });
    ASSERT_TRUE(raw.Start());
    KOVA::CredRequest stalled;
    ASSERT_TRUE(stalled.SetURL(raw.BaseUrl() + "/"));
    ASSERT_TRUE(stalled.SetResponseTimeout(1));
    EXPECT_FALSE(stalled.Process(true, 0));
    EXPECT_EQ(stalled.GetError(), KOVA::CRED_REQ_ERR_TIMEOUT);
    EXPECT_FALSE(kova_test::LogHas("CURL Error")) << kova_test::LogDump();

    File out = StreamWith("stale content from before", true);
    ASSERT_TRUE(out);
    kova_test::FakeSleepScope fake;
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(raw.BaseUrl() + "/"));
    ASSERT_TRUE(req.SetResponseTimeout(1));
    ASSERT_TRUE(req.SetRespStream(out.get()));
    EXPECT_TRUE(req.Process(true, 1)) << req.GetError();
    EXPECT_EQ(raw.ConnectionCount(), 3);
    EXPECT_EQ(kova_test::SleepCalls(), std::vector<unsigned>{1u});
    EXPECT_EQ(ReadAll(out.get()), "stale content from beforecomplete");
    EXPECT_EQ(req.GetResponse(), "");

    // Attempts that write nothing leave the caller's file alone, also what lies behind the
    // position it had when Process began.
    kovasim::RawServer silent([](kovasim::RawServer::Connection &c) { c.WaitForClose(5000); });
    ASSERT_TRUE(silent.Start());
    const std::string hundred = Pattern(100);
    File own = StreamWith(hundred);
    ASSERT_TRUE(own);
    fseek(own.get(), 10, SEEK_SET);
    KOVA::CredRequest quiet;
    ASSERT_TRUE(quiet.SetURL(silent.BaseUrl() + "/"));
    ASSERT_TRUE(quiet.SetResponseTimeout(1));
    ASSERT_TRUE(quiet.SetRespStream(own.get()));
    EXPECT_FALSE(quiet.Process(true, 1));
    EXPECT_EQ(quiet.GetError(), KOVA::CRED_REQ_ERR_TIMEOUT);
    EXPECT_EQ(silent.ConnectionCount(), 2);
    EXPECT_EQ(ftell(own.get()), 10);
    EXPECT_EQ(ReadAll(own.get()), hundred);

    // libcurl counts the stall in milliseconds held in a long: time-outs beyond that range (30
    // days where long has 32 bits, the longest long anywhere) must still let a stall pass, and
    // so must total time-outs past the range of the monotonic clock's nanoseconds.
    constexpr long kLongest = std::numeric_limits<long>::max();
    for (const auto &limits :
         {std::make_pair(30L * 24 * 3600, kLongest / 1000), std::make_pair(kLongest, kLongest)}) {
        SCOPED_TRACE(limits.first);
        KOVA::CredRequest slow;
        ASSERT_TRUE(slow.SetURL(raw.BaseUrl() + "/"));
        ASSERT_TRUE(slow.SetResponseTimeout(limits.first));
        ASSERT_TRUE(slow.SetTotalTimeout(limits.second));
        EXPECT_TRUE(slow.Process(true, 0)) << slow.GetError();
        EXPECT_EQ(slow.GetResponse(), "complete");
    }
    raw.Stop();
}

// Sets up, in a forked child run as root, a resolver that never answers: private network and
// mount namespaces, loopback up, /etc/resolv.conf replaced by one naming 127.0.0.1, where a UDP
// socket takes the queries and answers none. Returns the socket (kept open by the caller), or
// -1 when the namespaces cannot be made (not root, or other threads share the process).
int SilentResolver(const std::string &dir) {
    if (unshare(CLONE_NEWNS | CLONE_NEWNET) != 0 ||
        mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
        return -1;
    }
    const std::string conf = dir + "/resolv.conf";
    File f(fopen(conf.c_str(), "w"));
    // glibc waits timeout × attempts seconds for each query before it gives up.
    if (!f || fputs("nameserver 127.0.0.1\noptions timeout:5 attempts:2\n", f.get()) < 0) {
        return -1;
    }
    f.reset();
    if (mount(conf.c_str(), "/etc/resolv.conf", nullptr, MS_BIND, nullptr) != 0) {
        return -1;
    }
    const int ctl = socket(AF_INET, SOCK_DGRAM, 0);
    struct ifreq lo = {};
    strncpy(lo.ifr_name, "lo", sizeof(lo.ifr_name) - 1);
    const bool up = ctl >= 0 && ioctl(ctl, SIOCGIFFLAGS, &lo) == 0 &&
                    (lo.ifr_flags |= IFF_UP, ioctl(ctl, SIOCSIFFLAGS, &lo) == 0);
    if (ctl >= 0) {
        close(ctl);
    }
    const int dns = up ? socket(AF_INET, SOCK_DGRAM, 0) : -1;
    struct sockaddr_in addr = {};
    addr.sin_family = AF_INET;
    addr.sin_port = htons(53);
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    if (dns < 0 || bind(dns, reinterpret_cast<sockaddr *>(&addr), sizeof(addr)) != 0) {
        return -1;
    }
    return dns;
}

// A total time-out bounds Process as a whole: a body that drips in faster than the low-speed
// limit, retries and their pauses, and a name that the resolver never answers (libcurl must not
// wait for its resolver thread). Without it each case lasts far beyond the child's alarm. The
// pauses are real here: at most one pause of one second fits a deadline of 1.5 s.
TEST_F(ProcessTest, TotalTimeoutBoundsDripsRetriesAndSilentNames) {
    kovasim::RawServer drip([](kovasim::RawServer::Connection &c) {
        c.Send("HTTP/1.1 200 OK\r\nContent-Length: 1000\r\n\r\n");
        for (int i = 0; i < 1000 && c.Send("x"); ++i) {
            c.Pause(600);  // about 1.6 bytes a second
        }
    });
    ASSERT_TRUE(drip.Start());
    kova_test::TempDir dir;
    enum Kind { kDrip, kRetries, kSilentName };
    struct Case {
        Kind kind;
        std::string url;
        int retries;
        int curlCode;  // of the last attempt
    };
    const Case cases[] = {{kDrip, drip.BaseUrl() + "/", 2, CURLE_OPERATION_TIMEDOUT},
                          {kRetries, "http://kova-test.invalid/", 20, CURLE_COULDNT_RESOLVE_HOST},
                          {kSilentName, "http://kova-silent.test/", 2, CURLE_OPERATION_TIMEDOUT}};
    for (const Case &c : cases) {
        SCOPED_TRACE(c.url);
        const std::string result = kova_test::RunInChild(8, [&] {
            int dns = -1;
            if (c.kind == kSilentName && (dns = SilentResolver(dir.path())) < 0) {
                return 77;
            }
            kova_test::ClearSleeps();
            KOVA::CredRequest req;
            req.SetURL(c.url);
            req.SetDefaultTimeout(5);
            req.SetResponseTimeout(5);
            if (!req.SetTotalTimeout(1500) || req.GetTotalTimeout() != 1500) {
                return 2;
            }
            const bool ok = req.Process(true, c.retries);
            fprintf(stderr, "ok %d error %d curl %d (%s) pauses %zu\n", ok, req.GetError(),
                    req.GetCurlCode(), req.GetCurlErrorText().c_str(),
                    kova_test::SleepCalls().size());
            return !ok && req.GetError() == KOVA::CRED_REQ_ERR_TIMEOUT &&
                           req.GetCurlCode() == c.curlCode && kova_test::SleepCalls().size() <= 1
                       ? 0
                       : 1;
        });
        if (c.kind == kSilentName && result == "exit 77") {
            // Needs root and a process of one thread (a forked child) for the namespaces.
            printf("no private network namespace here: silent resolver case not run\n");
            continue;
        }
        EXPECT_EQ(result, "exit 0");
    }
}

// Headers reach the JSON value only when asked for. A header without a value is logged and
// skipped, an empty one after the colon is kept, the status line is not a header, and a huge
// one comes through whole. Printed headers come after their message, which shows once per
// process.
TEST_F(ProcessTest, HeadersAsJsonOnlyWhenAsked) {
    const std::string reply =
        "HTTP/1.1 200 OK\r\nX-Kova: value 1\r\nX-Empty: \r\nX-Bare:\r\nX-Huge: " +
        std::string(90000, 'h') + "\r\nContent-Length: 2\r\n\r\nok";
    kovasim::RawServer raw([&reply](kovasim::RawServer::Connection &c) { c.Send(reply); });
    ASSERT_TRUE(raw.Start());
    enum Mode { kJson, kNone, kStdout, kStdoutAgain };
    for (Mode mode : {kJson, kNone, kStdout, kStdoutAgain}) {
        SCOPED_TRACE(mode);
        kova_test::ClearLog();
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL(raw.BaseUrl() + "/"));
        ASSERT_TRUE(mode >= kStdout ? req.SetRespHeaderToStdout(true, "== headers ==")
                                    : req.SetRespHeaderToJsonValue(mode == kJson));
        ::testing::internal::CaptureStdout();
        const bool ok = req.Process(true, 0);
        fflush(stdout);
        const std::string printed = ::testing::internal::GetCapturedStdout();
        ASSERT_TRUE(ok);
        EXPECT_EQ(req.GetResponse(), "ok");
        const Json::Value &h = req.GetResponseHeader();
        if (mode != kJson) {
            EXPECT_TRUE(h.empty());
            EXPECT_EQ(printed.find("X-Kova: value 1\r\n") != std::string::npos, mode >= kStdout)
                << printed.substr(0, 200);
            EXPECT_EQ(printed.find("== headers ==\r\n"), mode == kStdout ? 0 : std::string::npos);
            if (mode == kNone) {
                EXPECT_FALSE(kova_test::LogHas("HTTP header has no value:"))
                    << kova_test::LogDump();
            } else {
                EXPECT_EQ(printed.find("HTTP/1.1 200"), std::string::npos);
                EXPECT_EQ(printed.substr(printed.size() - 4), "\r\n\r\n");
            }
            continue;
        }
        EXPECT_EQ(kova_test::LogCount("HTTP header has no value:"), 1u) << kova_test::LogDump();
        EXPECT_EQ(h.getMemberNames(),
                  (std::vector<std::string>{"Content-Length", "X-Empty", "X-Huge", "X-Kova"}));
        EXPECT_EQ(h["X-Kova"].asString(), "value 1");
        EXPECT_EQ(h["X-Empty"].asString(), "");
        EXPECT_EQ(h["X-Huge"].asString().size(), 90000u);
        EXPECT_EQ(h["Content-Length"].asString(), "2");
    }
}

class HttpsTest : public ::testing::Test {
  protected:
    void SetUp() override {
        kovasim::LoopbackServer::Options options;
        options.https = true;
        server_ = std::make_unique<kovasim::LoopbackServer>(options);
        server_->Route("GET", "/ok", [](const httplib::Request &, httplib::Response &res) {
            res.set_content("secure", "text/plain");
        });
        ASSERT_TRUE(server_->Start()) << server_->Error();
        kova_test::ClearLog();
    }
    std::string Url() const { return server_->BaseUrl() + "/ok"; }
    std::unique_ptr<kovasim::LoopbackServer> server_;
};

void CountingSslContext(void *, void *sslCtx, void *data) {
    if (sslCtx != nullptr) {
        ++*static_cast<int *>(data);
    }
}

// Clearing the context callback after a transfer is safe: the next connection has none.
TEST_F(HttpsTest, ClearedContextCallbackIsNotCalled) {
    EXPECT_EQ(kova_test::RunInChild(30,
                                    [&] {
                                        int calls = 0;
                                        KOVA::CredRequest req;
                                        req.SetURL(Url());
                                        req.SetSSLVerify(CountingSslContext, &calls);
                                        const bool first = req.Process(true, 0);
                                        req.SetSSLVerify(nullptr, nullptr);
                                        const bool second = req.Process(true, 0);
                                        return !first && !second && calls == 1 ? 0 : 1;
                                    }),
              "exit 0");
}

// Certificates of a private CA, checked the ways a request can: not at all by default; with
// SetHTTPSVerify(true), trusting the CA through a CA file or not at all; with a context
// callback (through the adapter that gives libcurl its result code), trusting the CA or not.
// Wherever the CA is trusted the certificate must still name the host the connection was made
// to: one naming only other hosts is refused, one naming 127.0.0.1 passes. A pinned key is
// checked with verification off: the server's own key passes, another key fails.
TEST_F(HttpsTest, PrivateCAHostNamesAndPinnedKeys) {
    kova_test::TestCa ca;
    ASSERT_FALSE(ca.CertPem().empty());
    kova_test::TempDir dir;
    const std::string caFile = dir.File("ca.pem");
    std::ofstream(caFile) << ca.CertPem();
    const kova_test::TlsIdentity other = ca.Issue("DNS:other.test,DNS:localhost");
    const kova_test::TlsIdentity own = ca.Issue("IP:127.0.0.1");
    ASSERT_FALSE(other.certPem.empty() || own.certPem.empty());
    enum Check { kNone, kVerify, kCallback };
    struct Case {
        const char *name;
        const kova_test::TlsIdentity &served;
        Check check;
        bool trusted;  // the CA file, or the CA added by the callback
        std::string pin;
        int curlCode;
    };
    const Case cases[] = {
        {"not checked", own, kNone, false, "", CURLE_OK},
        {"names other hosts", other, kVerify, true, "", CURLE_PEER_FAILED_VERIFICATION},
        {"names the address", own, kVerify, true, "", CURLE_OK},
        {"CA not trusted", own, kVerify, false, "", CURLE_PEER_FAILED_VERIFICATION},
        {"callback, names other hosts", other, kCallback, true, "", CURLE_PEER_FAILED_VERIFICATION},
        {"callback, names the address", own, kCallback, true, "", CURLE_OK},
        {"callback, CA not trusted", own, kCallback, false, "", CURLE_PEER_FAILED_VERIFICATION},
        {"pin matches", other, kNone, false, other.pin, CURLE_OK},
        {"pin differs", other, kNone, false, own.pin, CURLE_SSL_PINNEDPUBKEYNOTMATCH},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.name);
        kova_test::ClearLog();
        kovasim::LoopbackServer server(kova_test::HttpsWith(c.served));
        server.Route("GET", "/ok", [](const httplib::Request &, httplib::Response &res) {
            res.set_content("secure", "text/plain");
        });
        ASSERT_TRUE(server.Start()) << server.Error();
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL(server.BaseUrl() + "/ok"));
        kova_test::TrustedPem trust;
        int calls = 0;
        if (c.check == kVerify) {
            req.SetHTTPSVerify(true);
            if (c.trusted) {
                ASSERT_TRUE(req.SetCAFile(caFile));
            }
        } else if (c.check == kCallback) {
            trust.pem = ca.CertPem();
            c.trusted ? req.SetSSLVerify(kova_test::TrustPem, &trust)
                      : req.SetSSLVerify(CountingSslContext, &calls);
        }
        if (!c.pin.empty()) {
            ASSERT_TRUE(req.SetPinnedPublicKey(c.pin));
        }
        const bool ok = c.curlCode == CURLE_OK;
        EXPECT_EQ(req.Process(true, 0), ok) << kova_test::LogDump();
        EXPECT_EQ(req.GetCurlCode(), c.curlCode) << req.GetCurlErrorText();
        EXPECT_EQ(server.RequestCount(), ok ? 1u : 0u);
        EXPECT_EQ(trust.calls + calls, c.check == kCallback ? 1 : 0);
        if (ok) {
            EXPECT_EQ(req.GetResponse(), "secure");
            EXPECT_GT(req.GetTransferInfo()["tls"].asDouble(), 0.0);
        } else {
            EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_CURL_OTHER);
            EXPECT_TRUE(kova_test::LogHas("CURL Error(" + std::to_string(c.curlCode) + ")"))
                << kova_test::LogDump();
        }
    }
}

}  // namespace
