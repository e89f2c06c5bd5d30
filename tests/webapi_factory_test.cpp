// WebAPI request factories and the request's own login, checked on the wire of the
// in-process simulator.
#include <stdio.h>

#include <memory>
#include <set>
#include <string>

#include "webapi_fixture.h"

namespace kova_test {
namespace {

using KOVA::CredRequest;
using KOVA::CredRequestUtil;

class WebApiFactoryTest : public WebApiTest {
  protected:
    std::string EntryUrl() const { return Server().BaseUrl() + "/webapi/entry.cgi"; }

    // A request for the entry CGI that asks who its session belongs to.
    void WhoAmI(CredRequest &request) const {
        request.SetURL(EntryUrl());
        request.AddPostParam("api", "KOVA.Demo.Session");
        request.AddPostParam("version", "1");
        request.AddPostParam("method", "whoami");
    }
};

TEST_F(WebApiFactoryTest, RecordFormSendsSessionAsPostCookieAndTokenInQuery) {
    // An empty session still sends "_sid", but no cookie and no token.
    const struct {
        const char *sid, *token, *query, *cookie;  // cookie nullptr: no Cookie header
        std::set<std::string> names;
    } cases[] = {{"S1",
                  "T1",
                  "&KovaToken=T1",
                  "id=S1",
                  {"KovaToken", "_sid", "api", "method", "version", "x"}},
                 {"", "", "", nullptr, {"_sid", "api", "method", "version", "x"}}};
    KOVA_CRED cred = Cred();
    for (const auto &c : cases) {
        SCOPED_TRACE(c.sid);
        KOVA_CRED_SESS sess;
        sess.access_token = c.sid;
        sess.csrf_token = c.token;
        Json::Value params;
        params["x"] = "1";
        std::unique_ptr<CredRequest> request(
            CredRequest::CreateWebAPIRequest(&cred, &sess, "KOVA.Demo.Echo", 2, "echo", params));
        ASSERT_TRUE(request) << LogDump();
        EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, request->GetError());
        EXPECT_EQ("1", Answer(*request)["data"]["params"]["x"].asString());
        kovasim::RecordedRequest wire = Server().Last();
        EXPECT_EQ("/webapi/entry.cgi", wire.path);
        EXPECT_EQ("POST", wire.method);
        // The token is appended behind the (here empty) encoded query parameters.
        EXPECT_EQ(c.query, wire.query);
        EXPECT_EQ(c.cookie != nullptr, wire.HasHeader("Cookie"));
        EXPECT_EQ(c.cookie ? c.cookie : "", wire.Header("Cookie"));
        EXPECT_EQ(c.names, ParamNames(wire));
        EXPECT_EQ(c.sid, wire.Param("_sid"));
        EXPECT_NE(std::string::npos, wire.body.find(std::string("_sid=") + c.sid));
    }
}

TEST_F(WebApiFactoryTest, JsonFormatApiGetsJsonEncodedValues) {
    KOVA_CRED cred = Cred();
    KOVA_CRED_SESS sess;
    Json::Value params;
    params["count"] = 5;
    params["name"] = "kova";
    std::unique_ptr<CredRequest> request(
        CredRequest::CreateWebAPIRequest(&cred, &sess, "KOVA.Demo.Json", 1, "get", params));
    ASSERT_TRUE(request);
    EXPECT_EQ("JSON", request->GetRequestFormat());
    const Json::Value answer = Answer(*request)["data"]["params"];
    EXPECT_TRUE(answer["count"].isInt());
    EXPECT_EQ(5, answer["count"].asInt());
    EXPECT_EQ("kova", answer["name"].asString());
}

TEST_F(WebApiFactoryTest, FillFormErrorCodes) {
    KOVA_CRED cred = Cred();
    KOVA_CRED_SESS sess;
    EXPECT_FALSE(CredRequest::CreateWebAPIRequest(nullptr, &cred, &sess, "KOVA.Demo.Echo", 1,
                                                  "echo", Json::Value()));
    EXPECT_EQ(1u, LogCount("cred_request:"));

    struct Case {
        const KOVA_CRED *cred;
        const KOVA_CRED_SESS *sess;
        const char *api;
        int version;
        const char *method;
    } cases[] = {{&cred, &sess, "KOVA.Demo.Echo", 0, "echo"},
                 {&cred, &sess, "KOVA.Demo.Echo", -3, "echo"},
                 {&cred, &sess, "", 1, "echo"},
                 {&cred, &sess, "KOVA.Demo.Echo", 1, ""},
                 {nullptr, &sess, "KOVA.Demo.Echo", 1, "echo"},
                 {&cred, nullptr, "KOVA.Demo.Echo", 1, "echo"}};
    for (const auto &c : cases) {
        CredRequest request;
        EXPECT_FALSE(CredRequest::CreateWebAPIRequest(&request, c.cred, c.sess, c.api, c.version,
                                                      c.method, Json::Value()));
        EXPECT_EQ(KOVA::CRED_REQ_ERR_BAD_PARAM, request.GetError());
        EXPECT_EQ(nullptr, CredRequest::CreateWebAPIRequest(c.cred, c.sess, c.api, c.version,
                                                            c.method, Json::Value()));
    }
    EXPECT_EQ(13u, LogCount("Bad parameters")) << LogDump();
    EXPECT_EQ(6u, LogCount("Create CredRequest fail"));
    EXPECT_EQ(0u, Server().RequestCount());

    // A failed API look-up leaves the utilities' error in the request.
    CredRequest unknown;
    EXPECT_FALSE(CredRequest::CreateWebAPIRequest(&unknown, &cred, &sess, "KOVA.No.Such", 1, "x",
                                                  Json::Value()));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NO_SUCH_API, unknown.GetError());
    EXPECT_TRUE(LogHas("SetWebAPIURL fail")) << LogDump();

    // Parameters that are not an object are refused after the URL is set.
    CredRequest badParams;
    Json::Value list(Json::arrayValue);
    list.append(1);
    EXPECT_FALSE(CredRequest::CreateWebAPIRequest(&badParams, &cred, &sess, "KOVA.Demo.Echo", 1,
                                                  "echo", list));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_BAD_PARAM, badParams.GetError());

    // Success clears an error the request carried in.
    CredRequest reused;
    reused.SetError(KOVA::CRED_REQ_ERR_HTTP_CLIENT);
    EXPECT_TRUE(CredRequest::CreateWebAPIRequest(&reused, &cred, &sess, "KOVA.Demo.Echo", 1, "echo",
                                                 Json::Value()));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, reused.GetError());

    // A server that cannot be reached leaves the query failure.
    kovasim::RefusedPort closed;
    cred.port = closed.Port();
    cred.id = 50;  // not described yet
    CredRequest unreachable;
    EXPECT_FALSE(CredRequest::CreateWebAPIRequest(&unreachable, &cred, &sess, "KOVA.Demo.Echo", 1,
                                                  "echo", Json::Value()));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_QUERY_FAIL, unreachable.GetError());
}

// The credential-id factory logs in once and reuses the session; ProcessWithLogin attaches a
// session of an unknown id to nothing and a stored one's to the request.
TEST_F(WebApiFactoryTest, CredentialIdFormsLogInOnceAndReuseTheSession) {
    CredRequest unknown;
    unknown.SetURL(EntryUrl());
    EXPECT_FALSE(unknown.ProcessWithLogin(999, true, 0));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_LOGIN_FAIL, unknown.GetError());
    EXPECT_EQ(0u, Server().RequestCount());
    EXPECT_EQ(nullptr, unknown.GetCurlHandler());

    int id = StoreCred();
    size_t logins = Sim().Hits("KOVA.API.Auth");
    std::unique_ptr<CredRequest> first(
        CredRequest::CreateWebAPIRequest(id, "KOVA.Demo.Session", 1, "whoami", Json::Value()));
    ASSERT_TRUE(first) << LogDump();
    EXPECT_EQ(logins + 1, Sim().Hits("KOVA.API.Auth"));
    EXPECT_EQ("admin", Answer(*first)["data"]["account"].asString());

    std::unique_ptr<CredRequest> second(
        CredRequest::CreateWebAPIRequest(id, "KOVA.Demo.Session", 1, "whoami", Json::Value()));
    ASSERT_TRUE(second);
    EXPECT_EQ(logins + 1, Sim().Hits("KOVA.API.Auth"));
    EXPECT_EQ("admin", Answer(*second)["data"]["account"].asString());
    CredRequest request;
    WhoAmI(request);
    ASSERT_TRUE(request.ProcessWithLogin(id, true, 0)) << LogDump();
    EXPECT_EQ("admin", ParseBody(request.GetResponse())["data"]["account"].asString());
    kovasim::RecordedRequest wire = Server().Last();
    EXPECT_TRUE(wire.HasParam("KovaToken"));
    EXPECT_EQ("", wire.query);

    EXPECT_EQ(nullptr,
              CredRequest::CreateWebAPIRequest(id, "KOVA.Demo.Echo", 0, "echo", Json::Value()));
    EXPECT_TRUE(LogHas("Bad parameters"));

    // An unknown id and a failed login both fail the access token.
    for (long bad : {999L, static_cast<long>(StoreCred("admin", "wrong"))}) {
        ClearLog();
        EXPECT_EQ(nullptr, CredRequest::CreateWebAPIRequest(bad, "KOVA.Demo.Echo", 1, "echo",
                                                            Json::Value()));
        EXPECT_TRUE(LogHas("GetAccessToken fail")) << bad << LogDump();
    }
}

TEST_F(WebApiFactoryTest, RelayRequestReadsItsBodyFromTheStreams) {
    int id = StoreCred();
    File in = StreamWith("IN-BODY");
    File out = StreamWith("OUT-BODY");
    Json::Value headers;
    headers["X-Relay"] = "yes";
    std::unique_ptr<CredRequest> both(CredRequest::CreateRelayRequest(
        id, "KOVA.Demo.Echo", 1, "echo", headers, in.get(), out.get()));
    ASSERT_TRUE(both) << LogDump();
    both->Process(true, 0);
    kovasim::RecordedRequest wire = Server().Last();
    EXPECT_EQ("OUT-BODY", wire.body);
    EXPECT_EQ("yes", wire.Header("X-Relay"));
    EXPECT_FALSE(wire.HasHeader("Expect"));  // a streamed body would otherwise wait for 100
    EXPECT_NE(std::string::npos, wire.Header("Cookie").find("id="));

    rewind(in.get());
    std::unique_ptr<CredRequest> onlyIn(CredRequest::CreateRelayRequest(
        id, "KOVA.Demo.Echo", 1, "echo", Json::Value(), in.get(), nullptr));
    ASSERT_TRUE(onlyIn);
    onlyIn->Process(true, 0);
    EXPECT_EQ("IN-BODY", Server().Last().body);
    EXPECT_FALSE(Server().Last().HasHeader("X-Relay"));

    Json::Value notHeaders(Json::arrayValue);
    notHeaders.append("X-A: 1");
    EXPECT_EQ(nullptr, CredRequest::CreateRelayRequest(id, "KOVA.Demo.Echo", 1, "echo", notHeaders,
                                                       nullptr, nullptr));
    EXPECT_EQ(nullptr,
              CredRequest::CreateRelayRequest(id, "", 1, "echo", headers, nullptr, nullptr));
    EXPECT_EQ(2u, LogCount("Bad parameters")) << LogDump();
}

TEST_F(WebApiFactoryTest, RequestLoginWebApiRequestAndLogout) {
    const struct {
        const char *account;
        const char *url;  // nullptr: the request's own URL
        bool ownUrl;
    } refused[] = {{"", "", false}, {"admin", "https://[fe80::1", false}, {"", nullptr, true}};
    for (const auto &c : refused) {
        SCOPED_TRACE(std::string(c.account) + "@" + (c.url ? c.url : "own URL"));
        CredRequest request;
        if (c.ownUrl) {
            request.SetURL(EntryUrl());
        }
        EXPECT_FALSE(c.url ? request.Login(c.account, "secret", c.url)
                           : request.Login(c.account, "secret"));
        EXPECT_EQ(KOVA::CRED_REQ_ERR_LOGIN_PARAM, request.GetError());
    }
    EXPECT_TRUE(LogHas("parseURL Failed: https://[fe80::1")) << LogDump();

    CredRequest wrong;
    wrong.SetURL(EntryUrl());
    EXPECT_FALSE(wrong.Login("admin", "nope"));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_LOGIN_SESSION, wrong.GetError());
    EXPECT_FALSE(wrong.Logout());

    CredRequest request;
    WhoAmI(request);
    ASSERT_TRUE(request.Login("admin", "secret")) << LogDump();
    Answer(request);
    kovasim::RecordedRequest wire = Server().Last();
    const std::string sid = wire.Param("_sid");
    EXPECT_NE(std::string::npos, wire.query.find("_sid=" + sid));
    EXPECT_NE(std::string::npos, wire.query.find("KovaToken="));
    EXPECT_EQ("id=" + sid, wire.Header("Cookie"));
    EXPECT_TRUE(Sim().SessionValid(sid));
    // A WebAPI request set up on a logged-in request uses that request's own credential.
    CredRequest own;
    own.SetURL(EntryUrl());
    ASSERT_TRUE(own.Login("admin", "secret"));
    Json::Value params;
    params["a"] = "b";
    ASSERT_TRUE(own.SetWebAPIRequest("KOVA.Demo.Echo", 1, "echo", params)) << LogDump();
    const Json::Value answer = Answer(own);
    EXPECT_EQ("b", answer["data"]["params"]["a"].asString());
    EXPECT_EQ("KOVA.Demo.Echo", answer["data"]["api"].asString());
    CredRequest fresh;
    ClearLog();
    EXPECT_FALSE(fresh.SetWebAPIRequest("KOVA.Demo.Echo", 0, "echo", params));
    EXPECT_FALSE(fresh.SetWebAPIRequest("", 1, "echo", params));
    EXPECT_EQ(2u, LogCount("Bad parameters"));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, fresh.GetError());

    EXPECT_TRUE(request.Logout()) << LogDump();
    EXPECT_FALSE(Sim().SessionValid(sid));
}

TEST_F(WebApiFactoryTest, ApiValidityUsesTheRequestsUrl) {
    CredRequest request;
    request.SetURL(EntryUrl());
    EXPECT_TRUE(request.isAPIValid("KOVA.Demo.Echo"));
    EXPECT_FALSE(request.isAPIValid("KOVA.No.Such"));
    EXPECT_TRUE(CredRequestUtil::IsCredIdCached(-1));
    // An API the server does not list is never cached, so asking for it queries again.
    EXPECT_EQ(2u, Server().CountPath("/webapi/query.cgi"));
    EXPECT_TRUE(request.isAPIValid("KOVA.Demo.Echo"));
    EXPECT_EQ(2u, Server().CountPath("/webapi/query.cgi"));

    CredRequest noUrl;
    EXPECT_FALSE(noUrl.isAPIValid("KOVA.Demo.Echo"));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_LOGIN_PARAM, noUrl.GetError());

    // A port that is not a number becomes 0; the build itself succeeds.
    CredRequest oddPort;
    oddPort.SetURL("http://127.0.0.1:abc/webapi/entry.cgi");
    CredRequestUtil::m_jsData = Json::Value();
    EXPECT_FALSE(oddPort.isAPIValid("KOVA.Demo.Echo"));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, oddPort.GetError());
    EXPECT_TRUE(LogHas("127.0.0.1:0/webapi/query.cgi")) << LogDump();
}

}  // namespace
}  // namespace kova_test
