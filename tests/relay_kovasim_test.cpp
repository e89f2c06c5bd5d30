// kovasim's relay-directory role driven by kovacred resolve: the programs as a user runs them.
#include <stdlib.h>

#include <fstream>
#include <memory>
#include <string>

#include <gtest/gtest.h>
#include <json/value.h>

#include "platform/json_text.h"
#include "simlib/relay_sim.h"
#include "support/sim_process.h"
#include "support/temp_dir.h"

namespace kova_test {
namespace {

class KovasimRelayTest : public ::testing::Test {
  protected:
    void SetUp() override {
        global_ = kovasim::ProcessLoopbackAddress(40);
        site_ = kovasim::ProcessLoopbackAddress(41);
        Json::Value config;
        Json::Value &relay = config["relay"];
        relay["hosts"].append(global_);
        relay["hosts"].append(site_);
        relay["serverId"] = "SIM-42";
        Json::Value &directory = relay["directory"];
        directory["sites"].append(site_);
        Json::Value server;
        server["serverID"] = "SIM-42";
        server["sites"].append(site_);
        Json::Value nic;
        nic["ip"] = "127.0.0.1";
        server["interface"].append(nic);
        server["services"]["zon"]["port"] = "$http_port";
        server["services"]["zon_https"]["port"] = "$https_port";
        directory["servers"].append(server);
        std::ofstream(dir_.File("sim.json")) << kova::JsonToString(config);

        sim_ = std::make_unique<SimProcess>(dir_, "--config " + dir_.File("sim.json"), 2);
        if (sim_->RelayHosts().size() < 2 &&
            sim_->ErrorOutput().find("ermission denied") != std::string::npos) {
            GTEST_SKIP() << "binding port 80 on loopback is not permitted here: "
                         << sim_->ErrorOutput();
        }
        ASSERT_EQ(sim_->RelayHosts().size(), 2u) << sim_->ErrorOutput();
    }

    // Runs kovacred resolve with the directory hosts pointed at the simulator.
    int Resolve(const std::string &args, std::string *out) {
        std::string command = "kovacredential_farlink_global=" + global_ +
                              " kovacredential_farlink_server=" + site_ + " " +
                              ToolCommand(KOVACRED_BIN) + " --db " + dir_.File("unused.sqlite") +
                              " resolve " + args + " 2>&1";
        return RunCommand(command, out);
    }

    TempDir dir_;
    std::string global_;
    std::string site_;
    std::unique_ptr<SimProcess> sim_;
};

TEST_F(KovasimRelayTest, ListsItsDirectoryHostsOnPort80) {
    EXPECT_EQ(sim_->RelayHosts()[0], global_ + ":80");
    EXPECT_EQ(sim_->RelayHosts()[1], site_ + ":80");
}

TEST_F(KovasimRelayTest, ResolvesToTheHttpsListenerFirst) {
    std::string out;
    ASSERT_EQ(Resolve("SIM-42", &out), 0) << out;
    Json::Value candidate;
    ASSERT_TRUE(kova::JsonFromString(out, candidate)) << out;
    EXPECT_EQ(candidate["protocol"].asString(), "https");
    EXPECT_EQ(candidate["host"].asString(), "127.0.0.1");
    EXPECT_EQ(candidate["port"].asInt(), sim_->HttpsPort())
        << "the placeholder must have been replaced by the listener's port";
}

TEST_F(KovasimRelayTest, UnknownServerGivesTheErrorDocument) {
    std::string out;
    EXPECT_EQ(Resolve("NOBODY", &out), 23) << out;
    EXPECT_NE(out.find("\"code\":23"), std::string::npos) << out;
    EXPECT_NE(out.find("resolve failed (error 23)"), std::string::npos) << out;
}

TEST(KovasimRelayConfig, RejectsARelayRoleWithoutHosts) {
    TempDir dir;
    std::ofstream(dir.File("bad.json")) << "{\"relay\": {\"hosts\": []}}";
    std::string out;
    int status = RunCommand(
        ToolCommand(KOVASIM_BIN) + " --config " + dir.File("bad.json") + " --duration 1 2>&1",
        &out);
    EXPECT_EQ(status, 2);
    EXPECT_NE(out.find("relay: \"relay\" needs a non-empty array \"hosts\""), std::string::npos)
        << out;
}

}  // namespace
}  // namespace kova_test
