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

TEST(TraceTest, TracesHeadersAndDataWhenAsked) {
    kovasim::LoopbackServer server;
    server.Route("*", "/trace", [](const httplib::Request &, httplib::Response &res) {
        res.set_content("traced-body", "text/plain");
    });
    ASSERT_TRUE(server.Start()) << server.Error();
    for (bool traced : {false, true}) {
        SCOPED_TRACE(traced);
        kova_test::ClearLog();
        if (traced) {
            setenv("kovacredential_debug", "", 1);  // any value, even an empty one, turns it on
        }
        KOVA::CredRequest request;
        request.SetURL(server.BaseUrl() + "/trace");
        request.AddPostParam("field", "posted-value");
        const bool ok = request.Process(true, 0);
        unsetenv("kovacredential_debug");
        ASSERT_TRUE(ok);
        if (!traced) {
            EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
            continue;
        }
        for (const char *text :
             {"=> Send header\nPOST /trace HTTP/1.1", "=> Send data\nfield=posted-value",
              "<= Recv header\nHTTP/1.1 200 OK", "<= Recv data\ntraced-body", "=> TEXT\n"}) {
            EXPECT_TRUE(kova_test::LogHas(text)) << text << "\n" << kova_test::LogDump();
        }
        for (const auto &record : kova_test::LogRecords()) {
            EXPECT_EQ(record.rfind("cred_request:", 0), 0u) << record;
        }
    }
    // Types the trace does not name are skipped; SSL data is traced as such.
    kova_test::ClearLog();
    char data[] = "payload";
    EXPECT_EQ(KOVA::CredRequestPrivate::DebugCallback(nullptr, CURLINFO_END, data, 7, nullptr), 0);
    EXPECT_EQ(
        KOVA::CredRequestPrivate::DebugCallback(nullptr, CURLINFO_SSL_DATA_OUT, data, 7, nullptr),
        0);
    EXPECT_EQ(kova_test::LogRecords().size(), 1u) << kova_test::LogDump();
    EXPECT_TRUE(kova_test::LogHas("=> Send SSL data\npayload"));
}

}  // namespace
