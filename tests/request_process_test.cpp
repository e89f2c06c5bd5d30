// Process outcomes against loopback servers: statuses, redirects, libcurl failures, attempts
// and pauses, stalls, cut-off bodies, response streams, header modes and HTTPS.
#include <signal.h>
#include <stdint.h>
#include <stdio.h>
#include <unistd.h>

#include <atomic>
#include <limits>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <openssl/x509.h>

#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_util.h"
#include "simlib/loopback_server.h"
#include "simlib/relay_sim.h"
#include "support/child.h"
#include "support/interpose.h"
#include "support/temp_dir.h"

namespace {

using kova_test::File;
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
// set up, so settings changed afterwards do not reach the wire.
TEST_F(ProcessTest, SetUpOnlyThenOkTwiceOnTheSameHandle) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/ok")));
    EXPECT_EQ(req.GetCurlHandler(), nullptr);
    EXPECT_TRUE(req.Process(false, 0));
    CURL *handle = req.GetCurlHandler();
    ASSERT_NE(handle, nullptr);
    EXPECT_EQ(server_.RequestCount(), 0u);
    EXPECT_TRUE(req.Process(true, 0));
    EXPECT_EQ(req.GetResponse(), "{\"success\":true}");
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_NONE);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
    // The second run starts from an empty response and does not clear an earlier error.
    req.SetError(KOVA::CRED_REQ_ERR_TIMEOUT);
    ASSERT_TRUE(req.AddGetParam("late", "1"));
    EXPECT_TRUE(req.Process(true, 0));
    EXPECT_EQ(server_.Last().target, "/ok");
    EXPECT_EQ(req.GetCurlHandler(), handle);
    EXPECT_EQ(req.GetResponse(), "{\"success\":true}");
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_TIMEOUT);
    EXPECT_EQ(server_.CountPath("/ok"), 2u);
}

TEST_F(ProcessTest, MapsStatusToErrorWhenRedirectsAreNotFollowed) {
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
}

// Redirects are followed by default, and a POST stays a POST with its body on 301, 302 and 303,
// where libcurl on its own would turn it into a bodiless GET.
TEST_F(ProcessTest, FollowedRedirectKeepsPostAndItsBody) {
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
        const char *proxy = nullptr;
    };
    const std::string unresolvable = "http://kova-test.invalid/";
    const Case cases[] = {{refusedUrl, -5, KOVA::CRED_REQ_ERR_CONNECT, 0, 1, nullptr},
                          {refusedUrl, 0, KOVA::CRED_REQ_ERR_CONNECT, 0, 1, nullptr},
                          {refusedUrl, 2, KOVA::CRED_REQ_ERR_CONNECT, 0, 1, "kept"},
                          {refusedUrl, 2, KOVA::CRED_REQ_ERR_RESOLVE, 2, 0, nullptr,
                           "http://kova-proxy.invalid:3128"},
                          {unresolvable, -5, KOVA::CRED_REQ_ERR_RESOLVE, 0, 0, nullptr},
                          {unresolvable, 0, KOVA::CRED_REQ_ERR_RESOLVE, 0, 0, nullptr},
                          {unresolvable, 2, KOVA::CRED_REQ_ERR_RESOLVE, 2, 0, "kept"}};
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

// De-chunks a chunked request body; "" when it is malformed or incomplete.
std::string Dechunk(const std::string &chunked) {
    std::string body;
    for (size_t pos = 0, eol; (eol = chunked.find("\r\n", pos)) != std::string::npos;) {
        const size_t size = std::stoul(chunked.substr(pos, eol - pos), nullptr, 16);
        if (size == 0 || eol + 4 + size > chunked.size()) {
            return size == 0 ? body : "";
        }
        body.append(chunked, eol + 2, size);
        pos = eol + 4 + size;
    }
    return "";
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

std::string Pattern(size_t size) {
    std::string text(size, '\0');
    for (size_t i = 0; i < size; ++i) {
        text[i] = static_cast<char>('a' + (i * 7 + i / 251) % 26);
    }
    return text;
}

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
        fprintf(stderr, "ok %d error %d\n", ok, error);
        return !ok && (error == KOVA::CRED_REQ_ERR_SEND || error == KOVA::CRED_REQ_ERR_CONNECT) ? 0
                                                                                                : 1;
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

// Adds the certificate (PEM text at `data`) to the trusted ones of the TLS context.
void TrustCertificate(void *, void *sslCtx, void *data) {
    const std::string &pem = *static_cast<const std::string *>(data);
    BIO *bio = BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size()));
    X509 *cert = PEM_read_bio_X509(bio, nullptr, nullptr, nullptr);
    X509_STORE_add_cert(SSL_CTX_get_cert_store(static_cast<SSL_CTX *>(sslCtx)), cert);
    X509_free(cert);
    BIO_free(bio);
}

// With its certificate trusted the server still has to match the host name: the certificate
// names "localhost", so the same server passes under that name and fails under its address.
TEST_F(HttpsTest, VerificationChecksTheHostName) {
    const std::string pem = server_->CertificatePem();
    for (const std::string host : {"localhost", "127.0.0.1"}) {
        SCOPED_TRACE(host);
        kova_test::ClearLog();
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL("https://" + host + ":" + std::to_string(server_->Port()) + "/ok"));
        req.SetSSLVerify(TrustCertificate, const_cast<std::string *>(&pem));
        const bool byName = host == "localhost";
        EXPECT_EQ(req.Process(true, 0), byName) << kova_test::LogDump();
        EXPECT_EQ(req.GetResponse(), byName ? "secure" : "");
        if (!byName) {
            EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_CURL_OTHER);
            EXPECT_TRUE(kova_test::LogHas("CURL Error(60)")) << kova_test::LogDump();
        }
    }
}

}  // namespace
