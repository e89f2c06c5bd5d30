// Connection candidates: which addresses are built from the directory's answers, the order in
// which they are probed, what a probe must prove, and the whole look-ups by server id.
#include <stdlib.h>

#include <atomic>
#include <chrono>
#include <future>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "kovacredential/cred_request_farlink.h"
#include "platform/json_text.h"
#include "relay_fixture.h"
#include "request/cred_request_farlink_p.h"
#include "simlib/relay_sim.h"

namespace {

using KOVA::CredRequestFarlink;
using KOVA::CredRequestFarlinkPrivate;
using kova_test::Candidate;
using kova_test::ParseJson;
using Names = std::vector<std::string>;

// WebAPI-side servers answering the probe as a given server; every probe is noted, by the
// target's name, in one list shared by all targets.
class ProbeTargets {
  public:
    // Starts target `name` on host:port (0 picks a free port) answering as `serverId`.
    // Returns the port, or -1 (reported as a failure) when it cannot be bound.
    int Start(const std::string &name, const std::string &host, int port,
              const std::string &serverId, bool https = false) {
        kovasim::LoopbackServer::Options options;
        options.host = host;
        options.port = port;
        options.https = https;
        auto server = std::make_unique<kovasim::LoopbackServer>(options);
        const std::string text =
            R"({"ezid":")" + kovasim::Md5Hex(serverId) + R"(","success":true})";
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

    Names Order() const {
        std::lock_guard<std::mutex> lock(mutex_);
        return order_;
    }

  private:
    mutable std::mutex mutex_;
    Names order_;
    std::vector<std::unique_ptr<kovasim::LoopbackServer>> servers_;
};

std::string Addr(int i) {
    return kovasim::ProcessLoopbackAddress(10 + i);
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

    ProbeTargets targets_;
};

TEST_F(RelayCandidatesTest, DirectThenRelayCandidatesAreProbedInOrder) {
    // Every target but the relay's HTTPS endpoint answers as another server.
    const int port = targets_.Start("lan1", Addr(0), 0, "OTHER");
    targets_.Start("lan2", Addr(1), port, "OTHER");
    const int extPort = targets_.Start("external", Addr(2), 0, "OTHER");
    targets_.Start("ddns", Addr(3), extPort, "OTHER");
    const int relayPort = targets_.Start("relay_ip", Addr(4), 0, "OTHER");
    targets_.Start("relay_dn", Addr(5), relayPort, "OTHER");
    const int httpsPort = targets_.Start("relay_https", Addr(6), 0, "S1", true);
    Serve(ParseJson(
        R"({"serverID": "S1", "interface": [{"ip": "$0"}, {"ip": "$1"}],
        "external": {"ip": "$2"}, "ddns": "$3", "services": {"zon": {"port": $7, "ext_port": $8,
        "relay_ip": "$4", "relay_dn": "$5", "relay_port": $9, "https_ip": "$6", "https_port": $10}}})",
        {Addr(0), Addr(1), Addr(2), Addr(3), Addr(4), Addr(5), Addr(6), std::to_string(port),
         std::to_string(extPort), std::to_string(relayPort), std::to_string(httpsPort)}));

    Json::Value candidate;
    Json::Value errors;
    ASSERT_TRUE(CredRequestFarlink::GetConnInfo("S1", candidate, &errors))
        << errors.toStyledString();
    // The relay's HTTPS endpoint is "https" although the service is plain.
    EXPECT_EQ(candidate, Candidate("https", Addr(6), httpsPort));
    EXPECT_EQ(targets_.Order(),
              (Names{"lan1", "lan2", "external", "ddns", "relay_ip", "relay_dn", "relay_https"}));
    EXPECT_EQ(ServiceIdsAsked("get_server_info"), (Names{"zon_https", "zon"}));
    EXPECT_EQ(ServiceIdsAsked("request_tunnel"), Names{"zon"});
    EXPECT_EQ(Sim().Hits("get_site_list").size(), 2u);
}

// The LAN addresses are probed only on the service's port, the external address and the DDNS
// name only on its external port. The first address probed answers as another server.
TEST_F(RelayProbeTest, EachPortReachesItsOwnAddressesAndIncompleteInformationIs402) {
    for (const bool external : {false, true}) {
        SCOPED_TRACE(external ? "external port" : "LAN port");
        ProbeTargets targets;
        const int port =
            targets.Start(external ? "external" : "lan", Addr(external ? 2 : 0), 0, "OTHER");
        targets.Start(external ? "lan" : "external", Addr(external ? 0 : 2), port, "S1");
        targets.Start("ddns", Addr(3), port, "S1");
        const std::string p = std::to_string(port);
        const Json::Value info = ParseJson(
            R"({"server": {"serverID": "S1", "interface": [{"ip": "$0"}], "external": {"ip": "$1"},
                "ddns": "$2"}, "service": {$3}})",
            {Addr(0), Addr(2), Addr(3),
             external ? R"("port": 0, "ext_port": )" + p : R"("port": )" + p});

        CredRequestFarlinkPrivate client(nullptr);
        client.SetServiceId(external ? "zon_portal" : "zon");
        Json::Value candidate = "untouched";
        EXPECT_EQ(client.GetAvailableDirectConnInfo(info, candidate), external);
        EXPECT_EQ(candidate, external ? Candidate("http", Addr(3), port) : Json::Value());
        EXPECT_EQ(targets.Order(), (external ? Names{"external", "ddns"} : Names{"lan"}));
        EXPECT_EQ(client.GetError(), KOVA::CRED_REQ_ERR_NONE);
        EXPECT_EQ(client.GetServerIdMd5(), kovasim::Md5Hex("S1"));
    }
    // Server information without both parts is 402.
    CredRequestFarlink client;
    Json::Value candidate;
    for (const Json::Value &info :
         {Json::Value("text"), ParseJson(R"({"server": {}})"), ParseJson(R"({"service": {}})")}) {
        EXPECT_FALSE(client.GetAvailableConnInfo(info, candidate)) << info;
        EXPECT_EQ(client.GetError(), KOVA::CRED_REQ_ERR_NO_CONN_INFO) << info;
        EXPECT_EQ(client.GetErrors()["error"], info) << info;
    }
}

TEST_F(RelayCandidatesTest, NoPortMeans405WithoutProbesAndTheTunnelIsAsked) {
    const int relayPort = targets_.Start("relay", Addr(4), 0, "S1");
    Serve(ParseJson(R"({"serverID": "S1", "interface": [{"ip": "$0"}],
                        "services": {"zon": {"relay_ip": "$1", "relay_port": $2}}})",
                    {Addr(0), Addr(4), std::to_string(relayPort)}));
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
    EXPECT_EQ(Sim().Hits("request_tunnel").size(), 1u);
    EXPECT_EQ(targets_.Order(), Names{"relay"});
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
    targets_.Start("impostor", Addr(2), port, "S2");
    targets_.Start("real", Addr(3), port, "S1");
    // Nothing listens on Addr(0) at that port: the connection is refused.
    const Json::Value info = ParseJson(
        R"({"server": {"serverID": "S1", "interface": [{"ip": "$0"}, {"ip": "$1"}, {"ip": "$2"},
            {"ip": "$3"}]}, "service": {"port": $4}})",
        {Addr(0), Addr(1), Addr(2), Addr(3), std::to_string(port)});
    CredRequestFarlinkPrivate client(nullptr);
    Json::Value candidate;
    ASSERT_TRUE(client.GetAvailableDirectConnInfo(info, candidate));
    EXPECT_EQ(candidate, Candidate("http", Addr(3), port));
    EXPECT_EQ(targets_.Order(), (Names{"impostor", "real"}));
    EXPECT_EQ(client.GetError(), KOVA::CRED_REQ_ERR_NONE);
    for (int i = 0; i < 500 && probeHungUp < 0; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    EXPECT_EQ(silent.ConnectionCount(), 1);
    EXPECT_EQ(probeHungUp, 1);
}

// With a deadline, hosts that accept and never answer end each operation as soon as the
// deadline has passed, with error 10 and nothing tried after it: six LAN addresses (probes of
// 5 s each without a deadline), a relay endpoint (probed with libcurl's 120 s), and a directory
// host asked without a response time-out. Each call runs on a thread of its own so that the
// test's wait for it is bounded.
TEST_F(RelayCandidatesTest, DeadlineEndsEachOperationOverSilentHosts) {
    const auto stall = [](kovasim::RawServer::Connection &c) { c.WaitForClose(30000); };
    kovasim::RawServer silent(stall, Addr(1));
    ASSERT_TRUE(silent.Start());
    const std::string port = std::to_string(silent.Port());
    const std::string interfaces = kova_test::Fill(
        R"([{"ip": "$0"}, {"ip": "$0"}, {"ip": "$0"}, {"ip": "$0"}, {"ip": "$0"}, {"ip": "$0"}])",
        {Addr(1)});
    // The HTTPS service has no port, so its look-up goes on to the (silent) relay.
    Serve(ParseJson(R"({"serverID": "S1", "interface": $0, "services": {
                        "zon_https": {"relay_ip": "$1", "relay_port": $2}, "zon": {"port": $2}}})",
                    {interfaces, Addr(1), port}));
    const auto finishes = [](std::future<bool> &call) {
        return call.wait_for(std::chrono::seconds(20)) == std::future_status::ready;
    };

    CredRequestFarlink client;
    client.SetTotalTimeout(1500);
    Json::Value candidate;
    const Json::Value info =
        ParseJson(R"({"server": {"serverID": "S1", "interface": $0}, "service": {"port": $1}})",
                  {interfaces, port});
    auto probes = std::async(std::launch::async,
                             [&] { return client.GetAvailableConnInfo(info, candidate); });
    ASSERT_TRUE(finishes(probes));
    EXPECT_FALSE(probes.get());
    EXPECT_EQ(client.GetErrors(), ParseJson(R"({"code":10})"));
    EXPECT_TRUE(Sim().Hits("request_tunnel").empty());
    EXPECT_EQ(silent.ConnectionCount(), 1);
    // Each operation has the whole deadline again.
    EXPECT_TRUE(client.GetSiteList(candidate));

    Json::Value errors;
    auto lookUp = std::async(std::launch::async, [&] {
        return CredRequestFarlink::GetConnInfo("S1", candidate, &errors, 1500);
    });
    ASSERT_TRUE(finishes(lookUp));
    EXPECT_FALSE(lookUp.get());
    EXPECT_EQ(errors, ParseJson(R"({"code":10})"));
    EXPECT_EQ(ServiceIdsAsked("get_server_info"), Names{"zon_https"});
    EXPECT_EQ(ServiceIdsAsked("request_tunnel"), Names{"zon_https"});
    EXPECT_EQ(silent.ConnectionCount(), 2);

    kovasim::RawServer silentDirectory(stall, Addr(2), true, 80);
    ASSERT_TRUE(silentDirectory.Start());
    client.SetServerName(Addr(2));
    client.SetServerId("S1");
    client.SetTimeout(0);
    auto directory =
        std::async(std::launch::async, [&] { return client.GetServerInfo(candidate); });
    ASSERT_TRUE(finishes(directory));
    EXPECT_FALSE(directory.get());
    EXPECT_EQ(client.GetErrors(), ParseJson(R"({"code":10})"));
    EXPECT_EQ(silentDirectory.ConnectionCount(), 1);
}

TEST_F(RelayProbeTest, RelayAddressComesBeforeItsNameOnTheSamePort) {
    kovasim::RefusedPort dead(Addr(4));
    ASSERT_GT(dead.Port(), 0);
    targets_.Start("relay_dn", Addr(5), dead.Port(), "S1");
    const Json::Value tunnel = ParseJson(R"({"errno": 0, "server": {"serverID": "S1"},
        "service": {"relay_ip": "$0", "relay_dn": "$1", "relay_port": $2}})",
                                         {Addr(4), Addr(5), std::to_string(dead.Port())});
    CredRequestFarlinkPrivate client(nullptr);
    client.SetServiceId("zon_https");
    Json::Value candidate;
    // The service is "https" but the relay target speaks plain HTTP: nothing proves itself.
    EXPECT_FALSE(client.GetAvailableRelayConnInfo(tunnel, candidate));
    client.SetServiceId("zon");
    ASSERT_TRUE(client.GetAvailableRelayConnInfo(tunnel, candidate));
    EXPECT_EQ(candidate, Candidate("http", Addr(5), dead.Port()));
    EXPECT_EQ(targets_.Order(), Names{"relay_dn"});
    EXPECT_FALSE(
        client.GetAvailableRelayConnInfo(ParseJson(R"({"server": {}, "service": {}})"), candidate));
}

TEST_F(RelayCandidatesTest, PlainServiceIsTheFallbackOfTheHttpsOne) {
    const int port = targets_.Start("plain", Addr(0), 0, "S1");
    // The HTTPS service's port is refused and it has no relay (the tunnel is refused).
    kovasim::RefusedPort dead(Addr(0));
    Serve(ParseJson(R"({"serverID": "S1", "interface": [{"ip": "$0"}],
                        "services": {"zon_https": {"port": $1}, "zon": {"port": $2}}})",
                    {Addr(0), std::to_string(dead.Port()), std::to_string(port)}));

    Json::Value candidate;
    ASSERT_TRUE(CredRequestFarlink::GetConnInfo("S1", candidate, nullptr));
    EXPECT_EQ(candidate, Candidate("http", Addr(0), port));
    EXPECT_EQ(ServiceIdsAsked("get_server_info"), (Names{"zon_https", "zon"}));
    EXPECT_EQ(ServiceIdsAsked("request_tunnel"), Names{"zon_https"});
}

TEST_F(RelayCandidatesTest, PortalLookUpAsksForThePortalServices) {
    const int port = targets_.Start("portal", Addr(0), 0, "S1", true);
    Serve(ParseJson(R"({"serverID": "S1", "external": {"ip": "$0"},
                        "services": {"zon_portal_https": {"ext_port": $1}}})",
                    {Addr(0), std::to_string(port)}));
    Json::Value candidate;
    ASSERT_TRUE(CredRequestFarlink::GetConnInfoPortal("S1", candidate, nullptr));
    EXPECT_EQ(candidate, Candidate("https", Addr(0), port));
    EXPECT_EQ(ServiceIdsAsked("get_server_info"), Names{"zon_portal_https"});

    // A server without portal services: both portal ids are asked, and the errors say why.
    Sim().ClearHits();
    Json::Value errors;
    EXPECT_FALSE(CredRequestFarlink::GetConnInfoPortal("S2", candidate, &errors));
    EXPECT_EQ(ServiceIdsAsked("get_server_info"), (Names{"zon_portal_https", "zon_portal"}));
    EXPECT_EQ(errors["code"], 23);
    EXPECT_EQ(ParseJson(errors["error"].asString())["errno"], 4);
}

TEST_F(RelayCandidatesTest, EmptyServerIdOrNoDirectoryFailsTheLookUp) {
    Json::Value candidate;
    Json::Value errors;
    EXPECT_FALSE(CredRequestFarlink::GetConnInfo("", candidate, &errors));
    EXPECT_EQ(errors, ParseJson(R"({"code":401})"));
    EXPECT_FALSE(CredRequestFarlink::GetConnInfoPortal("", candidate, nullptr));
    EXPECT_EQ(Sim().HitCount(), 0u);

    // Without a directory the last error is reported.
    setenv("kovacredential_farlink_global", kovasim::ProcessLoopbackAddress(9).c_str(), 1);
    EXPECT_FALSE(CredRequestFarlink::GetConnInfo("S1", candidate, &errors));
    EXPECT_EQ(errors, ParseJson(R"({"code":22,"error":{"command":"get_site_list","version":1}})"));
}

}  // namespace
