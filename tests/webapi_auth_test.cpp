// Login, access tokens, redirect probing and logout against the in-process simulator, which
// opens the RSA and AES envelopes and checks every parameter it finds inside.
#include <string.h>

#include <fstream>
#include <functional>
#include <iterator>
#include <regex>
#include <string>

#include "kovacredential/kovaplatform.h"
#include "simlib/fault_server.h"
#include "webapi_fixture.h"

namespace kova_test {
namespace {

using KOVA::CredRequest;
using KOVA::CredRequestUtil;

class WebApiAuthTest : public WebApiTest {
  protected:
    static KOVA_CRED_SESS SessionStored(int id) {
        KOVA_CRED_SESS sess;
        EXPECT_EQ(0, KOVACredSessGetByID(id, &sess));
        return sess;
    }
    // The last request that reached the login/logout CGI.
    static kovasim::RecordedRequest LastAuthRequest() {
        kovasim::RecordedRequest last;
        for (const auto &r : Server().Requests()) {
            if (r.path == "/webapi/auth.cgi") {
                last = r;
            }
        }
        return last;
    }
};

TEST_F(WebApiAuthTest, LoginSendsEveryParameterInsideTheRsaEnvelopeAndStoresTheSession) {
    KOVA_CRED cred = StoredCred("admin", "secret", "backup");
    KOVA_CRED_SESS sess;
    Json::Value response;
    ASSERT_TRUE(CredRequestUtil::LoginWithOTP(&cred, "", &sess, &response)) << LogDump();

    kovasim::WebApiSim::LoginRecord login = Sim().LastLogin();
    EXPECT_EQ("rsa", login.envelope);
    EXPECT_TRUE(login.success);
    std::map<std::string, std::string> expected = {
        {"account", "admin"},     {"passwd", "secret"}, {"format", "sid"},  {"session", "backup"},
        {"api", "KOVA.API.Auth"}, {"version", "3"},     {"method", "login"}};
    EXPECT_EQ(expected, login.params);
    // Nothing but the envelope travelled in clear.
    kovasim::RecordedRequest wire = LastAuthRequest();
    EXPECT_EQ(std::set<std::string>{Sim().CipherKey()}, ParamNames(wire));
    EXPECT_EQ(std::string::npos, wire.body.find("secret"));

    const std::string sid = response["data"]["sid"].asString();
    EXPECT_TRUE(Sim().SessionValid(sid));
    EXPECT_EQ(sid, sess.access_token);
    EXPECT_EQ(response["data"]["kovatoken"].asString(), sess.csrf_token);
    EXPECT_EQ(1, sess.filled);
    KOVA_CRED_SESS stored = SessionStored(cred.id);
    EXPECT_EQ(1, stored.filled);
    EXPECT_EQ(sid, stored.access_token);
    EXPECT_EQ(sess.csrf_token, stored.csrf_token);
}

// The server's refusals of a login: a one-time code missing or wrong, and a ciphertoken older
// than its window.
TEST_F(WebApiAuthTest, OneTimeCodeAndCiphertokenAreChecked) {
    KOVA_CRED cred = StoredCred("otpuser", "secret");
    KOVA_CRED_SESS sess;
    Json::Value response;
    EXPECT_FALSE(CredRequestUtil::LoginWithOTP(&cred, "", &sess, &response));
    EXPECT_EQ(kovasim::WebApiSim::kErrOtpRequired, response["error"]["code"].asInt());
    EXPECT_TRUE(LogHas("Login response is invalid")) << LogDump();

    EXPECT_FALSE(CredRequestUtil::LoginWithOTP(&cred, "654321", &sess, &response));
    EXPECT_EQ(kovasim::WebApiSim::kErrOtpWrong, response["error"]["code"].asInt());
    EXPECT_EQ("654321", Sim().LastLogin().params["otp_code"]);
    EXPECT_EQ("", SessionStored(cred.id).access_token);

    ASSERT_TRUE(CredRequestUtil::LoginWithOTP(&cred, "123456", &sess, &response)) << LogDump();
    EXPECT_EQ("123456", Sim().LastLogin().params["otp_code"]);
    EXPECT_EQ(sess.access_token, SessionStored(cred.id).access_token);

    Sim().SetTokenWindow(-1);  // every server time is already too old
    EXPECT_FALSE(CredRequestUtil::LoginWithOTP(&cred, "123456", nullptr, &response));
    Sim().SetTokenWindow(300);
    EXPECT_EQ(kovasim::WebApiSim::kErrStaleToken, response["error"]["code"].asInt());
}

// A wrong password stores nothing; unknown ids, missing sessions and missing arguments are
// refused, each with its log record, without traffic; a login whose transfer fails says so.
TEST_F(WebApiAuthTest, WrongPasswordAndMissingInputsAreRefused) {
    int id = StoreCred("admin", "wrong");
    KOVA_CRED_SESS sess;
    EXPECT_FALSE(CredRequestUtil::Login(static_cast<long>(id), &sess));
    EXPECT_EQ(kovasim::WebApiSim::kErrWrongPassword, Sim().LastLogin().error);
    EXPECT_TRUE(LogHas("Login response is invalid")) << LogDump();
    EXPECT_EQ(0, sess.filled);
    EXPECT_EQ("", SessionStored(id).access_token);
    EXPECT_FALSE(CredRequestUtil::GetAccessToken(static_cast<long>(id), &sess));
    EXPECT_TRUE(LogHas("Cannot get access token from id=[" + std::to_string(id) + "]"))
        << LogDump();

    Server().ClearRecords();
    ClearLog();
    KOVA_CRED cred = Cred();
    const struct {
        std::function<bool()> call;
        std::string log;
    } refused[] = {
        {[&] { return CredRequestUtil::Login(4242L, &sess); }, "Cannot find id[4242] in database"},
        {[&] { return CredRequestUtil::LoginWithOTP(nullptr, "", &sess, nullptr); },
         "Bad parameters"},
        {[&] { return CredRequestUtil::Logout(static_cast<long>(id)); },
         "Cannot find id[" + std::to_string(id) + "] in sess"},
        {[&] { return CredRequestUtil::Logout(777L); }, "Cannot find id[777] in cred"},
        {[&] { return CredRequestUtil::Logout(&cred, std::string()); }, "Bad parameters"},
        {[&] { return CredRequestUtil::Logout(&cred, static_cast<KOVA_CRED_SESS *>(nullptr)); },
         "Bad parameters"},
        {[&] { return CredRequestUtil::GetAccessToken(static_cast<long>(id), nullptr); },
         "Bad parameters"},
        {[&] { return CredRequestUtil::GetAccessToken(nullptr, &sess); }, "Bad parameters"},
    };
    for (const auto &c : refused) {
        SCOPED_TRACE(c.log);
        ClearLog();
        EXPECT_FALSE(c.call());
        EXPECT_EQ(LogCount(c.log), 1u) << LogDump();
    }
    EXPECT_EQ(0u, Server().RequestCount());

    // A login whose transfer fails (same id, another server: the description is cached).
    CredRequestUtil::GetWebAPIDesc(&cred);
    kovasim::LoopbackServer failing;
    failing.Route("*", "/webapi/.*",
                  [](const httplib::Request &, httplib::Response &res) { res.status = 503; });
    ASSERT_TRUE(failing.Start());
    cred.port = failing.Port();
    EXPECT_FALSE(CredRequestUtil::Login(&cred, nullptr));
    EXPECT_TRUE(LogHas("Send login request fail.[13]")) << LogDump();
}

// The token provider of the AES envelope hands out this pass phrase.
std::string gAesKey;

int SimTokenProvider(char *token, size_t tokenSize, char *key, size_t keySize) {
    snprintf(token, tokenSize, "%s", "tok-0123456789");
    snprintf(key, keySize, "%s", gAesKey.c_str());
    return 0;
}

class WebApiAesTest : public WebApiAuthTest {
  protected:
    void SetUp() override {
        WebApiAuthTest::SetUp();
        Sim().SetAesSecret("tok-0123456789", "aes-pass-phrase");
        KOVACloudServiceHxtokenSetProvider(&SimTokenProvider);
    }
    void TearDown() override {
        KOVACloudServiceHxtokenSetProvider(nullptr);
        WebApiAuthTest::TearDown();
    }
};

// Parameters and a login travel in the AES envelope; a key other than the server's is a bad
// envelope.
TEST_F(WebApiAesTest, ParametersTravelInTheAesEnvelope) {
    KOVA_CRED cred = Cred();
    KOVA_CRED_SESS sess;
    sess.access_token = "S1";
    Json::Value params;
    params["color"] = "blue & green";
    for (const char *key : {"aes-pass-phrase", "not-the-phrase"}) {
        SCOPED_TRACE(key);
        gAesKey = key;
        CredRequest request;
        ASSERT_TRUE(CredRequest::CreateWebAPIRequest(&request, &cred, &sess, "KOVA.Demo.Echo", 1,
                                                     "echo", params));
        ASSERT_TRUE(request.SetEncryptMode(KOVA::CRED_REQ_CRYPTO_AES));
        ASSERT_TRUE(request.Process(true, 0)) << LogDump();
        Json::Value answer = ParseBody(request.GetResponse());
        if (gAesKey != "aes-pass-phrase") {
            EXPECT_EQ(kovasim::WebApiSim::kErrBadEnvelope, answer["error"]["code"].asInt());
            continue;
        }
        ASSERT_TRUE(answer["success"].asBool()) << request.GetResponse();
        EXPECT_EQ("aes", answer["data"]["envelope"].asString());
        EXPECT_EQ("blue & green", answer["data"]["params"]["color"].asString());
        EXPECT_EQ("S1", answer["data"]["params"]["_sid"].asString());
        kovasim::RecordedRequest wire = Server().Last();
        EXPECT_TRUE(wire.HasParam("__tXeTrEhPiC"));
        EXPECT_EQ("\"tok-0123456789\"", wire.Param("__nEkOtReHpIc"));
        EXPECT_FALSE(wire.HasParam("color"));
    }

    CredRequest login;
    ASSERT_TRUE(CredRequestUtil::SetWebAPIURL(&cred, "KOVA.API.Auth", 3, "login", &login));
    login.AddPostParam("account", "admin");
    login.AddPostParam("passwd", "secret");
    ASSERT_TRUE(login.SetEncryptMode(KOVA::CRED_REQ_CRYPTO_AES));
    gAesKey = "aes-pass-phrase";
    EXPECT_TRUE(Sim().SessionValid(Answer(login)["data"]["sid"].asString()));
    EXPECT_EQ("aes", Sim().LastLogin().envelope);
    EXPECT_EQ("admin", Sim().LastLogin().params["account"]);
}

// A stored session is the access token, without traffic; a logout sends its id as parameter
// and cookie and ends it on the server, and a second logout of it is refused.
TEST_F(WebApiAuthTest, AccessTokenReusesTheStoredSessionAndLogoutEndsIt) {
    KOVA_CRED cred = StoredCred();
    KOVA_CRED_SESS sess;
    size_t logins = Sim().Hits("KOVA.API.Auth");
    ASSERT_TRUE(CredRequestUtil::GetAccessToken(static_cast<long>(cred.id), &sess)) << LogDump();
    EXPECT_EQ(logins + 1, Sim().Hits("KOVA.API.Auth"));
    EXPECT_EQ(sess.access_token, SessionStored(cred.id).access_token);
    ASSERT_TRUE(Sim().SessionValid(sess.access_token));

    Server().ClearRecords();
    KOVA_CRED_SESS again;
    ASSERT_TRUE(CredRequestUtil::GetAccessToken(static_cast<long>(cred.id), &again));
    EXPECT_EQ(sess.access_token, again.access_token);
    EXPECT_EQ(sess.csrf_token, again.csrf_token);
    KOVA_CRED_SESS byRecord;
    ASSERT_TRUE(CredRequestUtil::GetAccessToken(&cred, &byRecord));
    EXPECT_EQ(sess.access_token, byRecord.access_token);
    EXPECT_EQ(0u, Server().RequestCount());

    ASSERT_TRUE(CredRequestUtil::Logout(static_cast<long>(cred.id))) << LogDump();
    kovasim::RecordedRequest wire = LastAuthRequest();
    EXPECT_EQ(sess.access_token, wire.Param("_sid"));
    EXPECT_EQ("logout", wire.Param("method"));
    EXPECT_EQ("1", wire.Param("version"));
    EXPECT_EQ("id=" + sess.access_token, wire.Header("Cookie"));
    EXPECT_FALSE(Sim().SessionValid(sess.access_token));
    // The stored session is left for the caller to remove.
    EXPECT_EQ(sess.access_token, SessionStored(cred.id).access_token);
    EXPECT_FALSE(CredRequestUtil::Logout(&cred, &sess));
    EXPECT_TRUE(LogHas("Logout response is invalid")) << LogDump();
}

// A usable answer but for a member nested deeper than the parser allows.
const std::string kDeepAnswer =
    "{\"success\":true,\"data\":{\"sid\":\"S\",\"x\":" + std::string(1000, '[') +
    std::string(1000, ']') + "}}";

// Login and logout answers that cannot be used. The parameter is an index into this table, so
// that test names stay short.
const std::string kBadAnswers[] = {kDeepAnswer,
                                   "<html>login</html>",
                                   "{\"success\":false}",
                                   "{\"success\":true}",
                                   "{\"success\":\"yes\"}",
                                   "{\"success\":true,\"data\":\"sid\"}",
                                   "[1,2]",
                                   ""};

class WebApiBadAnswerTest : public WebApiAuthTest, public ::testing::WithParamInterface<size_t> {};

TEST_P(WebApiBadAnswerTest, IsAnInvalidResponse) {
    const std::string body = kBadAnswers[GetParam()];
    auto bad = FixedAnswer("/webapi/auth.cgi", body, true);
    KOVA_CRED cred = Cred(bad->Port());
    cred.id = 99;  // not stored: nothing to write back
    KOVA_CRED_SESS sess;
    Json::Value response(Json::objectValue);
    EXPECT_FALSE(CredRequestUtil::LoginWithOTP(&cred, "", &sess, &response));
    EXPECT_TRUE(LogHas("Login response is invalid")) << LogDump();
    EXPECT_EQ(0, sess.filled);
    EXPECT_EQ(ParseBody(body), response);

    // A logout needs nothing but "success" true.
    Json::Value answer = ParseBody(body);
    const bool logoutUsable =
        answer.isObject() && answer["success"].isBool() && answer["success"].asBool();
    ClearLog();
    EXPECT_EQ(logoutUsable, CredRequestUtil::Logout(&cred, "SID"));
    EXPECT_EQ(!logoutUsable, LogHas("Logout response is invalid")) << LogDump();
}

INSTANTIATE_TEST_SUITE_P(Answers, WebApiBadAnswerTest,
                         ::testing::Range(size_t{0}, std::size(kBadAnswers)));

TEST_F(WebApiAuthTest, LoginAnswerIsReadLenientlyButLogoutAnswerMustBeWhole) {
    auto lenient = FixedAnswer(
        "/webapi/auth.cgi",
        "/* session */ {\"success\":true,\"data\":{\"sid\":\"S-1\",\"kovatoken\":\"T-1\"}}"
        "\n<!-- served in 1 ms -->",
        true);
    KOVA_CRED cred = Cred(lenient->Port());
    KOVA_CRED_SESS sess;
    Json::Value response;
    ASSERT_TRUE(CredRequestUtil::LoginWithOTP(&cred, "", &sess, &response)) << LogDump();
    EXPECT_EQ(1, sess.filled);
    EXPECT_EQ("S-1", sess.access_token);
    EXPECT_EQ("T-1", sess.csrf_token);
    EXPECT_EQ("S-1", response["data"]["sid"].asString());

    EXPECT_FALSE(CredRequestUtil::Logout(&cred, "S-1"));
    EXPECT_TRUE(LogHas("Logout response is invalid")) << LogDump();
}

// Every request of a login or logout over a transport runs with the transport's checks and
// deadline, and the failing one's cause comes back in the transport.
TEST_F(WebApiAuthTest, LoginAndLogoutOverATransportCheckTheServerBeforeTheSecretsGo) {
    kovasim::LoopbackServer::Options options;
    options.https = true;
    kovasim::LoopbackServer https(options);
    Sim().Install(https);
    ASSERT_TRUE(https.Start()) << https.Error();
    TempDir dir;
    const std::string caFile = dir.File("server.pem");
    std::ofstream(caFile) << https.CertificatePem();
    // The simulator's self-signed certificate names "localhost".
    KOVA_CRED cred = Cred(https.Port());
    cred.protocol = "https";
    cred.host = "localhost";
    auto expectRefused = [&](CredRequest &transport, const std::string &step) {
        EXPECT_EQ(KOVA::CRED_REQ_ERR_CURL_OTHER, transport.GetError()) << step;
        EXPECT_EQ(CURLE_PEER_FAILED_VERIFICATION, transport.GetCurlCode()) << step;
        EXPECT_FALSE(transport.GetCurlErrorText().empty()) << step;
        EXPECT_EQ(0u, https.CountPath("/webapi/auth.cgi")) << step << ": the secret was sent";
    };

    // Refused at the description query, then (description cached) at the encryption query.
    CredRequest verifying;
    verifying.SetHTTPSVerify(true);
    KOVA_CRED_SESS sess;
    EXPECT_FALSE(CredRequestUtil::LoginWithOTP(&cred, "", &sess, nullptr, &verifying));
    expectRefused(verifying, "uncached login");
    EXPECT_EQ(0u, https.RequestCount());
    ASSERT_TRUE(CredRequestUtil::GetWebAPIDesc(&cred));
    EXPECT_FALSE(CredRequestUtil::LoginWithOTP(&cred, "", &sess, nullptr, &verifying));
    expectRefused(verifying, "cached login");
    CredRequestUtil::RemoveWebAPIDesc(&cred);
    EXPECT_FALSE(CredRequestUtil::GetWebAPIDesc(&cred, &verifying));
    expectRefused(verifying, "description");

    // The server's own certificate as CA file: every step passes, and the outcome is cleared.
    CredRequest trusting;
    trusting.SetCAFile(caFile);
    trusting.SetError(KOVA::CRED_REQ_ERR_UNKNOWN);
    ASSERT_TRUE(CredRequestUtil::LoginWithOTP(&cred, "", &sess, nullptr, &trusting)) << LogDump();
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NONE, trusting.GetError());
    EXPECT_EQ(1u, https.CountPath("/webapi/auth.cgi"));
    EXPECT_TRUE(Sim().SessionValid(sess.access_token));

    // Logout: with the description cached, its own post is the first request.
    https.ClearRecords();
    EXPECT_FALSE(CredRequestUtil::Logout(&cred, sess.access_token, &verifying));
    expectRefused(verifying, "logout");
    EXPECT_TRUE(Sim().SessionValid(sess.access_token));
    EXPECT_TRUE(CredRequestUtil::Logout(&cred, sess.access_token, &trusting)) << LogDump();
    EXPECT_FALSE(Sim().SessionValid(sess.access_token));

    // A server that never answers: the transport's deadline bounds the login as a whole (the
    // redirect probe and the description query), before any response time-out.
    kovasim::FaultServer silent(kovasim::Fault::kSilent);
    ASSERT_TRUE(silent.Start());
    KOVA_CRED silentCred = Cred(silent.Port());
    CredRequestUtil::RemoveWebAPIDesc(&silentCred);  // the same id as `cred`
    CredRequest bounded;
    bounded.SetResponseTimeout(5);
    bounded.SetTotalTimeout(300);
    EXPECT_FALSE(CredRequestUtil::LoginWithOTP(&silentCred, "", &sess, nullptr, &bounded));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_TIMEOUT, bounded.GetError());
    EXPECT_EQ(CURLE_OPERATION_TIMEDOUT, bounded.GetCurlCode());
    // The deadline's time-out, not the low-speed abort ("Operation too slow").
    EXPECT_TRUE(std::regex_search(bounded.GetCurlErrorText(),
                                  std::regex("timed out after [0-9]+ milliseconds")))
        << bounded.GetCurlErrorText();
}

class WebApiRedirectTest : public WebApiAuthTest {
  protected:
    void SetUp() override {
        WebApiAuthTest::SetUp();
        kovasim::LoopbackServer::Options tls;
        tls.https = true;
        https_ = std::make_unique<kovasim::LoopbackServer>(tls);
        Sim().Install(*https_);
        ASSERT_TRUE(https_->Start());
        redirect_ = std::make_unique<kovasim::LoopbackServer>();
        kovasim::WebApiSim::InstallRedirect(*redirect_, https_->Port());
        ASSERT_TRUE(redirect_->Start());
    }
    std::unique_ptr<kovasim::LoopbackServer> https_;
    std::unique_ptr<kovasim::LoopbackServer> redirect_;
};

TEST_F(WebApiRedirectTest, OnlyPlainHttpCredentialsAreProbedAndFollowTheRedirect) {
    const struct {
        const char *protocol;
        bool probed;
    } cases[] = {{"http", true},   {"Http", true},   {"HTTP", true},
                 {"https", false}, {"HTTPS", false}, {"Https", false}};
    for (const auto &c : cases) {
        SCOPED_TRACE(c.protocol);
        KOVA_CRED cred = Cred(redirect_->Port());
        cred.protocol = c.protocol;
        redirect_->ClearRecords();
        ASSERT_TRUE(CredRequestUtil::CheckRedirect(&cred)) << LogDump();
        EXPECT_EQ(c.probed ? "https" : c.protocol, cred.protocol);
        EXPECT_EQ("127.0.0.1", cred.host);
        EXPECT_EQ(c.probed ? https_->Port() : redirect_->Port(), cred.port);
        ASSERT_EQ(c.probed ? 1u : 0u, redirect_->RequestCount());
        if (c.probed) {
            EXPECT_EQ("/webapi/query.cgi", redirect_->Last().path);
        }
    }
    EXPECT_FALSE(CredRequestUtil::CheckRedirect(nullptr));
}

TEST_F(WebApiRedirectTest, LoginGoesToTheRedirectTargetWithOnlyTheGivenFields) {
    KOVA_CRED cred = Cred(redirect_->Port());
    KOVA_CRED_SESS sess;
    ASSERT_TRUE(CredRequestUtil::Login(&cred, &sess)) << LogDump();
    EXPECT_TRUE(Sim().SessionValid(sess.access_token));
    EXPECT_EQ("https", cred.protocol);
    EXPECT_EQ(https_->Port(), cred.port);
    EXPECT_EQ(1u, https_->CountPath("/webapi/auth.cgi"));
    // An empty application and one-time code are not sent.
    kovasim::WebApiSim::LoginRecord login = Sim().LastLogin();
    EXPECT_EQ(0u, login.params.count("session"));
    EXPECT_EQ(0u, login.params.count("otp_code"));
    // An unstored credential keeps its session in memory only.
    KOVA_CRED_SESS *list = nullptr;
    EXPECT_EQ(0, KOVACredSessListGet(&list, nullptr, nullptr));
    KOVACredSessListFree(&list);
}

// A refused probe changes nothing and leaves the request to report its own error; a Location is
// taken as the server sent it.
TEST_F(WebApiRedirectTest, RefusedProbeAndLocationsAsTheServerSentThem) {
    kovasim::RefusedPort closed;
    KOVA_CRED refused = Cred(closed.Port());
    EXPECT_TRUE(CredRequestUtil::CheckRedirect(&refused));
    EXPECT_EQ("http", refused.protocol);
    EXPECT_EQ(closed.Port(), refused.port);
    EXPECT_FALSE(CredRequestUtil::Login(&refused, nullptr));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_QUERY_FAIL, CredRequestUtil::m_errCode);

    // A blank in front of the address hides its scheme from the split: the credential stays
    // plain HTTP and the text before the last colon becomes its host.
    const struct {
        const char *location;  // nullptr: no Location header at all
        const char *log;       // nullptr: the probe succeeds
    } cases[] = {{nullptr, "Return 302, but no Location in header."},
                 {"https://[fe80::1", "Can not identify 302 Location: https://[fe80::1."},
                 {" https://127.0.0.1:5001/", nullptr}};
    for (const auto &c : cases) {
        SCOPED_TRACE(c.location ? c.location : "none");
        ClearLog();
        kovasim::LoopbackServer odd;
        const char *location = c.location;
        odd.Route("*", "/webapi/query.cgi",
                  [location](const httplib::Request &, httplib::Response &res) {
                      res.status = 302;
                      if (location != nullptr) {
                          res.set_header("Location", location);
                      }
                  });
        ASSERT_TRUE(odd.Start());
        KOVA_CRED cred = Cred(odd.Port());
        EXPECT_EQ(c.log == nullptr, CredRequestUtil::CheckRedirect(&cred));
        if (c.log != nullptr) {
            EXPECT_TRUE(LogHas(c.log)) << LogDump();
            EXPECT_FALSE(CredRequestUtil::Login(&cred, nullptr));
            EXPECT_TRUE(LogHas("CheckRedirect failed.")) << LogDump();
        } else {
            EXPECT_EQ("http", cred.protocol);
            EXPECT_EQ(" https", cred.host);
            EXPECT_EQ(0, cred.port);
        }
    }
}

TEST_F(WebApiAuthTest, SetWebApiUrlPlacesStandardParametersByFormat) {
    KOVA_CRED cred = Cred();
    CredRequest json;
    ASSERT_TRUE(CredRequestUtil::SetWebAPIURL(&cred, "KOVA.Demo.Json", 1, "get", &json));
    EXPECT_EQ("JSON", json.GetRequestFormat());
    EXPECT_EQ("http://127.0.0.1:" + std::to_string(Server().Port()) + "/webapi/entry.cgi",
              json.GetURL());
    Answer(json);
    kovasim::RecordedRequest wire = Server().Last();
    EXPECT_NE(std::string::npos, wire.query.find("api="));
    EXPECT_NE(std::string::npos, wire.query.find("method="));
    EXPECT_EQ(std::string::npos, wire.body.find("api="));

    CredRequest plain;
    ASSERT_TRUE(CredRequestUtil::SetWebAPIURL(&cred, "KOVA.Demo.Echo", 2, "echo", &plain));
    EXPECT_EQ("", plain.GetRequestFormat());
    ASSERT_TRUE(plain.Process(true, 0));
    wire = Server().Last();
    EXPECT_EQ("", wire.query);
    EXPECT_EQ("KOVA.Demo.Echo", wire.Param("api"));
    EXPECT_EQ("2", wire.Param("version"));
    EXPECT_EQ("echo", wire.Param("method"));

    CredRequest unknown;
    EXPECT_FALSE(CredRequestUtil::SetWebAPIURL(&cred, "KOVA.No.Such", 1, "x", &unknown));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_NO_SUCH_API, unknown.GetError());
    EXPECT_TRUE(LogHas("GetWebAPIPath fail![KOVA.No.Such]")) << LogDump();
    EXPECT_FALSE(CredRequestUtil::SetWebAPIURL(&cred, "KOVA.Demo.Echo", 0, "x", &unknown));
    EXPECT_FALSE(CredRequestUtil::SetWebAPIURL(nullptr, "KOVA.Demo.Echo", 1, "x", &unknown));
}

}  // namespace
}  // namespace kova_test
