// Transfer tracing: with kovacredential_debug set, every new transfer writes its traffic to the
// system log; without it, nothing is traced.
#include <stdlib.h>

#include <string>

#include <gtest/gtest.h>

#include "kovacredential/cred_request.h"
#include "request/cred_request_p.h"
#include "simlib/loopback_server.h"
#include "support/interpose.h"

namespace {

class TraceTest : public ::testing::Test {
  protected:
    void SetUp() override {
        server_.Route("*", "/trace", [](const httplib::Request &, httplib::Response &res) {
            res.set_content("traced-body", "text/plain");
        });
        ASSERT_TRUE(server_.Start()) << server_.Error();
        kova_test::ClearLog();
    }
    void TearDown() override { unsetenv("kovacredential_debug"); }

    bool Get() {
        KOVA::CredRequest request;
        request.SetURL(server_.BaseUrl() + "/trace");
        request.AddPostParam("field", "posted-value");
        return request.Process(true, 0);
    }

    kovasim::LoopbackServer server_;
};

TEST_F(TraceTest, TracesHeadersAndDataWhenAsked) {
    setenv("kovacredential_debug", "", 1);  // any value, even an empty one, turns it on
    ASSERT_TRUE(Get());
    EXPECT_TRUE(kova_test::LogHas("=> Send header\nPOST /trace HTTP/1.1")) << kova_test::LogDump();
    EXPECT_TRUE(kova_test::LogHas("=> Send data\nfield=posted-value"));
    EXPECT_TRUE(kova_test::LogHas("<= Recv header\nHTTP/1.1 200 OK"));
    EXPECT_TRUE(kova_test::LogHas("<= Recv data\ntraced-body"));
    EXPECT_TRUE(kova_test::LogHas("=> TEXT\n"));
    for (const auto &record : kova_test::LogRecords()) {
        EXPECT_EQ(record.rfind("cred_request:", 0), 0u) << record;
    }
}

TEST_F(TraceTest, StaysQuietWithoutTheVariable) {
    unsetenv("kovacredential_debug");
    ASSERT_TRUE(Get());
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

TEST_F(TraceTest, IgnoresUnknownTraceTypes) {
    char data[] = "payload";
    EXPECT_EQ(KOVA::CredRequestPrivate::DebugCallback(nullptr, CURLINFO_END, data, 7, nullptr), 0);
    EXPECT_EQ(
        KOVA::CredRequestPrivate::DebugCallback(nullptr, CURLINFO_SSL_DATA_OUT, data, 7, nullptr),
        0);
    ASSERT_EQ(kova_test::LogRecords().size(), 1u);
    EXPECT_NE(kova_test::LogRecords()[0].find("=> Send SSL data\npayload"), std::string::npos);
}

}  // namespace
