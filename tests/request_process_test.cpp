// Process outcomes against loopback servers: statuses, libcurl failures, attempts and pauses,
// stalls, cut-off bodies, response streams, header modes and HTTPS.
#include <fcntl.h>
#include <stdio.h>
#include <sys/socket.h>
#include <netinet/in.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <memory>
#include <sstream>
#include <string>

#include <gtest/gtest.h>

#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_util.h"
#include "simlib/loopback_server.h"
#include "support/interpose.h"
#include "support/temp_dir.h"

namespace {

struct FileCloser {
    void operator()(FILE *f) const {
        if (f != nullptr)
            fclose(f);
    }
};
using File = std::unique_ptr<FILE, FileCloser>;

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
            res.set_header("X-Empty", "");
            res.set_content("body", "text/plain");
        });
        ASSERT_TRUE(server_.Start()) << server_.Error();
        kova_test::ClearLog();
        kova_test::ClearSleeps();
    }
    std::string Url(const std::string &path) const { return server_.BaseUrl() + path; }

    kovasim::LoopbackServer server_;
};

TEST_F(ProcessTest, OkIsSuccess) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/ok")));
    EXPECT_TRUE(req.Process(true, 0));
    EXPECT_EQ(req.GetResponse(), "{\"success\":true}");
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_NONE);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

struct StatusCase {
    int status;
    KOVA::CRED_REQ_ERR error;
    bool logged;
};

class StatusTest : public ProcessTest, public ::testing::WithParamInterface<StatusCase> {};

TEST_P(StatusTest, MapsStatusToError) {
    const StatusCase &c = GetParam();
    KOVA::CredRequest req;
    req.SetFollowLocation(false);
    ASSERT_TRUE(req.SetURL(Url("/status/" + std::to_string(c.status))));
    EXPECT_FALSE(req.Process(true, 0));
    EXPECT_EQ(req.GetError(), c.error);
    EXPECT_EQ(kova_test::LogHas("HTTP Error(" + std::to_string(c.status) + ")"), c.logged)
        << kova_test::LogDump();
    EXPECT_EQ(server_.RequestCount(), 1u);
}

INSTANTIATE_TEST_SUITE_P(
    Statuses, StatusTest,
    ::testing::Values(StatusCase{204, KOVA::CRED_REQ_ERR_HTTP_UNEXPECTED, false},
                      StatusCase{201, KOVA::CRED_REQ_ERR_HTTP_UNEXPECTED, false},
                      StatusCase{301, KOVA::CRED_REQ_ERR_HTTP_UNEXPECTED, false},
                      StatusCase{302, KOVA::CRED_REQ_ERR_REDIRECT, false},
                      StatusCase{304, KOVA::CRED_REQ_ERR_NOT_MODIFIED, false},
                      StatusCase{400, KOVA::CRED_REQ_ERR_HTTP_CLIENT, true},
                      StatusCase{404, KOVA::CRED_REQ_ERR_HTTP_CLIENT, true},
                      StatusCase{499, KOVA::CRED_REQ_ERR_HTTP_CLIENT, true},
                      StatusCase{500, KOVA::CRED_REQ_ERR_HTTP_SERVER, true},
                      StatusCase{503, KOVA::CRED_REQ_ERR_HTTP_SERVER, true}));

TEST_F(ProcessTest, RedirectIsFollowedByDefault) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/status/302")));
    EXPECT_TRUE(req.Process(true, 0));
    EXPECT_EQ(req.GetResponse(), "{\"success\":true}");
    EXPECT_EQ(server_.CountPath("/ok"), 1u);
}

TEST_F(ProcessTest, SuccessDoesNotClearAnEarlierError) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/ok")));
    req.SetError(KOVA::CRED_REQ_ERR_TIMEOUT);
    EXPECT_TRUE(req.Process(true, 0));
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_TIMEOUT);
}

TEST_F(ProcessTest, NoUrlFailsSetUpWithoutTransfer) {
    KOVA::CredRequest req;
    EXPECT_FALSE(req.Process(false, 0));
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_NO_URL);
    EXPECT_TRUE(kova_test::LogHas("InitCurlHandler failed")) << kova_test::LogDump();
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

TEST_F(ProcessTest, EmptyUrlIsPassedToLibcurl) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(""));
    EXPECT_FALSE(req.Process(true, 0));
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_CURL_OTHER);
    EXPECT_TRUE(kova_test::LogHas("CURL Error(3)")) << kova_test::LogDump();
}

TEST_F(ProcessTest, SecondProcessReusesHandleAndStartsFromEmptyResponse) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/ok")));
    ASSERT_TRUE(req.Process(true, 0));
    CURL *handle = req.GetCurlHandler();
    ASSERT_TRUE(req.Process(true, 0));
    EXPECT_EQ(req.GetCurlHandler(), handle);
    EXPECT_EQ(req.GetResponse(), "{\"success\":true}");
    EXPECT_EQ(server_.CountPath("/ok"), 2u);
}

TEST_F(ProcessTest, RefusedConnectionRetriesWithoutPause) {
    RefusingPort port;
    for (int retries : {-5, 0, 2}) {
        kova_test::FakeSleepScope fake;
        kova_test::ClearLog();
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL(port.Url()));
        EXPECT_FALSE(req.Process(true, retries));
        EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_CONNECT);
        EXPECT_TRUE(kova_test::SleepCalls().empty());
        EXPECT_EQ(kova_test::LogCount("CURL Error(7)"), 1u) << kova_test::LogDump();
        EXPECT_TRUE(kova_test::LogHas("(pid=" + std::to_string(getpid()) + ")CURL Error(7)"));
    }
}

// ".invalid" never resolves (RFC 6761), and the resolver answers that at once.
TEST_F(ProcessTest, UnresolvableNamePausesOneSecondBetweenAttempts) {
    struct Case {
        int retries;
        size_t pauses;
    };
    for (Case c : {Case{-5, 0}, Case{0, 0}, Case{2, 2}}) {
        kova_test::FakeSleepScope fake;
        kova_test::ClearLog();
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL("http://kova-test.invalid/"));
        const auto start = std::chrono::steady_clock::now();
        EXPECT_FALSE(req.Process(true, c.retries));
        EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(20));
        EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_RESOLVE);
        EXPECT_EQ(kova_test::SleepCalls(), std::vector<unsigned>(c.pauses, 1u));
        EXPECT_FALSE(kova_test::LogHas("CURL Error")) << kova_test::LogDump();
    }
}

TEST_F(ProcessTest, CountsAttemptsForRetries) {
    // Every attempt reaches the server and fails mid-body, so attempts can be counted there.
    kovasim::RawServer raw([](kovasim::RawServer::Connection &c) {
        c.Send("HTTP/1.1 200 OK\r\nContent-Length: 100\r\n\r\npart-");
    });
    ASSERT_TRUE(raw.Start());
    struct Case {
        int retries;
        int attempts;
    };
    int before = 0;
    for (Case c : {Case{-5, 1}, Case{0, 1}, Case{2, 3}}) {
        kova_test::FakeSleepScope fake;
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL(raw.BaseUrl() + "/cut"));
        EXPECT_FALSE(req.Process(true, c.retries));
        EXPECT_EQ(raw.ConnectionCount() - before, c.attempts);
        before = raw.ConnectionCount();
        EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_CURL_OTHER);
        EXPECT_TRUE(kova_test::SleepCalls().empty());
        // Partial bodies of failed attempts stay in front of the next attempt's.
        std::string expected;
        for (int i = 0; i < c.attempts; ++i)
            expected += "part-";
        EXPECT_EQ(req.GetResponse(), expected);
    }
}

TEST_F(ProcessTest, BodyCutOffMidTransfer) {
    kovasim::RawServer raw([](kovasim::RawServer::Connection &c) {
        c.Send("HTTP/1.1 200 OK\r\nContent-Length: 1000\r\n\r\n" + std::string(300, 'a'));
    });
    ASSERT_TRUE(raw.Start());
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(raw.BaseUrl() + "/"));
    EXPECT_FALSE(req.Process(true, 0));
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_CURL_OTHER);
    EXPECT_TRUE(kova_test::LogHas("CURL Error(18)")) << kova_test::LogDump();
    EXPECT_EQ(req.GetResponse(), std::string(300, 'a'));
}

TEST_F(ProcessTest, StallBelowOneBytePerSecondTimesOut) {
    kovasim::RawServer raw([](kovasim::RawServer::Connection &c) {
        c.Send("HTTP/1.1 200 OK\r\nContent-Length: 100\r\n\r\nx");
        c.WaitForClose(5000);
    });
    ASSERT_TRUE(raw.Start());
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(raw.BaseUrl() + "/"));
    ASSERT_TRUE(req.SetResponseTimeout(1));
    const auto start = std::chrono::steady_clock::now();
    EXPECT_FALSE(req.Process(true, 0));
    const auto elapsed = std::chrono::steady_clock::now() - start;
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_TIMEOUT);
    EXPECT_GE(elapsed, std::chrono::milliseconds(900));
    EXPECT_LT(elapsed, std::chrono::seconds(4));
    EXPECT_FALSE(kova_test::LogHas("CURL Error")) << kova_test::LogDump();
    raw.Stop();
}

TEST_F(ProcessTest, TimeOutTruncatesResponseStreamBeforeNextAttempt) {
    // The first connection sends half a body and stalls; the second sends the whole body.
    kovasim::RawServer raw([](kovasim::RawServer::Connection &c) {
        if (c.Index() == 0) {
            // libcurl averages the speed over several seconds, so one byte is all it gets.
            c.Send("HTTP/1.1 200 OK\r\nContent-Length: 8\r\n\r\ns");
            c.WaitForClose(5000);
        } else {
            c.Send("HTTP/1.1 200 OK\r\nContent-Length: 8\r\n\r\ncomplete");
        }
    });
    ASSERT_TRUE(raw.Start());
    File out(tmpfile());
    ASSERT_TRUE(out);
    fputs("stale content from before", out.get());
    fflush(out.get());
    kova_test::FakeSleepScope fake;
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(raw.BaseUrl() + "/"));
    ASSERT_TRUE(req.SetResponseTimeout(1));
    ASSERT_TRUE(req.SetRespStream(out.get()));
    EXPECT_TRUE(req.Process(true, 1)) << req.GetError();
    EXPECT_EQ(kova_test::SleepCalls(), std::vector<unsigned>{1u});
    EXPECT_EQ(ReadAll(out.get()), "complete");
    EXPECT_EQ(req.GetResponse(), "");
}

TEST_F(ProcessTest, ResolveFailureTruncatesResponseStream) {
    File out(tmpfile());
    ASSERT_TRUE(out);
    fputs("old", out.get());
    fflush(out.get());
    kova_test::FakeSleepScope fake;
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL("http://kova-test.invalid/"));
    ASSERT_TRUE(req.SetRespStream(out.get()));
    EXPECT_FALSE(req.Process(true, 1));
    EXPECT_EQ(ReadAll(out.get()), "");
}

TEST_F(ProcessTest, OtherFailuresDoNotTruncateResponseStream) {
    RefusingPort port;
    File out(tmpfile());
    ASSERT_TRUE(out);
    fputs("kept", out.get());
    fflush(out.get());
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(port.Url()));
    ASSERT_TRUE(req.SetRespStream(out.get()));
    EXPECT_FALSE(req.Process(true, 2));
    EXPECT_EQ(ReadAll(out.get()), "kept");
}

TEST_F(ProcessTest, LargeBodyToMemoryAndToStream) {
    KOVA::CredRequest toMemory;
    ASSERT_TRUE(toMemory.SetURL(Url("/big")));
    ASSERT_TRUE(toMemory.Process(true, 0));
    EXPECT_EQ(toMemory.GetResponse().size(), 50u << 20);

    File out(tmpfile());
    ASSERT_TRUE(out);
    KOVA::CredRequest toStream;
    ASSERT_TRUE(toStream.SetURL(Url("/big")));
    ASSERT_TRUE(toStream.SetRespStream(out.get()));
    ASSERT_TRUE(toStream.Process(true, 0));
    EXPECT_EQ(toStream.GetResponse(), "");
    fflush(out.get());
    EXPECT_EQ(ftell(out.get()), 50L << 20);
}

size_t CountingWriter(char *, size_t size, size_t nmemb, void *user) {
    *static_cast<size_t *>(user) += size * nmemb;
    return size * nmemb;
}

TEST_F(ProcessTest, CallersWriterReceivesTheStream) {
    size_t counted = 0;
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/ok")));
    ASSERT_TRUE(req.SetRespStream(reinterpret_cast<FILE *>(&counted), CountingWriter));
    ASSERT_TRUE(req.Process(true, 0));
    EXPECT_EQ(counted, std::string("{\"success\":true}").size());
}

TEST_F(ProcessTest, HeadersAsJson) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/headers")));
    ASSERT_TRUE(req.SetRespHeaderToJsonValue(true));
    ASSERT_TRUE(req.Process(true, 0));
    const Json::Value &h = req.GetResponseHeader();
    EXPECT_EQ(h["X-Kova"].asString(), "value 1");
    EXPECT_TRUE(h.isMember("X-Empty"));
    EXPECT_EQ(h["X-Empty"].asString(), "");
    EXPECT_EQ(h["Content-Type"].asString(), "text/plain");
    EXPECT_EQ(h["Content-Length"].asString(), "4");
    EXPECT_EQ(req.GetResponse(), "body");
}

TEST_F(ProcessTest, HeaderWithoutValueIsLoggedAndSkipped) {
    kovasim::RawServer raw([](kovasim::RawServer::Connection &c) {
        c.Send("HTTP/1.1 200 OK\r\nX-Bare:\r\nX-Next: n\r\nContent-Length: 2\r\n\r\nok");
    });
    ASSERT_TRUE(raw.Start());
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(raw.BaseUrl() + "/"));
    ASSERT_TRUE(req.SetRespHeaderToJsonValue(true));
    ASSERT_TRUE(req.Process(true, 0));
    EXPECT_FALSE(req.GetResponseHeader().isMember("X-Bare"));
    EXPECT_EQ(req.GetResponseHeader()["X-Next"].asString(), "n");
    EXPECT_EQ(kova_test::LogCount("HTTP header has no value:"), 1u) << kova_test::LogDump();
    EXPECT_EQ(req.GetResponse(), "ok");
}

TEST_F(ProcessTest, HeadersAreNotKeptWithoutAMode) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/headers")));
    ASSERT_TRUE(req.SetRespHeaderToJsonValue(false));
    ASSERT_TRUE(req.Process(true, 0));
    EXPECT_TRUE(req.GetResponseHeader().empty());
}

TEST_F(ProcessTest, HugeResponseHeader) {
    kovasim::RawServer raw([](kovasim::RawServer::Connection &c) {
        c.Send("HTTP/1.1 200 OK\r\nX-Huge: " + std::string(90000, 'h') +
               "\r\nContent-Length: 2\r\n\r\nok");
    });
    ASSERT_TRUE(raw.Start());
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(raw.BaseUrl() + "/"));
    ASSERT_TRUE(req.SetRespHeaderToJsonValue(true));
    ASSERT_TRUE(req.Process(true, 0));
    EXPECT_EQ(req.GetResponseHeader()["X-Huge"].asString().size(), 90000u);
}

// Runs `fn` with file descriptor 1 sent to a temporary file and returns what was written.
template <typename Fn>
std::string CaptureStdout(Fn fn) {
    fflush(stdout);
    File capture(tmpfile());
    int saved = dup(1);
    dup2(fileno(capture.get()), 1);
    fn();
    fflush(stdout);
    dup2(saved, 1);
    close(saved);
    std::string out;
    lseek(fileno(capture.get()), 0, SEEK_SET);
    char buf[4096];
    ssize_t n;
    while ((n = read(fileno(capture.get()), buf, sizeof(buf))) > 0) {
        out.append(buf, static_cast<size_t>(n));
    }
    return out;
}

TEST_F(ProcessTest, HeadersToStdoutWithMessageOncePerProcess) {
    std::string first = CaptureStdout([&] {
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL(Url("/headers")));
        ASSERT_TRUE(req.SetRespHeaderToStdout(true, "== headers =="));
        ASSERT_TRUE(req.Process(true, 0));
        EXPECT_EQ(req.GetResponse(), "body");
    });
    EXPECT_EQ(first.rfind("== headers ==\r\n", 0), 0u) << first;
    EXPECT_NE(first.find("X-Kova: value 1\r\n"), std::string::npos) << first;
    EXPECT_EQ(first.find("HTTP/1.1 200"), std::string::npos) << first;
    EXPECT_EQ(first.substr(first.size() - 4), "\r\n\r\n");

    std::string second = CaptureStdout([&] {
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL(Url("/headers")));
        ASSERT_TRUE(req.SetRespHeaderToStdout(true, "== headers =="));
        ASSERT_TRUE(req.Process(true, 0));
    });
    EXPECT_EQ(second.find("== headers =="), std::string::npos) << second;
    EXPECT_NE(second.find("X-Kova: value 1\r\n"), std::string::npos) << second;
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
    std::unique_ptr<kovasim::LoopbackServer> server_;
};

TEST_F(HttpsTest, SelfSignedAcceptedWithoutVerification) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(server_->BaseUrl() + "/ok"));
    ASSERT_TRUE(req.Process(true, 0)) << req.GetError() << kova_test::LogDump();
    EXPECT_EQ(req.GetResponse(), "secure");
}

TEST_F(HttpsTest, SelfSignedRejectedWithVerification) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(server_->BaseUrl() + "/ok"));
    req.SetHTTPSVerify(true);
    EXPECT_FALSE(req.Process(true, 0));
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_CURL_OTHER);
    EXPECT_TRUE(kova_test::LogHas("CURL Error(60)")) << kova_test::LogDump();
    EXPECT_EQ(server_->RequestCount(), 0u);
}

void CountingSslContext(void *, void *sslCtx, void *data) {
    if (sslCtx != nullptr) {
        ++*static_cast<int *>(data);
    }
}

TEST_F(HttpsTest, ContextCallbackForcesVerification) {
    int calls = 0;
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(server_->BaseUrl() + "/ok"));
    req.SetHTTPSVerify(false);
    req.SetSSLVerify(CountingSslContext, &calls);
    EXPECT_FALSE(req.Process(true, 0));
    EXPECT_EQ(calls, 1);
    EXPECT_TRUE(kova_test::LogHas("CURL Error(60)")) << kova_test::LogDump();
}

TEST_F(HttpsTest, PlainHttpToTlsPortFails) {
    std::string url = server_->BaseUrl();
    url.replace(0, 5, "http");
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(url + "/ok"));
    EXPECT_FALSE(req.Process(true, 0));
    EXPECT_NE(req.GetError(), KOVA::CRED_REQ_ERR_NONE);
}

}  // namespace
