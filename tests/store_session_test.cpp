// The session interface: one session per credential, kept under the credential's id.
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "store_fixture.h"

namespace {

using namespace store_test;

using SessionTest = StoreTest;

TEST_F(SessionTest, SaveWithTheCredentialIdStoresAndReplacesSetByIdTakesItsId) {
    int id = AddCred("h");
    SessPtr sess = MakeSess(id, "sid-1", "tok-1");
    EXPECT_EQ(KOVACredSessSave(sess.get()), 0) << kova_test::LogDump();
    ASSERT_TRUE(Query("UPDATE credential_sessions SET mtime=5;").empty());
    sess->access_token = "sid-2";
    sess->csrf_token = "tok-2";
    sess->extra_info = "";
    const long before = time(nullptr);
    EXPECT_EQ(KOVACredSessSave(sess.get()), 0);
    auto rows = Query(
        "SELECT id, mtime, access_token, csrf_token, extra_info FROM "
        "credential_sessions;");
    ASSERT_EQ(rows.size(), 1u);
    EXPECT_EQ(rows[0][0], std::to_string(id));
    EXPECT_GE(std::stol(rows[0][1]), before);
    EXPECT_EQ((Row{rows[0][2], rows[0][3], rows[0][4]}), (Row{"sid-2", "tok-2", ""}));

    SessPtr loaded = NewSess();
    EXPECT_EQ(KOVACredSessGetByID(id, loaded.get()), 0);
    EXPECT_EQ(loaded->id, id);
    EXPECT_EQ(loaded->filled, 1);
    EXPECT_EQ(loaded->access_token, "sid-2");
    EXPECT_EQ(loaded->csrf_token, "tok-2");

    // SetByID writes under the id it is given, not the record's.
    int other = AddCred("b");
    EXPECT_EQ(KOVACredSessSetByID(other, sess.get()), 0);
    EXPECT_EQ(Query("SELECT id FROM credential_sessions WHERE access_token='sid-2';"),
              (std::vector<Row>{{std::to_string(id)}, {std::to_string(other)}}));
    EXPECT_EQ(sess->id, id);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

TEST_F(SessionTest, SetForAMissingCredentialFailsOnTheForeignKey) {
    AddCred("h");
    SessPtr sess = MakeSess(7, "s", "t");
    EXPECT_EQ(KOVACredSessSetByID(7, sess.get()), -1);
    EXPECT_EQ(kova_test::LogCount("cred_db:550 Exec sql:[REPLACE INTO credential_sessions"), 1u);
    EXPECT_EQ(kova_test::LogCount("] error: FOREIGN KEY constraint failed\n"), 1u);
    EXPECT_EQ(kova_test::LogCount("cred_sess_set:19 Set Cred record failed. id:[7][0x"), 1u)
        << kova_test::LogDump();
    kova_test::ClearLog();
    EXPECT_EQ(KOVACredSessSave(sess.get()), -1);
    EXPECT_EQ(kova_test::LogCount("cred_sess_save:21 Set task failed. [7] [0x"), 1u)
        << kova_test::LogDump();
    EXPECT_TRUE(Query("SELECT * FROM credential_sessions;").empty());
}

TEST_F(SessionTest, AddPicksTheNextRowIdWhichMustBeACredential) {
    SessPtr sess = MakeSess(-1, "s", "t");
    EXPECT_EQ(KOVACredSessAdd(sess.get()), -1);
    EXPECT_EQ(sess->id, -1);
    EXPECT_EQ(kova_test::LogCount("cred_db:414 Exec sql:[INSERT INTO credential_sessions"), 1u);
    EXPECT_EQ(kova_test::LogCount("cred_sess_add:20 Add Cred record failed. [0x"), 1u)
        << kova_test::LogDump();

    AddCred("one");
    AddCred("two");
    EXPECT_EQ(KOVACredSessSave(sess.get()), 0) << kova_test::LogDump();  // id -1: add
    EXPECT_EQ(sess->id, 1);
    SessPtr next = MakeSess(-1, "s2", "t2");
    EXPECT_EQ(KOVACredSessAdd(next.get()), 0);
    EXPECT_EQ(next->id, 2);
    SessPtr third = MakeSess(-1, "s3", "t3");
    kova_test::ClearLog();
    EXPECT_EQ(KOVACredSessSave(third.get()), -1);
    EXPECT_EQ(kova_test::LogCount("cred_sess_save:16 Add task failed. [0x"), 1u)
        << kova_test::LogDump();
}

TEST_F(SessionTest, LoadClearsOrReads) {
    int id = AddCred("h");
    ASSERT_EQ(KOVACredSessSetByID(id, MakeSess(id, "sid", "tok").get()), 0);
    SessPtr sess = NewSess();
    ExpectArgErrors({
        {[&] { return KOVACredSessLoad(-2, sess.get()); }, "cred_sess_load", 10, "-1 <= id"},
        // The id is checked first.
        {[] { return KOVACredSessLoad(-2, nullptr); }, "cred_sess_load", 10, "-1 <= id"},
        {[&] { return KOVACredSessLoad(id, nullptr); }, "cred_sess_load", 10, "NULL != pSess"},
    });

    EXPECT_EQ(KOVACredSessLoad(id, sess.get()), 0);
    EXPECT_EQ(sess->access_token, "sid");
    sess->next = KOVACredSessAlloc();
    EXPECT_EQ(KOVACredSessLoad(-1, sess.get()), 0);
    EXPECT_EQ(sess->next, nullptr);
    EXPECT_EQ(sess->filled, 0);
    EXPECT_EQ(sess->id, -1);
    EXPECT_TRUE(sess->access_token.empty());
}

TEST_F(SessionTest, ListRemoveAndNext) {
    int a = AddCred("a");
    int b = AddCred("b");
    int c = AddCred("c");
    for (int id : {a, c, b}) {
        ASSERT_EQ(KOVACredSessSetByID(id, MakeSess(id, "s" + std::to_string(id), "t").get()), 0);
    }
    KOVA_CRED_SESS *list = nullptr;
    EXPECT_EQ(KOVACredSessListGet(&list, nullptr, nullptr), 3);
    EXPECT_EQ(Ids(list), (std::vector<int>{c, b, a}));  // newest id first
    EXPECT_EQ(KOVACredSessNext(list->next->next), nullptr);
    KOVACredSessListFree(&list);
    EXPECT_EQ(list, nullptr);

    auto onlyB = [](KOVA_CRED_SESS *sess, void *arg) -> int {
        return sess->id == *static_cast<int *>(arg);
    };
    EXPECT_EQ(KOVACredSessListGet(&list, onlyB, &b), 1);
    ASSERT_NE(list, nullptr);
    EXPECT_EQ(list->access_token, "s" + std::to_string(b));
    KOVACredSessListFree(&list);

    EXPECT_EQ(KOVACredSessRemoveByID(b), 0);
    EXPECT_EQ(KOVACredSessRemoveByID(b), 0);  // nothing left to remove: still 0
    EXPECT_EQ(Query("SELECT count(*) FROM credentials;"), (std::vector<Row>{{"3"}}));
    EXPECT_EQ(KOVACredSessListGet(&list, onlyB, &b), 0);
    EXPECT_EQ(list, nullptr);

    EXPECT_EQ(KOVACredSessListGet(nullptr, nullptr, nullptr), -1);
    EXPECT_TRUE(ArgErrorReported("cred_sess_list", 14, "__null != pSessList"));
}

TEST_F(SessionTest, ArgumentAndOpenErrors) {
    ExpectArgErrors({
        {[] { return KOVACredSessGetByID(1, nullptr); }, "cred_sess_get", 10, "__null != pSess"},
        {[] { return KOVACredSessSetByID(1, nullptr); }, "cred_sess_set", 10, "__null != pSess"},
        {[] { return KOVACredSessAdd(nullptr); }, "cred_sess_add", 11, "__null != pSess"},
        {[] { return KOVACredSessSave(nullptr); }, "cred_sess_save", 11, "__null != pSess"},
    });

    BlockDatabase();
    SessPtr sess = MakeSess(1, "s", "t");
    ExpectFailuresLogged(
        {
            {[&] { return KOVACredSessGetByID(1, sess.get()); },
             "cred_sess_get:15 Init sqlite failed. "},
            {[&] { return KOVACredSessSetByID(1, sess.get()); },
             "cred_sess_set:15 Init sqlite failed. "},
            {[&] { return KOVACredSessAdd(sess.get()); }, "cred_sess_add:16 Init sqlite failed. "},
            {[&] {
                 KOVA_CRED_SESS *list = nullptr;
                 return KOVACredSessListGet(&list, nullptr, nullptr);
             },
             "cred_sess_list:19 Init sqlite failed. "},
            {[&] { return KOVACredSessRemoveByID(1); }, "cred_sess_remove:14 Init sqlite failed. "},
            {[&] { return KOVACredSessLoad(2, sess.get()); },
             "cred_sess_load:19 get task failed. [2] "},
        },
        "[0x0900 cred_db:169]");
}

TEST_F(SessionTest, StatementFailuresOfAnOpenDatabaseAreLogged) {
    AddCred("h");
    // A view under the session table's name survives the schema statements (IF NOT EXISTS)
    // but has no id column and takes no writes, so the steps fail on a database that opened.
    ASSERT_TRUE(Query("DROP TABLE credential_sessions;").empty());
    ASSERT_TRUE(Query("CREATE VIEW credential_sessions AS SELECT 1 AS x, 2 AS y;").empty());
    SessPtr sess = NewSess();
    ExpectFailuresLogged(
        {
            {[&] { return KOVACredSessGetByID(1, sess.get()); },
             "cred_sess_get:20 Get Cred_sess record failed. id:[1]"},
            {[&] { return KOVACredSessRemoveByID(1); },
             "cred_sess_remove:18 Remove Cred record failed. id:[1]"},
        },
        "[0x0000 :0]");
}

}  // namespace
