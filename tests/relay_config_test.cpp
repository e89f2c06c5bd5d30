// Relay client configuration: service ids, the server id and its MD5, defaults and Clear,
// error documents, answer checks, and how one directory request is prepared.
#include <stdlib.h>

#include <memory>
#include <string>

#include <gtest/gtest.h>

#include "kovacredential/cred_request_farlink.h"
#include "relay_fixture.h"
#include "request/cred_request_farlink_p.h"
#include "simlib/relay_sim.h"
#include "support/interpose.h"

namespace {

using KOVA::CredRequest;
using KOVA::CredRequestFarlink;
using KOVA::CredRequestFarlinkPrivate;

// The directory hosts come from the environment, which each test leaves without them.
class RelayConfig : public ::testing::Test {
  protected:
    void TearDown() override {
        unsetenv("kovacredential_farlink_global");
        unsetenv("kovacredential_farlink_server");
    }
};

using kova_test::ParseJson;

TEST_F(RelayConfig, ServiceIdsSelectTheirProtocolAndServerIdsCarryTheirMd5) {
    kova_test::ClearLog();
    CredRequestFarlinkPrivate client(nullptr);
    EXPECT_EQ(client.GetServiceId(), "zon");
    EXPECT_EQ(client.GetServiceProtocol(), "http");
    const std::pair<const char *, const char *> table[] = {{"zon_https", "https"},
                                                           {"zon", "http"},
                                                           {"zon_portal_https", "https"},
                                                           {"zon_portal", "http"}};
    for (const auto &row : table) {
        client.SetServiceId(row.first);
        EXPECT_EQ(client.GetServiceId(), row.first);
        EXPECT_EQ(client.GetServiceProtocol(), row.second) << row.first;
    }
    EXPECT_EQ(kova_test::LogCount("is not supported"), 0u);

    // An unsupported id is kept with the protocol it replaces, and logged.
    client.SetServiceId("zon_https");
    client.SetServiceId("ftp");
    EXPECT_EQ(client.GetServiceId(), "ftp");
    EXPECT_EQ(client.GetServiceProtocol(), "https");
    ASSERT_EQ(kova_test::LogCount("Service id[ftp] is not supported"), 1u) << kova_test::LogDump();
    EXPECT_EQ(kova_test::LogRecords().back().rfind("cred_request_farlink_conn:", 0), 0u)
        << kova_test::LogDump();
    EXPECT_EQ(client.GetError(), KOVA::CRED_REQ_ERR_NONE);

    // The server id carries its lower-case MD5.
    client.SetServerId("abc");
    EXPECT_EQ(client.GetServerId(), "abc");
    EXPECT_EQ(client.GetServerIdMd5(), "900150983cd24fb0d6963f7d28e17f72");
    // Overwrite the digest behind the id's back: setting the same id again must not redo it,
    // while a new id replaces both.
    client.SetServerIdMd5("something else");
    const std::string planted = client.GetServerIdMd5();
    ASSERT_NE(planted, "900150983cd24fb0d6963f7d28e17f72");
    client.SetServerId("abc");
    EXPECT_EQ(client.GetServerIdMd5(), planted);
    client.SetServerId("abd");
    EXPECT_EQ(client.GetServerId(), "abd");
    EXPECT_EQ(client.GetServerIdMd5(), kovasim::Md5Hex("abd"));
    // An empty id clears the digest with 401.
    client.SetServerId("");
    EXPECT_EQ(client.GetServerId(), "");
    EXPECT_EQ(client.GetServerIdMd5(), "");
    EXPECT_EQ(client.GetError(), KOVA::CRED_REQ_ERR_NO_SERVER_ID);
    EXPECT_EQ(client.GetErrors(), ParseJson(R"({"code":401})"));
}

TEST_F(RelayConfig, DirectoryHostComesFromTheEnvironmentOrTheBuildAndClearRestoresIt) {
    unsetenv("kovacredential_farlink_server");
    EXPECT_EQ(CredRequestFarlinkPrivate(nullptr).GetServerName(), KOVA_DEFAULT_FARLINK_SERVER);
    setenv("kovacredential_farlink_server", "", 1);
    EXPECT_EQ(CredRequestFarlinkPrivate(nullptr).GetServerName(), KOVA_DEFAULT_FARLINK_SERVER);
    setenv("kovacredential_farlink_server", "dir.example", 1);
    setenv("kovacredential_farlink_global", "global.example", 1);
    EXPECT_EQ(CredRequestFarlinkPrivate(nullptr).GetServerName(), "dir.example");
    EXPECT_EQ(CredRequestFarlinkPrivate::GlobalServerName(), "global.example");

    // Clear restores the connection settings only.
    CredRequestFarlinkPrivate client(nullptr);
    client.SetServerId("abc");
    client.SetServiceId("zon_portal_https");
    client.SetServerName("elsewhere.example");
    client.SetHTTPS(true, true);
    client.SetTimeout(30);
    client.SetError(KOVA::CRED_REQ_ERR_SERVER_ERRNO, "kept");
    client.Clear();
    EXPECT_EQ(client.GetServerName(), "dir.example");
    EXPECT_FALSE(client.useHTTPS);
    EXPECT_FALSE(client.verifyHTTPS);
    EXPECT_EQ(client.timeout, 5);
    EXPECT_EQ(client.GetServerId(), "abc");
    EXPECT_EQ(client.GetServiceId(), "zon_portal_https");
    EXPECT_EQ(client.GetServiceProtocol(), "https");
    EXPECT_EQ(client.GetErrors(), ParseJson(R"({"code":23,"error":"kept"})"));
}

TEST_F(RelayConfig, ErrorDocumentsAnswerChecksAndPreparedRequests) {
    // The error document carries the detail only when there is one.
    CredRequestFarlink client;
    EXPECT_EQ(client.GetErrors(), ParseJson(R"({"code":0})"));
    client.SetError(KOVA::CRED_REQ_ERR_NO_PORT);
    EXPECT_EQ(client.GetErrors(), ParseJson(R"({"code":405})"));
    client.SetError(KOVA::CRED_REQ_ERR_UNKNOWN, 20);
    EXPECT_EQ(client.GetErrors(), ParseJson(R"({"code":22,"error":20})"));
    client.SetError(KOVA::CRED_REQ_ERR_NO_CONN_INFO, Json::Value(Json::objectValue));
    EXPECT_EQ(client.GetErrors(), ParseJson(R"({"code":402})"));

    // Only objects whose "errno" is 0, or that have none, are accepted, and nothing else is kept.
    CredRequestFarlinkPrivate core(nullptr);
    Json::Value out = "untouched";
    for (const char *text : {"", "{\"errno\":0", "[0]", "{\"errno\":1}", "{\"errno\":\"x\"}"}) {
        EXPECT_FALSE(core.CheckResponse(text, &out)) << text;
    }
    EXPECT_EQ(out, Json::Value("untouched"));
    EXPECT_TRUE(core.CheckResponse("{\"a\":1}", nullptr));
    EXPECT_TRUE(core.CheckResponse("{\"errno\":0,\"sites\":[\"s\"]}", &out));
    EXPECT_EQ(out, ParseJson(R"({"errno":0,"sites":["s"]})"));
    EXPECT_EQ(core.GetError(), KOVA::CRED_REQ_ERR_NONE);

    // A prepared request needs a directory host (reported first), then a body.
    core.SetServerName("");
    EXPECT_EQ(core.CreateFarlinkRequest(Json::Value()), nullptr);
    EXPECT_EQ(core.GetError(), KOVA::CRED_REQ_ERR_NO_SERVICE_ID);
    Json::Value body = ParseJson(R"({"version":1})");
    Json::Value answer;
    // Sending reports any failure to make the request as 22 with the document.
    EXPECT_FALSE(core.SendFarlinkRequest(body, answer));
    EXPECT_EQ(core.GetErrors(), ParseJson(R"({"code":22,"error":{"version":1}})"));
    core.SetServerName("dir.example");
    EXPECT_EQ(core.CreateFarlinkRequest(Json::Value(Json::objectValue)), nullptr);
    EXPECT_EQ(core.GetError(), KOVA::CRED_REQ_ERR_EMPTY_REQUEST);

    // The port is explicit; the response time-out is set only when positive.
    std::unique_ptr<CredRequest> request(core.CreateFarlinkRequest(body));
    ASSERT_TRUE(request);
    EXPECT_EQ(request->GetURL().rfind("http://dir.example:80/", 0), 0u) << request->GetURL();
    EXPECT_EQ(request->GetResponseTimeout(), 5);
    const std::pair<int, int> timeouts[] = {{0, 120}, {-3, 120}, {42, 42}};
    for (const auto &row : timeouts) {
        core.SetTimeout(row.first);
        request.reset(core.CreateFarlinkRequest(body));
        ASSERT_TRUE(request);
        EXPECT_EQ(request->GetResponseTimeout(), row.second) << row.first;
    }
    core.SetHTTPS(true, false);
    request.reset(core.CreateFarlinkRequest(body));
    EXPECT_EQ(request->GetURL().rfind("https://dir.example:443/", 0), 0u) << request->GetURL();
}

// The same on the wire: a directory host listening on both 80 and 443 sees plain HTTP on 80
// and TLS on 443, with nothing on any other port.
TEST_F(RelayConfig, DirectoryRequestsReachPort80OrTls443) {
    kovasim::RelaySim sim;
    kovasim::LoopbackServer::Options plainOptions;
    plainOptions.host = kovasim::ProcessLoopbackAddress(0);
    plainOptions.port = 80;
    kovasim::LoopbackServer plain(plainOptions);
    kovasim::LoopbackServer::Options tlsOptions = plainOptions;
    tlsOptions.port = 443;
    tlsOptions.https = true;
    kovasim::LoopbackServer tls(tlsOptions);
    sim.Install(plain);
    sim.Install(tls);
    for (kovasim::LoopbackServer *server : {&plain, &tls}) {
        if (!server->Start()) {
            if (kovasim::BindNotPermitted(*server)) {
                GTEST_SKIP() << "binding a directory host on a privileged port is not "
                                "permitted here: "
                             << server->Error();
            }
            FAIL() << server->Error();
        }
    }
    setenv("kovacredential_farlink_global", plainOptions.host.c_str(), 1);
    CredRequestFarlink client;
    Json::Value answer;
    ASSERT_TRUE(client.GetSiteList(answer)) << client.GetErrors().toStyledString();
    EXPECT_EQ(plain.CountPath("//Serv.php") + plain.CountPath("/Serv.php"), 1u);
    EXPECT_EQ(tls.RequestCount(), 0u);
    client.SetHTTPS(true, false);
    ASSERT_TRUE(client.GetSiteList(answer)) << client.GetErrors().toStyledString();
    EXPECT_EQ(plain.RequestCount(), 1u);
    EXPECT_EQ(tls.RequestCount(), 1u);
    // A certificate check against the self-signed certificate fails the request.
    client.SetHTTPS(true, true);
    EXPECT_FALSE(client.GetSiteList(answer));
    EXPECT_EQ(client.GetError(), KOVA::CRED_REQ_ERR_UNKNOWN);
}

}  // namespace
