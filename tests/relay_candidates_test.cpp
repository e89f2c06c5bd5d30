// Connection candidates: which addresses are built from the directory's answers, the order in
// which they are probed, what a probe must prove, and the whole look-ups by server id.
#include <stdlib.h>

#include <atomic>
#include <chrono>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>
#include <json/writer.h>

#include "kovacredential/cred_request_farlink.h"
#include "platform/json_text.h"
#include "relay_fixture.h"
#include "request/cred_request_farlink_p.h"
#include "simlib/relay_sim.h"

namespace {

using KOVA::CredRequestFarlink;
using KOVA::CredRequestFarlinkPrivate;

using kova_test::ParseJson;

Json::Value Candidate(const std::string &protocol, const std::string &host, int port) {
    Json::Value candidate(Json::objectValue);
    candidate["protocol"] = protocol;
    candidate["host"] = host;
    candidate["port"] = port;
    return candidate;
}

// WebAPI-side servers answering the probe as a given server; every probe is noted, by the
// target's name, in one list shared by all targets.
class ProbeTargets {
  public:
    // Starts target `name` on host:port (0 picks a free port) answering as `serverId`.
    // Returns the port, or -1 when it cannot be bound.
    int Start(const std::string &name, const std::string &host, int port,
              const std::string &serverId, bool https = false) {
        kovasim::LoopbackServer::Options options;
        options.host = host;
        options.port = port;
        options.https = https;
        auto server = std::make_unique<kovasim::LoopbackServer>(options);
        Json::Value answer(Json::objectValue);
        answer["ezid"] = kovasim::Md5Hex(serverId);
        answer["success"] = true;
        const std::string text = kova::JsonToString(answer);
        server->Route("*", "/+webman/pingpong\\.cgi",
                      [this, name, text](const httplib::Request &, httplib::Response &res) {
                          std::lock_guard<std::mutex> lock(mutex_);
                          order_.push_back(name);
                          res.set_content(text, "application/json");
                      });
        if (!server->Start()) {
            ADD_FAILURE() << "target " << name << ": " << server->Error();
            return -1;
        }
        servers_.push_back(std::move(server));
        return servers_.back()->Port();
    }

    std::vector<std::string> Order() const {
        std::lock_guard<std::mutex> lock(mutex_);
        return order_;
    }

  private:
    mutable std::mutex mutex_;
    std::vector<std::string> order_;
    std::vector<std::unique_ptr<kovasim::LoopbackServer>> servers_;
};

std::string Addr(int i) {
    return kovasim::ProcessLoopbackAddress(10 + i);
}

// Server information naming server S1 with the given LAN addresses and service port.
Json::Value LanInfo(const std::vector<std::string> &addresses, int port) {
    Json::Value info(Json::objectValue);
    info["server"]["serverID"] = "S1";
    info["server"]["interface"] = Json::Value(Json::arrayValue);
    for (const std::string &address : addresses) {
        info["server"]["interface"].append(Json::Value(Json::objectValue))["ip"] = address;
    }
    info["service"]["port"] = port;
    return info;
}

// Probe targets on loopback addresses of this process (any port, no privilege needed).
class RelayProbeTest : public ::testing::Test {
  protected:
    ProbeTargets targets_;
};

// Adds the directory: host 0 is the global directory, host 1 its only site.
class RelayCandidatesTest : public kova_test::RelayDirectoryTest {
  protected:
    RelayCandidatesTest() : RelayDirectoryTest(2) {}

    // One server known at the site, which is the only one in the site list.
    void Serve(const Json::Value &server) {
        Json::Value config(Json::objectValue);
        config["sites"].append(directory_.Host(1));
        config["servers"].append(server);
        ASSERT_TRUE(directory_.Sim().Configure(config));
    }

    std::vector<std::string> ServiceIdsAsked(const std::string &command) {
        std::vector<std::string> ids;
        for (const auto &hit : directory_.Sim().Hits(command)) {
            ids.push_back(hit.request["id"].asString());
        }
        return ids;
    }

    ProbeTargets targets_;
};

TEST_F(RelayCandidatesTest, DirectThenRelayCandidatesAreProbedInOrder) {
    // Every target but the relay's HTTPS endpoint answers as another server.
    const int port = targets_.Start("lan1", Addr(0), 0, "OTHER");
    ASSERT_GT(port, 0);
    ASSERT_EQ(targets_.Start("lan2", Addr(1), port, "OTHER"), port);
    const int extPort = targets_.Start("external", Addr(2), 0, "OTHER");
    ASSERT_GT(extPort, 0);
    ASSERT_EQ(targets_.Start("ddns", Addr(3), extPort, "OTHER"), extPort);
    const int relayPort = targets_.Start("relay_ip", Addr(4), 0, "OTHER");
    ASSERT_GT(relayPort, 0);
    ASSERT_EQ(targets_.Start("relay_dn", Addr(5), relayPort, "OTHER"), relayPort);
    const int httpsPort = targets_.Start("relay_https", Addr(6), 0, "S1", true);
    ASSERT_GT(httpsPort, 0);

    Json::Value server(Json::objectValue);
    server["serverID"] = "S1";
    server["interface"].append(ParseJson("{}"))["ip"] = Addr(0);
    server["interface"].append(ParseJson("{}"))["ip"] = Addr(1);
    server["external"]["ip"] = Addr(2);
    server["ddns"] = Addr(3);
    Json::Value &zon = server["services"]["zon"];
    zon["port"] = port;
    zon["ext_port"] = extPort;
    zon["relay_ip"] = Addr(4);
    zon["relay_dn"] = Addr(5);
    zon["relay_port"] = relayPort;
    zon["https_ip"] = Addr(6);
    zon["https_port"] = httpsPort;
    Serve(server);

    Json::Value candidate;
    Json::Value errors;
    ASSERT_TRUE(CredRequestFarlink::GetConnInfo("S1", candidate, &errors))
        << errors.toStyledString();
    // The relay's HTTPS endpoint is "https" although the service is plain.
    EXPECT_EQ(candidate, Candidate("https", Addr(6), httpsPort));
    EXPECT_EQ(targets_.Order(), (std::vector<std::string>{"lan1", "lan2", "external", "ddns",
                                                          "relay_ip", "relay_dn", "relay_https"}));
    EXPECT_EQ(ServiceIdsAsked("get_server_info"), (std::vector<std::string>{"zon_https", "zon"}));
    EXPECT_EQ(ServiceIdsAsked("request_tunnel"), (std::vector<std::string>{"zon"}));
    EXPECT_EQ(directory_.Sim().Hits("get_site_list").size(), 2u);
}

TEST_F(RelayProbeTest, LanPortAloneIgnoresExternalAndDdns) {
    const int port = targets_.Start("lan", Addr(0), 0, "OTHER");
    ASSERT_GT(port, 0);
    ASSERT_EQ(targets_.Start("external", Addr(2), port, "S1"), port);
    ASSERT_EQ(targets_.Start("ddns", Addr(3), port, "S1"), port);
    Json::Value info = LanInfo({Addr(0)}, port);
    info["server"]["external"]["ip"] = Addr(2);
    info["server"]["ddns"] = Addr(3);

    CredRequestFarlinkPrivate client(nullptr);
    Json::Value candidate = "untouched";
    EXPECT_FALSE(client.GetAvailableDirectConnInfo(info, candidate));
    EXPECT_TRUE(candidate.isNull());
    EXPECT_EQ(targets_.Order(), std::vector<std::string>{"lan"});
    EXPECT_EQ(client.GetError(), KOVA::CRED_REQ_ERR_NONE);
    EXPECT_EQ(client.GetServerIdMd5(), kovasim::Md5Hex("S1"));
}

TEST_F(RelayProbeTest, ExternalPortAloneSkipsTheLanAndServesExternalAndDdns) {
    const int extPort = targets_.Start("external", Addr(2), 0, "OTHER");
    ASSERT_GT(extPort, 0);
    ASSERT_EQ(targets_.Start("lan", Addr(0), extPort, "S1"), extPort);
    ASSERT_EQ(targets_.Start("ddns", Addr(3), extPort, "S1"), extPort);
    Json::Value info = LanInfo({Addr(0)}, 0);
    info["server"]["external"]["ip"] = Addr(2);
    info["server"]["ddns"] = Addr(3);
    info["service"]["ext_port"] = extPort;

    CredRequestFarlinkPrivate client(nullptr);
    client.SetServiceId("zon_portal");
    Json::Value candidate;
    ASSERT_TRUE(client.GetAvailableDirectConnInfo(info, candidate));
    EXPECT_EQ(candidate, Candidate("http", Addr(3), extPort));
    EXPECT_EQ(targets_.Order(), (std::vector<std::string>{"external", "ddns"}));
}

TEST_F(RelayCandidatesTest, NoPortMeans405WithoutProbesAndTheTunnelIsAsked) {
    const int relayPort = targets_.Start("relay", Addr(4), 0, "S1");
    ASSERT_GT(relayPort, 0);
    Json::Value server = ParseJson(R"({"serverID": "S1", "services": {"zon": {}}})");
    server["interface"].append(ParseJson("{}"))["ip"] = Addr(0);
    server["services"]["zon"]["relay_ip"] = Addr(4);
    server["services"]["zon"]["relay_port"] = relayPort;
    Serve(server);
    Json::Value info = ParseJson(R"({"server": {"serverID": "S1", "interface": [{"ip": "x"}]},
                                 "service": {"id": "zon"}})");

    CredRequestFarlinkPrivate core(nullptr);
    Json::Value candidate;
    EXPECT_FALSE(core.GetAvailableDirectConnInfo(info, candidate));
    EXPECT_EQ(core.GetErrors(), ParseJson(R"({"code":405})"));
    EXPECT_TRUE(targets_.Order().empty());

    CredRequestFarlink client;
    ASSERT_TRUE(client.GetAvailableConnInfo(info, candidate))
        << client.GetErrors().toStyledString();
    EXPECT_EQ(candidate, Candidate("http", Addr(4), relayPort));
    EXPECT_EQ(directory_.Sim().Hits("request_tunnel").size(), 1u);
    EXPECT_EQ(targets_.Order(), std::vector<std::string>{"relay"});
}

TEST_F(RelayProbeTest, UnusableServerInformationIs402) {
    CredRequestFarlink client;
    Json::Value candidate;
    for (const Json::Value &info :
         {Json::Value("text"), ParseJson(R"({"server": {}})"), ParseJson(R"({"service": {}})")}) {
        EXPECT_FALSE(client.GetAvailableConnInfo(info, candidate)) << info;
        EXPECT_EQ(client.GetError(), KOVA::CRED_REQ_ERR_NO_CONN_INFO) << info;
        EXPECT_EQ(client.GetErrors()["error"], info) << info;
    }
}

TEST_F(RelayProbeTest, DeadSilentAndImpostorHostsAreSkipped) {
    // Addr(1) accepts and never answers. The probe must hang up within its response time-out of
    // 5 s; without it the wait would last 10 s (the probe's default time-out) or more, and the
    // silent host would close first.
    std::atomic<int> probeHungUp{-1};
    kovasim::RawServer silent(
        [&probeHungUp](kovasim::RawServer::Connection &c) { probeHungUp = c.WaitForClose(9000); },
        Addr(1));
    ASSERT_TRUE(silent.Start());
    const int port = silent.Port();
    ASSERT_EQ(targets_.Start("impostor", Addr(2), port, "S2"), port);
    ASSERT_EQ(targets_.Start("real", Addr(3), port, "S1"), port);
    // Nothing listens on Addr(0) at that port: the connection is refused.
    Json::Value info = LanInfo({Addr(0), Addr(1), Addr(2), Addr(3)}, port);
    CredRequestFarlinkPrivate client(nullptr);
    Json::Value candidate;
    ASSERT_TRUE(client.GetAvailableDirectConnInfo(info, candidate));
    EXPECT_EQ(candidate, Candidate("http", Addr(3), port));
    EXPECT_EQ(targets_.Order(), (std::vector<std::string>{"impostor", "real"}));
    EXPECT_EQ(client.GetError(), KOVA::CRED_REQ_ERR_NONE);
    for (int i = 0; i < 500 && probeHungUp < 0; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    EXPECT_EQ(silent.ConnectionCount(), 1);
    EXPECT_EQ(probeHungUp, 1);
}

TEST_F(RelayProbeTest, RelayAddressComesBeforeItsNameOnTheSamePort) {
    kovasim::RefusedPort dead(Addr(4));
    ASSERT_GT(dead.Port(), 0);
    ASSERT_EQ(targets_.Start("relay_dn", Addr(5), dead.Port(), "S1"), dead.Port());
    Json::Value tunnel = ParseJson(R"({"errno": 0, "server": {"serverID": "S1"}, "service": {}})");
    tunnel["service"]["relay_ip"] = Addr(4);
    tunnel["service"]["relay_dn"] = Addr(5);
    tunnel["service"]["relay_port"] = dead.Port();
    CredRequestFarlinkPrivate client(nullptr);
    client.SetServiceId("zon_https");
    Json::Value candidate;
    // The service is "https" but the relay target speaks plain HTTP: nothing proves itself.
    EXPECT_FALSE(client.GetAvailableRelayConnInfo(tunnel, candidate));
    client.SetServiceId("zon");
    ASSERT_TRUE(client.GetAvailableRelayConnInfo(tunnel, candidate));
    EXPECT_EQ(candidate, Candidate("http", Addr(5), dead.Port()));
    EXPECT_EQ(targets_.Order(), std::vector<std::string>{"relay_dn"});
    EXPECT_FALSE(
        client.GetAvailableRelayConnInfo(ParseJson(R"({"server": {}, "service": {}})"), candidate));
}

TEST_F(RelayCandidatesTest, PlainServiceIsTheFallbackOfTheHttpsOne) {
    const int port = targets_.Start("plain", Addr(0), 0, "S1");
    ASSERT_GT(port, 0);
    Json::Value server =
        ParseJson(R"({"serverID": "S1", "services": {"zon_https": {}, "zon": {}}})");
    server["interface"].append(ParseJson("{}"))["ip"] = Addr(0);
    // The HTTPS service's port is refused and it has no relay (the tunnel is refused).
    kovasim::RefusedPort dead(Addr(0));
    server["services"]["zon_https"]["port"] = dead.Port();
    server["services"]["zon"]["port"] = port;
    Serve(server);

    Json::Value candidate;
    ASSERT_TRUE(CredRequestFarlink::GetConnInfo("S1", candidate, nullptr));
    EXPECT_EQ(candidate, Candidate("http", Addr(0), port));
    EXPECT_EQ(ServiceIdsAsked("get_server_info"), (std::vector<std::string>{"zon_https", "zon"}));
    EXPECT_EQ(ServiceIdsAsked("request_tunnel"), std::vector<std::string>{"zon_https"});
}

TEST_F(RelayCandidatesTest, PortalLookUpAsksForThePortalServices) {
    const int port = targets_.Start("portal", Addr(0), 0, "S1", true);
    ASSERT_GT(port, 0);
    Json::Value server = ParseJson(R"({"serverID": "S1", "services": {"zon_portal_https": {}}})");
    server["external"]["ip"] = Addr(0);
    server["services"]["zon_portal_https"]["ext_port"] = port;
    Serve(server);
    Json::Value candidate;
    ASSERT_TRUE(CredRequestFarlink::GetConnInfoPortal("S1", candidate, nullptr));
    EXPECT_EQ(candidate, Candidate("https", Addr(0), port));
    EXPECT_EQ(ServiceIdsAsked("get_server_info"), std::vector<std::string>{"zon_portal_https"});

    // A server without portal services: both portal ids are asked, and the errors say why.
    directory_.Sim().ClearHits();
    Json::Value errors;
    EXPECT_FALSE(CredRequestFarlink::GetConnInfoPortal("S2", candidate, &errors));
    EXPECT_EQ(ServiceIdsAsked("get_server_info"),
              (std::vector<std::string>{"zon_portal_https", "zon_portal"}));
    EXPECT_EQ(errors["code"], 23);
    EXPECT_EQ(ParseJson(errors["error"].asString())["errno"], 4);
}

TEST_F(RelayCandidatesTest, EmptyServerIdOrNoDirectoryFailsTheLookUp) {
    Json::Value candidate;
    Json::Value errors;
    EXPECT_FALSE(CredRequestFarlink::GetConnInfo("", candidate, &errors));
    EXPECT_EQ(errors, ParseJson(R"({"code":401})"));
    EXPECT_FALSE(CredRequestFarlink::GetConnInfoPortal("", candidate, nullptr));
    EXPECT_EQ(directory_.Sim().HitCount(), 0u);

    // Without a directory the last error is reported.
    setenv("kovacredential_farlink_global", kovasim::ProcessLoopbackAddress(9).c_str(), 1);
    EXPECT_FALSE(CredRequestFarlink::GetConnInfo("S1", candidate, &errors));
    EXPECT_EQ(errors, ParseJson(R"({"code":22,"error":{"command":"get_site_list","version":1}})"));
}

}  // namespace
