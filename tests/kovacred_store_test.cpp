// kovacred's store commands end to end on a temporary database: output, failure messages,
// exit codes, and that no password ever reaches the output.
#include <string>

#include <gtest/gtest.h>

#include "store_fixture.h"

namespace {

using namespace store_test;

const char kPassword[] = "pa$$'w0rd\"-SECRET";

class KovacredStoreTest : public StoreTest {
  protected:
    // Runs kovacred on the test database with `input` on standard input; returns the exit
    // status and collects standard output and standard error.
    int Run(const std::string &args, const std::string &input = "") {
        const std::string in = db_.dir().File("stdin");
        const std::string err = db_.dir().File("stderr");
        FILE *f = fopen(in.c_str(), "w");
        fwrite(input.data(), 1, input.size(), f);
        fclose(f);
        out_.clear();
        int status =
            kova_test::RunCommand(kova_test::ToolCommand(KOVACRED_BIN) + " --db '" + DbPath() +
                                      "' " + args + " <'" + in + "' 2>'" + err + "'",
                                  &out_);
        err_.clear();
        if (FILE *e = fopen(err.c_str(), "r")) {
            char buf[4096];
            size_t n;
            while ((n = fread(buf, 1, sizeof(buf), e)) > 0) {
                err_.append(buf, n);
            }
            fclose(e);
        }
        return status;
    }

    void AddTwo() {
        ASSERT_EQ(Run("add --host nas.example --port 5001 --protocol https --account admin "
                      "--application backup --extra '{\"note\":1}' --owner 1026",
                      std::string(kPassword) + "\n"),
                  0)
            << err_;
        EXPECT_EQ(out_, "added credential 1\n");
        ASSERT_EQ(
            Run("add --host 10.0.0.7 --port 5000 --protocol http --account ops", "other-secret\n"),
            0)
            << err_;
    }

    std::string out_;
    std::string err_;
};

TEST_F(KovacredStoreTest, AddStoresThePasswordFromStandardInput) {
    AddTwo();
    CredPtr cred = NewCred();
    ASSERT_EQ(KOVACredGetByID(1, cred.get()), 0);
    EXPECT_EQ(cred->remote_passwd, kPassword);  // one line, without its newline
    EXPECT_EQ(cred->host, "nas.example");
    EXPECT_EQ(cred->port, 5001);
    EXPECT_EQ(cred->owner, 1026);
    EXPECT_EQ(cred->extra_info, "{\"note\":1}");
    EXPECT_EQ(cred->application, "backup");
    CredPtr second = NewCred();
    ASSERT_EQ(KOVACredGetByID(2, second.get()), 0);
    EXPECT_EQ(second->remote_passwd, "other-secret");
    EXPECT_EQ(second->owner, -1);
    EXPECT_EQ(second->protocol, "http");
}

TEST_F(KovacredStoreTest, ListAndShowNeverPrintPasswords) {
    AddTwo();
    ASSERT_EQ(Run("list"), 0) << err_;
    EXPECT_EQ(out_.find("SECRET"), std::string::npos) << out_;
    EXPECT_EQ(out_.find("other-secret"), std::string::npos) << out_;
    // Header then the rows oldest first, columns aligned.
    const size_t header = out_.find("ID  HOST         PORT  PROTOCOL");
    const size_t first = out_.find("\n1   nas.example  5001  https");
    const size_t second = out_.find("\n2   10.0.0.7     5000  http");
    EXPECT_EQ(header, 0u) << out_;
    EXPECT_NE(first, std::string::npos) << out_;
    EXPECT_NE(second, std::string::npos) << out_;
    EXPECT_LT(first, second);

    ASSERT_EQ(Run("list --json"), 0) << err_;
    EXPECT_EQ(out_.find("SECRET"), std::string::npos) << out_;
    EXPECT_EQ(out_.find("passw"), std::string::npos) << out_;
    EXPECT_NE(out_.find("\"host\" : \"nas.example\""), std::string::npos) << out_;
    EXPECT_NE(out_.find("\"extra\" : \"{\\\"note\\\":1}\""), std::string::npos) << out_;

    ASSERT_EQ(Run("show 1"), 0) << err_;
    EXPECT_EQ(out_.find("SECRET"), std::string::npos) << out_;
    EXPECT_NE(out_.find("password:     (stored, not shown)"), std::string::npos) << out_;
    EXPECT_NE(out_.find("owner:        1026"), std::string::npos) << out_;
    EXPECT_NE(out_.find("session:      none"), std::string::npos) << out_;
}

TEST_F(KovacredStoreTest, SessionCommands) {
    AddTwo();
    ASSERT_EQ(Run("session set 1 --sid SID-1 --token TOK-1 --extra e"), 0) << err_;
    ASSERT_EQ(Run("session show 1"), 0) << err_;
    EXPECT_EQ(out_, "id:     1\nsid:    SID-1\ntoken:  TOK-1\nextra:  e\n");
    ASSERT_EQ(Run("show 1"), 0);
    EXPECT_NE(out_.find("session:      stored"), std::string::npos) << out_;
    ASSERT_EQ(Run("session set 1 --sid SID-2"), 0) << err_;
    SessPtr sess = NewSess();
    ASSERT_EQ(KOVACredSessGetByID(1, sess.get()), 0);
    EXPECT_EQ(sess->access_token, "SID-2");
    EXPECT_EQ(sess->csrf_token, "");

    ASSERT_EQ(Run("session remove 1"), 0) << err_;
    EXPECT_EQ(Run("session show 1"), 1);
    EXPECT_EQ(err_, "kovacred: session show: no session for credential 1\n");
    EXPECT_EQ(Run("session remove 1"), 1);
    EXPECT_EQ(err_, "kovacred: session remove: no session for credential 1\n");
    EXPECT_EQ(Run("session set 9 --sid x"), 1);
    EXPECT_EQ(err_, "kovacred: session set: no credential with id 9\n");
}

TEST_F(KovacredStoreTest, RemoveTakesTheSessionAlong) {
    AddTwo();
    ASSERT_EQ(Run("session set 2 --sid s --token t"), 0) << err_;
    ASSERT_EQ(Run("remove 2"), 0) << err_;
    EXPECT_EQ(out_, "removed credential 2\n");
    EXPECT_EQ(Query("SELECT id FROM credentials;"), (std::vector<Row>{{"1"}}));
    EXPECT_TRUE(Query("SELECT * FROM credential_sessions;").empty());
    EXPECT_EQ(Run("remove 2"), 1);
    EXPECT_EQ(err_, "kovacred: remove: no credential with id 2\n");
}

TEST_F(KovacredStoreTest, FailuresPrintOneLineAndExitNonZero) {
    EXPECT_EQ(Run("show 42"), 1);
    EXPECT_EQ(out_, "");
    EXPECT_EQ(err_, "kovacred: show: no credential with id 42\n");

    EXPECT_EQ(Run("add --host h --port 1 --account a"), 1);
    EXPECT_EQ(err_, "kovacred: add: no password on standard input (give it as one line)\n");
    EXPECT_TRUE(Query("SELECT * FROM credentials;").empty());

    // The password is never taken from the command line.
    EXPECT_NE(Run("add --host h --port 1 --account a --password x", "pw\n"), 0);
    EXPECT_TRUE(Query("SELECT * FROM credentials;").empty());

    EXPECT_NE(Run("show nope"), 0);
    EXPECT_NE(Run("add --host h --port 70000 --account a", "pw\n"), 0);

    ASSERT_EQ(Run("list"), 0);
    EXPECT_EQ(out_, "no credentials\n");
}

TEST_F(KovacredStoreTest, UnusableDatabaseIsReportedWithTheLibraryCode) {
    const std::string cmd =
        kova_test::ToolCommand(KOVACRED_BIN) + " --db '" + BlockDatabase() + "' list";
    std::string out;
    EXPECT_EQ(kova_test::RunCommand(cmd + " 2>&1", &out), 1);
    EXPECT_EQ(out, "kovacred: list credentials failed (error 2304)\n");

    {
        FILE *f = fopen(DbPath().c_str(), "w");
        fputs(std::string(4096, 'J').c_str(), f);
        fclose(f);
    }
    EXPECT_EQ(Run("show 1"), 1);
    EXPECT_EQ(err_,
              "kovacred: show: reading credential 1 failed: the database could not be used "
              "(details in the system log)\n");
    EXPECT_EQ(Run("add --host h --port 1 --account a", "pw\n"), 1);
    EXPECT_EQ(err_.find("kovacred: add credential failed"), 0u) << err_;
}

}  // namespace
