// kovacred request / probe against a loopback server.
#include <string>

#include <gtest/gtest.h>

#include "simlib/loopback_server.h"
#include "support/temp_dir.h"

namespace {

class CliTest : public ::testing::Test {
  protected:
    void SetUp() override {
        server_.Route("*", "/echo", [](const httplib::Request &req, httplib::Response &res) {
            std::string out = req.method + " " + req.target + " " + req.body;
            out += " H=" + req.get_header_value("X-Test");
            out += " C=" + req.get_header_value("Cookie");
            res.set_header("X-Answer", "42");
            res.set_content(out, "text/plain");
        });
        ASSERT_TRUE(server_.Start());
    }
    int Run(const std::string &args, std::string *out) {
        return kova_test::RunCommand(kova_test::ToolCommand(KOVACRED_BIN) + " " + args + " 2>&1",
                                     out);
    }
    kovasim::LoopbackServer server_;
    kova_test::TempDir dir_;
};

TEST_F(CliTest, RequestPrintsBody) {
    std::string out;
    EXPECT_EQ(
        Run("request " + server_.BaseUrl() + "/echo -q a=1 -d b=x -H 'X-Test: t' -b id=S", &out),
        0);
    EXPECT_EQ(out, "POST /echo?a=1 b=x H=t C=id=S\n");
}

TEST_F(CliTest, RequestWithHeadersAndRawBody) {
    std::string file = dir_.File("body.json");
    kova_test::RunCommand("printf '{\"k\":1}' > " + file);
    std::string out;
    EXPECT_EQ(
        Run("request --headers --body-file " + file + " " + server_.BaseUrl() + "/echo", &out), 0);
    EXPECT_NE(out.find("\"X-Answer\":\"42\""), std::string::npos) << out;
    EXPECT_NE(out.find("POST /echo {\"k\":1}"), std::string::npos) << out;
}

TEST_F(CliTest, FailureReportsTheErrorCode) {
    std::string out;
    int status = Run("request " + server_.BaseUrl() + "/missing", &out);
    EXPECT_EQ(status, 14) << out;
    EXPECT_EQ(out, "kovacred: request failed (error 14)\n");
}

TEST_F(CliTest, Probe) {
    std::string out;
    EXPECT_EQ(Run("probe " + server_.BaseUrl() + "/echo", &out), 0);
    EXPECT_EQ(out, "reachable\n");
    EXPECT_EQ(Run("probe " + server_.BaseUrl() + "/missing", &out), 5);
}

}  // namespace
