// The servers and links that connection tests and benchmarks stand on: nginx with TLS and
// HTTP/2 from the test harness, counting the connections its clients open, and the relay that
// adds a round-trip time.
#include <chrono>
#include <memory>
#include <string>

#include <curl/curl.h>
#include <gtest/gtest.h>

#include "kovacredential/cred_request.h"
#include "simlib/link_relay.h"
#include "simlib/loopback_server.h"
#include "support/nginx_server.h"

namespace {

using kova_test::NginxServer;

struct EasyCleanup {
    void operator()(CURL *c) const { curl_easy_cleanup(c); }
};
using Easy = std::unique_ptr<CURL, EasyCleanup>;

size_t Append(char *data, size_t size, size_t count, void *out) {
    static_cast<std::string *>(out)->append(data, size * count);
    return size * count;
}

// A raw libcurl transfer on `easy` (kept, so that its connection can carry the next one).
// Returns the body; `status` gets the HTTP status.
std::string Fetch(CURL *easy, const std::string &url, long *status, bool fresh = false,
                  const std::string &post = "") {
    std::string body;
    curl_easy_setopt(easy, CURLOPT_URL, url.c_str());
    curl_easy_setopt(easy, CURLOPT_SSL_VERIFYPEER, 0L);
    curl_easy_setopt(easy, CURLOPT_SSL_VERIFYHOST, 0L);
    curl_easy_setopt(easy, CURLOPT_WRITEFUNCTION, Append);
    curl_easy_setopt(easy, CURLOPT_WRITEDATA, &body);
    curl_easy_setopt(easy, CURLOPT_FRESH_CONNECT, fresh ? 1L : 0L);
    if (!post.empty()) {
        curl_easy_setopt(easy, CURLOPT_POSTFIELDS, post.c_str());
    } else {
        curl_easy_setopt(easy, CURLOPT_HTTPGET, 1L);
    }
    *status = 0;
    if (curl_easy_perform(easy) == CURLE_OK) {
        curl_easy_getinfo(easy, CURLINFO_RESPONSE_CODE, status);
    }
    return body;
}

// nginx answers a CredRequest over HTTP/2 and TLS; its log tells the connections apart: a
// reused raw handle rides one connection, a fresh connection is a new one, and keep-alive
// turned off gives every request its own. The echo and delay locations answer.
TEST(NginxHarness, ServesHttp2AndCountsConnections) {
    NginxServer nginx;
    ASSERT_TRUE(nginx.Start()) << nginx.Error();

    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(nginx.BaseUrl() + "/small"));
    ASSERT_TRUE(req.Process(true, 0)) << req.GetError();
    EXPECT_EQ(req.GetResponse(), "hello from nginx\n");
    ASSERT_TRUE(nginx.WaitForRequests(1));
    EXPECT_EQ(nginx.AccessLog()[0].protocol, "HTTP/2.0");
    EXPECT_EQ(nginx.ConnectionCount(), 1u);

    nginx.ClearLog();
    Easy easy(curl_easy_init());
    long status = 0;
    EXPECT_EQ(Fetch(easy.get(), nginx.BaseUrl() + "/small", &status), "hello from nginx\n");
    EXPECT_EQ(Fetch(easy.get(), nginx.BaseUrl() + "/echo", &status, false, "ping"), "ping");
    EXPECT_EQ(status, 200);
    EXPECT_EQ(Fetch(easy.get(), nginx.BaseUrl() + "/delay", &status, true), "delayed\n");
    ASSERT_TRUE(nginx.WaitForRequests(3));
    const auto log = nginx.AccessLog();
    ASSERT_EQ(log.size(), 3u);
    EXPECT_EQ(log[0].connection, log[1].connection);
    EXPECT_EQ(log[1].connectionRequests, 2);
    EXPECT_EQ(log[1].method, "POST");
    EXPECT_NE(log[2].connection, log[1].connection);
    EXPECT_EQ(log[2].uri, "/delay");
    EXPECT_EQ(nginx.ConnectionCount(), 2u);

    NginxServer::Options once;
    once.tls = false;
    once.keepaliveTimeoutSeconds = 0;
    NginxServer closing(once);
    ASSERT_TRUE(closing.Start()) << closing.Error();
    for (int i = 0; i < 2; ++i) {
        EXPECT_EQ(Fetch(easy.get(), closing.BaseUrl() + "/small", &status), "hello from nginx\n");
    }
    ASSERT_TRUE(closing.WaitForRequests(2));
    EXPECT_EQ(closing.ConnectionCount(), 2u);
    EXPECT_EQ(closing.AccessLog()[0].protocol, "HTTP/1.1");
}

// Through a 100 ms link a new connection costs a round trip before its request crosses, and
// the request and its answer one more: at least 2 RTT in all. A reused connection still pays
// one round trip per request. Bodies cross whole and in order both ways; the link counts the
// connections it accepted.
TEST(LinkRelay, DelaysConnectionsAndBytesKeepingThem) {
    kovasim::LoopbackServer server;
    server.Route("*", "/echo", [](const httplib::Request &req, httplib::Response &res) {
        res.set_content(req.body, "application/octet-stream");
    });
    ASSERT_TRUE(server.Start()) << server.Error();
    kovasim::LinkRelay::Options options;
    options.toPort = server.Port();
    options.rttMs = 100;
    kovasim::LinkRelay link(options);
    ASSERT_TRUE(link.Start()) << link.Error();
    const std::string url = "http://127.0.0.1:" + std::to_string(link.Port()) + "/echo";

    using Clock = std::chrono::steady_clock;
    const auto msSince = [](Clock::time_point start) {
        return std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - start).count();
    };
    std::string body(300 * 1024, ' ');
    for (size_t i = 0; i < body.size(); ++i) {
        body[i] = static_cast<char>('a' + (i * 7 + i / 251) % 26);
    }
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(url));
    ASSERT_TRUE(req.AddRawParam(body));
    // (cpp-httplib caps form-encoded bodies at 8 KiB.)
    ASSERT_TRUE(req.AddHeader("Content-Type", "application/octet-stream"));
    auto start = Clock::now();
    ASSERT_TRUE(req.Process(true, 0)) << req.GetError();
    EXPECT_GE(msSince(start), 200);
    EXPECT_TRUE(req.GetResponse() == body) << "the echoed body differs";

    Easy easy(curl_easy_init());
    long status = 0;
    Fetch(easy.get(), url, &status, false, "one");
    start = Clock::now();
    EXPECT_EQ(Fetch(easy.get(), url, &status, false, "two"), "two");
    EXPECT_GE(msSince(start), 100);
    EXPECT_EQ(link.ConnectionCount(), 2);
    EXPECT_EQ(server.RequestCount(), 3u);
    EXPECT_GE(link.BytesUp(), static_cast<long long>(body.size()));
    EXPECT_GE(link.BytesDown(), static_cast<long long>(body.size()));
}

}  // namespace
