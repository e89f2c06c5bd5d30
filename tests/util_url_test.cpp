// URL helpers: splitting, building (IPv6 brackets, the "fld" scheme) and the probe.
#include <string>

#include <gtest/gtest.h>

#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_util.h"
#include "simlib/loopback_server.h"
#include "support/interpose.h"

namespace {

using KOVA::CredRequestUtil;

struct Parsed {
    bool ok;
    std::string scheme, host, port;
};

Parsed Parse(const std::string &url) {
    Parsed p{false, "s?", "h?", "p?"};
    p.ok = CredRequestUtil::ParseURL(url, p.scheme, p.host, p.port);
    return p;
}

TEST(ParseURL, EmptyLeavesOutputsUntouched) {
    Parsed p = Parse("");
    EXPECT_FALSE(p.ok);
    EXPECT_EQ(p.scheme, "s?");
    EXPECT_EQ(p.host, "h?");
    EXPECT_EQ(p.port, "p?");
}

// Every way a text is split: schemes and default ports, bracketed IPv6, no scheme, the
// case-sensitive prefix, the last colon winning, a query without a path, an unclosed bracket
// (which fails after the scheme's defaults were set).
TEST(ParseURL, SplitsEveryForm) {
    const struct {
        const char *url;
        bool ok;
        const char *scheme;
        const char *host;
        const char *port;
    } cases[] = {
        {"http://nas.example/webapi/query.cgi?x=1", true, "http", "nas.example", "80"},
        {"https://nas.example:5001/", true, "https", "nas.example", "5001"},
        {"https://nas.example", true, "https", "nas.example", "443"},
        {"https://[fe80::1]:5001/webapi", true, "https", "[fe80::1]", "5001"},
        {"http://[::1]/x", true, "http", "[::1]", "80"},
        {"https://[fe80::1", false, "https", "", "443"},
        {"nas.local", true, "http", "nas.local", "80"},
        {"nas.local:", true, "http", "nas.local", ""},
        {"HTTPS://h/", true, "http", "HTTPS", ""},
        {"http://u:p@h:81/", true, "http", "u:p@h", "81"},
        {"host?x=1", true, "http", "host?x=1", "80"},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.url);
        Parsed p = Parse(c.url);
        EXPECT_EQ(p.ok, c.ok);
        EXPECT_EQ(p.scheme, c.scheme);
        EXPECT_EQ(p.host, c.host);
        EXPECT_EQ(p.port, c.port);
    }
}

TEST(GetURL, AlwaysWritesThePort) {
    EXPECT_EQ(CredRequestUtil::GetURL("https", "a.b", 443, "webapi/query.cgi"),
              "https://a.b:443/webapi/query.cgi");
    EXPECT_EQ(CredRequestUtil::GetURL("http", "10.0.0.1", 5000, "/x"), "http://10.0.0.1:5000//x");
}

TEST(GetURL, FldMeansDirectHttps) {
    EXPECT_EQ(CredRequestUtil::GetURL("fld", "1.2.3.4", 443, "webapi/auth.cgi"),
              "https://1.2.3.4:443/direct/webapi/auth.cgi");
    EXPECT_EQ(CredRequestUtil::GetURL("FLD", "h", 1, "p"), "FLD://h:1/p");
}

TEST(GetURL, BracketsOnlyIPv6Literals) {
    EXPECT_EQ(CredRequestUtil::GetURL("http", "::1", 5000, "x"), "http://[::1]:5000/x");
    EXPECT_EQ(CredRequestUtil::GetURL("https", "fe80::1%eth0", 5001, ""),
              "https://[fe80::1%eth0]:5001/");
    EXPECT_EQ(CredRequestUtil::GetURL("http", "nas.local", 80, ""), "http://nas.local:80/");
}

TEST(GetURL, FourPartSetURLStoresIt) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL("http", "::1", 5000, "webapi/query.cgi"));
    EXPECT_EQ(req.GetURL(), "http://[::1]:5000/webapi/query.cgi");
}

TEST(TestURL, AnsweringServerAndFailures) {
    kovasim::LoopbackServer server;
    server.Route("GET", "/ok", [](const httplib::Request &, httplib::Response &res) {
        res.set_content("pong", "text/plain");
    });
    ASSERT_TRUE(server.Start());
    kova_test::ClearLog();
    CredRequestUtil::m_errCode = 0;
    EXPECT_TRUE(CredRequestUtil::TestURL(server.BaseUrl() + "/ok"));
    EXPECT_EQ(CredRequestUtil::m_errCode, 0);
    EXPECT_EQ(server.CountPath("/ok"), 1u);

    EXPECT_FALSE(CredRequestUtil::TestURL(server.BaseUrl() + "/missing"));
    EXPECT_EQ(CredRequestUtil::m_errCode, KOVA::CRED_REQ_ERR_QUERY_FAIL);
    EXPECT_TRUE(kova_test::LogHas("cred_request_util:"));
    EXPECT_TRUE(kova_test::LogHas("Cred Error:[" + server.BaseUrl() + "/missing][14]"))
        << kova_test::LogDump();
    // A password in the URL stays out of the log.
    std::string withPassword = server.BaseUrl() + "/missing";
    withPassword.insert(withPassword.find("://") + 3, "probe:S3cret@");
    EXPECT_FALSE(CredRequestUtil::TestURL(withPassword));
    EXPECT_TRUE(kova_test::LogHas("Cred Error:[http://probe:***@" + server.BaseUrl().substr(7) +
                                  "/missing][14]"))
        << kova_test::LogDump();
    EXPECT_FALSE(kova_test::LogHas("S3cret"));

    CredRequestUtil::m_errCode = 0;
    EXPECT_FALSE(CredRequestUtil::TestURL(""));
    EXPECT_EQ(CredRequestUtil::m_errCode, KOVA::CRED_REQ_ERR_QUERY_FAIL);
}

}  // namespace
