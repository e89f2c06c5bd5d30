// The WebAPI description cache against the in-process simulator and against servers that
// answer badly.
#include <set>
#include <string>

#include "webapi_fixture.h"

namespace kova_test {
namespace {

using KOVA::CredRequestUtil;

class WebApiDescTest : public WebApiTest {
  protected:
    // A credential of a server whose discovery CGI answers with `body` only.
    static std::unique_ptr<kovasim::LoopbackServer> FixedQuery(const std::string &body,
                                                               KOVA_CRED &cred, int id) {
        auto server = FixedAnswer("/webapi/query.cgi", body, false);
        cred = Cred(server->Port());
        cred.id = id;
        return server;
    }
};

// Each credential is described once, by one POST with the three standard parameters only, and
// answered from the cache (by record or by id) until its description is removed.
TEST_F(WebApiDescTest, DiscoversOncePerCredentialAndAnswersFromTheCache) {
    KOVA_CRED a = StoredCred("admin");
    KOVA_CRED b = StoredCred("otpuser");
    size_t before = Sim().QueryHits();

    EXPECT_EQ("entry.cgi", CredRequestUtil::GetWebAPIPath(&a, "KOVA.Demo.Echo"));
    EXPECT_EQ(before + 1, Sim().QueryHits());
    EXPECT_TRUE(CredRequestUtil::IsCredIdCached(a.id));
    EXPECT_FALSE(CredRequestUtil::IsCredIdCached(b.id));
    EXPECT_EQ("upload.cgi", CredRequestUtil::GetWebAPIPath(&a, "KOVA.Demo.Upload"));
    EXPECT_EQ("JSON", CredRequestUtil::GetWebAPIRequestFormat(&a, "KOVA.Demo.Json"));
    EXPECT_EQ("", CredRequestUtil::GetWebAPIRequestFormat(&a, "KOVA.Demo.Echo"));
    EXPECT_EQ("auth.cgi", CredRequestUtil::GetWebAPIPath(static_cast<long>(a.id), "KOVA.API.Auth"));
    EXPECT_EQ("JSON",
              CredRequestUtil::GetWebAPIRequestFormat(static_cast<long>(a.id), "KOVA.Demo.Json"));
    EXPECT_EQ(before + 1, Sim().QueryHits());
    ASSERT_EQ(1u, Server().CountPath("/webapi/query.cgi"));
    kovasim::RecordedRequest query = Server().Requests().front();
    EXPECT_EQ("POST", query.method);
    EXPECT_EQ("KOVA.API.Info", query.Param("api"));
    EXPECT_EQ("1", query.Param("version"));
    EXPECT_EQ("query", query.Param("method"));
    EXPECT_EQ((std::set<std::string>{"api", "method", "version"}), ParamNames(query));
    const Json::Value &entry = CredRequestUtil::m_jsData["webapiDesc"][std::to_string(a.id)];
    EXPECT_EQ("delay.cgi", entry["KOVA.Demo.Delay"]["path"].asString());
    EXPECT_EQ(1, entry["KOVA.Demo.Delay"]["minVersion"].asInt());

    // A second credential of the same server has its own entry.
    EXPECT_EQ("entry.cgi", CredRequestUtil::GetWebAPIPath(&b, "KOVA.Demo.Echo"));
    EXPECT_EQ(before + 2, Sim().QueryHits());
    CredRequestUtil::RemoveWebAPIDesc(&a);
    EXPECT_FALSE(CredRequestUtil::IsCredIdCached(a.id));
    EXPECT_TRUE(CredRequestUtil::IsCredIdCached(b.id));
    EXPECT_EQ("entry.cgi", CredRequestUtil::GetWebAPIPath(&b, "KOVA.Demo.Echo"));
    EXPECT_EQ(before + 2, Sim().QueryHits());
    EXPECT_EQ("entry.cgi", CredRequestUtil::GetWebAPIPath(&a, "KOVA.Demo.Echo"));
    EXPECT_EQ(before + 3, Sim().QueryHits());

    // An unstored credential is cached under -1.
    KOVA_CRED unstored = Cred();
    ASSERT_EQ(-1, unstored.id);
    EXPECT_EQ("encryption.cgi", CredRequestUtil::GetWebAPIPath(&unstored, "KOVA.API.Encryption"));
    EXPECT_TRUE(CredRequestUtil::m_jsData["webapiDesc"].isMember("-1"));
}

TEST_F(WebApiDescTest, UnknownApiSetsErrorSixAndIsQueriedAgain) {
    KOVA_CRED cred = Cred();
    cred.id = 41;
    size_t before = Sim().QueryHits();

    EXPECT_EQ("", CredRequestUtil::GetWebAPIPath(&cred, "KOVA.No.Such"));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NO_SUCH_API, CredRequestUtil::m_errCode);
    EXPECT_TRUE(LogHas("cred_request_util:")) << LogDump();
    EXPECT_TRUE(LogHas("No such api: KOVA.No.Such")) << LogDump();
    // The look-up left a null member under the API's name ...
    const Json::Value &entry = CredRequestUtil::m_jsData["webapiDesc"]["41"];
    ASSERT_TRUE(entry.isMember("KOVA.No.Such"));
    EXPECT_TRUE(entry["KOVA.No.Such"].isNull());
    EXPECT_EQ(before + 1, Sim().QueryHits());

    // ... so the next look-up queries the server again, while known APIs stay cached.
    EXPECT_EQ("", CredRequestUtil::GetWebAPIPath(&cred, "KOVA.No.Such"));
    EXPECT_EQ(before + 2, Sim().QueryHits());
    EXPECT_EQ("entry.cgi", CredRequestUtil::GetWebAPIPath(&cred, "KOVA.Demo.Echo"));
    EXPECT_EQ(before + 2, Sim().QueryHits());
    // The format of an unknown API is empty, yet the look-up succeeds.
    std::string format = "unchanged";
    EXPECT_TRUE(CredRequestUtil::GetWebAPIRequestFormat(&cred, "KOVA.No.Such", format));
    EXPECT_EQ("", format);
}

// "0,0,...,0" with `count` zeros.
std::string ZeroList(size_t count) {
    std::string list(2 * count - 1, ',');
    for (size_t i = 0; i < list.size(); i += 2) {
        list[i] = '0';
    }
    return list;
}

TEST_F(WebApiDescTest, UnusableAnswersAreNotCached) {
    const struct {
        std::string body;
        const char *log;
    } cases[] = {
        {"<html><body>It works</body></html>", "Query response is invalid"},
        {"{\"success\":false,\"error\":{\"code\":105}}", "Query request fail!"},
        {"[\"success\"]", "Query request fail!"},
        {"{\"success\":true,\"data\":{\"x\":" + std::string(1000, '[') + std::string(1000, ']') +
             "}}",
         "Query response is invalid"},
        // Values that would take far more memory than their text (about 100 bytes
        // for each "0,"), and a description too large to keep for the process's life.
        {"{\"success\":true,\"data\":[" + ZeroList(500000) + "]}", "Query response is invalid"},
        {"{\"success\":true,\"data\":{\"x\":{\"path\":\"" + std::string(17000000, 'p') + "\"}}}",
         "Query response is invalid"}};
    int id = 7;
    for (const auto &c : cases) {
        SCOPED_TRACE(c.body.substr(0, 80));
        ClearLog();
        KOVA_CRED cred;
        auto server = FixedQuery(c.body, cred, ++id);
        EXPECT_FALSE(CredRequestUtil::GetWebAPIDesc(&cred));
        EXPECT_TRUE(LogHas(c.log)) << LogDump();
        EXPECT_FALSE(CredRequestUtil::IsCredIdCached(id));
        EXPECT_EQ(0, CredRequestUtil::m_errCode);
    }

    // Without a description every look-up asks again and fails.
    ClearLog();
    KOVA_CRED cred;
    auto html = FixedQuery(cases[0].body, cred, 7);
    EXPECT_EQ("", CredRequestUtil::GetWebAPIPath(&cred, "KOVA.Demo.Echo"));
    EXPECT_TRUE(LogHas("cannot get cgi path from id=[7]")) << LogDump();
    std::string format;
    EXPECT_FALSE(CredRequestUtil::GetWebAPIRequestFormat(&cred, "KOVA.Demo.Echo", format));
    EXPECT_TRUE(LogHas("Cannot find api[KOVA.Demo.Echo] description")) << LogDump();
    EXPECT_EQ(2u, html->CountPath("/webapi/query.cgi"));

    // A successful answer whose data is no object never throws.
    auto odd = FixedQuery("{\"success\":true,\"data\":[1,2,3]}", cred, 20);
    EXPECT_EQ("", CredRequestUtil::GetWebAPIPath(&cred, "KOVA.Demo.Echo"));
    format = "x";
    EXPECT_TRUE(CredRequestUtil::GetWebAPIRequestFormat(&cred, "KOVA.Demo.Echo", format));
    EXPECT_EQ("", format);
}

// Bad arguments and unknown ids are refused without traffic; a failed transfer sets error 5.
TEST_F(WebApiDescTest, BadArgumentsUnknownIdsAndFailedTransfers) {
    EXPECT_FALSE(CredRequestUtil::GetWebAPIDesc(nullptr));
    EXPECT_EQ("", CredRequestUtil::GetWebAPIPath(nullptr, "KOVA.Demo.Echo"));
    std::string format;
    EXPECT_FALSE(CredRequestUtil::GetWebAPIRequestFormat(nullptr, "KOVA.Demo.Echo", format));
    EXPECT_EQ(3u, LogCount("Bad parameters")) << LogDump();
    CredRequestUtil::RemoveWebAPIDesc(nullptr);

    EXPECT_EQ("", CredRequestUtil::GetWebAPIPath(999L, "KOVA.Demo.Echo"));
    EXPECT_TRUE(LogHas("cannot get cgi path from id=[999]")) << LogDump();
    EXPECT_EQ("", CredRequestUtil::GetWebAPIRequestFormat(999L, "KOVA.Demo.Echo"));
    EXPECT_TRUE(LogHas("Cannot find id[999] in database")) << LogDump();
    EXPECT_EQ(0u, Server().RequestCount());
    EXPECT_FALSE(CredRequestUtil::IsCredIdCached(999));

    kovasim::RefusedPort closed;
    KOVA_CRED cred = Cred(closed.Port());
    cred.id = 11;
    EXPECT_FALSE(CredRequestUtil::GetWebAPIDesc(&cred));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_QUERY_FAIL, CredRequestUtil::m_errCode);
    EXPECT_TRUE(LogHas("Cred Error:[http://127.0.0.1:" + std::to_string(cred.port) +
                       "/webapi/query.cgi][20]"))
        << LogDump();
}

}  // namespace
}  // namespace kova_test
