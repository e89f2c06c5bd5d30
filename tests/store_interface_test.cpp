// The credential and session interface: every operation opens the database, does one thing and
// closes it; a session is kept under its credential's id.
#include <unistd.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "store_fixture.h"

namespace {

using namespace store_test;

using InterfaceTest = StoreTest;
using SessionTest = StoreTest;

TEST_F(InterfaceTest, ArgumentErrorsTouchNoDatabase) {
    CredPtr cred = NewCred();
    SessPtr sess = NewSess();
    ExpectArgErrors({
        {[] { return KOVACredGetByID(1, nullptr); }, "cred_get", 10, "__null != pCred"},
        {[] { return KOVACredSetByID(1, nullptr); }, "cred_set", 10, "__null != pCred"},
        {[] { return KOVACredAdd(nullptr); }, "cred_add", 11, "__null != pCred"},
        {[] { return KOVACredSave(nullptr); }, "cred_save", 11, "__null != pCred"},
        {[] { return KOVACredListGet(nullptr, nullptr, nullptr); }, "cred_list", 14,
         "__null != pCredList"},
        {[] { return KOVACredIDGetByApplication(nullptr); }, "cred_get", 44,
         "__null != szApplication"},
        // The id is checked before the record.
        {[&] { return KOVACredLoad(-2, cred.get()); }, "cred_load", 10, "-1 <= id"},
        {[] { return KOVACredLoad(-2, nullptr); }, "cred_load", 10, "-1 <= id"},
        {[] { return KOVACredLoad(1, nullptr); }, "cred_load", 10, "NULL != pCred"},
        {[] { return KOVACredSessGetByID(1, nullptr); }, "cred_sess_get", 10, "__null != pSess"},
        {[] { return KOVACredSessSetByID(1, nullptr); }, "cred_sess_set", 10, "__null != pSess"},
        {[] { return KOVACredSessAdd(nullptr); }, "cred_sess_add", 11, "__null != pSess"},
        {[] { return KOVACredSessSave(nullptr); }, "cred_sess_save", 11, "__null != pSess"},
        {[] { return KOVACredSessListGet(nullptr, nullptr, nullptr); }, "cred_sess_list", 14,
         "__null != pSessList"},
        {[&] { return KOVACredSessLoad(-2, sess.get()); }, "cred_sess_load", 10, "-1 <= id"},
        {[] { return KOVACredSessLoad(-2, nullptr); }, "cred_sess_load", 10, "-1 <= id"},
        {[] { return KOVACredSessLoad(1, nullptr); }, "cred_sess_load", 10, "NULL != pSess"},
    });
    EXPECT_NE(access(DbPath().c_str(), F_OK), 0);
}

TEST_F(InterfaceTest, OpenFailuresNameTheInnerError) {
    // Below a regular file neither a folder nor the database can be made.
    const std::string blocker = db_.dir().File("plainfile");
    ASSERT_NE(kova_test::File(fopen(blocker.c_str(), "w")), nullptr);
    setenv("kovacredential_db", (blocker + "/sub/credentials.sqlite").c_str(), 1);
    CredPtr cred = MakeCred("h");
    SessPtr sess = MakeSess(1, "s", "t");
    KOVA_CRED *list = nullptr;
    KOVA_CRED_SESS *sessList = nullptr;
    ExpectFailuresLogged(
        {
            {[&] { return KOVACredGetByID(1, cred.get()); }, "cred_get:15 Init sqlite failed. "},
            {[&] { return KOVACredSetByID(1, cred.get()); }, "cred_set:15 Init sqlite failed. "},
            {[&] { return KOVACredAdd(cred.get()); }, "cred_add:16 Init sqlite failed. "},
            {[&] { return KOVACredListGet(&list, nullptr, nullptr); },
             "cred_list:19 Init sqlite failed. "},
            {[&] { return KOVACredRemoveByID(1); }, "cred_remove:14 Init sqlite failed. "},
            {[&] { return KOVACredIDGetByApplication("app"); },
             "cred_list:19 Init sqlite failed. "},
            {[&] { return KOVACredLoad(3, cred.get()); }, "cred_load:19 get task failed. [3] "},
            {[&] { return KOVACredSave(cred.get()); }, "cred_save:16 Add task failed. "},
            {[&] { return KOVACredSessGetByID(1, sess.get()); },
             "cred_sess_get:15 Init sqlite failed. "},
            {[&] { return KOVACredSessSetByID(1, sess.get()); },
             "cred_sess_set:15 Init sqlite failed. "},
            {[&] { return KOVACredSessAdd(sess.get()); }, "cred_sess_add:16 Init sqlite failed. "},
            {[&] { return KOVACredSessListGet(&sessList, nullptr, nullptr); },
             "cred_sess_list:19 Init sqlite failed. "},
            {[&] { return KOVACredSessRemoveByID(1); }, "cred_sess_remove:14 Init sqlite failed. "},
            {[&] { return KOVACredSessLoad(2, sess.get()); },
             "cred_sess_load:19 get task failed. [2] "},
        },
        "[0x0900 cred_db:169]");
    EXPECT_EQ(cred->id, -1);
}

TEST_F(InterfaceTest, StatementFailuresOfAnOpenDatabaseAreLogged) {
    AddCred("h");
    // Views under the tables' names survive the schema statements (IF NOT EXISTS) but read a
    // table that is gone or lack the id column, and take no writes: every step fails on a
    // database that opened. The inner steps record no code: the error slot keeps what an
    // earlier failure left there, and the lines carry that.
    ASSERT_TRUE(Query("DROP TABLE credential_sessions; DROP TABLE credentials; CREATE VIEW "
                      "credentials AS SELECT * FROM gone; CREATE VIEW credential_sessions AS "
                      "SELECT 1 AS x, 2 AS y;")
                    .empty());
    CredPtr cred = MakeCred("h");
    SessPtr sess = NewSess();
    VLIBCErrSetEx(KOVA_ERR_DB_READBACK, "earlier", 7);
    ExpectFailuresLogged(
        {
            {[&] { return KOVACredGetByID(1, cred.get()); },
             "cred_get:19 Get Cred record failed. id:[1]"},
            {[&] { return KOVACredAdd(cred.get()); }, "cred_add:20 Add Cred record failed. "},
            {[&] { return KOVACredRemoveByID(1); },
             "cred_remove:18 Remove Cred record failed. id:[1]"},
            {[&] { return KOVACredSessGetByID(1, sess.get()); },
             "cred_sess_get:20 Get Cred_sess record failed. id:[1]"},
            {[&] { return KOVACredSessRemoveByID(1); },
             "cred_sess_remove:18 Remove Cred record failed. id:[1]"},
        },
        "[0x0B00 earlier:7]");
    EXPECT_TRUE(ErrorIs(KOVA_ERR_DB_READBACK, "earlier", 7));
    // A failed read of the table looks like an empty one, to the look-up by application too.
    kova_test::ClearLog();
    KOVA_CRED *list = nullptr;
    EXPECT_EQ(KOVACredListGet(&list, nullptr, nullptr), 0);
    EXPECT_EQ(list, nullptr);
    EXPECT_EQ(KOVACredIDGetByApplication("app"), -1);
    EXPECT_EQ(LogCountPrefix("cred_db:297 Exec sql:[SELECT * FROM credentials;] error: "), 2u)
        << kova_test::LogDump();
    EXPECT_EQ(kova_test::LogRecords().size(), 2u);
}

TEST_F(InterfaceTest, AddSaveGetAndSet) {
    CredPtr cred = MakeCred("first", "backup");
    EXPECT_EQ(KOVACredSave(cred.get()), 0);                                  // id -1: an add
    EXPECT_EQ((Ints{cred->id, cred->ctime, cred->mtime}), (Ints{1, 0, 0}));  // the row has times
    CredPtr second = MakeCred("second");
    EXPECT_EQ(KOVACredAdd(second.get()), 0);
    EXPECT_EQ(second->id, 2);
    CredPtr loaded = NewCred();
    EXPECT_EQ(KOVACredGetByID(1, loaded.get()), 0);
    EXPECT_EQ((Ints{loaded->id, loaded->filled}), (Ints{1, 1}));
    EXPECT_EQ((Texts{loaded->host, loaded->remote_passwd, loaded->application}),
              (Texts{"first", "pw-first", "backup"}));
    EXPECT_GT(loaded->ctime, 0);
    EXPECT_EQ(loaded->ctime, loaded->mtime);
    // A missing row is no failure: the record stays unfilled.
    CredPtr missing = NewCred();
    EXPECT_EQ(KOVACredGetByID(5, missing.get()), 0);
    EXPECT_EQ((Ints{missing->id, missing->filled}), (Ints{-1, 0}));
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();

    // A save with an id updates the row: ctime stays, mtime moves.
    ASSERT_TRUE(Query("UPDATE credentials SET ctime=100, mtime=100;").empty());
    cred->host = "changed";
    cred->port = 443;
    const long before = time(nullptr);
    EXPECT_EQ(KOVACredSave(cred.get()), 0) << kova_test::LogDump();
    EXPECT_EQ(cred->id, 1);
    auto rows = Query("SELECT host, port, ctime, mtime FROM credentials WHERE id=1;");
    ASSERT_EQ(rows.size(), 1u);
    EXPECT_EQ((Row{rows[0][0], rows[0][1], rows[0][2]}), (Row{"changed", "443", "100"}));
    EXPECT_GE(std::stol(rows[0][3]), before);

    // A set of a row that is gone fails on the read-back.
    ASSERT_TRUE(Query("DELETE FROM credentials;").empty());
    EXPECT_EQ(KOVACredSetByID(42, cred.get()), -1);
    EXPECT_TRUE(ErrorIs(KOVA_ERR_DB_READBACK, "cred_db", 377));
    kova_test::ClearLog();
    cred->id = 42;
    EXPECT_EQ(KOVACredSave(cred.get()), -1);
    EXPECT_EQ(kova_test::LogRecords(),
              (Texts{"cred_set:19 Set Cred record failed. id:[42][0x0B00 cred_db:377]",
                     "cred_save:21 Set task failed. [42] [0x0B00 cred_db:377]"}));
}

TEST_F(InterfaceTest, LoadClearsOrReads) {
    const int id = AddCred("loaded");
    const int other = AddCred("other");
    ASSERT_EQ(KOVACredSessSetByID(id, MakeSess(id, "sid", "tok").get()), 0);
    CredPtr cred = NewCred();
    EXPECT_EQ(KOVACredLoad(id, cred.get()), 0);
    EXPECT_EQ(cred->host, "loaded");
    // id -1 clears the record and frees its chain; the record then reads another row.
    cred->next = KOVACredAlloc();
    cred->next->next = KOVACredAlloc();
    EXPECT_EQ(KOVACredLoad(-1, cred.get()), 0);
    EXPECT_EQ(cred->next, nullptr);
    EXPECT_EQ((Ints{cred->id, cred->filled}), (Ints{-1, 0}));
    EXPECT_TRUE(cred->host.empty());
    EXPECT_EQ(KOVACredLoad(other, cred.get()), 0);
    EXPECT_EQ(cred->host, "other");
    // A load of a missing id leaves members the row would have set.
    CredPtr partial = NewCred();
    partial->host = "mine";
    EXPECT_EQ(KOVACredLoad(99, partial.get()), 0);
    EXPECT_EQ(partial->host, "mine");

    SessPtr sess = NewSess();
    EXPECT_EQ(KOVACredSessLoad(id, sess.get()), 0);
    EXPECT_EQ(sess->access_token, "sid");
    sess->next = KOVACredSessAlloc();
    EXPECT_EQ(KOVACredSessLoad(-1, sess.get()), 0);
    EXPECT_EQ(sess->next, nullptr);
    EXPECT_EQ((Ints{sess->id, sess->filled}), (Ints{-1, 0}));
    EXPECT_TRUE(sess->access_token.empty());
}

TEST_F(InterfaceTest, ListIsNewestFirstFilteredAndLookedUpByApplication) {
    KOVA_CRED *list = nullptr;
    EXPECT_EQ(KOVACredListGet(&list, nullptr, nullptr), 0);  // an empty table
    EXPECT_EQ(list, nullptr);
    EXPECT_EQ(KOVACredIDGetByApplication("odd"), -1);
    for (int i = 1; i <= 5; ++i) {
        AddCred("h" + std::to_string(i), i % 2 ? "odd" : "even");
    }
    EXPECT_EQ(KOVACredListGet(&list, nullptr, nullptr), 5);
    EXPECT_EQ(Ids(list), (std::vector<int>{5, 4, 3, 2, 1}));
    EXPECT_EQ(list->host, "h5");
    KOVACredListFree(&list);
    EXPECT_EQ(list, nullptr);
    char odd[] = "odd";
    char oddSpace[] = "odd ";
    EXPECT_EQ(KOVACredListGet(&list, KOVACredKeepByApplication, oddSpace), 0);
    EXPECT_EQ(KOVACredListGet(&list, KOVACredKeepByApplication, odd), 3);
    EXPECT_EQ(Ids(list), (std::vector<int>{5, 3, 1}));
    KOVACredListFree(&list);
    // The newest of an application, by exact and case-sensitive name.
    EXPECT_EQ(KOVACredIDGetByApplication("odd"), 5);
    KOVACredRemoveByID(5);
    EXPECT_EQ(KOVACredIDGetByApplication("odd"), 3);
    for (const char *miss : {"Odd", "od", ""}) {
        EXPECT_EQ(KOVACredIDGetByApplication(miss), -1) << miss;
    }

    // A filter that drops everything leaves the caller's head as it was.
    KOVA_CRED sentinel;
    list = &sentinel;
    auto none = [](KOVA_CRED *, void *) { return 0; };
    EXPECT_EQ(KOVACredListGet(&list, none, nullptr), 0);
    EXPECT_EQ(list, &sentinel);
    // The filter sees each record with the caller's argument.
    std::vector<int> seen;
    auto record = [](KOVA_CRED *cred, void *arg) -> int {
        static_cast<std::vector<int> *>(arg)->push_back(cred->id);
        return cred->id == 2;
    };
    list = nullptr;
    EXPECT_EQ(KOVACredListGet(&list, record, &seen), 1);
    EXPECT_EQ(seen, (std::vector<int>{4, 3, 2, 1}));
    EXPECT_EQ(Ids(list), (std::vector<int>{2}));
    EXPECT_EQ(KOVACredNext(list), nullptr);
    KOVACredListFree(&list);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();

    // A table made elsewhere: columns in another order and one the record lacks, ids out of
    // the rows' order, an application left NULL. Lists find the columns by name, and the
    // newest of an application is the head of such a list: the last matching row.
    ASSERT_TRUE(Query("DROP TABLE credential_sessions; DROP TABLE credentials; CREATE TABLE "
                      "credentials (application TEXT, note TEXT, port INTEGER, host TEXT, id "
                      "INTEGER, ctime INTEGER); INSERT INTO credentials VALUES ('backup', 'n', "
                      "9001, 'h9', 9, 1700000009), ('backup', 'n', 4001, 'h4', 4, 14), (NULL, "
                      "'n', 7001, 'h7', 7, 17);")
                    .empty());
    ASSERT_EQ(KOVACredListGet(&list, nullptr, nullptr), 3);
    EXPECT_EQ(Ids(list), (std::vector<int>{7, 4, 9}));
    EXPECT_EQ((Ints{list->next->port, list->next->ctime}), (Ints{4001, 14}));
    EXPECT_EQ((Texts{list->next->application, list->next->host, list->application}),
              (Texts{"backup", "h4", ""}));
    KOVACredListFree(&list);
    EXPECT_EQ(KOVACredIDGetByApplication("backup"), 4);
    EXPECT_EQ(KOVACredIDGetByApplication(""), 7);
    EXPECT_EQ(KOVACredIDGetByApplication("h9"), -1);

    // Integer members read what the row's text reads as, whatever the column holds: a real
    // number is cut at its point (even past the range), a text read as strtol reads it, an
    // integer beyond 32 bits saturates. A list and a read by id agree on every member.
    ASSERT_TRUE(Query("DELETE FROM credentials; INSERT INTO credentials VALUES ('odd', 'n', "
                      "7001.9, 'h', 11, ' 42abc'), ('odd', 'n', -5e30, 'h', 12, 99999999999), "
                      "('odd', 'n', NULL, 'h', 13, -99999999999);")
                    .empty());
    ASSERT_EQ(KOVACredListGet(&list, nullptr, nullptr), 3);
    std::vector<Ints> listed;
    for (const KOVA_CRED *cred = list; cred != nullptr; cred = cred->next) {
        listed.push_back({cred->id, cred->port, cred->ctime});
        CredPtr byId = NewCred();
        ASSERT_EQ(KOVACredGetByID(cred->id, byId.get()), 0);
        EXPECT_EQ(listed.back(), (Ints{byId->id, byId->port, byId->ctime}));
    }
    EXPECT_EQ(listed, (std::vector<Ints>{{13, 0, INT32_MIN}, {12, -5, INT32_MAX}, {11, 7001, 42}}));
    KOVACredListFree(&list);
    EXPECT_EQ(KOVACredIDGetByApplication("odd"), 13);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

TEST_F(SessionTest, SaveStoresAndReplacesSetByIdTakesItsId) {
    const int id = AddCred("h");
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
    EXPECT_GE(std::stol(rows[0][1]), before);
    EXPECT_EQ((Row{rows[0][0], rows[0][2], rows[0][3], rows[0][4]}),
              (Row{std::to_string(id), "sid-2", "tok-2", ""}));
    SessPtr loaded = NewSess();
    EXPECT_EQ(KOVACredSessGetByID(id, loaded.get()), 0);
    EXPECT_EQ((Ints{loaded->id, loaded->filled}), (Ints{id, 1}));
    EXPECT_EQ((Texts{loaded->access_token, loaded->csrf_token}), (Texts{"sid-2", "tok-2"}));

    // SetByID writes under the id it is given, not the record's.
    const int other = AddCred("b");
    EXPECT_EQ(KOVACredSessSetByID(other, sess.get()), 0);
    EXPECT_EQ(Query("SELECT id FROM credential_sessions WHERE access_token='sid-2';"),
              (std::vector<Row>{{std::to_string(id)}, {std::to_string(other)}}));
    EXPECT_EQ(sess->id, id);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

TEST_F(SessionTest, WritesNeedTheirCredential) {
    // An add takes the next row id, which must be a credential's.
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
    kova_test::ClearLog();
    EXPECT_EQ(KOVACredSessSave(MakeSess(-1, "s3", "t3").get()), -1);
    EXPECT_EQ(kova_test::LogCount("cred_sess_save:16 Add task failed. [0x"), 1u)
        << kova_test::LogDump();

    // A set under an id without a credential fails on the foreign key.
    kova_test::ClearLog();
    SessPtr orphan = MakeSess(7, "s", "t");
    EXPECT_EQ(KOVACredSessSetByID(7, orphan.get()), -1);
    EXPECT_EQ(kova_test::LogCount("cred_db:550 Exec sql:[REPLACE INTO credential_sessions"), 1u);
    EXPECT_EQ(kova_test::LogCount("] error: FOREIGN KEY constraint failed\n"), 1u);
    EXPECT_EQ(kova_test::LogCount("cred_sess_set:19 Set Cred record failed. id:[7][0x"), 1u)
        << kova_test::LogDump();
    kova_test::ClearLog();
    EXPECT_EQ(KOVACredSessSave(orphan.get()), -1);
    EXPECT_EQ(kova_test::LogCount("cred_sess_save:21 Set task failed. [7] [0x"), 1u)
        << kova_test::LogDump();
    EXPECT_EQ(Query("SELECT id FROM credential_sessions;"), (std::vector<Row>{{"1"}, {"2"}}));
}

TEST_F(SessionTest, ListRemoveAndNext) {
    const int a = AddCred("a");
    int b = AddCred("b");
    const int c = AddCred("c");
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
}

}  // namespace
