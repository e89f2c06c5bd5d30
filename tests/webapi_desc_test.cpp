// The WebAPI description cache against the in-process simulator and against servers that
// answer badly.
#include <set>
#include <string>

#include "webapi_fixture.h"

namespace kova_test {
namespace {

using KOVA::CredRequestUtil;

class WebApiDescTest : public WebApiTest {};

// A server whose discovery CGI answers with a fixed body.
class FixedAnswerServer {
  public:
    explicit FixedAnswerServer(const std::string &body) {
        server_.Route("*", "/webapi/query.cgi",
                      [body](const httplib::Request &, httplib::Response &res) {
                          res.set_content(body, "text/html");
                      });
        EXPECT_TRUE(server_.Start());
    }
    void Fill(KOVA_CRED &cred) const {
        cred.protocol = "http";
        cred.host = "127.0.0.1";
        cred.port = server_.Port();
    }
    size_t Hits() const { return server_.CountPath("/webapi/query.cgi"); }

  private:
    kovasim::LoopbackServer server_;
};

TEST_F(WebApiDescTest, DiscoversOncePerCredentialAndAnswersFromTheCache) {
    int id = StoreCred();
    KOVA_CRED cred;
    ASSERT_EQ(0, KOVACredGetByID(id, &cred));
    size_t before = Sim().QueryHits();

    EXPECT_EQ("entry.cgi", CredRequestUtil::GetWebAPIPath(&cred, "KOVA.Demo.Echo"));
    EXPECT_EQ(before + 1, Sim().QueryHits());
    EXPECT_TRUE(CredRequestUtil::IsCredIdCached(id));

    EXPECT_EQ("upload.cgi", CredRequestUtil::GetWebAPIPath(&cred, "KOVA.Demo.Upload"));
    EXPECT_EQ("JSON", CredRequestUtil::GetWebAPIRequestFormat(&cred, "KOVA.Demo.Json"));
    EXPECT_EQ("", CredRequestUtil::GetWebAPIRequestFormat(&cred, "KOVA.Demo.Echo"));
    EXPECT_EQ("auth.cgi", CredRequestUtil::GetWebAPIPath(static_cast<long>(id), "KOVA.API.Auth"));
    EXPECT_EQ("JSON",
              CredRequestUtil::GetWebAPIRequestFormat(static_cast<long>(id), "KOVA.Demo.Json"));
    EXPECT_EQ(before + 1, Sim().QueryHits());

    // What reached the wire: one POST with the three standard parameters only.
    ASSERT_EQ(1u, PathCount("/webapi/query.cgi"));
    kovasim::RecordedRequest query = Server().Requests().front();
    EXPECT_EQ("POST", query.method);
    EXPECT_EQ("KOVA.API.Info", query.Param("api"));
    EXPECT_EQ("1", query.Param("version"));
    EXPECT_EQ("query", query.Param("method"));
    std::set<std::string> names;
    for (const auto &p : query.params) {
        names.insert(p.first);
    }
    EXPECT_EQ((std::set<std::string>{"api", "method", "version"}), names);

    const Json::Value &entry = CredRequestUtil::m_jsData["webapiDesc"][std::to_string(id)];
    EXPECT_EQ("delay.cgi", entry["KOVA.Demo.Delay"]["path"].asString());
    EXPECT_EQ(1, entry["KOVA.Demo.Delay"]["minVersion"].asInt());
}

TEST_F(WebApiDescTest, UnknownApiSetsErrorSixAndIsQueriedAgain) {
    KOVA_CRED cred;
    FillCred(cred);
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
}

TEST_F(WebApiDescTest, FormatOfAnUnknownApiIsEmptyButSucceeds) {
    KOVA_CRED cred;
    FillCred(cred);
    cred.id = 42;
    std::string format = "unchanged";
    EXPECT_TRUE(CredRequestUtil::GetWebAPIRequestFormat(&cred, "KOVA.No.Such", format));
    EXPECT_EQ("", format);
    EXPECT_TRUE(CredRequestUtil::IsCredIdCached(42));
}

TEST_F(WebApiDescTest, HtmlInsteadOfJsonIsRejectedWithoutCacheEntry) {
    FixedAnswerServer html("<html><body>It works</body></html>");
    KOVA_CRED cred;
    html.Fill(cred);
    cred.id = 7;
    EXPECT_FALSE(CredRequestUtil::GetWebAPIDesc(&cred));
    EXPECT_TRUE(LogHas("Query response is invalid")) << LogDump();
    EXPECT_FALSE(CredRequestUtil::IsCredIdCached(7));
    EXPECT_EQ(0, CredRequestUtil::m_errCode);

    ClearLog();
    EXPECT_EQ("", CredRequestUtil::GetWebAPIPath(&cred, "KOVA.Demo.Echo"));
    EXPECT_TRUE(LogHas("cannot get cgi path from id=[7]")) << LogDump();
    std::string format;
    EXPECT_FALSE(CredRequestUtil::GetWebAPIRequestFormat(&cred, "KOVA.Demo.Echo", format));
    EXPECT_TRUE(LogHas("Cannot find api[KOVA.Demo.Echo] description")) << LogDump();
    EXPECT_EQ(3u, html.Hits());
}

TEST_F(WebApiDescTest, UnsuccessfulAnswerIsNotCached) {
    FixedAnswerServer refusing("{\"success\":false,\"error\":{\"code\":105}}");
    KOVA_CRED cred;
    refusing.Fill(cred);
    cred.id = 8;
    EXPECT_FALSE(CredRequestUtil::GetWebAPIDesc(&cred));
    EXPECT_TRUE(LogHas("Query request fail!")) << LogDump();
    EXPECT_FALSE(CredRequestUtil::IsCredIdCached(8));
    EXPECT_EQ(0, CredRequestUtil::m_errCode);
}

TEST_F(WebApiDescTest, OddlyShapedAnswersNeverThrow) {
    FixedAnswerServer odd("{\"success\":true,\"data\":[1,2,3]}");
    KOVA_CRED cred;
    odd.Fill(cred);
    cred.id = 9;
    EXPECT_EQ("", CredRequestUtil::GetWebAPIPath(&cred, "KOVA.Demo.Echo"));
    std::string format = "x";
    EXPECT_TRUE(CredRequestUtil::GetWebAPIRequestFormat(&cred, "KOVA.Demo.Echo", format));
    EXPECT_EQ("", format);

    FixedAnswerServer scalar("[\"success\"]");
    scalar.Fill(cred);
    cred.id = 10;
    EXPECT_FALSE(CredRequestUtil::GetWebAPIDesc(&cred));
    EXPECT_TRUE(LogHas("Query request fail!"));
}

TEST_F(WebApiDescTest, FailedTransferSetsErrorFive) {
    KOVA_CRED cred;
    FillCred(cred);
    {
        kovasim::LoopbackServer closed;
        ASSERT_TRUE(closed.Start());
        cred.port = closed.Port();
        closed.Stop();
    }
    cred.id = 11;
    EXPECT_FALSE(CredRequestUtil::GetWebAPIDesc(&cred));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_QUERY_FAIL, CredRequestUtil::m_errCode);
    EXPECT_TRUE(LogHas("Cred Error:[http://127.0.0.1:" + std::to_string(cred.port) +
                       "/webapi/query.cgi][20]"))
        << LogDump();
}

TEST_F(WebApiDescTest, UnstoredCredentialIsCachedUnderMinusOne) {
    KOVA_CRED cred;
    FillCred(cred);
    ASSERT_EQ(-1, cred.id);
    EXPECT_EQ("encryption.cgi", CredRequestUtil::GetWebAPIPath(&cred, "KOVA.API.Encryption"));
    EXPECT_TRUE(CredRequestUtil::IsCredIdCached(-1));
    EXPECT_TRUE(CredRequestUtil::m_jsData["webapiDesc"].isMember("-1"));
}

TEST_F(WebApiDescTest, TwoCredentialsOfOneServerAreCachedSeparately) {
    int first = StoreCred("admin");
    int second = StoreCred("otpuser");
    KOVA_CRED a;
    KOVA_CRED b;
    ASSERT_EQ(0, KOVACredGetByID(first, &a));
    ASSERT_EQ(0, KOVACredGetByID(second, &b));
    size_t before = Sim().QueryHits();

    EXPECT_EQ("entry.cgi", CredRequestUtil::GetWebAPIPath(&a, "KOVA.Demo.Echo"));
    EXPECT_EQ("entry.cgi", CredRequestUtil::GetWebAPIPath(&b, "KOVA.Demo.Echo"));
    EXPECT_EQ(before + 2, Sim().QueryHits());
    EXPECT_TRUE(CredRequestUtil::IsCredIdCached(first));
    EXPECT_TRUE(CredRequestUtil::IsCredIdCached(second));

    CredRequestUtil::RemoveWebAPIDesc(&a);
    EXPECT_FALSE(CredRequestUtil::IsCredIdCached(first));
    EXPECT_TRUE(CredRequestUtil::IsCredIdCached(second));
    EXPECT_EQ("entry.cgi", CredRequestUtil::GetWebAPIPath(&b, "KOVA.Demo.Echo"));
    EXPECT_EQ(before + 2, Sim().QueryHits());
    EXPECT_EQ("entry.cgi", CredRequestUtil::GetWebAPIPath(&a, "KOVA.Demo.Echo"));
    EXPECT_EQ(before + 3, Sim().QueryHits());
}

TEST_F(WebApiDescTest, BadArgumentsAndUnknownIdsAreRefusedWithoutTraffic) {
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
}

}  // namespace
}  // namespace kova_test
