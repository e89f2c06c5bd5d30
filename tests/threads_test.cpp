// Several threads at once, each with objects of its own: requests whose parameters and answers
// go through the JSON reader and writer, encryption information, factories that share the
// description cache, and relay look-ups. Each scenario runs in a forked child, so that a crash
// or a hang fails its test alone.
#include <atomic>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "kovacredential/cred_request_farlink.h"
#include "relay_fixture.h"
#include "support/child.h"
#include "webapi_fixture.h"

namespace {

using KOVA::CredRequest;
using KOVA::CredRequestUtil;

// In a forked child, runs `work(thread, round)` for `rounds` rounds on each of `threads`
// threads and expects every call to return true (each failure is reported on standard error),
// then, when given, `after` on the child's first thread once all have ended.
void ExpectOnThreads(int threads, int rounds, const std::function<bool(int, int)> &work,
                     const std::function<bool()> &after = nullptr) {
    const std::string ended = kova_test::RunInChild(60, [&] {
        std::atomic<int> failures{0};
        std::vector<std::thread> pool;
        for (int t = 0; t < threads; ++t) {
            pool.emplace_back([&, t] {
                for (int r = 0; r < rounds; ++r) {
                    if (!work(t, r)) {
                        fprintf(stderr, "thread %d round %d failed\n", t, r);
                        ++failures;
                    }
                }
            });
        }
        for (std::thread &thread : pool) {
            thread.join();
        }
        if (after && !after()) {
            fprintf(stderr, "the check after the threads failed\n");
            ++failures;
        }
        return failures.load();
    });
    EXPECT_EQ(ended, "exit 0");
}

class ThreadsWebApiTest : public kova_test::WebApiTest {};

// Numbers and arrays travel in their JSON form (the writer) and come back in the answer (the
// reader); encryption information is asked at the same time. The last error is one value for
// the whole process: what the failed probes left is what the first thread reads, and the
// library's stores of it do not race.
TEST_F(ThreadsWebApiTest, JsonParametersEncryptionInformationAndTheLastError) {
    const KOVA_CRED cred = Cred();
    ASSERT_FALSE(CredRequestUtil::GetWebAPIPath(&cred, "KOVA.Demo.Json").empty());
    const std::string encUrl = Server().BaseUrl() + "/webapi/encryption.cgi";
    const std::string missing = Server().BaseUrl() + "/missing";
    CredRequestUtil::m_errCode = KOVA::CRED_REQ_ERR_NONE;
    ExpectOnThreads(
        8, 20,
        [&](int t, int r) {
            CredRequest req;
            Json::Value params(Json::objectValue);
            params["n"] = t * 1000 + r;
            params["list"].append(t);
            params["list"].append(1.5);
            Json::Value answer, info;
            return CredRequestUtil::SetWebAPIURL(&cred, "KOVA.Demo.Json", 1, "get", &req) &&
                   req.AddPostParam(params) && req.Process() &&
                   kova::JsonFromString(req.GetResponse(), answer) &&
                   answer["data"]["params"] == params &&
                   (r % 4 != 0 || (CredRequestUtil::GetEncInfo(encUrl, info) &&
                                   info["public_key"].asString() == Sim().PublicKeyHex())) &&
                   (r % 4 != 1 || !CredRequestUtil::TestURL(missing));
        },
        [] { return CredRequestUtil::m_errCode == KOVA::CRED_REQ_ERR_QUERY_FAIL; });
}

// The threads start with an empty cache, so they race to fill and read it.
TEST_F(ThreadsWebApiTest, FactoriesShareTheDescriptionCache) {
    const int id = StoreCred();
    KOVA_CRED_SESS sess;
    ASSERT_TRUE(CredRequestUtil::GetAccessToken(static_cast<long>(id), &sess))
        << kova_test::LogDump();
    CredRequestUtil::m_jsData = Json::Value();
    ExpectOnThreads(8, 10, [&](int t, int r) {
        Json::Value params(Json::objectValue);
        params["who"] = std::to_string(t * 100 + r);
        std::unique_ptr<CredRequest> req(
            CredRequest::CreateWebAPIRequest(id, "KOVA.Demo.Echo", 1, "echo", params));
        Json::Value answer;
        return req && req->Process() && kova::JsonFromString(req->GetResponse(), answer) &&
               answer["data"]["params"]["who"] == params["who"];
    });
}

class ThreadsRelayTest : public kova_test::RelayDirectoryTest {
  protected:
    ThreadsRelayTest() : RelayDirectoryTest(2) {}
};

TEST_F(ThreadsRelayTest, LookUpsWithClientsOfTheirOwn) {
    kovasim::LoopbackServer::Options options;
    options.host = kovasim::ProcessLoopbackAddress(10);
    options.threads = 16;
    kovasim::LoopbackServer target(options);
    kovasim::InstallPingPong(target, "S1");
    ASSERT_TRUE(target.Start()) << target.Error();
    Serve(kova_test::ParseJson(
        R"({"serverID": "S1", "interface": [{"ip": "$0"}], "services": {"zon": {"port": $1}}})",
        {options.host, std::to_string(target.Port())}));
    const Json::Value expected = kova_test::Candidate("http", options.host, target.Port());
    ExpectOnThreads(8, 5, [&](int, int) {
        Json::Value candidate;
        return KOVA::CredRequestFarlink::GetConnInfo("S1", candidate, nullptr) &&
               candidate == expected;
    });
}

}  // namespace
