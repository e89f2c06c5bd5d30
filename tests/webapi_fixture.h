// Shared set-up of the WebAPI tests: one in-process simulator per test program (its RSA key
// is made once), a fresh temporary credential database, an empty description cache and empty
// log and request records for every test.
#ifndef KOVA_TESTS_WEBAPI_FIXTURE_H
#define KOVA_TESTS_WEBAPI_FIXTURE_H

#include <memory>
#include <set>
#include <string>

#include <gtest/gtest.h>

#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_util.h"
#include "kovacredential/kovacred.h"
#include "kovacredential/kovacredsetter.h"
#include "platform/json_text.h"
#include "simlib/loopback_server.h"
#include "simlib/relay_sim.h"
#include "simlib/webapi_sim.h"
#include "support/interpose.h"
#include "support/temp_dir.h"

namespace kova_test {

class WebApiTest : public ::testing::Test {
  protected:
    static void SetUpTestSuite() {
        sim_ = new kovasim::WebApiSim();
        kovasim::LoopbackServer::Options options;
        options.threads = 32;
        server_ = new kovasim::LoopbackServer(options);
        sim_->Install(*server_);
        ASSERT_TRUE(server_->Start()) << server_->Error();
    }
    static void TearDownTestSuite() {
        server_->Stop();
        delete server_;
        delete sim_;
        server_ = nullptr;
        sim_ = nullptr;
    }

    void SetUp() override {
        KOVA::CredRequestUtil::m_jsData = Json::Value();
        KOVA::CredRequestUtil::m_errCode = 0;
        db_ = std::make_unique<TempDatabase>();
        server_->ClearRecords();
        ClearLog();
    }
    void TearDown() override { db_.reset(); }

    static kovasim::WebApiSim &Sim() { return *sim_; }
    static kovasim::LoopbackServer &Server() { return *server_; }

    // A credential record for the simulator, or for the server on `port` (not stored).
    static KOVA_CRED Cred(int port = 0, const std::string &account = "admin",
                          const std::string &password = "secret",
                          const std::string &application = "") {
        KOVA_CRED cred;
        cred.protocol = "http";
        cred.host = "127.0.0.1";
        cred.port = port != 0 ? port : Server().Port();
        cred.remote_account = account;
        cred.remote_passwd = password;
        cred.application = application;
        return cred;
    }

    // Stores a credential for the simulator; returns its id.
    static int StoreCred(const std::string &account = "admin",
                         const std::string &password = "secret",
                         const std::string &application = "") {
        KOVA_CRED cred = Cred(0, account, password, application);
        EXPECT_EQ(0, KOVACredAdd(&cred));
        EXPECT_GT(cred.id, 0);
        return cred.id;
    }

    // Stores a credential for the simulator and returns it as the store gives it back.
    static KOVA_CRED StoredCred(const std::string &account = "admin",
                                const std::string &password = "secret",
                                const std::string &application = "") {
        KOVA_CRED cred;
        EXPECT_EQ(0, KOVACredGetByID(StoreCred(account, password, application), &cred));
        return cred;
    }

    // Runs `request` and returns its parsed answer, expecting both to succeed.
    static Json::Value Answer(KOVA::CredRequest &request) {
        EXPECT_TRUE(request.Process(true, 0)) << request.GetError() << "\n" << LogDump();
        Json::Value answer = ParseBody(request.GetResponse());
        EXPECT_TRUE(answer["success"].asBool()) << request.GetResponse();
        return answer;
    }

    // A started server answering `path` with `body`; with `withSim` the simulator serves its
    // other CGIs (discovery, encryption).
    static std::unique_ptr<kovasim::LoopbackServer> FixedAnswer(const std::string &path,
                                                                const std::string &body,
                                                                bool withSim) {
        auto server = std::make_unique<kovasim::LoopbackServer>();
        server->Route("*", path, [body](const httplib::Request &, httplib::Response &res) {
            res.set_content(body, "application/json");
        });
        if (withSim) {
            Sim().Install(*server);
        }
        EXPECT_TRUE(server->Start()) << server->Error();
        return server;
    }

    static std::set<std::string> ParamNames(const kovasim::RecordedRequest &r) {
        std::set<std::string> names;
        for (const auto &p : r.params) {
            names.insert(p.first);
        }
        return names;
    }

    static Json::Value ParseBody(const std::string &body) {
        Json::Value v;
        kova::JsonFromString(body, v);
        return v;
    }

    std::unique_ptr<TempDatabase> db_;
    static kovasim::WebApiSim *sim_;
    static kovasim::LoopbackServer *server_;
};

inline kovasim::WebApiSim *WebApiTest::sim_ = nullptr;
inline kovasim::LoopbackServer *WebApiTest::server_ = nullptr;

}  // namespace kova_test

#endif  // KOVA_TESTS_WEBAPI_FIXTURE_H
