// Hostile and broken peers: every fault of the fault server ends Process with its mapped error
// in bounded time, without a crash and (in the sanitizer build) without a leak; a response held
// in memory stops at its cap (exactly), plain or gzip-encoded, while a response stream or the
// caller's writer takes a 200 MB body in flat memory; libcurl's own environment variables do not
// take effect in a process with AT_SECURE. Each case runs in a forked child under an alarm, so
// that a crash or a hang fails that case alone.
#include <signal.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/auxv.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <string>

#include <gtest/gtest.h>

#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_util.h"
#include "request/cred_request_p.h"
#include "simlib/fault_server.h"
#include "simlib/loopback_server.h"
#include "support/child.h"
#include "support/interpose.h"
#include "support/temp_dir.h"

namespace {

using kova_test::File;
using kovasim::Fault;

// What a child reports about its case.
struct Outcome {
    bool ok = false;
    int error = -1;
    int headers = 0;                // response headers collected in the JSON mode
    uint64_t bytes = 0;             // body bytes that reached the response string or stream
    long rssGrowthKiB = -1;         // growth of the peak resident set during the transfer
    int queryError = -1;            // CredRequestUtil::m_errCode after a discovery query
    bool writeErrorLogged = false;  // "CURL Error(23)", the write error, in the log
    int curlCode = -1;              // GetCurlCode of the request
    int code = 0;                   // anything else a case reports
};

// Runs `body` in a forked child that an alarm ends after `seconds`, and hands back its outcome
// through shared memory. Fails when the child crashed, hung or leaked (the sanitizer build
// checks at the child's exit).
template <typename Body>
::testing::AssertionResult InChild(unsigned seconds, Body body, Outcome *out) {
    void *shared =
        mmap(nullptr, sizeof(Outcome), PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
    fflush(nullptr);
    const pid_t pid = shared != MAP_FAILED ? fork() : -1;
    if (pid == 0) {
        alarm(seconds);
        *static_cast<Outcome *>(shared) = body();
        exit(0);  // exit, not _exit: the leak check runs at exit
    }
    int status = -1;
    if (pid > 0) {
        waitpid(pid, &status, 0);
        *out = *static_cast<Outcome *>(shared);
    }
    munmap(shared, sizeof(Outcome));
    if (WIFEXITED(status) && WEXITSTATUS(status) == 0) {
        return ::testing::AssertionSuccess();
    }
    return ::testing::AssertionFailure()
           << "the child ended with status " << status
           << (WIFSIGNALED(status) && WTERMSIG(status) == SIGALRM ? " (hung)" : "");
}

// Where a response body goes.
enum class Sink { kMemory, kStream, kWriter };

// A response stream that only counts what is written to it.
ssize_t CountWrite(void *cookie, const char *, size_t size) {
    *static_cast<uint64_t *>(cookie) += size;
    return static_cast<ssize_t>(size);
}

// The caller's own body writer, counting what it receives.
size_t CountingWriter(char *, size_t size, size_t nmemb, void *user) {
    *reinterpret_cast<uint64_t *>(user) += size * nmemb;
    return size * nmemb;
}

// One request to a server with `fault`, its headers collected as JSON and its body sent to
// `sink`.
Outcome Fetch(Fault fault, Sink sink) {
    Outcome outcome;
    kovasim::FaultServer server(fault);
    if (!server.Start()) {
        return outcome;
    }
    uint64_t counted = 0;
    cookie_io_functions_t io = {nullptr, CountWrite, nullptr, nullptr};
    FILE *stream = sink == Sink::kStream ? fopencookie(&counted, "w", io) : nullptr;
    KOVA::CredRequest request;
    request.SetURL(server.BaseUrl() + "/webapi/entry.cgi");
    request.SetRespHeaderToJsonValue(true);
    request.SetResponseTimeout(1);  // a silent peer is given up after one second
    if (stream != nullptr) {
        request.SetRespStream(stream);
    } else if (sink == Sink::kWriter) {
        request.SetRespStream(reinterpret_cast<FILE *>(&counted), CountingWriter);
    }
    const long before = kova_test::PeakRssKiB(true);
    outcome.ok = request.Process(true, 0);
    outcome.rssGrowthKiB = kova_test::PeakRssKiB() - before;
    outcome.error = request.GetError();
    outcome.headers = static_cast<int>(request.GetResponseHeader().size());
    if (stream != nullptr) {
        fclose(stream);
    }
    outcome.bytes = sink == Sink::kMemory ? request.GetResponse().size() : counted;
    outcome.writeErrorLogged = kova_test::LogHas("CURL Error(23)");
    return outcome;
}

constexpr uint64_t kCap = uint64_t{64} << 20;
constexpr long kMiB = 1024;

TEST(HostilePeerTest, EveryFaultEndsWithItsMappedError) {
    struct Case {
        Fault fault;
        bool ok;
        KOVA::CRED_REQ_ERR error;
        int headers;  // headers collected; -1 when not checked
    };
    const Case cases[] = {
        {Fault::kSilent, false, KOVA::CRED_REQ_ERR_TIMEOUT, 0},
        {Fault::kResetHeaders, false, KOVA::CRED_REQ_ERR_CONNECT, 0},
        {Fault::kResetBody, false, KOVA::CRED_REQ_ERR_CONNECT, 2},
        {Fault::kGarbageStatus, false, KOVA::CRED_REQ_ERR_CURL_OTHER, 0},
        // Every header is kept, and "Content-Length" beside them.
        {Fault::kManyHeaders, true, KOVA::CRED_REQ_ERR_NONE, kovasim::kFaultHeaderCount + 1},
        {Fault::kHugeHeader, false, KOVA::CRED_REQ_ERR_CURL_OTHER, 0},
        {Fault::kBadChunk, false, KOVA::CRED_REQ_ERR_CONNECT, -1},
        {Fault::kPlainOnTls, false, KOVA::CRED_REQ_ERR_SSL_CONNECT, 0},
        {Fault::kTlsOnPlain, false, KOVA::CRED_REQ_ERR_CURL_OTHER, 0},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(kovasim::FaultName(c.fault));
        Outcome outcome;
        ASSERT_TRUE(InChild(
            30, [&] { return Fetch(c.fault, Sink::kMemory); }, &outcome));
        EXPECT_EQ(outcome.ok, c.ok);
        EXPECT_EQ(outcome.error, c.error);
        if (c.headers >= 0) {
            EXPECT_EQ(outcome.headers, c.headers);
        }
    }
}

// A 200 MB body reaches a response stream or the caller's writer whole, in flat memory (held
// in memory it stops at the cap: ResponseCapBoundary).
TEST(HostilePeerTest, HugeBodyStreamsWholeInFlatMemory) {
    for (Sink sink : {Sink::kStream, Sink::kWriter}) {
        SCOPED_TRACE(static_cast<int>(sink));
        Outcome outcome;
        ASSERT_TRUE(InChild(
            120, [&] { return Fetch(Fault::kHugeBody, sink); }, &outcome));
        EXPECT_TRUE(outcome.ok);
        EXPECT_EQ(outcome.bytes, kovasim::kFaultBodyBytes);
        EXPECT_LT(outcome.rssGrowthKiB, 32 * kMiB);
    }
}

// The discovery query turns decoding on: a gzip body that decodes to 512 MB is bounded by the
// same cap, and the query fails as any failed transfer does.
TEST(HostilePeerTest, GzipBombThroughDiscoveryStopsAtTheCap) {
    Outcome outcome;
    ASSERT_TRUE(InChild(
        120,
        [] {
            Outcome result;
            const std::string bomb = kovasim::GzipBomb(uint64_t{512} << 20);
            kovasim::LoopbackServer server;
            server.Route("POST", "/webapi/query.cgi",
                         [&bomb](const httplib::Request &, httplib::Response &res) {
                             res.set_header("Content-Encoding", "gzip");
                             res.set_content(bomb, "application/json");
                         });
            if (!server.Start()) {
                return result;
            }
            KOVA_CRED cred;
            cred.id = 5;
            cred.protocol = "http";
            cred.host = "127.0.0.1";
            cred.port = server.Port();
            KOVA::CredRequestUtil::m_errCode = 0;
            const long before = kova_test::PeakRssKiB(true);
            result.ok = KOVA::CredRequestUtil::GetWebAPIDesc(&cred);
            result.rssGrowthKiB = kova_test::PeakRssKiB() - before;
            result.queryError = KOVA::CredRequestUtil::m_errCode;
            result.bytes = server.RequestCount();
            result.writeErrorLogged = kova_test::LogHas("CURL Error(23)");
            return result;
        },
        &outcome));
    EXPECT_FALSE(outcome.ok);
    EXPECT_EQ(outcome.queryError, KOVA::CRED_REQ_ERR_QUERY_FAIL);
    EXPECT_EQ(outcome.bytes, 1u);
    EXPECT_TRUE(outcome.writeErrorLogged);
    EXPECT_LT(outcome.rssGrowthKiB, 200 * kMiB);
}

// An answer of exactly the cap comes back whole; one byte more ends the transfer with the write
// error. The cap can be lowered, raised or lifted per request; the default is 64 MiB.
TEST(HostilePeerTest, ResponseCapBoundary) {
    // GET /N answers N bytes.
    kovasim::RawServer sized([](kovasim::RawServer::Connection &c) {
        const uint64_t n = strtoull(c.Head().c_str() + 5, nullptr, 10);
        c.Send("HTTP/1.1 200 OK\r\nContent-Length: " + std::to_string(n) + "\r\n\r\n");
        const std::string block(size_t{1} << 20, 'x');
        for (uint64_t sent = 0; sent < n;) {
            const size_t part = static_cast<size_t>(std::min<uint64_t>(block.size(), n - sent));
            if (!c.Send(block.data(), part)) {
                return;
            }
            sent += part;
        }
    });
    ASSERT_TRUE(sized.Start());
    constexpr size_t kDefault = SIZE_MAX;  // leave the cap as it is
    struct Case {
        size_t cap;
        uint64_t bytes;
        bool ok;
    };
    const Case cases[] = {{1000, 1000, true},     {1000, 1001, false},
                          {0, 3000000, true},     {kCap + 5, kCap + 5, true},
                          {kDefault, kCap, true}, {kDefault, kCap + 1, false}};
    for (const Case &c : cases) {
        SCOPED_TRACE(std::to_string(c.cap) + " cap, " + std::to_string(c.bytes) + " bytes");
        Outcome outcome;
        ASSERT_TRUE(InChild(
            60,
            [&] {
                Outcome result;
                KOVA::CredRequest request;
                request.SetURL(sized.BaseUrl() + "/" + std::to_string(c.bytes));
                if (c.cap != kDefault) {
                    request.SetMaxResponseSize(c.cap);
                }
                result.ok = request.Process(true, 0);
                result.error = request.GetError();
                result.curlCode = request.GetCurlCode();
                result.bytes = request.GetResponse().size();
                result.writeErrorLogged = kova_test::LogHas("CURL Error(23)");
                return result;
            },
            &outcome));
        EXPECT_EQ(outcome.ok, c.ok);
        EXPECT_EQ(outcome.writeErrorLogged, !c.ok);
        if (c.ok) {
            EXPECT_EQ(outcome.bytes, c.bytes);
        } else {
            EXPECT_EQ(outcome.error, KOVA::CRED_REQ_ERR_CURL_OTHER);
            EXPECT_EQ(outcome.curlCode, CURLE_WRITE_ERROR);
            EXPECT_LT(outcome.bytes, c.bytes);
        }
    }
}

// kovasim serves each fault by its name and says which scheme clients are to use.
TEST(HostilePeerTest, KovasimServesEveryFaultByName) {
    for (Fault fault : kovasim::AllFaults()) {
        const std::string name = kovasim::FaultName(fault);
        SCOPED_TRACE(name);
        std::string out;
        EXPECT_EQ(kova_test::RunCommand(kova_test::ToolCommand(KOVASIM_BIN) + " --fault " + name +
                                            " --duration 0.2 2>&1",
                                        &out),
                  0);
        const std::string scheme = fault == Fault::kPlainOnTls ? "https" : "http";
        EXPECT_EQ(out.rfind(scheme + " 127.0.0.1:", 0), 0u) << out;
    }
    std::string out;
    EXPECT_NE(
        kova_test::RunCommand(kova_test::ToolCommand(KOVASIM_BIN) + " --fault nonsense 2>&1", &out),
        0);
}

// ---- Hostile environment: libcurl's own variables in a process that gained privileges.

// What a copy of this program does when started by SecureProcessIgnoresProxyAndKeyLogVariables:
// a plain request to KOVA_CHILD_HTTP and a TLS one to KOVA_CHILD_HTTPS, before any test runs.
// Its exit status has bit 0 for AT_SECURE, bit 1 for a plain request that succeeded and bit 2
// for a TLS one that did.
class SecureChild : public ::testing::Environment {
  public:
    void SetUp() override {
        const char *http = getenv("KOVA_CHILD_HTTP");
        const char *https = getenv("KOVA_CHILD_HTTPS");
        if (http == nullptr || https == nullptr) {
            return;
        }
        int status = getauxval(AT_SECURE) != 0 ? 1 : 0;
        KOVA::CredRequest plain;
        plain.SetURL(http);
        status |= plain.Process(true, 0) ? 2 : 0;
        KOVA::CredRequest tls;
        tls.SetURL(https);
        status |= tls.Process(true, 0) ? 4 : 0;
        fflush(nullptr);
        _exit(status);
    }
};
::testing::Environment *const kSecureChild = ::testing::AddGlobalTestEnvironment(new SecureChild);

// In a process with AT_SECURE, the invoker's http_proxy does not carry the request elsewhere
// and SSLKEYLOGFILE does not receive the TLS keys. The decision is checked with the flag forced
// here, and for real in a set-gid copy of this program (as root); an ordinary copy shows that
// both variables take effect otherwise.
TEST(HostileEnvironmentTest, SecureProcessIgnoresProxyAndKeyLogVariables) {
    kovasim::LoopbackServer target;
    target.Route("GET", "/direct", [](const httplib::Request &, httplib::Response &res) {
        res.set_content("direct", "text/plain");
    });
    kovasim::LoopbackServer proxy;
    proxy.Fallback([](const httplib::Request &, httplib::Response &res) { res.status = 502; });
    kovasim::LoopbackServer::Options tlsOptions;
    tlsOptions.https = true;
    kovasim::LoopbackServer tls(tlsOptions);
    tls.Route("GET", "/direct", [](const httplib::Request &, httplib::Response &res) {
        res.set_content("direct", "text/plain");
    });
    ASSERT_TRUE(target.Start() && proxy.Start() && tls.Start());
    const std::string targetUrl = target.BaseUrl() + "/direct";

    for (bool secure : {false, true}) {
        SCOPED_TRACE(secure);
        target.ClearRecords();
        proxy.ClearRecords();
        Outcome outcome;
        ASSERT_TRUE(InChild(
            30,
            [&] {
                Outcome result;
                setenv("http_proxy", proxy.BaseUrl().c_str(), 1);
                setenv("SSLKEYLOGFILE", "/nonexistent/keys", 1);
                KOVA::CredRequestPrivate::ScrubCurlEnvironment(secure);
                result.code = getenv("SSLKEYLOGFILE") != nullptr ? 1 : 0;
                KOVA::CredRequestPrivate p(nullptr);
                p.secureProcess = secure;
                p.SetRawData("URL", Json::Value(targetUrl));
                result.ok = p.InitCurlHandler() && curl_easy_perform(p.curl) == CURLE_OK;
                result.bytes = p.response.size();
                return result;
            },
            &outcome));
        EXPECT_TRUE(outcome.ok);
        EXPECT_EQ(outcome.code, secure ? 0 : 1);
        EXPECT_EQ(target.RequestCount(), secure ? 1u : 0u);
        EXPECT_EQ(proxy.RequestCount(), secure ? 0u : 1u);
    }

    if (getuid() != 0 || getenv("KOVA_TEST_LAUNCHER") != nullptr) {
        // A set-gid program needs root to make, and an emulator gives its guest no AT_SECURE.
        printf("not root or emulated: the set-gid run is left out\n");
        return;
    }
    kova_test::TempDir dir;
    for (bool setgid : {false, true}) {
        SCOPED_TRACE(setgid);
        target.ClearRecords();
        proxy.ClearRecords();
        const std::string program = dir.File(setgid ? "setgid-copy" : "plain-copy");
        const std::string keys = dir.File(setgid ? "setgid-keys" : "plain-keys");
        ASSERT_EQ(kova_test::RunCommand("cp /proc/" + std::to_string(getpid()) + "/exe '" +
                                        program + "'"),
                  0);
        if (setgid) {
            // Owned by another group than the caller's, set-gid: the kernel sets AT_SECURE.
            ASSERT_EQ(chown(program.c_str(), 0, 65534), 0);
            ASSERT_EQ(chmod(program.c_str(), 02755), 0);
        }
        std::string out;
        const int status = kova_test::RunCommand(
            "KOVA_CHILD_HTTP='" + targetUrl + "' KOVA_CHILD_HTTPS='" + tls.BaseUrl() +
                "/direct' http_proxy='" + proxy.BaseUrl() + "' SSLKEYLOGFILE='" + keys + "' '" +
                program + "' --gtest_filter=HostileEnvironmentTest.* 2>&1",
            &out);
        // Set-gid: AT_SECURE, both requests go straight to their servers. Otherwise the proxy
        // takes the plain request (and answers 502) and the keys reach the file.
        EXPECT_EQ(status, setgid ? 7 : 4) << out;
        EXPECT_EQ(target.RequestCount(), setgid ? 1u : 0u);
        EXPECT_EQ(proxy.RequestCount(), setgid ? 0u : 1u);
        EXPECT_EQ(access(keys.c_str(), F_OK) == 0, !setgid);
    }
}

}  // namespace
