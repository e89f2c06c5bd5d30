// The request manager with WebAPI requests against the in-process WebAPI simulator: requests
// by credential id, by records and by bare server address, discovery under pseudo-ids, and
// the factories' failures.
#include <fstream>
#include <memory>
#include <string>

#include "kovacredential/cred_request_mgr.h"
#include "webapi_fixture.h"

namespace {

using KOVA::CredRequest;
using KOVA::CredRequestMgr;
using KOVA::CredRequestUtil;

class ManagerWebApiTest : public kova_test::WebApiTest {
  protected:
    void SetUp() override {
        WebApiTest::SetUp();
        plain_ = FixedAnswer("/plain", "plain answer", false);
        queries_ = Sim().QueryHits();
        echoes_ = Sim().Hits("KOVA.Demo.Echo");
    }

    // Negative member names left in the description cache.
    static int PseudoEntries() {
        int count = 0;
        const Json::Value &desc = CredRequestUtil::m_jsData["webapiDesc"];
        if (!desc.isObject()) {
            return 0;
        }
        for (const std::string &name : desc.getMemberNames()) {
            if (!name.empty() && name[0] == '-') {
                ++count;
            }
        }
        return count;
    }

    std::unique_ptr<kovasim::LoopbackServer> plain_;
    size_t queries_ = 0;  // discovery queries and echo calls the simulator saw before the test
    size_t echoes_ = 0;
};

TEST_F(ManagerWebApiTest, MixedRequestsRunTogetherInAddingOrder) {
    long credId = StoreCred();
    KOVA_CRED cred;
    ASSERT_EQ(0, KOVACredGetByID(credId, &cred));
    KOVA_CRED_SESS sess;
    ASSERT_TRUE(CredRequestUtil::GetAccessToken(credId, &sess));
    ASSERT_FALSE(sess.access_token.empty());

    CredRequestMgr mgr;
    Json::Value one;
    one["word"] = "one";
    EXPECT_EQ(0, mgr.AddWebAPIRequest(credId, "KOVA.Demo.Echo", 1, "echo", one));
    Json::Value two;
    two["word"] = "two";
    EXPECT_EQ(1, mgr.AddWebAPIRequest(&cred, &sess, "KOVA.Demo.Echo", 2, "echo", two));
    Json::Value three;
    three["word"] = "three";
    EXPECT_EQ(2, mgr.AddCredRequest("http", "127.0.0.1", Server().Port(), sess.access_token,
                                    "KOVA.Demo.Echo", 1, "echo", three));
    auto *plain = new CredRequest();
    ASSERT_TRUE(plain->SetURL(plain_->BaseUrl() + "/plain"));
    EXPECT_EQ(3, mgr.AddCredRequest(plain));
    Json::Value headers;
    headers["X-Relay-Test"] = "yes";
    EXPECT_EQ(4,
              mgr.AddRelayRequest(credId, "KOVA.Demo.Echo", 1, "echo", headers, nullptr, nullptr));
    ASSERT_EQ(5, mgr.Size()) << kova_test::LogDump();

    EXPECT_TRUE(mgr.Run()) << kova_test::LogDump();
    Json::Value all = mgr.GetAllResponse();
    ASSERT_EQ(5u, all.size());
    const char *words[] = {"one", "two", "three"};
    for (int i = 0; i < 3; ++i) {
        Json::Value answer = ParseBody(all[i].asString());
        EXPECT_TRUE(answer["success"].asBool()) << all[i].asString();
        EXPECT_EQ(words[i], answer["data"]["params"]["word"].asString()) << i;
        EXPECT_EQ(sess.access_token, answer["data"]["params"]["_sid"].asString()) << i;
    }
    EXPECT_EQ(2, ParseBody(all[1].asString())["data"]["version"].asInt());
    EXPECT_EQ("plain answer", all[3].asString());
    EXPECT_TRUE(ParseBody(all[4].asString())["success"].asBool()) << all[4].asString();
    size_t relayed = 0;
    for (const auto &request : Server().Requests()) {
        relayed += request.path == "/webapi/entry.cgi" && request.Header("X-Relay-Test") == "yes";
    }
    EXPECT_EQ(1u, relayed);
    EXPECT_EQ(4u, Sim().Hits("KOVA.Demo.Echo") - echoes_);
}

TEST_F(ManagerWebApiTest, ServerAddressDiscoversUnderPseudoIdAndDropsIt) {
    CredRequestMgr mgr;
    ASSERT_FALSE(CredRequestUtil::IsCredIdCached(-1));
    Json::Value params;
    params["word"] = "x";
    ASSERT_EQ(0, mgr.AddCredRequest("http", "127.0.0.1", Server().Port(), "", "KOVA.Demo.Echo", 1,
                                    "echo", params))
        << kova_test::LogDump();
    EXPECT_EQ(1u, Sim().QueryHits() - queries_);
    EXPECT_FALSE(CredRequestUtil::IsCredIdCached(-1));
    EXPECT_EQ(0, PseudoEntries());
    EXPECT_EQ(Server().BaseUrl() + "/webapi/entry.cgi", mgr.GetRequest(0)->GetURL());

    // The pseudo-id is free again, so the next request discovers afresh under the same id and
    // again leaves nothing behind.
    ASSERT_EQ(1, mgr.AddCredRequest("http", "127.0.0.1", Server().Port(), "", "KOVA.Demo.Delay", 1,
                                    "wait", Json::Value()));
    EXPECT_EQ(2u, Sim().QueryHits() - queries_);
    EXPECT_EQ(0, PseudoEntries());
    EXPECT_EQ(Server().BaseUrl() + "/webapi/delay.cgi", mgr.GetRequest(1)->GetURL());

    ASSERT_TRUE(mgr.Run()) << kova_test::LogDump();
    Json::Value answer = ParseBody(mgr.GetResponse(0));
    EXPECT_TRUE(answer["success"].asBool());
    EXPECT_EQ("x", answer["data"]["params"]["word"].asString());
    // No session id given: none is sent.
    EXPECT_FALSE(answer["data"]["params"].isMember("_sid"));
    EXPECT_TRUE(ParseBody(mgr.GetResponse(1))["success"].asBool());
}

TEST_F(ManagerWebApiTest, ServerAddressSkipsPseudoIdsAlreadyCached) {
    // Whatever sits under -1 must be neither used nor dropped by the manager.
    Json::Value bogus;
    bogus["KOVA.Demo.Echo"]["path"] = "bogus.cgi";
    CredRequestUtil::m_jsData["webapiDesc"]["-1"] = bogus;

    CredRequestMgr mgr;
    ASSERT_EQ(0, mgr.AddCredRequest("http", "127.0.0.1", Server().Port(), "", "KOVA.Demo.Echo", 1,
                                    "echo", Json::Value()))
        << kova_test::LogDump();
    EXPECT_EQ(Server().BaseUrl() + "/webapi/entry.cgi", mgr.GetRequest(0)->GetURL());
    EXPECT_EQ(bogus, CredRequestUtil::m_jsData["webapiDesc"]["-1"]);
    EXPECT_FALSE(CredRequestUtil::IsCredIdCached(-2));
    EXPECT_EQ(1, PseudoEntries());
}

TEST_F(ManagerWebApiTest, FailuresAreLoggedAndAddNothing) {
    CredRequestMgr mgr;
    EXPECT_EQ(-1, mgr.AddCredRequest("http", "127.0.0.1", Server().Port(), "sid", "KOVA.No.Such", 1,
                                     "get", Json::Value()));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_QUERY_FAIL, mgr.GetError());
    EXPECT_EQ(1u, Sim().QueryHits() - queries_);
    EXPECT_EQ(0, PseudoEntries());

    // A server that cannot be reached.
    int port = plain_->Port();
    plain_->Stop();
    mgr.SetError(KOVA::CRED_REQ_ERR_NONE);
    EXPECT_EQ(-1, mgr.AddCredRequest("http", "127.0.0.1", port, "", "KOVA.Demo.Echo", 1, "echo",
                                     Json::Value()));
    EXPECT_EQ(KOVA::CRED_REQ_ERR_QUERY_FAIL, mgr.GetError());
    EXPECT_EQ(0, PseudoEntries());

    // The factories' failures are logged with the manager's line.
    EXPECT_EQ(-1, mgr.AddWebAPIRequest(4242L, "KOVA.Demo.Echo", 1, "echo", Json::Value()));
    EXPECT_TRUE(kova_test::LogHas("cred_request_mgr:39 CreateWebAPIRequest fail"))
        << kova_test::LogDump();
    KOVA_CRED_SESS sess;
    EXPECT_EQ(-1, mgr.AddWebAPIRequest(nullptr, &sess, "KOVA.Demo.Echo", 1, "echo", Json::Value()));
    EXPECT_TRUE(kova_test::LogHas("cred_request_mgr:58 CreateWebAPIRequest fail"));
    EXPECT_EQ(-1, mgr.AddRelayRequest(4242L, "KOVA.Demo.Echo", 1, "echo", Json::Value(), nullptr,
                                      nullptr));
    EXPECT_TRUE(kova_test::LogHas("cred_request_mgr:77 CreateRelayRequest fail"));
    EXPECT_EQ(0, mgr.Size());
    EXPECT_EQ(0u, Sim().Hits("KOVA.Demo.Echo") - echoes_);
}

TEST_F(ManagerWebApiTest, BatchCommandRunsCredentialAndUrlCalls) {
    long credId = StoreCred();
    Json::Value calls(Json::arrayValue);
    Json::Value byCred;
    byCred["cred"] = static_cast<Json::Int64>(credId);
    byCred["api"] = "KOVA.Demo.Echo";
    byCred["version"] = 1;
    byCred["method"] = "echo";
    byCred["params"]["word"] = "batch";
    calls.append(byCred);
    Json::Value byUrl;
    byUrl["url"] = plain_->BaseUrl() + "/plain";
    calls.append(byUrl);
    Json::Value unknown = byCred;
    unknown["cred"] = 4242;
    calls.append(unknown);
    std::string file = db_->dir().File("calls.json");
    std::ofstream(file) << kova::JsonToString(calls);

    std::string out;
    std::string errFile = db_->dir().File("stderr.txt");
    int status = kova_test::RunCommand(kova_test::ToolCommand(KOVACRED_BIN) + " --db " +
                                           db_->path() + " batch " + file + " 2>" + errFile,
                                       &out);
    std::ifstream errIn(errFile);
    std::string err((std::istreambuf_iterator<char>(errIn)), std::istreambuf_iterator<char>());
    EXPECT_NE(0, status);
    Json::Value answers = ParseBody(out.substr(0, out.find_last_not_of('\n') + 1));
    ASSERT_EQ(3u, answers.size()) << out;
    EXPECT_TRUE(answers[0]["success"].asBool()) << out;
    EXPECT_EQ("batch", answers[0]["data"]["params"]["word"].asString());
    EXPECT_EQ("plain answer", answers[1].asString());
    EXPECT_TRUE(answers[2].isNull());
    EXPECT_NE(std::string::npos, err.find("call 2 failed")) << err;
    EXPECT_EQ(std::string::npos, err.find("call 0 failed")) << err;
}

}  // namespace
