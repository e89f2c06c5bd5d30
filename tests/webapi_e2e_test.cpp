// kovacred against a kovasim process: the programs as a user runs them.
#include <signal.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <fstream>
#include <memory>
#include <sstream>
#include <string>
#include <thread>

#include <gtest/gtest.h>

#include "support/sim_process.h"
#include "support/temp_dir.h"

namespace kova_test {
namespace {

class WebApiE2eTest : public ::testing::Test {
  protected:
    void SetUp() override {
        sim_ = std::make_unique<SimProcess>(dir_);
        ASSERT_GT(sim_->HttpPort(), 0);
        ASSERT_GT(sim_->HttpsPort(), 0);
    }
    // Runs kovacred with the test's database; standard error is kept in `err`.
    int Kovacred(const std::string &args, std::string *out = nullptr, std::string *err = nullptr,
                 const std::string &input = "") {
        std::string errFile = dir_.File("stderr");
        std::string command = (input.empty() ? "" : "printf '%s\\n' '" + input + "' | ") +
                              ToolCommand(KOVACRED_BIN) + " --db " + dir_.File("db.sqlite") + " " +
                              args + " 2>" + errFile;
        int status = RunCommand(command, out);
        if (err != nullptr) {
            std::ifstream in(errFile);
            std::stringstream text;
            text << in.rdbuf();
            *err = text.str();
        }
        return status;
    }
    int Add(const std::string &account, const std::string &password, int port,
            const std::string &protocol = "http") {
        return Kovacred("add --host 127.0.0.1 --port " + std::to_string(port) + " --protocol " +
                            protocol + " --account " + account + " --application e2e",
                        nullptr, nullptr, password);
    }

    TempDir dir_;
    std::unique_ptr<SimProcess> sim_;
};

TEST_F(WebApiE2eTest, AddLoginCallLogout) {
    ASSERT_EQ(0, Add("admin", "secret", sim_->HttpPort()));
    std::string out;
    std::string err;
    ASSERT_EQ(0, Kovacred("login 1", &out, &err)) << err;
    EXPECT_NE(std::string::npos, out.find("session stored for credential 1")) << out;

    ASSERT_EQ(0, Kovacred("call 1 KOVA.Demo.Echo 1 echo greeting=hello", &out, &err)) << err;
    EXPECT_NE(std::string::npos, out.find("\"greeting\":\"hello\"")) << out;
    EXPECT_NE(std::string::npos, out.find("\"success\":true")) << out;

    ASSERT_EQ(0, Kovacred("call 1 KOVA.Demo.Session 1 whoami --pretty", &out, &err)) << err;
    EXPECT_NE(std::string::npos, out.find("\"account\" : \"admin\"")) << out;

    ASSERT_EQ(0, Kovacred("apis 1", &out, &err)) << err;
    EXPECT_NE(std::string::npos, out.find("KOVA.Demo.Json")) << out;
    EXPECT_NE(std::string::npos, out.find("JSON")) << out;

    ASSERT_EQ(0, Kovacred("logout 1", &out, &err)) << err;
    EXPECT_NE(0, Kovacred("logout 1", &out, &err));
    EXPECT_NE(std::string::npos, err.find("no stored session")) << err;
    EXPECT_EQ(0, sim_->Stop());
}

TEST_F(WebApiE2eTest, WrongPasswordAndOneTimeCodeFailClearly) {
    ASSERT_EQ(0, Add("admin", "wrong", sim_->HttpPort()));
    ASSERT_EQ(0, Add("otpuser", "secret", sim_->HttpPort()));
    std::string out;
    std::string err;
    EXPECT_NE(0, Kovacred("login 1", &out, &err));
    EXPECT_EQ("kovacred: login failed (error 400: wrong account or password)\n", err);
    EXPECT_NE(0, Kovacred("call 1 KOVA.Demo.Echo 1 echo", &out, &err));
    EXPECT_EQ(1, std::count(err.begin(), err.end(), '\n')) << err;

    EXPECT_NE(0, Kovacred("login 2", &out, &err));
    EXPECT_EQ("kovacred: login failed (error 403: one-time code required)\n", err);
    EXPECT_NE(0, Kovacred("login 2 --otp 000000", &out, &err));
    EXPECT_EQ("kovacred: login failed (error 404: wrong one-time code)\n", err);
    EXPECT_EQ(0, Kovacred("login 2 --otp 123456", &out, &err)) << err;
}

TEST_F(WebApiE2eTest, UnknownApiAndIdFailWithOneLine) {
    ASSERT_EQ(0, Add("admin", "secret", sim_->HttpPort()));
    std::string out;
    std::string err;
    EXPECT_EQ(6, Kovacred("call 1 KOVA.No.Such 1 get", &out, &err));
    EXPECT_EQ("kovacred: call failed (error 6: the server does not offer KOVA.No.Such)\n", err);
    EXPECT_NE(0, Kovacred("call 9 KOVA.Demo.Echo 1 echo", &out, &err));
    EXPECT_EQ("kovacred: call failed: no credential with id 9\n", err);
}

TEST_F(WebApiE2eTest, HttpsAndRedirectedHttpWork) {
    TempDir other;
    SimProcess redirecting(other, "--redirect-http");
    ASSERT_GT(redirecting.HttpPort(), 0);
    ASSERT_EQ(0, Add("admin", "secret", sim_->HttpsPort(), "https"));
    ASSERT_EQ(0, Add("admin", "secret", redirecting.HttpPort(), "http"));
    std::string out;
    std::string err;
    ASSERT_EQ(0, Kovacred("call 1 KOVA.Demo.Session 1 whoami", &out, &err)) << err;
    EXPECT_NE(std::string::npos, out.find("\"account\":\"admin\"")) << out;
    ASSERT_EQ(0, Kovacred("login 2", &out, &err)) << err;
    EXPECT_NE(std::string::npos,
              out.find("https://127.0.0.1:" + std::to_string(redirecting.HttpsPort())))
        << out;
}

}  // namespace
}  // namespace kova_test
