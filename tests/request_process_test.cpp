// Process outcomes against loopback servers: statuses, libcurl failures, attempts and pauses,
// stalls, cut-off bodies, response streams and header modes.
#include <gtest/gtest.h>

#include "kovacredential/cred_request.h"
#include "simlib/loopback_server.h"
#include "support/interpose.h"

namespace {

class ProcessTest : public ::testing::Test {
  protected:
    void SetUp() override {
        server_.Route("GET", "/ok", [](const httplib::Request &, httplib::Response &res) {
            res.set_content("{\"success\":true}", "application/json");
        });
        server_.Route("GET", "/status/(\\d+)",
                      [](const httplib::Request &req, httplib::Response &res) {
                          res.status = std::stoi(req.matches[1]);
                      });
        ASSERT_TRUE(server_.Start()) << server_.Error();
        kova_test::ClearLog();
    }
    std::string Url(const std::string &path) const { return server_.BaseUrl() + path; }
    kovasim::LoopbackServer server_;
};

TEST_F(ProcessTest, OkIsSuccess) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/ok")));
    EXPECT_TRUE(req.Process(true, 0));
    EXPECT_EQ(req.GetResponse(), "{\"success\":true}");
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_NONE);
}

TEST_F(ProcessTest, NotFound) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/status/404")));
    EXPECT_FALSE(req.Process(true, 0));
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_HTTP_CLIENT);
    EXPECT_TRUE(kova_test::LogHas("HTTP Error(404)")) << kova_test::LogDump();
}

}  // namespace
