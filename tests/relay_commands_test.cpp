// Relay directory commands against a simulated directory: the documents on the wire, the site
// list and the walk over its sites, tunnels, and how unusable answers are reported.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <stdlib.h>

#include <memory>
#include <string>
#include <vector>

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

    // Replaces the simulator's configuration; "$1" .. "$3" stand for the sites' hosts.
    void Configure(const std::string &text) {
        Sim().ClearHits();
        std::string error;
        ASSERT_TRUE(Sim().Configure(ParseJson(text, {Host(0), Host(1), Host(2), Host(3)}), &error))
            << error;
    }
};

TEST_F(RelayCommandsTest, RequestDocumentsOnTheWire) {
    Configure(R"({"sites": ["$1"], "servers": [{"serverID": "S1",
                  "services": {"zon_portal": {"port": 5000, "relay_ip": "10.9.9.9",
                                              "relay_port": 7000}}}]})");
    CredRequestFarlink client;
    client.SetServerId("S1");
    client.SetServiceId("zon_portal");
    Json::Value answer;
    ASSERT_TRUE(client.GetSiteList(answer)) << client.GetErrors().toStyledString();
    ASSERT_TRUE(client.GetServerInfo(answer)) << client.GetErrors().toStyledString();
    ASSERT_TRUE(client.RequestTunnel(answer)) << client.GetErrors().toStyledString();
    std::vector<std::string> seen;
    for (const auto &hit : Sim().Hits()) {
        seen.push_back(hit.site + " " + hit.method + " " + hit.body);
    }
    EXPECT_EQ(seen, (std::vector<std::string>{
                        Host(0) + R"( POST {"command":"get_site_list","version":1})",
                        Host(1) + R"( POST {"command":"get_server_info","id":"zon_portal",)"
                                  R"("serverID":"S1","version":1})",
                        Host(1) + R"( POST {"command":"request_tunnel","id":"zon_portal",)"
                                  R"("serverID":"S1","version":1})"}));
    EXPECT_EQ(answer, ParseJson(R"({"errno": 0, "server": {"serverID": "S1"},
        "service": {"id": "zon_portal", "relay_ip": "10.9.9.9", "relay_port": 7000}})"));
}

TEST_F(RelayCommandsTest, ServerInformationIsTheWholeAnswer) {
    // Without a server id: 401 for the prepared request, 22 for the information, 1 for a tunnel.
    CredRequestFarlink client;
    EXPECT_EQ(client.GetServerInfo(), nullptr);
    EXPECT_EQ(client.GetErrors(), ParseJson(R"({"code":401})"));
    Json::Value info;
    EXPECT_FALSE(client.GetServerInfo(info));
    EXPECT_EQ(client.GetErrors(), ParseJson(R"({"code":22})"));
    EXPECT_FALSE(client.RequestTunnel(info));
    EXPECT_EQ(client.GetErrors(), ParseJson(R"({"code":1})"));

    // The prepared request is not sent until it is processed.
    client.SetServerId("S1");
    std::unique_ptr<CredRequest> request(client.GetServerInfo());
    ASSERT_TRUE(request);
    EXPECT_EQ(Sim().HitCount(), 0u);
    ASSERT_TRUE(request->Process(true, 0));
    EXPECT_EQ(Sim().HitCount(), 1u);
    EXPECT_EQ(ParseJson(request->GetResponse())["server"]["serverID"], "S1");

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

    // An errno answer to server information is detailed by its raw text.
    client.SetServiceId("zon");
    client.SetServerId("S9");
    EXPECT_FALSE(client.GetServerInfo(info));
    EXPECT_EQ(client.GetError(), KOVA::CRED_REQ_ERR_SERVER_ERRNO);
    EXPECT_EQ(client.GetErrors()["error"], Sim().Hits().back().answer);
    EXPECT_EQ(ParseJson(client.GetErrors()["error"].asString())["errno"], 4);
    // Nothing listens at the directory host: 22 with the request's error.
    client.SetServerName(kovasim::ProcessLoopbackAddress(9));
    EXPECT_FALSE(client.GetServerInfo(info));
    EXPECT_EQ(client.GetErrors(), ParseJson(R"({"code":22,"error":20})"));
}

// The sites are tried in order until one knows the server; a failure stays recorded, and the
// server name stays at the site that answered (or was tried last), so the tunnel is asked of it.
// A site given as a JSON number is used as the text of that number: the 32-bit number form of
// an IPv4 address reaches the site at that address.
TEST_F(RelayCommandsTest, SitesAreTriedInOrderUntilOneAnswers) {
    in_addr address{};
    ASSERT_EQ(inet_pton(AF_INET, Host(2).c_str(), &address), 1);
    const std::string number = std::to_string(ntohl(address.s_addr));
    const struct {
        std::string config;
        bool found;
        std::vector<std::string> asked;  // the sites asked for server information
        bool tunnel;
    } cases[] = {
        {R"({"sites": ["$1", "$2", "$3"], "servers": [{"serverID": "S1", "sites": ["$2", "$3"],
            "services": {"zon": {"port": 5000, "relay_ip": "10.9.9.9", "relay_port": 7000}}}]})",
         true,
         {Host(1), Host(2)},
         true},
        {R"({"sites": [)" + number + R"(], "servers": [{"serverID": "S1", "sites": ["$2"],
            "services": {"zon": {"port": 5000}}}]})",
         true,
         {Host(2)},
         false},
        {R"({"sites": ["$2", "$3"], "servers": []})", false, {Host(2), Host(3)}, false},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.config);
        Configure(c.config);
        CredRequestFarlink client;
        client.SetServerId("S1");
        Json::Value info;
        EXPECT_EQ(client.GetAvailableServerInfo(info), c.found)
            << client.GetErrors().toStyledString();
        EXPECT_EQ(info["service"]["port"], c.found ? Json::Value(5000) : Json::Value());
        std::vector<std::string> asked;
        for (const auto &hit : Sim().Hits("get_server_info")) {
            asked.push_back(hit.site);
        }
        EXPECT_EQ(asked, c.asked);
        EXPECT_EQ(client.GetError(),
                  c.asked.size() > 1 ? KOVA::CRED_REQ_ERR_SERVER_ERRNO : KOVA::CRED_REQ_ERR_NONE);
        Json::Value tunnel;
        EXPECT_EQ(client.RequestTunnel(tunnel), c.tunnel);
        const auto tunnels = Sim().Hits("request_tunnel");
        ASSERT_EQ(tunnels.size(), 1u);
        EXPECT_EQ(tunnels[0].site, c.asked.back());
    }
}

// A site list that fails, or holds nothing to try, fails the walk and leaves the server name, so
// the tunnel is asked where the client pointed before; an unusable list sets no new error.
TEST_F(RelayCommandsTest, FailingSiteListsLeaveTheServerName) {
    const char *before = R"({"code":405,"error":"before"})";
    const struct {
        const char *config;  // nullptr: nothing listens at the global host
        const char *errors;
    } cases[] = {
        {R"({"servers": []})", before},                 // no "sites"
        {R"({"sites": "$2", "servers": []})", before},  // not an array
        {R"({"sites": {"a": "$2"}})", before},          // an object is not a list either
        {R"({"sites": []})", before},                   // nothing to try
        {R"({"answers": [{"command": "get_site_list", "json": {"errno": 7}}]})",
         R"({"code":23,"error":{"errno":7}})"},
        {nullptr, R"({"code":22,"error":{"command":"get_site_list","version":1}})"},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.config != nullptr ? c.config : "no global host");
        if (c.config != nullptr) {
            Configure(c.config);
        } else {
            setenv("kovacredential_farlink_global", kovasim::ProcessLoopbackAddress(9).c_str(), 1);
        }
        Sim().ClearHits();
        CredRequestFarlink client;
        client.SetServerId("S1");
        client.SetServerName(Host(3));
        client.SetError(KOVA::CRED_REQ_ERR_NO_PORT, "before");
        Json::Value info;
        EXPECT_FALSE(client.GetAvailableServerInfo(info));
        EXPECT_EQ(client.GetErrors(), ParseJson(c.errors));
        EXPECT_EQ(Sim().HitCount(), c.config != nullptr ? 1u : 0u);
        client.RequestTunnel(info);
        const auto tunnels = Sim().Hits("request_tunnel");
        ASSERT_EQ(tunnels.size(), 1u);
        EXPECT_EQ(tunnels[0].site, Host(3));
    }
}

TEST_F(RelayCommandsTest, UnusableAnswersGiveTheirErrorDocuments) {
    // Answers that are no object or carry an errno give 23 with the answer (server information
    // with its text); answers that are no JSON give 22 with the request document. JSON that is
    // no object is still received by the core, which only refuses it in its check.
    enum Command { kSites, kInfo, kTunnel };
    const char *html = R"({"answers": [{"raw": "<html>busy</html>"}]})";
    const char *zero = R"({"answers": [{"raw": "0"}]})";
    const struct {
        const char *config;
        Command command;
        const char *errors;
        const char *received;  // what the core receives, where it is JSON
    } cases[] = {
        {R"({"answers": [{"command": "request_tunnel", "json": {"errno": 1}}]})", kTunnel,
         R"({"code":23,"error":{"errno":1}})", nullptr},
        {html, kInfo, R"({"code":23,"error":"<html>busy</html>"})", nullptr},
        {html, kSites, R"({"code":22,"error":{"command":"get_site_list","version":1}})", nullptr},
        {html, kTunnel, R"({"code":22,"error":{"command":"request_tunnel","id":"zon",
                                               "serverID":"S1","version":1}})",
         nullptr},
        {R"({"answers": [{"json": [1, 2]}]})", kSites, R"({"code":23,"error":[1,2]})", "[1,2]"},
        {zero, kSites, R"({"code":23,"error":0})", "0"},
        {zero, kInfo, R"({"code":23,"error":"0"})", nullptr},
        {R"({"answers": [{"raw": ""}]})", kInfo, R"({"code":23,"error":""})", nullptr},
    };
    KOVA::CredRequestFarlinkPrivate core(nullptr);
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
        if (c.received != nullptr) {
            EXPECT_TRUE(core.SendFarlinkRequest(
                ParseJson(R"({"version":1,"command":"get_site_list"})"), answer));
            EXPECT_EQ(answer, ParseJson(c.received));
            EXPECT_FALSE(core.CheckResponse(c.received, nullptr));
        }
    }

    // An otherwise usable answer nested deeper than the parser allows is unparsable like any
    // other; a long one is detailed by its whole text.
    const std::string deep =
        "{\"errno\":0,\"server\":" + std::string(1000, '[') + std::string(1000, ']') + "}";
    const std::string longText = std::string(4095, 'x') + "\xc3\xa9" + std::string(200000, 'y');
    const std::pair<std::string, std::string> answers[] = {{deep, deep}, {longText, longText}};
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

}  // namespace
