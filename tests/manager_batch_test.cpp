// kovacred batch: calls from a JSON file run together through the request manager against a
// loopback server; answers on standard output in input order, failures named on standard
// error.
#include <fstream>
#include <sstream>
#include <string>

#include <gtest/gtest.h>

#include "platform/json_text.h"
#include "simlib/loopback_server.h"
#include "support/temp_dir.h"

namespace {

class BatchCommandTest : public ::testing::Test {
  protected:
    void SetUp() override {
        server_.Route("*", "/number", [](const httplib::Request &req, httplib::Response &res) {
            res.set_content("{\"n\":" + req.get_param_value("n") + "}", "application/json");
        });
        server_.Route("*", "/text", [](const httplib::Request &, httplib::Response &res) {
            res.set_content("not json", "text/plain");
        });
        ASSERT_TRUE(server_.Start()) << server_.Error();
    }
    void TearDown() override { server_.Stop(); }

    // Writes `calls` to a file and runs the command on it; its exit status.
    int RunBatch(const Json::Value &calls) {
        std::string file = dir_.File("calls.json");
        std::ofstream(file) << kova::JsonToString(calls);
        return RunBatchFile(file);
    }
    int RunBatchFile(const std::string &file) {
        std::string errFile = dir_.File("stderr.txt");
        out_.clear();
        int status =
            kova_test::RunCommand(kova_test::ToolCommand(KOVACRED_BIN) + " --db " +
                                      dir_.File("db.sqlite") + " batch " + file + " 2>" + errFile,
                                  &out_);
        std::ifstream in(errFile);
        std::stringstream text;
        text << in.rdbuf();
        err_ = text.str();
        return status;
    }
    Json::Value UrlCall(const std::string &target) const {
        Json::Value call;
        call["url"] = server_.BaseUrl() + target;
        return call;
    }
    Json::Value Output() const {
        Json::Value value;
        EXPECT_TRUE(kova::JsonFromString(out_.substr(0, out_.find_last_not_of('\n') + 1), value))
            << out_;
        return value;
    }

    kova_test::TempDir dir_;
    // More workers than calls: a worker stays with its keep-alive connection while the
    // manager's run holds it open.
    static kovasim::LoopbackServer::Options ServerOptions() {
        kovasim::LoopbackServer::Options options;
        options.threads = 40;
        return options;
    }
    kovasim::LoopbackServer server_{ServerOptions()};
    std::string out_;
    std::string err_;
};

TEST_F(BatchCommandTest, LargeBatchAnswersInInputOrderWithProgress) {
    constexpr int kCalls = 25;
    Json::Value calls(Json::arrayValue);
    for (int i = 0; i < kCalls; ++i) {
        calls.append(UrlCall("/number?n=" + std::to_string(i)));
    }
    calls.append(UrlCall("/text"));
    EXPECT_EQ(0, RunBatch(calls)) << err_;
    Json::Value answers = Output();
    ASSERT_TRUE(answers.isArray());
    ASSERT_EQ(static_cast<Json::ArrayIndex>(kCalls + 1), answers.size());
    for (int i = 0; i < kCalls; ++i) {
        EXPECT_EQ(i, answers[i]["n"].asInt()) << i;
    }
    EXPECT_EQ("not json", answers[kCalls].asString());
    EXPECT_NE(std::string::npos, err_.find("running 26 calls")) << err_;
    EXPECT_EQ(static_cast<size_t>(kCalls), server_.CountPath("/number"));
}

TEST_F(BatchCommandTest, FailedCallsAreNamedAndExitNonZero) {
    Json::Value calls(Json::arrayValue);
    calls.append(UrlCall("/number?n=7"));
    calls.append(UrlCall("/missing"));
    Json::Value bad;
    bad["neither"] = 1;
    calls.append(bad);
    EXPECT_NE(0, RunBatch(calls));

    Json::Value answers = Output();
    ASSERT_EQ(3u, answers.size());
    EXPECT_EQ(7, answers[0]["n"].asInt());
    EXPECT_TRUE(answers[2].isNull());
    EXPECT_EQ(std::string::npos, err_.find("call 0 failed")) << err_;
    EXPECT_NE(std::string::npos, err_.find("call 1 failed: HTTP status 404")) << err_;
    EXPECT_NE(std::string::npos, err_.find("call 2 failed")) << err_;
    // Small batches print no progress.
    EXPECT_EQ(std::string::npos, err_.find("running")) << err_;
}

TEST_F(BatchCommandTest, RejectsFilesThatAreNotArraysOfCalls) {
    std::string file = dir_.File("object.json");
    std::ofstream(file) << "{\"url\": \"http://127.0.0.1/\"}";
    EXPECT_NE(0, RunBatchFile(file));
    EXPECT_NE(std::string::npos, err_.find("JSON array")) << err_;

    EXPECT_NE(0, RunBatchFile(dir_.File("absent.json")));
    EXPECT_NE(std::string::npos, err_.find("cannot read")) << err_;
    EXPECT_EQ(0u, server_.RequestCount());
}

}  // namespace
