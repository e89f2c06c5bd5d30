// kovacred resolve end to end: the tool, pointed at an in-process directory through the
// environment, prints the candidate or the error document.
#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "relay_fixture.h"
#include "simlib/relay_sim.h"
#include "support/temp_dir.h"

namespace {

using kova_test::ParseJson;

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

        Json::Value config(Json::objectValue);
        config["sites"].append(directory_.Host(1));
        Json::Value &server = config["servers"].append(Json::Value(Json::objectValue));
        server["serverID"] = "S1";
        server["external"]["ip"] = options.host;
        server["services"]["zon"]["ext_port"] = target_->Port();
        server["services"]["zon_portal"]["port"] = target_->Port();
        server["interface"].append(Json::Value(Json::objectValue))["ip"] = options.host;
        ASSERT_TRUE(directory_.Sim().Configure(config));
    }

    // Runs kovacred resolve with the directory hosts in its environment; returns its exit
    // status and its standard output.
    int Resolve(const std::string &arguments, std::string *out) {
        std::string command = "kovacredential_farlink_global=" + directory_.Host(0) +
                              " kovacredential_farlink_server=" + directory_.Host(1) + " " +
                              kova_test::ToolCommand(KOVACRED_BIN) + " resolve " + arguments +
                              " 2>/dev/null";
        out->clear();
        return kova_test::RunCommand(command, out);
    }

    std::unique_ptr<kovasim::LoopbackServer> target_;
};

TEST_F(RelayResolveTest, PrintsTheCandidate) {
    std::string out;
    ASSERT_EQ(Resolve("S1", &out), 0) << out;
    Json::Value expected(Json::objectValue);
    expected["protocol"] = "http";
    expected["host"] = target_->Host();
    expected["port"] = target_->Port();
    EXPECT_EQ(ParseJson(out), expected);
}

TEST_F(RelayResolveTest, PortalFlagLooksUpThePortalService) {
    std::string out;
    ASSERT_EQ(Resolve("S1 --portal", &out), 0) << out;
    EXPECT_EQ(ParseJson(out)["port"], target_->Port());
    std::vector<std::string> ids;
    for (const auto &hit : directory_.Sim().Hits("get_server_info")) {
        ids.push_back(hit.request["id"].asString());
    }
    EXPECT_EQ(ids, (std::vector<std::string>{"zon_portal_https", "zon_portal"}));
}

TEST_F(RelayResolveTest, FailurePrintsTheErrorDocumentAndExitsNonZero) {
    std::string out;
    EXPECT_EQ(Resolve("UNKNOWN", &out), 23) << out;  // the directory's error
    Json::Value errors = ParseJson(out);
    EXPECT_EQ(errors["code"], 23);
    EXPECT_EQ(ParseJson(errors["error"].asString())["errno"], 4);

    EXPECT_EQ(Resolve("''", &out), 1) << out;  // 401 does not fit an exit status
    EXPECT_EQ(ParseJson(out), ParseJson(R"({"code":401})"));
    EXPECT_EQ(directory_.Sim().Hits("get_site_list").size(), 2u);
}

}  // namespace
