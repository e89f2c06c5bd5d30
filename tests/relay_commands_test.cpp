// Relay directory commands against a simulated directory: the documents on the wire, the site
// list and the walk over its sites, tunnels, and how unusable answers are reported.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <stdlib.h>

#include <memory>
#include <string>

#include <gtest/gtest.h>

#include "kovacredential/cred_request_farlink.h"
#include "request/cred_request_farlink_p.h"
#include "relay_fixture.h"
#include "simlib/relay_sim.h"

namespace {

using KOVA::CredRequest;
using KOVA::CredRequestFarlink;

using kova_test::ParseJson;

// Host 0 is the global directory, hosts 1 to 3 are sites.
class RelayCommandsTest : public kova_test::RelayDirectoryTest {
  protected:
    RelayCommandsTest() : RelayDirectoryTest(4) {}

    void SetUp() override {
        RelayDirectoryTest::SetUp();
        if (IsSkipped() || HasFatalFailure()) {
            return;
        }
        Configure(R"({"servers": [{"serverID": "S1",
                        "interface": [{"ip": "10.0.0.5"}], "ddns": "s1.example",
                        "services": {"zon": {"port": 5000, "ext_port": 0,
                                             "relay_ip": "10.9.9.9", "relay_port": 7000}}}]})");
    }

    // Replaces the simulator's configuration; "%1" .. "%3" stand for the sites' hosts.
    void Configure(std::string text) {
        for (int i = 1; i <= 3; ++i) {
            const std::string mark = "%" + std::to_string(i);
            for (size_t at = text.find(mark); at != std::string::npos; at = text.find(mark)) {
                text.replace(at, mark.size(), Host(i));
            }
        }
        std::string error;
        ASSERT_TRUE(Sim().Configure(ParseJson(text), &error)) << error;
    }
};

TEST_F(RelayCommandsTest, RequestDocumentsOnTheWire) {
    Configure(R"({"sites": ["%1"], "servers": [{"serverID": "S1",
                  "services": {"zon_portal": {"port": 5000, "relay_ip": "10.9.9.9",
                                              "relay_port": 7000}}}]})");
    CredRequestFarlink client;
    client.SetServerId("S1");
    client.SetServiceId("zon_portal");
    Json::Value answer;
    ASSERT_TRUE(client.GetSiteList(answer)) << client.GetErrors().toStyledString();
    ASSERT_TRUE(client.GetServerInfo(answer)) << client.GetErrors().toStyledString();
    ASSERT_TRUE(client.RequestTunnel(answer)) << client.GetErrors().toStyledString();

    auto hits = Sim().Hits();
    ASSERT_EQ(hits.size(), 3u);
    EXPECT_EQ(hits[0].site, Host(0));
    EXPECT_EQ(hits[0].method, "POST");
    EXPECT_EQ(hits[0].body, R"({"command":"get_site_list","version":1})");
    EXPECT_EQ(hits[1].site, Host(1));
    EXPECT_EQ(hits[1].body,
              R"({"command":"get_server_info","id":"zon_portal","serverID":"S1","version":1})");
    EXPECT_EQ(hits[2].site, Host(1));
    EXPECT_EQ(hits[2].body,
              R"({"command":"request_tunnel","id":"zon_portal","serverID":"S1","version":1})");
    EXPECT_EQ(answer, ParseJson(R"({"errno": 0, "server": {"serverID": "S1"},
        "service": {"id": "zon_portal", "relay_ip": "10.9.9.9", "relay_port": 7000}})"));
}

TEST_F(RelayCommandsTest, ServerInformationIsTheWholeAnswer) {
    CredRequestFarlink client;
    client.SetServerId("S1");
    // The prepared request is not sent until it is processed.
    std::unique_ptr<CredRequest> request(client.GetServerInfo());
    ASSERT_TRUE(request);
    EXPECT_EQ(Sim().HitCount(), 0u);
    ASSERT_TRUE(request->Process(true, 0));
    EXPECT_EQ(Sim().HitCount(), 1u);
    EXPECT_EQ(ParseJson(request->GetResponse())["server"]["serverID"], "S1");

    Json::Value info;
    ASSERT_TRUE(client.GetServerInfo(info)) << client.GetErrors().toStyledString();
    EXPECT_EQ(info, ParseJson(R"({"errno": 0,
        "server": {"serverID": "S1", "interface": [{"ip": "10.0.0.5"}], "ddns": "s1.example"},
        "service": {"id": "zon", "port": 5000, "ext_port": 0}})"));

    // An unsupported service id travels as it stands.
    client.SetServiceId("ftp");
    EXPECT_FALSE(client.GetServerInfo(info));
    ASSERT_EQ(Sim().HitCount(), 3u);
    EXPECT_EQ(Sim().Hits()[2].request["id"], "ftp");
    EXPECT_EQ(client.GetError(), KOVA::CRED_REQ_ERR_SERVER_ERRNO);
}

TEST_F(RelayCommandsTest, MissingServerIdIs401ForInformationAnd1ForTunnels) {
    CredRequestFarlink client;
    EXPECT_EQ(client.GetServerInfo(), nullptr);
    EXPECT_EQ(client.GetErrors(), ParseJson(R"({"code":401})"));
    Json::Value answer;
    EXPECT_FALSE(client.GetServerInfo(answer));
    EXPECT_EQ(client.GetErrors(), ParseJson(R"({"code":22})"));
    EXPECT_FALSE(client.RequestTunnel(answer));
    EXPECT_EQ(client.GetErrors(), ParseJson(R"({"code":1})"));
    EXPECT_EQ(Sim().HitCount(), 0u);
}

TEST_F(RelayCommandsTest, SitesAreTriedInOrderUntilOneAnswers) {
    Configure(R"({"sites": ["%1", "%2", "%3"],
                  "servers": [{"serverID": "S1", "sites": ["%2", "%3"],
                               "services": {"zon": {"port": 5000, "relay_ip": "10.9.9.9",
                                                    "relay_port": 7000}}}]})");
    CredRequestFarlink client;
    client.SetServerId("S1");
    Json::Value info;
    ASSERT_TRUE(client.GetAvailableServerInfo(info)) << client.GetErrors().toStyledString();
    EXPECT_EQ(info["service"]["port"], 5000);

    auto asked = Sim().Hits("get_server_info");
    ASSERT_EQ(asked.size(), 2u);
    EXPECT_EQ(asked[0].site, Host(1));
    EXPECT_EQ(asked[1].site, Host(2));
    // The failure of the first site stays recorded; the server name stays at the site that
    // answered, so the tunnel is asked of it.
    EXPECT_EQ(client.GetError(), KOVA::CRED_REQ_ERR_SERVER_ERRNO);
    Json::Value tunnel;
    ASSERT_TRUE(client.RequestTunnel(tunnel));
    auto tunnels = Sim().Hits("request_tunnel");
    ASSERT_EQ(tunnels.size(), 1u);
    EXPECT_EQ(tunnels[0].site, Host(2));
}

TEST_F(RelayCommandsTest, SiteEntriesAreTakenAsText) {
    // A site given as a JSON number is used as the text of that number: the 32-bit number
    // form of an IPv4 address reaches the site at that address.
    in_addr address{};
    ASSERT_EQ(inet_pton(AF_INET, Host(2).c_str(), &address), 1);
    const std::string number = std::to_string(ntohl(address.s_addr));
    Configure(R"({"sites": [)" + number + R"(],
                  "servers": [{"serverID": "S1", "sites": ["%2"],
                               "services": {"zon": {"port": 5000}}}]})");
    CredRequestFarlink client;
    client.SetServerId("S1");
    Json::Value info;
    ASSERT_TRUE(client.GetAvailableServerInfo(info)) << client.GetErrors().toStyledString();
    EXPECT_EQ(info["service"]["port"], 5000);
    auto asked = Sim().Hits("get_server_info");
    ASSERT_EQ(asked.size(), 1u);
    EXPECT_EQ(asked[0].site, Host(2));
}

TEST_F(RelayCommandsTest, NoSiteAnsweringLeavesTheLastSiteAndFails) {
    Configure(R"({"sites": ["%2", "%3"], "servers": []})");
    CredRequestFarlink client;
    client.SetServerId("S1");
    Json::Value info;
    EXPECT_FALSE(client.GetAvailableServerInfo(info));
    EXPECT_EQ(client.GetError(), KOVA::CRED_REQ_ERR_SERVER_ERRNO);
    EXPECT_EQ(Sim().Hits("get_server_info").size(), 2u);
    Json::Value tunnel;
    client.RequestTunnel(tunnel);
    ASSERT_EQ(Sim().Hits("request_tunnel").size(), 1u);
    EXPECT_EQ(Sim().Hits("request_tunnel")[0].site, Host(3));
}

TEST_F(RelayCommandsTest, UnusableSiteListsFailWithoutANewError) {
    const char *lists[] = {
        R"({"servers": []})",                 // no "sites"
        R"({"sites": "%2", "servers": []})",  // not an array
        R"({"sites": {"a": "%2"}})",          // an object is not a list either
        R"({"sites": []})",                   // nothing to try
    };
    for (const char *list : lists) {
        Configure(list);
        Sim().ClearHits();
        CredRequestFarlink client;
        client.SetServerId("S1");
        client.SetError(KOVA::CRED_REQ_ERR_NO_PORT, "before");
        Json::Value info = "untouched";
        EXPECT_FALSE(client.GetAvailableServerInfo(info)) << list;
        EXPECT_EQ(client.GetErrors(), ParseJson(R"({"code":405,"error":"before"})")) << list;
        EXPECT_EQ(Sim().HitCount(), 1u) << list;
    }
}

TEST_F(RelayCommandsTest, FailingSiteListLeavesTheServerName) {
    CredRequestFarlink client;
    client.SetServerId("S1");
    client.SetServerName(Host(3));
    Configure(R"({"answers": [{"command": "get_site_list", "json": {"errno": 7}}],
                  "servers": [{"serverID": "S1", "services": {"zon": {
                               "relay_ip": "10.9.9.9", "relay_port": 7000}}}]})");
    Json::Value answer;
    EXPECT_FALSE(client.GetSiteList(answer));
    EXPECT_EQ(client.GetErrors(), ParseJson(R"({"code":23,"error":{"errno":7}})"));
    EXPECT_FALSE(client.GetAvailableServerInfo(answer));
    EXPECT_EQ(client.GetError(), KOVA::CRED_REQ_ERR_SERVER_ERRNO);
    ASSERT_TRUE(client.RequestTunnel(answer));
    EXPECT_EQ(Sim().Hits("request_tunnel")[0].site, Host(3));

    // A global host where nothing listens: the request does not complete.
    setenv("kovacredential_farlink_global", kovasim::ProcessLoopbackAddress(9).c_str(), 1);
    EXPECT_FALSE(client.GetSiteList(answer));
    EXPECT_EQ(client.GetErrors(),
              ParseJson(R"({"code":22,"error":{"command":"get_site_list","version":1}})"));
    Sim().ClearHits();
    ASSERT_TRUE(client.RequestTunnel(answer));
    EXPECT_EQ(Sim().Hits("request_tunnel")[0].site, Host(3));
}

TEST_F(RelayCommandsTest, UnusableAnswersGiveTheirErrorDocuments) {
    // Answers that are no object or carry an errno give 23 with the answer (server information
    // with its text); answers that are no JSON give 22 with the request document.
    enum Command { kSites, kInfo, kTunnel };
    const char *html = R"({"answers": [{"raw": "<html>busy</html>"}]})";
    const char *zero = R"({"answers": [{"raw": "0"}]})";
    const struct {
        const char *config;
        Command command;
        const char *errors;
    } cases[] = {
        {R"({"answers": [{"command": "request_tunnel", "json": {"errno": 1}}]})", kTunnel,
         R"({"code":23,"error":{"errno":1}})"},
        {html, kInfo, R"({"code":23,"error":"<html>busy</html>"})"},
        {html, kSites, R"({"code":22,"error":{"command":"get_site_list","version":1}})"},
        {html, kTunnel, R"({"code":22,"error":{"command":"request_tunnel","id":"zon",
                                               "serverID":"S1","version":1}})"},
        {R"({"answers": [{"json": [1, 2]}]})", kSites, R"({"code":23,"error":[1,2]})"},
        {zero, kSites, R"({"code":23,"error":0})"},
        {zero, kInfo, R"({"code":23,"error":"0"})"},
        {R"({"answers": [{"raw": ""}]})", kInfo, R"({"code":23,"error":""})"},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(std::string(c.config) + " command " + std::to_string(c.command));
        Configure(c.config);
        CredRequestFarlink client;
        client.SetServerId("S1");
        Json::Value answer;
        EXPECT_FALSE(c.command == kSites  ? client.GetSiteList(answer)
                     : c.command == kInfo ? client.GetServerInfo(answer)
                                          : client.RequestTunnel(answer));
        EXPECT_EQ(client.GetErrors(), ParseJson(c.errors));
    }

    // An otherwise usable answer nested deeper than the parser allows is unparsable like any
    // other; a long one is detailed by its first 4096 bytes, cut before a split character.
    const std::string deep =
        "{\"errno\":0,\"server\":" + std::string(1000, '[') + std::string(1000, ']') + "}";
    const std::string longText = std::string(4095, 'x') + "\xc3\xa9" + std::string(9000, 'y');
    const std::pair<std::string, std::string> answers[] = {{deep, deep},
                                                           {longText, std::string(4095, 'x')}};
    KOVA::CredRequestFarlinkPrivate core(nullptr);
    for (const auto &a : answers) {
        SCOPED_TRACE(a.first.substr(0, 20));
        Json::Value config(Json::objectValue);
        config["answers"][0]["raw"] = a.first;
        std::string error;
        ASSERT_TRUE(Sim().Configure(config, &error)) << error;
        CredRequestFarlink client;
        client.SetServerId("S1");
        Json::Value answer;
        EXPECT_FALSE(client.GetServerInfo(answer));
        Json::Value expected(Json::objectValue);
        expected["code"] = KOVA::CRED_REQ_ERR_SERVER_ERRNO;
        expected["error"] = a.second;
        EXPECT_EQ(client.GetErrors(), expected);
        EXPECT_FALSE(core.SendFarlinkRequest(ParseJson(R"({"version":1,"command":"x"})"), answer));
        EXPECT_EQ(core.GetErrors(), expected);
    }
}

TEST_F(RelayCommandsTest, JsonThatIsNoObjectIsReceivedButNotAccepted) {
    KOVA::CredRequestFarlinkPrivate core(nullptr);
    Json::Value body = ParseJson(R"({"version":1,"command":"get_site_list"})");
    const std::pair<const char *, const char *> answers[] = {
        {R"({"answers": [{"json": [1, 2]}]})", "[1,2]"}, {R"({"answers": [{"raw": "0"}]})", "0"}};
    for (const auto &a : answers) {
        SCOPED_TRACE(a.second);
        Configure(a.first);
        Json::Value answer;
        EXPECT_TRUE(core.SendFarlinkRequest(body, answer));
        EXPECT_EQ(answer, ParseJson(a.second));
        EXPECT_FALSE(core.CheckResponse(a.second, nullptr));
    }
}

TEST_F(RelayCommandsTest, UnknownServerAndUnreachableDirectoryHostFailInformation) {
    CredRequestFarlink client;
    client.SetServerId("S9");
    Json::Value info;
    // An errno answer to server information is detailed by its raw text.
    EXPECT_FALSE(client.GetServerInfo(info));
    EXPECT_EQ(client.GetError(), KOVA::CRED_REQ_ERR_SERVER_ERRNO);
    EXPECT_EQ(client.GetErrors()["error"], Sim().Hits("get_server_info")[0].answer);
    EXPECT_EQ(ParseJson(client.GetErrors()["error"].asString())["errno"], 4);
    // Nothing listens at the directory host: 22 with the request's error.
    client.SetServerName(kovasim::ProcessLoopbackAddress(9));
    EXPECT_FALSE(client.GetServerInfo(info));
    EXPECT_EQ(client.GetErrors(), ParseJson(R"({"code":22,"error":20})"));
}

}  // namespace
