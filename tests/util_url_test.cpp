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

TEST(ParseURL, SchemesAndDefaultPorts) {
    Parsed a = Parse("http://nas.example/webapi/query.cgi?x=1");
    EXPECT_TRUE(a.ok);
    EXPECT_EQ(a.scheme, "http");
    EXPECT_EQ(a.host, "nas.example");
    EXPECT_EQ(a.port, "80");
    Parsed b = Parse("https://nas.example:5001/");
    EXPECT_TRUE(b.ok);
    EXPECT_EQ(b.scheme, "https");
    EXPECT_EQ(b.host, "nas.example");
    EXPECT_EQ(b.port, "5001");
    Parsed c = Parse("https://nas.example");
    EXPECT_EQ(c.port, "443");
}

TEST(ParseURL, BracketedIPv6) {
    Parsed p = Parse("https://[fe80::1]:5001/webapi");
    EXPECT_TRUE(p.ok);
    EXPECT_EQ(p.scheme, "https");
    EXPECT_EQ(p.host, "[fe80::1]");
    EXPECT_EQ(p.port, "5001");
    Parsed noPort = Parse("http://[::1]/x");
    EXPECT_TRUE(noPort.ok);
    EXPECT_EQ(noPort.host, "[::1]");
    EXPECT_EQ(noPort.port, "80");
}

TEST(ParseURL, UnclosedBracketFailsAfterSchemeDefaults) {
    Parsed p = Parse("https://[fe80::1");
    EXPECT_FALSE(p.ok);
    EXPECT_EQ(p.scheme, "https");
    EXPECT_EQ(p.port, "443");
    EXPECT_EQ(p.host, "");
}

TEST(ParseURL, NoSchemeIsPlainHttp) {
    Parsed p = Parse("nas.local");
    EXPECT_TRUE(p.ok);
    EXPECT_EQ(p.scheme, "http");
    EXPECT_EQ(p.host, "nas.local");
    EXPECT_EQ(p.port, "80");
    Parsed colon = Parse("nas.local:");
    EXPECT_TRUE(colon.ok);
    EXPECT_EQ(colon.host, "nas.local");
    EXPECT_EQ(colon.port, "");
}

TEST(ParseURL, SchemePrefixIsCaseSensitive) {
    Parsed p = Parse("HTTPS://h/");
    EXPECT_TRUE(p.ok);
    EXPECT_EQ(p.scheme, "http");
    EXPECT_EQ(p.host, "HTTPS");
    EXPECT_EQ(p.port, "");
}

TEST(ParseURL, LastColonWinsAndUserInfoIsNotRecognised) {
    Parsed p = Parse("http://u:p@h:81/");
    EXPECT_TRUE(p.ok);
    EXPECT_EQ(p.host, "u:p@h");
    EXPECT_EQ(p.port, "81");
}

TEST(ParseURL, QueryWithoutPathStaysInHost) {
    Parsed p = Parse("host?x=1");
    EXPECT_TRUE(p.ok);
    EXPECT_EQ(p.host, "host?x=1");
    EXPECT_EQ(p.port, "80");
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

    CredRequestUtil::m_errCode = 0;
    EXPECT_FALSE(CredRequestUtil::TestURL(""));
    EXPECT_EQ(CredRequestUtil::m_errCode, KOVA::CRED_REQ_ERR_QUERY_FAIL);
}

}  // namespace
