// The credential interface: every operation opens the database, does one thing and closes it.
#include <unistd.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "store_fixture.h"

namespace {

using namespace store_test;

using InterfaceTest = StoreTest;

TEST_F(InterfaceTest, AddStoresTheRowAndTheNewId) {
    CredPtr cred = MakeCred("nas.example", "backup");
    EXPECT_EQ(KOVACredAdd(cred.get()), 0);
    EXPECT_EQ(cred->id, 1);
    EXPECT_EQ(cred->ctime, 0);  // the row holds the time, the record does not
    EXPECT_EQ(cred->mtime, 0);

    CredPtr loaded = NewCred();
    EXPECT_EQ(KOVACredGetByID(1, loaded.get()), 0);
    EXPECT_EQ(loaded->id, 1);
    EXPECT_EQ(loaded->filled, 1);
    EXPECT_EQ(loaded->host, "nas.example");
    EXPECT_EQ(loaded->remote_passwd, "pw-nas.example");
    EXPECT_EQ(loaded->application, "backup");
    EXPECT_GT(loaded->ctime, 0);
    EXPECT_EQ(loaded->ctime, loaded->mtime);
    // A missing row is no failure: the record stays unfilled.
    CredPtr missing = NewCred();
    EXPECT_EQ(KOVACredGetByID(5, missing.get()), 0);
    EXPECT_EQ(missing->id, -1);
    EXPECT_EQ(missing->filled, 0);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

TEST_F(InterfaceTest, SaveInsertsThenUpdatesAndSetFailsOnAMissingRow) {
    CredPtr cred = MakeCred("first");
    EXPECT_EQ(KOVACredSave(cred.get()), 0);
    ASSERT_EQ(cred->id, 1);
    // Age the row so that the update's new mtime is visible.
    ASSERT_TRUE(Query("UPDATE credentials SET ctime=100, mtime=100;").empty());
    cred->host = "second";
    cred->port = 443;
    const long before = time(nullptr);
    EXPECT_EQ(KOVACredSave(cred.get()), 0) << kova_test::LogDump();
    EXPECT_EQ(cred->id, 1);
    auto rows = Query("SELECT id, host, port, ctime, mtime FROM credentials;");
    ASSERT_EQ(rows.size(), 1u);
    EXPECT_EQ(rows[0][1], "second");
    EXPECT_EQ(rows[0][2], "443");
    EXPECT_EQ(rows[0][3], "100");
    EXPECT_GE(std::stol(rows[0][4]), before);

    // A set of a row that is gone fails on the read-back.
    ASSERT_TRUE(Query("DELETE FROM credentials;").empty());
    EXPECT_EQ(KOVACredSetByID(42, cred.get()), -1);
    EXPECT_TRUE(ErrorIs(KOVA_ERR_DB_READBACK, "cred_db", 377));
    kova_test::ClearLog();
    cred->id = 42;
    EXPECT_EQ(KOVACredSave(cred.get()), -1);
    EXPECT_EQ(
        kova_test::LogRecords(),
        (std::vector<std::string>{"cred_set:19 Set Cred record failed. id:[42][0x0B00 cred_db:377]",
                                  "cred_save:21 Set task failed. [42] [0x0B00 cred_db:377]"}));
}

TEST_F(InterfaceTest, LoadChecksClearsAndReads) {
    int id = AddCred("loaded");
    CredPtr cred = NewCred();
    EXPECT_EQ(KOVACredLoad(-2, cred.get()), -1);
    EXPECT_TRUE(ArgErrorReported("cred_load", 10, "-1 <= id"));
    kova_test::ClearLog();
    EXPECT_EQ(KOVACredLoad(-2, nullptr), -1);  // the id is checked first
    EXPECT_TRUE(ArgErrorReported("cred_load", 10, "-1 <= id"));
    kova_test::ClearLog();
    EXPECT_EQ(KOVACredLoad(1, nullptr), -1);
    EXPECT_TRUE(ArgErrorReported("cred_load", 10, "NULL != pCred"));

    EXPECT_EQ(KOVACredLoad(id, cred.get()), 0);
    EXPECT_EQ(cred->host, "loaded");
    int other = AddCred("other");

    // id -1 clears the record and frees its chain.
    cred->next = KOVACredAlloc();
    cred->next->next = KOVACredAlloc();
    EXPECT_EQ(KOVACredLoad(-1, cred.get()), 0);
    EXPECT_EQ(cred->next, nullptr);
    EXPECT_EQ(cred->id, -1);
    EXPECT_EQ(cred->filled, 0);
    EXPECT_TRUE(cred->host.empty());
    EXPECT_EQ(KOVACredLoad(other, cred.get()), 0);
    EXPECT_EQ(cred->host, "other");

    // A load of a missing id leaves members the row would have set.
    CredPtr partial = NewCred();
    partial->host = "mine";
    EXPECT_EQ(KOVACredLoad(99, partial.get()), 0);
    EXPECT_EQ(partial->host, "mine");
}

TEST_F(InterfaceTest, ListIsNewestFirstAndFiltered) {
    KOVA_CRED *list = nullptr;
    EXPECT_EQ(KOVACredListGet(&list, nullptr, nullptr), 0);  // an empty table
    EXPECT_EQ(list, nullptr);
    for (int i = 1; i <= 5; ++i) {
        AddCred("h" + std::to_string(i), i % 2 ? "odd" : "even");
    }
    EXPECT_EQ(KOVACredListGet(&list, nullptr, nullptr), 5);
    EXPECT_EQ(Ids(list), (std::vector<int>{5, 4, 3, 2, 1}));
    EXPECT_EQ(list->host, "h5");
    KOVACredListFree(&list);
    EXPECT_EQ(list, nullptr);

    char odd[] = "odd";
    EXPECT_EQ(KOVACredListGet(&list, KOVACredKeepByApplication, odd), 3);
    EXPECT_EQ(Ids(list), (std::vector<int>{5, 3, 1}));
    KOVACredListFree(&list);

    // A filter that drops everything leaves the caller's head as it was.
    KOVA_CRED sentinel;
    list = &sentinel;
    auto none = [](KOVA_CRED *, void *) -> int { return 0; };
    EXPECT_EQ(KOVACredListGet(&list, none, nullptr), 0);
    EXPECT_EQ(list, &sentinel);

    // The filter sees each record with the caller's argument.
    struct Seen {
        std::vector<int> ids;
    } seen;
    auto record = [](KOVA_CRED *cred, void *arg) -> int {
        static_cast<Seen *>(arg)->ids.push_back(cred->id);
        return cred->id == 2;
    };
    list = nullptr;
    EXPECT_EQ(KOVACredListGet(&list, record, &seen), 1);
    EXPECT_EQ(seen.ids, (std::vector<int>{5, 4, 3, 2, 1}));
    EXPECT_EQ(Ids(list), (std::vector<int>{2}));
    EXPECT_EQ(KOVACredNext(list), nullptr);
    KOVACredListFree(&list);

    EXPECT_EQ(KOVACredListGet(nullptr, nullptr, nullptr), -1);
    EXPECT_TRUE(ArgErrorReported("cred_list", 14, "__null != pCredList"));
}

TEST_F(InterfaceTest, LookUpByApplicationFindsTheNewest) {
    for (int i = 1; i <= 9; ++i) {
        AddCred("h" + std::to_string(i), (i == 4 || i == 9) ? "backup" : "app" + std::to_string(i));
    }
    EXPECT_EQ(KOVACredIDGetByApplication("backup"), 9);
    KOVACredRemoveByID(9);
    EXPECT_EQ(KOVACredIDGetByApplication("backup"), 4);
    EXPECT_EQ(KOVACredIDGetByApplication("Backup"), -1);  // exact, case-sensitive
    EXPECT_EQ(KOVACredIDGetByApplication("backu"), -1);
    EXPECT_EQ(KOVACredIDGetByApplication(""), -1);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
    EXPECT_EQ(KOVACredIDGetByApplication(nullptr), -1);
    EXPECT_TRUE(ArgErrorReported("cred_get", 44, "__null != szApplication"));

    CredPtr cred = MakeCred("h", "tag");
    char tag[] = "tag";
    char other[] = "tag ";
    EXPECT_EQ(KOVACredKeepByApplication(cred.get(), tag), 1);
    EXPECT_EQ(KOVACredKeepByApplication(cred.get(), other), 0);

    kova_test::ClearLog();
    // A table made elsewhere: columns in another order and one the record lacks, ids out of
    // the rows' order, an application left NULL. Lists find the columns by name, and the
    // newest of an application is the head of such a list: the last matching row.
    ASSERT_TRUE(Query("DROP TABLE credential_sessions; DROP TABLE credentials; CREATE TABLE "
                      "credentials (application TEXT, note TEXT, extra_info TEXT, port INTEGER, "
                      "host TEXT, id INTEGER, owner INTEGER, remote_account TEXT, remote_passwd "
                      "TEXT, protocol TEXT, ctime INTEGER, mtime INTEGER); INSERT INTO "
                      "credentials VALUES ('backup', 'n', 'e9', 9001, 'h9', 9, 1, 'a9', 'p9', "
                      "'https', 1700000009, 19), ('backup', 'n', 'e4', 4001, 'h4', 4, 2, 'a4', "
                      "'p4', 'http', 14, 1700000004), (NULL, 'n', 'e7', 7001, 'h7', 7, 3, 'a7', "
                      "'p7', 'ftp', 17, 27);")
                    .empty());
    KOVA_CRED *list = nullptr;
    ASSERT_EQ(KOVACredListGet(&list, nullptr, nullptr), 3);
    EXPECT_EQ(Ids(list), (std::vector<int>{7, 4, 9}));
    const KOVA_CRED &four = *list->next;
    EXPECT_EQ((std::vector<int32_t>{four.port, four.owner, four.ctime, four.mtime}),
              (std::vector<int32_t>{4001, 2, 14, 1700000004}));
    EXPECT_EQ((std::vector<std::string>{four.application, four.extra_info, four.host,
                                        four.remote_account, four.remote_passwd, four.protocol}),
              (std::vector<std::string>{"backup", "e4", "h4", "a4", "p4", "http"}));
    EXPECT_EQ(list->application, "");
    KOVACredListFree(&list);
    EXPECT_EQ(KOVACredIDGetByApplication("backup"), 4);
    EXPECT_EQ(KOVACredIDGetByApplication(""), 7);
    EXPECT_EQ(KOVACredIDGetByApplication("h9"), -1);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

TEST_F(InterfaceTest, ArgumentErrorsOfTheInterface) {
    ExpectArgErrors({
        {[] { return KOVACredGetByID(1, nullptr); }, "cred_get", 10, "__null != pCred"},
        {[] { return KOVACredSetByID(1, nullptr); }, "cred_set", 10, "__null != pCred"},
        {[] { return KOVACredAdd(nullptr); }, "cred_add", 11, "__null != pCred"},
        {[] { return KOVACredSave(nullptr); }, "cred_save", 11, "__null != pCred"},
    });
    // None of them touched the database.
    EXPECT_NE(access(DbPath().c_str(), F_OK), 0);
}

TEST_F(InterfaceTest, OpenFailuresNameTheInnerError) {
    BlockDatabase();
    CredPtr cred = MakeCred("h");
    ExpectFailuresLogged(
        {
            {[&] { return KOVACredGetByID(1, cred.get()); }, "cred_get:15 Init sqlite failed. "},
            {[&] { return KOVACredSetByID(1, cred.get()); }, "cred_set:15 Init sqlite failed. "},
            {[&] { return KOVACredAdd(cred.get()); }, "cred_add:16 Init sqlite failed. "},
            {[&] {
                 KOVA_CRED *list = nullptr;
                 return KOVACredListGet(&list, nullptr, nullptr);
             },
             "cred_list:19 Init sqlite failed. "},
            {[&] { return KOVACredRemoveByID(1); }, "cred_remove:14 Init sqlite failed. "},
            {[&] { return KOVACredIDGetByApplication("app"); },
             "cred_list:19 Init sqlite failed. "},
            {[&] { return KOVACredLoad(3, cred.get()); }, "cred_load:19 get task failed. [3] "},
            {[&] {
                 cred->id = -1;
                 return KOVACredSave(cred.get());
             },
             "cred_save:16 Add task failed. "},
        },
        "[0x0900 cred_db:169]");
    EXPECT_EQ(cred->id, -1);
}

TEST_F(InterfaceTest, StatementFailuresOfAnOpenDatabaseAreLogged) {
    AddCred("h");
    // A view under the credential table's name survives the schema statements (IF NOT EXISTS)
    // but reads a table that is gone and takes no writes, so every step fails on a database
    // that opened.
    ASSERT_TRUE(Query("DROP TABLE credential_sessions; DROP TABLE credentials; "
                      "CREATE VIEW credentials AS SELECT * FROM gone;")
                    .empty());
    CredPtr cred = MakeCred("h");
    // The inner steps record no code of their own: the lines carry the empty slot.
    ExpectFailuresLogged(
        {
            {[&] { return KOVACredGetByID(1, cred.get()); },
             "cred_get:19 Get Cred record failed. id:[1]"},
            {[&] { return KOVACredAdd(cred.get()); }, "cred_add:20 Add Cred record failed. "},
            {[&] { return KOVACredRemoveByID(1); },
             "cred_remove:18 Remove Cred record failed. id:[1]"},
        },
        "[0x0000 :0]");
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

}  // namespace
