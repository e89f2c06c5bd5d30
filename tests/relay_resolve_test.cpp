// kovacred resolve end to end, its directory hosts given through the environment: a directory
// in this process, and kovasim's relay-directory role as a user runs it.
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "relay_fixture.h"
#include "simlib/relay_sim.h"
#include "support/sim_process.h"
#include "support/temp_dir.h"

namespace {

using kova_test::Candidate;
using kova_test::ParseJson;

// Runs kovacred resolve against the directory hosts `global` and `site`; returns its exit status
// and its standard output, joined by its standard error when `withErrors`.
int Resolve(const std::string &global, const std::string &site, const std::string &arguments,
            std::string *out, bool withErrors = false) {
    out->clear();
    return kova_test::RunCommand("kovacredential_farlink_global=" + global +
                                     " kovacredential_farlink_server=" + site + " " +
                                     kova_test::ToolCommand(KOVACRED_BIN) + " resolve " +
                                     arguments + (withErrors ? " 2>&1" : " 2>/dev/null"),
                                 out);
}

class RelayResolveTest : public kova_test::RelayDirectoryTest {
  protected:
    RelayResolveTest() : RelayDirectoryTest(2) {}

    void SetUp() override {
        RelayDirectoryTest::SetUp();
        if (IsSkipped() || HasFatalFailure()) {
            return;
        }
        kovasim::LoopbackServer::Options options;
        options.host = kovasim::ProcessLoopbackAddress(10);
        target_ = std::make_unique<kovasim::LoopbackServer>(options);
        kovasim::InstallPingPong(*target_, "S1");
        ASSERT_TRUE(target_->Start()) << target_->Error();
        Serve(ParseJson(R"({"serverID": "S1", "external": {"ip": "$0"}, "interface": [{"ip": "$0"}],
                            "services": {"zon": {"ext_port": $1}, "zon_portal": {"port": $1}}})",
                        {options.host, std::to_string(target_->Port())}));
    }

    int Resolve(const std::string &arguments, std::string *out) {
        return ::Resolve(Host(0), Host(1), arguments, out);
    }

    std::unique_ptr<kovasim::LoopbackServer> target_;
};

TEST_F(RelayResolveTest, PrintsTheCandidateOrTheErrorDocument) {
    std::string out;
    ASSERT_EQ(Resolve("--json S1", &out), 0) << out;
    EXPECT_EQ(ParseJson(out), Candidate("http", target_->Host(), target_->Port()));

    // Without --json, one line saying how the server is reached: the LAN interfaces have no
    // port for this service, so it is the external address.
    ASSERT_EQ(Resolve("S1", &out), 0) << out;
    EXPECT_EQ(out, "S1  http://" + target_->Host() + ":" + std::to_string(target_->Port()) +
                       "  (external)\n");

    Sim().ClearHits();
    ASSERT_EQ(Resolve("--json S1 --portal", &out), 0) << out;
    EXPECT_EQ(ParseJson(out)["port"], target_->Port());
    EXPECT_EQ(ServiceIdsAsked("get_server_info"),
              (std::vector<std::string>{"zon_portal_https", "zon_portal"}));

    // A failure prints the error document and exits with its code.
    Sim().ClearHits();
    EXPECT_EQ(Resolve("--json UNKNOWN", &out), 23) << out;  // the directory's error
    Json::Value errors = ParseJson(out);
    EXPECT_EQ(errors["code"], 23);
    EXPECT_EQ(ParseJson(errors["error"].asString())["errno"], 4);

    EXPECT_EQ(Resolve("--json ''", &out), 1) << out;  // 401 does not fit an exit status
    EXPECT_EQ(ParseJson(out), ParseJson(R"({"code":401})"));
    EXPECT_EQ(Sim().Hits("get_site_list").size(), 2u);
}

// kovasim's relay role, configured as a user would, serves its directory hosts on port 80 and
// leads to its own HTTPS listener (the port placeholders replaced by the listeners' ports).
TEST(KovasimRelayTest, ResolvesToItsOwnListeners) {
    const std::string global = kovasim::ProcessLoopbackAddress(40);
    const std::string site = kovasim::ProcessLoopbackAddress(41);
    kova_test::TempDir dir;
    std::ofstream(dir.File("sim.json")) << kova_test::Fill(
        R"({"relay": {"hosts": ["$0", "$1"], "serverId": "SIM-42", "directory": {"sites": ["$1"],
            "servers": [{"serverID": "SIM-42", "sites": ["$1"], "interface": [{"ip": "127.0.0.1"}],
                         "services": {"zon": {"port": "$http_port"},
                                      "zon_https": {"port": "$https_port"}}}]}}})",
        {global, site});
    kova_test::SimProcess sim(dir, "--config " + dir.File("sim.json"), 2);
    if (sim.RelayHosts().size() < 2 &&
        sim.ErrorOutput().find("ermission denied") != std::string::npos) {
        GTEST_SKIP() << "binding port 80 on loopback is not permitted here: " << sim.ErrorOutput();
    }
    ASSERT_EQ(sim.RelayHosts(), (std::vector<std::string>{global + ":80", site + ":80"}))
        << sim.ErrorOutput();

    std::string out;
    ASSERT_EQ(Resolve(global, site, "SIM-42", &out, true), 0) << out;
    EXPECT_EQ(out, "SIM-42  https://127.0.0.1:" + std::to_string(sim.HttpsPort()) + "  (LAN)\n");
    ASSERT_EQ(Resolve(global, site, "--json SIM-42", &out), 0) << out;
    EXPECT_EQ(ParseJson(out), Candidate("https", "127.0.0.1", sim.HttpsPort()));
    EXPECT_EQ(Resolve(global, site, "NOBODY", &out, true), 23) << out;
    EXPECT_EQ(out,
              "kovacred: resolve NOBODY failed (error 23 CRED_REQ_ERR_SERVER_ERRNO: the relay "
              "directory answered with an error)\n");
}

TEST(KovasimRelayTest, RejectsARelayRoleWithoutHosts) {
    kova_test::TempDir dir;
    std::ofstream(dir.File("bad.json")) << "{\"relay\": {\"hosts\": []}}";
    std::string out;
    EXPECT_EQ(kova_test::RunCommand(kova_test::ToolCommand(KOVASIM_BIN) + " --config " +
                                        dir.File("bad.json") + " --duration 1 2>&1",
                                    &out),
              2);
    EXPECT_NE(out.find("relay: \"relay\" needs a non-empty array \"hosts\""), std::string::npos)
        << out;
}

}  // namespace
