// Process outcomes against loopback servers: statuses, libcurl failures, attempts and pauses,
// stalls, cut-off bodies, response streams, header modes and HTTPS.
#include <stdio.h>
#include <sys/socket.h>
#include <netinet/in.h>
#include <unistd.h>

#include <chrono>
#include <limits>
#include <memory>
#include <string>

#include <gtest/gtest.h>

#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_util.h"
#include "simlib/loopback_server.h"
#include "support/interpose.h"
#include "support/temp_dir.h"

namespace {

using kova_test::File;

std::string ReadAll(FILE *f) {
    fflush(f);
    rewind(f);
    std::string out;
    char buf[65536];
    size_t n;
    while ((n = fread(buf, 1, sizeof(buf), f)) > 0) {
        out.append(buf, n);
    }
    return out;
}

// A loopback port with nothing listening on it: bound, never listened on, so a connection
// attempt is refused for as long as the object lives.
class RefusingPort {
  public:
    RefusingPort() {
        fd_ = socket(AF_INET, SOCK_STREAM, 0);
        struct sockaddr_in addr = {};
        addr.sin_family = AF_INET;
        addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        bind(fd_, reinterpret_cast<struct sockaddr *>(&addr), sizeof(addr));
        socklen_t len = sizeof(addr);
        getsockname(fd_, reinterpret_cast<struct sockaddr *>(&addr), &len);
        port_ = ntohs(addr.sin_port);
    }
    ~RefusingPort() { close(fd_); }
    std::string Url() const { return "http://127.0.0.1:" + std::to_string(port_) + "/"; }

  private:
    int fd_;
    int port_ = 0;
};

class ProcessTest : public ::testing::Test {
  protected:
    void SetUp() override {
        server_.Route("*", "/ok", [](const httplib::Request &, httplib::Response &res) {
            res.set_content("{\"success\":true}", "application/json");
        });
        server_.Route("GET", R"(/status/(\d+))",
                      [](const httplib::Request &req, httplib::Response &res) {
                          res.status = std::stoi(req.matches[1]);
                          if (res.status == 302) {
                              res.set_header("Location", "/ok");
                          }
                      });
        server_.Route("GET", "/big", [](const httplib::Request &, httplib::Response &res) {
            res.set_content(std::string(50u << 20, 'b'), "application/octet-stream");
        });
        server_.Route("GET", "/headers", [](const httplib::Request &, httplib::Response &res) {
            res.set_header("X-Kova", "value 1");
            res.set_content("body", "text/plain");
        });
        ASSERT_TRUE(server_.Start()) << server_.Error();
        kova_test::ClearLog();
        kova_test::ClearSleeps();
    }
    std::string Url(const std::string &path) const { return server_.BaseUrl() + path; }

    kovasim::LoopbackServer server_;
};

// A raw server that answers every connection with `reply`.
std::unique_ptr<kovasim::RawServer> StartRaw(const std::string &reply) {
    auto raw = std::make_unique<kovasim::RawServer>(
        [reply](kovasim::RawServer::Connection &c) { c.Send(reply); });
    EXPECT_TRUE(raw->Start());
    return raw;
}

// A temporary stream holding `text`, positioned at its end.
File StreamWith(const std::string &text) {
    File f(tmpfile());
    if (f) {
        fputs(text.c_str(), f.get());
        fflush(f.get());
    }
    return f;
}

TEST_F(ProcessTest, OkIsSuccessAndASecondProcessReusesTheHandle) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/ok")));
    EXPECT_TRUE(req.Process(true, 0));
    EXPECT_EQ(req.GetResponse(), "{\"success\":true}");
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_NONE);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
    CURL *handle = req.GetCurlHandler();
    // The second run starts from an empty response and does not clear an earlier error.
    req.SetError(KOVA::CRED_REQ_ERR_TIMEOUT);
    EXPECT_TRUE(req.Process(true, 0));
    EXPECT_EQ(req.GetCurlHandler(), handle);
    EXPECT_EQ(req.GetResponse(), "{\"success\":true}");
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_TIMEOUT);
    EXPECT_EQ(server_.CountPath("/ok"), 2u);
}

TEST_F(ProcessTest, MapsStatusToErrorAndFollowsRedirectsByDefault) {
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
    // Redirects are followed unless turned off.
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/status/302")));
    EXPECT_TRUE(req.Process(true, 0));
    EXPECT_EQ(req.GetResponse(), "{\"success\":true}");
    EXPECT_EQ(server_.CountPath("/ok"), 1u);
}

// Without a URL the set-up itself fails; an empty one is handed to libcurl, which refuses it.
TEST_F(ProcessTest, MissingOrEmptyUrl) {
    for (bool empty : {false, true}) {
        SCOPED_TRACE(empty);
        kova_test::ClearLog();
        KOVA::CredRequest req;
        if (empty) {
            ASSERT_TRUE(req.SetURL(""));
        }
        EXPECT_FALSE(req.Process(empty, 0));
        EXPECT_EQ(req.GetError(),
                  empty ? KOVA::CRED_REQ_ERR_CURL_OTHER : KOVA::CRED_REQ_ERR_NO_URL);
        EXPECT_TRUE(kova_test::LogHas(empty ? "CURL Error(3)" : "InitCurlHandler failed"))
            << kova_test::LogDump();
    }
    EXPECT_EQ(server_.RequestCount(), 0u);
}

TEST_F(ProcessTest, SetUpOnlyLeavesAReadyHandle) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/ok")));
    EXPECT_EQ(req.GetCurlHandler(), nullptr);
    EXPECT_TRUE(req.Process(false, 0));
    ASSERT_NE(req.GetCurlHandler(), nullptr);
    EXPECT_EQ(server_.RequestCount(), 0u);
    EXPECT_EQ(curl_easy_perform(req.GetCurlHandler()), CURLE_OK);
    EXPECT_EQ(req.GetResponse(), "{\"success\":true}");
}

// A refused connection is retried at once and logged; a name that does not resolve (".invalid"
// never does, RFC 6761, and the resolver answers that at once) pauses one second between
// attempts, is not logged, and empties the response stream. Fewer than one retry means a single
// attempt.
TEST_F(ProcessTest, ConnectFailuresRetryWithTheirOwnPauses) {
    RefusingPort port;
    struct Case {
        std::string url;
        int retries;
        KOVA::CRED_REQ_ERR error;
        size_t pauses;
        size_t curlLogs;
        const char *stream;  // what is left of "kept" in the response stream, if checked
    };
    const std::string unresolvable = "http://kova-test.invalid/";
    const Case cases[] = {{port.Url(), -5, KOVA::CRED_REQ_ERR_CONNECT, 0, 1, nullptr},
                          {port.Url(), 0, KOVA::CRED_REQ_ERR_CONNECT, 0, 1, nullptr},
                          {port.Url(), 2, KOVA::CRED_REQ_ERR_CONNECT, 0, 1, "kept"},
                          {unresolvable, -5, KOVA::CRED_REQ_ERR_RESOLVE, 0, 0, nullptr},
                          {unresolvable, 0, KOVA::CRED_REQ_ERR_RESOLVE, 0, 0, nullptr},
                          {unresolvable, 2, KOVA::CRED_REQ_ERR_RESOLVE, 2, 0, ""}};
    for (const Case &c : cases) {
        SCOPED_TRACE(c.url + " retries " + std::to_string(c.retries));
        kova_test::FakeSleepScope fake;
        kova_test::ClearLog();
        File out = StreamWith("kept");
        ASSERT_TRUE(out);
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL(c.url));
        if (c.stream != nullptr) {
            ASSERT_TRUE(req.SetRespStream(out.get()));
        }
        const auto start = std::chrono::steady_clock::now();
        EXPECT_FALSE(req.Process(true, c.retries));
        EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(20));
        EXPECT_EQ(req.GetError(), c.error);
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

TEST_F(ProcessTest, BodyCutOffIsRetriedAndKeepsEveryPartialBody) {
    // Every attempt reaches the server and fails mid-body, so attempts can be counted there.
    auto raw = StartRaw("HTTP/1.1 200 OK\r\nContent-Length: 100\r\n\r\npart-");
    struct Case {
        int retries;
        int attempts;
    };
    int before = 0;
    for (Case c : {Case{-5, 1}, Case{0, 1}, Case{2, 3}}) {
        SCOPED_TRACE(c.retries);
        kova_test::FakeSleepScope fake;
        kova_test::ClearLog();
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL(raw->BaseUrl() + "/cut"));
        EXPECT_FALSE(req.Process(true, c.retries));
        EXPECT_EQ(raw->ConnectionCount() - before, c.attempts);
        before = raw->ConnectionCount();
        EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_CURL_OTHER);
        EXPECT_EQ(kova_test::LogCount("CURL Error(18)"), 1u) << kova_test::LogDump();
        EXPECT_TRUE(kova_test::SleepCalls().empty());
        // Partial bodies of failed attempts stay in front of the next attempt's.
        std::string expected;
        for (int i = 0; i < c.attempts; ++i)
            expected += "part-";
        EXPECT_EQ(req.GetResponse(), expected);
    }
}

TEST_F(ProcessTest, StallTimesOutAndTruncatesResponseStreamBeforeNextAttempt) {
    // The first two connections send one byte of the body and stall (libcurl averages the speed
    // over several seconds, so one byte is all it gets); the third sends the whole body; later
    // ones send the rest of the body after a stall of 5 s.
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
    // Ended by the time-out, before the server gives up after 5 s (a cut-off body is error 18).
    EXPECT_FALSE(stalled.Process(true, 0));
    EXPECT_EQ(stalled.GetError(), KOVA::CRED_REQ_ERR_TIMEOUT);
    EXPECT_FALSE(kova_test::LogHas("CURL Error")) << kova_test::LogDump();

    File out = StreamWith("stale content from before");
    ASSERT_TRUE(out);
    kova_test::FakeSleepScope fake;
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(raw.BaseUrl() + "/"));
    ASSERT_TRUE(req.SetResponseTimeout(1));
    ASSERT_TRUE(req.SetRespStream(out.get()));
    EXPECT_TRUE(req.Process(true, 1)) << req.GetError();
    EXPECT_EQ(kova_test::SleepCalls(), std::vector<unsigned>{1u});
    EXPECT_EQ(ReadAll(out.get()), "complete");
    EXPECT_EQ(req.GetResponse(), "");

    // libcurl counts the stall in milliseconds held in a long: time-outs beyond that range (30
    // days where long has 32 bits, the longest long anywhere) must still let a stall pass.
    for (long seconds : {30L * 24 * 3600, std::numeric_limits<long>::max()}) {
        SCOPED_TRACE(seconds);
        KOVA::CredRequest slow;
        ASSERT_TRUE(slow.SetURL(raw.BaseUrl() + "/"));
        ASSERT_TRUE(slow.SetResponseTimeout(seconds));
        EXPECT_TRUE(slow.Process(true, 0)) << slow.GetError();
        EXPECT_EQ(slow.GetResponse(), "complete");
    }
    raw.Stop();
}

size_t CountingWriter(char *, size_t size, size_t nmemb, void *user) {
    *static_cast<size_t *>(user) += size * nmemb;
    return size * nmemb;
}

// A large body reaches memory, a stream, or the caller's writer whole; only memory keeps it.
TEST_F(ProcessTest, LargeBodyToMemoryStreamOrWriter) {
    const size_t size = 50u << 20;
    for (int sink = 0; sink < 3; ++sink) {
        SCOPED_TRACE(sink);
        File out(tmpfile());
        ASSERT_TRUE(out);
        size_t counted = 0;
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL(Url("/big")));
        if (sink == 1) {
            ASSERT_TRUE(req.SetRespStream(out.get()));
        }
        if (sink == 2) {
            ASSERT_TRUE(req.SetRespStream(reinterpret_cast<FILE *>(&counted), CountingWriter));
        }
        ASSERT_TRUE(req.Process(true, 0));
        EXPECT_EQ(req.GetResponse().size(), sink == 0 ? size : 0u);
        fflush(out.get());
        EXPECT_EQ(static_cast<size_t>(ftell(out.get())), sink == 1 ? size : 0u);
        EXPECT_EQ(counted, sink == 2 ? size : 0u);
    }
}

// Headers reach the JSON value only when asked for. A header without a value is logged and
// skipped, an empty one after the colon is kept, the status line is not a header, and a huge
// one comes through whole.
TEST_F(ProcessTest, HeadersAsJsonOnlyWhenAsked) {
    auto raw = StartRaw("HTTP/1.1 200 OK\r\nX-Kova: value 1\r\nX-Empty: \r\nX-Bare:\r\nX-Huge: " +
                        std::string(90000, 'h') + "\r\nContent-Length: 2\r\n\r\nok");
    for (bool asked : {true, false}) {
        SCOPED_TRACE(asked);
        kova_test::ClearLog();
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL(raw->BaseUrl() + "/"));
        ASSERT_TRUE(req.SetRespHeaderToJsonValue(asked));
        ASSERT_TRUE(req.Process(true, 0));
        EXPECT_EQ(req.GetResponse(), "ok");
        const Json::Value &h = req.GetResponseHeader();
        EXPECT_EQ(kova_test::LogCount("HTTP header has no value:"), asked ? 1u : 0u)
            << kova_test::LogDump();
        if (!asked) {
            EXPECT_TRUE(h.empty());
            continue;
        }
        EXPECT_EQ(h.getMemberNames(),
                  (std::vector<std::string>{"Content-Length", "X-Empty", "X-Huge", "X-Kova"}));
        EXPECT_EQ(h["X-Kova"].asString(), "value 1");
        EXPECT_EQ(h["X-Empty"].asString(), "");
        EXPECT_EQ(h["X-Huge"].asString().size(), 90000u);
        EXPECT_EQ(h["Content-Length"].asString(), "2");
    }
}

TEST_F(ProcessTest, HeadersToStdoutWithMessageOncePerProcess) {
    std::string out[2];
    for (std::string &captured : out) {
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL(Url("/headers")));
        ASSERT_TRUE(req.SetRespHeaderToStdout(true, "== headers =="));
        ::testing::internal::CaptureStdout();
        const bool ok = req.Process(true, 0);
        fflush(stdout);
        captured = ::testing::internal::GetCapturedStdout();
        ASSERT_TRUE(ok);
        EXPECT_EQ(req.GetResponse(), "body");
        EXPECT_NE(captured.find("X-Kova: value 1\r\n"), std::string::npos) << captured;
    }
    EXPECT_EQ(out[0].rfind("== headers ==\r\n", 0), 0u) << out[0];
    EXPECT_EQ(out[0].find("HTTP/1.1 200"), std::string::npos) << out[0];
    EXPECT_EQ(out[0].substr(out[0].size() - 4), "\r\n\r\n");
    EXPECT_EQ(out[1].find("== headers =="), std::string::npos) << out[1];
}

TEST_F(ProcessTest, ProbeUsesTestURL) {
    KOVA::CredRequestUtil::m_errCode = 0;
    KOVA::CredRequest req;
    EXPECT_TRUE(req.isURLValid(Url("/ok")));
    EXPECT_EQ(KOVA::CredRequestUtil::m_errCode, 0);
    EXPECT_FALSE(req.isURLValid(Url("/status/404")));
    EXPECT_EQ(KOVA::CredRequestUtil::m_errCode, KOVA::CRED_REQ_ERR_QUERY_FAIL);
    EXPECT_TRUE(kova_test::LogHas("Cred Error:[" + Url("/status/404") + "][14]"))
        << kova_test::LogDump();
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

// The self-signed certificate is accepted by default; verification, asked for directly or
// forced by a context callback, rejects it before any request reaches the server.
TEST_F(HttpsTest, SelfSignedCertificate) {
    enum Mode { kDefault, kVerify, kCallback };
    for (Mode mode : {kDefault, kVerify, kCallback}) {
        SCOPED_TRACE(mode);
        kova_test::ClearLog();
        int calls = 0;
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL(Url()));
        if (mode != kDefault)
            req.SetHTTPSVerify(mode == kVerify);
        if (mode == kCallback)
            req.SetSSLVerify(CountingSslContext, &calls);
        EXPECT_EQ(req.Process(true, 0), mode == kDefault) << kova_test::LogDump();
        EXPECT_EQ(calls, mode == kCallback ? 1 : 0);
        if (mode == kDefault) {
            EXPECT_EQ(req.GetResponse(), "secure");
            continue;
        }
        EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_CURL_OTHER);
        EXPECT_TRUE(kova_test::LogHas("CURL Error(60)")) << kova_test::LogDump();
        EXPECT_EQ(server_->RequestCount(), 1u);
    }
}

TEST_F(HttpsTest, PlainHttpToTlsPortFails) {
    std::string url = Url();
    url.replace(0, 5, "http");
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(url));
    EXPECT_FALSE(req.Process(true, 0));
    EXPECT_NE(req.GetError(), KOVA::CRED_REQ_ERR_NONE);
}

}  // namespace
