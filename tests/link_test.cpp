// The servers and links that connection tests and benchmarks stand on: nginx with TLS and
// HTTP/2 from the test harness, counting the connections its clients open, and the relay that
// adds a round-trip time.
#include <memory>
#include <string>
#include <vector>

#include <curl/curl.h>
#include <gtest/gtest.h>

#include "kovacredential/cred_request.h"
#include "simlib/link_relay.h"
#include "simlib/loopback_server.h"
#include "support/interpose.h"
#include "support/nginx_server.h"

namespace {

using kova_test::NginxServer;

// A raw libcurl transfer on `easy` (kept, so that its connection can carry the next one); a
// POST when `post` is given. Returns the body, or "<failed>".
std::string Fetch(CURL *easy, const std::string &url, bool fresh = false,
                  const std::string &post = "") {
    std::string body;
    curl_easy_setopt(easy, CURLOPT_URL, url.c_str());
    curl_easy_setopt(easy, CURLOPT_SSL_VERIFYPEER, 0L);
    curl_easy_setopt(easy, CURLOPT_SSL_VERIFYHOST, 0L);
    curl_easy_setopt(
        easy, CURLOPT_WRITEFUNCTION, +[](char *data, size_t size, size_t n, void *out) {
            static_cast<std::string *>(out)->append(data, size * n);
            return size * n;
        });
    curl_easy_setopt(easy, CURLOPT_WRITEDATA, &body);
    curl_easy_setopt(easy, CURLOPT_FRESH_CONNECT, fresh ? 1L : 0L);
    post.empty() ? curl_easy_setopt(easy, CURLOPT_HTTPGET, 1L)
                 : curl_easy_setopt(easy, CURLOPT_POSTFIELDS, post.c_str());
    return curl_easy_perform(easy) == CURLE_OK ? body : "<failed>";
}

using Easy = std::unique_ptr<CURL, void (*)(CURL *)>;

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
    Easy easy(curl_easy_init(), curl_easy_cleanup);
    EXPECT_EQ(Fetch(easy.get(), nginx.BaseUrl() + "/small"), "hello from nginx\n");
    EXPECT_EQ(Fetch(easy.get(), nginx.BaseUrl() + "/echo", false, "ping"), "ping");
    EXPECT_EQ(Fetch(easy.get(), nginx.BaseUrl() + "/delay", true), "delayed\n");
    ASSERT_TRUE(nginx.WaitForRequests(3));
    const auto log = nginx.AccessLog();
    ASSERT_EQ(log.size(), 3u);
    EXPECT_EQ((std::vector<std::string>{log[1].method, log[2].uri}),
              (std::vector<std::string>{"POST", "/delay"}));
    EXPECT_EQ(log[0].connection, log[1].connection);
    EXPECT_EQ(log[1].connectionRequests, 2);
    EXPECT_NE(log[2].connection, log[1].connection);
    EXPECT_EQ(nginx.ConnectionCount(), 2u);

    NginxServer::Options once;
    once.tls = false;
    once.keepaliveTimeoutSeconds = 0;
    NginxServer closing(once);
    ASSERT_TRUE(closing.Start()) << closing.Error();
    for (int i = 0; i < 2; ++i) {
        EXPECT_EQ(Fetch(easy.get(), closing.BaseUrl() + "/small"), "hello from nginx\n");
    }
    ASSERT_TRUE(closing.WaitForRequests(2));
    EXPECT_EQ(closing.ConnectionCount(), 2u);
    EXPECT_EQ(closing.AccessLog()[0].protocol, "HTTP/1.1");
}

// The link that adds a round-trip time carries bodies whole and in order both ways, keeps a
// reused connection, and counts the connections and bytes it carried.
TEST(LinkRelay, CarriesBodiesAndCountsConnections) {
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
    const std::string body = kova_test::Pattern(300 * 1024);
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(url));
    ASSERT_TRUE(req.AddRawParam(body));
    // (cpp-httplib caps form-encoded bodies at 8 KiB.)
    ASSERT_TRUE(req.AddHeader("Content-Type", "application/octet-stream"));
    ASSERT_TRUE(req.Process(true, 0)) << req.GetError();
    EXPECT_TRUE(req.GetResponse() == body) << "the echoed body differs";

    Easy easy(curl_easy_init(), curl_easy_cleanup);
    EXPECT_EQ(Fetch(easy.get(), url, false, "one") + Fetch(easy.get(), url, false, "two"),
              "onetwo");
    EXPECT_EQ(link.ConnectionCount(), 2);
    EXPECT_EQ(server.RequestCount(), 3u);
    EXPECT_GE(link.BytesUp(), static_cast<long long>(body.size()));
    EXPECT_GE(link.BytesDown(), static_cast<long long>(body.size()));
}

}  // namespace
