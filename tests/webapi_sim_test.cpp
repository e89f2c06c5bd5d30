// The simulator's own contract: JSON error answers for every bad request (never a crash),
// configuration checks, and enough worker threads for many concurrent slow calls.
#include <atomic>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "webapi_fixture.h"

namespace kova_test {
namespace {

using KOVA::CredRequest;

class WebApiSimTest : public WebApiTest {
  protected:
    // Posts a raw form body to /webapi/<cgi> and returns the answer's error code (0 on success).
    static int Post(const std::string &cgi, const std::string &body, Json::Value *answer = nullptr,
                    const std::string &query = "") {
        CredRequest request;
        request.SetURL(Server().BaseUrl() + "/webapi/" + cgi + query);
        request.AddRawParam(body);
        EXPECT_TRUE(request.Process(true, 0)) << request.GetError();
        Json::Value parsed = ParseBody(request.GetResponse());
        if (answer != nullptr) {
            *answer = parsed;
        }
        EXPECT_TRUE(parsed.isObject()) << request.GetResponse();
        return parsed["success"].asBool() ? 0 : parsed["error"]["code"].asInt();
    }
};

TEST_F(WebApiSimTest, BadRequestsGetJsonErrors) {
    using S = kovasim::WebApiSim;
    const std::string login = "api=KOVA.API.Auth&version=3&method=login&account=admin";
    const struct {
        const char *cgi;
        std::string body;
        int code;
        const char *query;
    } cases[] = {
        {"entry.cgi", "version=1&method=echo", S::kErrMissingParam, ""},
        {"entry.cgi", "garbage", S::kErrMissingParam, ""},
        {"entry.cgi", "api=KOVA.None&version=1&method=x", S::kErrNoSuchApi, ""},
        {"auth.cgi", "api=KOVA.Demo.Echo&version=1&method=x", S::kErrNoSuchApi, ""},
        {"entry.cgi", "api=KOVA.Demo.Echo&version=3&method=x", S::kErrBadVersion, ""},
        {"entry.cgi", "api=KOVA.Demo.Echo&version=one&method=x", S::kErrBadParam, ""},
        {"query.cgi", "api=KOVA.API.Info&version=1&method=x", S::kErrNoSuchMethod, ""},
        {"auth.cgi", login + "&passwd=secret", S::kErrNeedEncryption, ""},
        {"auth.cgi", "api=KOVA.API.Auth&version=1&method=login&account=admin", S::kErrBadVersion,
         ""},
        {"auth.cgi", Sim().CipherKey() + "=%21%21notbase64", S::kErrBadEnvelope, ""},
        {"auth.cgi", Sim().CipherKey() + "=QUJDRA%3D%3D", S::kErrBadEnvelope, ""},
        {"entry.cgi", "__tXeTrEhPiC=QUJD&__nEkOtReHpIc=wrong", S::kErrBadEnvelope, ""},
        {"entry.cgi", "api=KOVA.Demo.Session&version=1&method=x&_sid=unknown",
         S::kErrInvalidSession, ""},
        {"auth.cgi", "api=KOVA.API.Auth&version=1&method=logout&_sid=unknown",
         S::kErrInvalidSession, ""},
        {"auth.cgi", "api=KOVA.API.Auth&version=1&method=logout", S::kErrMissingParam, ""},
        {"entry.cgi", "count=notjson", S::kErrBadParam,
         "?api=%22KOVA.Demo.Json%22&version=%221%22&method=%22get%22"},
        {"delay.cgi", "api=KOVA.Demo.Delay&version=1&method=x&ms=z", S::kErrBadParam, ""},
    };
    for (const auto &c : cases) {
        EXPECT_EQ(c.code, Post(c.cgi, c.body, nullptr, c.query)) << c.cgi << " " << c.body;
    }

    Json::Value answer;
    EXPECT_EQ(0,
              Post("encryption.cgi", "api=KOVA.API.Encryption&version=1&method=getinfo", &answer));
    EXPECT_EQ(Sim().PublicKeyHex(), answer["data"]["public_key"].asString());
    EXPECT_TRUE(answer["data"]["server_time"].isIntegral());
    EXPECT_EQ(0, Post("query.cgi", "api=KOVA.API.Info&version=1&method=query&query=KOVA.API.Auth",
                      &answer));
    EXPECT_EQ(1u, answer["data"].size());
}

TEST_F(WebApiSimTest, UploadNeedsASessionAndAFile) {
    KOVA_CRED cred = Cred();
    KOVA_CRED_SESS sess;
    ASSERT_TRUE(KOVA::CredRequestUtil::Login(&cred, &sess));
    TempDir dir;
    std::string path = dir.File("data.bin");
    std::ofstream(path) << "0123456789";
    std::unique_ptr<CredRequest> request(CredRequest::CreateWebAPIRequest(
        &cred, &sess, "KOVA.Demo.Upload", 1, "put", Json::Value()));
    ASSERT_TRUE(request);
    ASSERT_TRUE(request->SetUploadFile("file", path.c_str()));
    Json::Value answer = Answer(*request);
    EXPECT_EQ(10, answer["data"]["size"].asInt());
    EXPECT_EQ("data.bin", answer["data"]["name"].asString());
    ASSERT_FALSE(Sim().Uploads().empty());
    EXPECT_EQ("0123456789", Sim().Uploads().back().content);
    // The session id travels in the query, not in the multipart form.
    const kovasim::RecordedRequest wire = Server().Last();
    EXPECT_EQ(0u, wire.query.find("_sid=" + sess.access_token)) << wire.query;
    for (const auto &part : wire.parts) {
        EXPECT_NE("_sid", part.name);
    }

    EXPECT_EQ(
        kovasim::WebApiSim::kErrMissingParam,
        Post("upload.cgi", "api=KOVA.Demo.Upload&version=1&method=put&_sid=" + sess.access_token));
}

TEST_F(WebApiSimTest, ConfigurationIsCheckedBeforeItApplies) {
    kovasim::WebApiSim sim;
    std::string error;
    EXPECT_FALSE(sim.Configure(ParseBody(R"({"apis": {"X.Y": {"handler": "echo"}}})"), &error));
    EXPECT_NE(std::string::npos, error.find("path")) << error;
    for (const char *bad : {R"({"accounts": "admin"})", R"({"delayMs": "slow"})",
                            R"({"apis": {"X.Y": {"path": "x.cgi", "handler": "nonsense"}}})"}) {
        EXPECT_FALSE(sim.Configure(ParseBody(bad), &error)) << bad;
    }
    EXPECT_FALSE(sim.Configure(Json::Value("text"), &error));

    EXPECT_TRUE(sim.Configure(ParseBody(R"({"apis": {"X.Custom": {"path": "custom.cgi",
        "requestFormat": "JSON"}, "KOVA.Demo.Delay": null}, "delayMs": 5,
        "accounts": [{"account": "ops", "password": "pw"}]})"),
                              &error))
        << error;
    kovasim::LoopbackServer server;
    sim.Install(server);
    ASSERT_TRUE(server.Start());
    KOVA_CRED cred = Cred(server.Port(), "ops", "pw");
    EXPECT_EQ("custom.cgi", KOVA::CredRequestUtil::GetWebAPIPath(&cred, "X.Custom"));
    EXPECT_EQ("JSON", KOVA::CredRequestUtil::GetWebAPIRequestFormat(&cred, "X.Custom"));
    EXPECT_EQ("", KOVA::CredRequestUtil::GetWebAPIPath(&cred, "KOVA.Demo.Delay"));
    EXPECT_TRUE(KOVA::CredRequestUtil::Login(&cred, nullptr));
}

TEST_F(WebApiSimTest, ServesManySlowCallsAtOnce) {
    kovasim::LoopbackServer::Options options;
    options.threads = 256;
    kovasim::LoopbackServer wide(options);
    Sim().Install(wide);
    ASSERT_TRUE(wide.Start());
    const std::string url = wide.BaseUrl() + "/webapi/delay.cgi";
    auto call = [&url] {
        CredRequest request;
        request.SetURL(url);
        request.AddRawParam("api=KOVA.Demo.Delay&version=1&method=wait&ms=400");
        return request.Process(true, 0);
    };
    ASSERT_TRUE(call());  // initialises libcurl on this thread first
    const int clients = 96;
    std::atomic<int> done{0};
    std::vector<std::thread> threads;
    for (int i = 0; i < clients; ++i) {
        threads.emplace_back([&] { done += call() ? 1 : 0; });
    }
    for (auto &t : threads) {
        t.join();
    }
    EXPECT_EQ(clients, done.load());
    EXPECT_GE(Sim().MaxConcurrent(), clients / 2);
}

}  // namespace
}  // namespace kova_test
