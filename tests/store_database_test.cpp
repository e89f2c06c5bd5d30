// The credential database: file, mode and schema; the record-level operations on an open
// connection; their argument and statement errors; hostile text; a broken environment.
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "store_fixture.h"

namespace {

using namespace store_test;

class DatabaseTest : public StoreTest {
  protected:
    DbPtr Open() {
        DbPtr db(KOVACredDBInit());
        EXPECT_NE(db, nullptr) << kova_test::LogDump();
        return db;
    }

    int Add(sqlite3 *db, const KOVA_CRED &cred) {
        int id = -1;
        EXPECT_EQ(KOVACredDBRecordAdd(db, &cred, &id), 0) << kova_test::LogDump();
        return id;
    }
};

mode_t ModeOf(const std::string &path) {
    struct stat st;
    return stat(path.c_str(), &st) == 0 ? (st.st_mode & 07777) : 0;
}

std::vector<std::string> ColumnsOf(const std::string &dbPath, const std::string &table) {
    std::vector<std::string> names;
    for (const auto &row : RawQuery(dbPath, "PRAGMA table_info(" + table + ");")) {
        names.push_back(row[1] + " " + row[2] + (row[5] == "1" ? " PK" : ""));
    }
    return names;
}

TEST_F(DatabaseTest, CreatesFileWithBothTablesAndMode0600) {
    ASSERT_NE(access(DbPath().c_str(), F_OK), 0);
    DbPtr db = Open();
    ASSERT_NE(db, nullptr);
    db.reset();
    EXPECT_EQ(ModeOf(DbPath()), 0600u);
    EXPECT_EQ(ColumnsOf(DbPath(), "credentials"),
              (std::vector<std::string>{"id INTEGER PK", "ctime INTEGER", "mtime INTEGER",
                                        "host TEXT", "owner INTEGER", "remote_account TEXT",
                                        "remote_passwd TEXT", "port INTEGER", "protocol TEXT",
                                        "application TEXT", "extra_info TEXT", "pid INTEGER"}));
    EXPECT_EQ(ColumnsOf(DbPath(), "credential_sessions"),
              (std::vector<std::string>{"id INTEGER PK", "mtime INTEGER", "access_token TEXT",
                                        "csrf_token TEXT", "extra_info TEXT"}));
    auto fk = Query("PRAGMA foreign_key_list(credential_sessions);");
    ASSERT_EQ(fk.size(), 1u);
    EXPECT_EQ(fk[0][2], "credentials");
    EXPECT_EQ(fk[0][3], "id");
    EXPECT_EQ(fk[0][4], "id");
    // The schema statements are stored as written, tabs included.
    auto sql = Query("SELECT sql FROM sqlite_master WHERE name='credentials';");
    ASSERT_EQ(sql.size(), 1u);
    EXPECT_NE(sql[0][0].find("ASC, \t\t\t\t\t\t ctime"), std::string::npos) << sql[0][0];
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

TEST_F(DatabaseTest, ReopenKeepsRowsAndRestoresTheMode) {
    {
        DbPtr db = Open();
        Add(db.get(), *MakeCred("a.example"));
    }
    ASSERT_EQ(chmod(DbPath().c_str(), 0644), 0);
    DbPtr db = Open();
    ASSERT_NE(db, nullptr);
    EXPECT_EQ(ModeOf(DbPath()), 0600u);
    EXPECT_EQ(Query("SELECT host FROM credentials;"), (std::vector<Row>{{"a.example"}}));
}

TEST_F(DatabaseTest, CreatesMissingParentFolders) {
    const std::string nested = db_.dir().File("one/two/credentials.sqlite");
    setenv("kovacredential_db", nested.c_str(), 1);
    DbPtr db = Open();
    ASSERT_NE(db, nullptr);
    EXPECT_EQ(ModeOf(db_.dir().File("one")), 0700u);
    EXPECT_EQ(ModeOf(db_.dir().File("one/two")), 0700u);
    EXPECT_EQ(ModeOf(nested), 0600u);
}

TEST_F(DatabaseTest, AddWritesEveryColumn) {
    DbPtr db = Open();
    CredPtr cred = MakeCred("nas.example", "backup", 5001);
    cred->id = 99;  // never written: SQLite assigns the id
    cred->ctime = 5;
    cred->mtime = 6;
    const long before = time(nullptr);
    int id = Add(db.get(), *cred);
    const long after = time(nullptr);
    EXPECT_EQ(id, 1);
    EXPECT_EQ(Add(db.get(), *cred), 2);
    EXPECT_EQ(KOVACredDBRecordAdd(db.get(), cred.get(), nullptr), 0);
    auto rows = Query(
        "SELECT id, ctime, mtime, host, owner, remote_account, remote_passwd, port, protocol, "
        "application, extra_info, pid, typeof(port) FROM credentials WHERE id=1;");
    ASSERT_EQ(rows.size(), 1u);
    const Row &r = rows[0];
    EXPECT_EQ(r[0], "1");
    EXPECT_GE(std::stol(r[1]), before);
    EXPECT_LE(std::stol(r[1]), after);
    EXPECT_EQ(r[1], r[2]);
    EXPECT_EQ((Row{r[3], r[4], r[5], r[6], r[7], r[8], r[9], r[10], r[11], r[12]}),
              (Row{"nas.example", "1024", "admin", "pw-nas.example", "5001", "https", "backup",
                   "{\"k\":1}", std::to_string(getpid()), "integer"}));
}

TEST_F(DatabaseTest, GetReadsOneRowAndReportsFound) {
    DbPtr db = Open();
    CredPtr stored = MakeCred("h1");
    stored->owner = 7;
    int id = Add(db.get(), *stored);

    CredPtr cred = NewCred();
    EXPECT_EQ(KOVACredDBRecordGet(db.get(), id, cred.get()), 1);
    EXPECT_EQ(cred->id, id);
    EXPECT_EQ(cred->host, "h1");
    EXPECT_EQ(cred->owner, 7);
    EXPECT_EQ(cred->remote_passwd, "pw-h1");
    EXPECT_GT(cred->ctime, 0);

    CredPtr missing = NewCred();
    missing->host = "untouched";
    EXPECT_EQ(KOVACredDBRecordGet(db.get(), 42, missing.get()), 0);
    EXPECT_EQ(missing->id, -1);
    EXPECT_EQ(missing->host, "untouched");

    // A filled record is not overwritten and counts as found.
    CredPtr filled = NewCred();
    filled->filled = 1;
    filled->host = "mine";
    EXPECT_EQ(KOVACredDBRecordGet(db.get(), 42, filled.get()), 1);
    EXPECT_EQ(KOVACredDBRecordGet(db.get(), id, filled.get()), 1);
    EXPECT_EQ(filled->host, "mine");
}

TEST_F(DatabaseTest, GetListOrderConditionAndOrdering) {
    DbPtr db = Open();
    for (int port : {3, 1, 2}) {
        Add(db.get(), *MakeCred("h" + std::to_string(port), "app", port));
    }
    auto ids = [](KOVA_CRED *head) {
        std::vector<int> out = Ids(head);
        KOVACredListFree(&head);
        return out;
    };
    // Rows come in id order and every node is linked in front: newest first.
    EXPECT_EQ(ids(KOVACredDBRecordGetList(db.get(), nullptr, nullptr, 0)),
              (std::vector<int>{3, 2, 1}));
    EXPECT_EQ(ids(KOVACredDBRecordGetList(db.get(), "", "", 1)), (std::vector<int>{3, 2, 1}));
    EXPECT_EQ(ids(KOVACredDBRecordGetList(db.get(), "port > 1", nullptr, 0)),
              (std::vector<int>{3, 1}));
    // Ascending port 1,2,3 is ids 2,3,1, reversed by the list.
    EXPECT_EQ(ids(KOVACredDBRecordGetList(db.get(), nullptr, "port", 1)),
              (std::vector<int>{1, 3, 2}));
    // Descending port among ids 2 and 3 delivers 3 then 2.
    EXPECT_EQ(ids(KOVACredDBRecordGetList(db.get(), "id >= 2", "port", 0)),
              (std::vector<int>{2, 3}));
    EXPECT_EQ(KOVACredDBRecordGetList(db.get(), "id > 100", nullptr, 0), nullptr);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

TEST_F(DatabaseTest, GetListConditionCannotHoldQuotedLiterals) {
    DbPtr db = Open();
    Add(db.get(), *MakeCred("a"));
    EXPECT_EQ(KOVACredDBRecordGetList(db.get(), "host='a'", nullptr, 0), nullptr);
    EXPECT_EQ(kova_test::LogCount("cred_db:297 Exec sql:[SELECT * FROM credentials WHERE "
                                  "host=''a'';] error: "),
              1u)
        << kova_test::LogDump();
    EXPECT_EQ(KOVACredSessDBRecordGetList(db.get(), "csrf_token='t'", "id", 1), nullptr);
    EXPECT_EQ(kova_test::LogCount("cred_db:498 Exec sql:[SELECT * FROM credential_sessions "
                                  "WHERE csrf_token=''t''  ORDER BY id ASC;] error: "),
              1u)
        << kova_test::LogDump();
}

TEST_F(DatabaseTest, UpdateRewritesTheRowAndVerifiesIt) {
    DbPtr db = Open();
    int id = Add(db.get(), *MakeCred("old"));
    ASSERT_EQ(sqlite3_exec(db.get(), "UPDATE credentials SET ctime=10, mtime=10, pid=1;", nullptr,
                           nullptr, nullptr),
              SQLITE_OK);
    CredPtr cred = MakeCred("new", "app2", 6001);
    cred->id = 555;  // the argument names the row, not the record
    cred->owner = -1;
    const long before = time(nullptr);
    EXPECT_EQ(KOVACredDBRecordUpdate(db.get(), id, cred.get()), 0) << kova_test::LogDump();
    auto rows = Query(
        "SELECT id, ctime, mtime, host, owner, port, application, pid "
        "FROM credentials;");
    ASSERT_EQ(rows.size(), 1u);
    EXPECT_EQ(rows[0][0], std::to_string(id));
    EXPECT_EQ(rows[0][1], "10");  // ctime and pid stay
    EXPECT_GE(std::stol(rows[0][2]), before);
    EXPECT_EQ((Row{rows[0][3], rows[0][4], rows[0][5], rows[0][6], rows[0][7]}),
              (Row{"new", "-1", "6001", "app2", "1"}));
}

TEST_F(DatabaseTest, UpdateOfAMissingRowFailsOnReadBack) {
    DbPtr db = Open();
    EXPECT_EQ(KOVACredDBRecordUpdate(db.get(), 42, MakeCred("x").get()), -1);
    EXPECT_TRUE(ErrorIs(KOVA_ERR_DB_READBACK, "cred_db", 377));
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
    EXPECT_EQ(KOVACredSessDBRecordUpdate(db.get(), 42, MakeSess(42, "s", "t").get()), -1);
    // No credential 42: the REPLACE itself fails on the foreign key.
    EXPECT_EQ(kova_test::LogCount("cred_db:550 Exec sql:[REPLACE INTO credential_sessions (id, "
                                  "mtime, access_token, csrf_token, extra_info) \t\t\tVALUES "
                                  "(42, "),
              1u)
        << kova_test::LogDump();
    EXPECT_TRUE(kova_test::LogHas("FOREIGN KEY constraint failed"));
}

TEST_F(DatabaseTest, SessionUpdateReadBackMismatchIs2816) {
    DbPtr db = Open();
    int id = Add(db.get(), *MakeCred("h"));
    // A trigger rewrites the token behind the writer's back, so the read-back finds nothing.
    ASSERT_EQ(sqlite3_exec(db.get(),
                           "CREATE TRIGGER mangle AFTER INSERT ON credential_sessions BEGIN "
                           "UPDATE credential_sessions SET csrf_token='changed' WHERE id=NEW.id; "
                           "END;",
                           nullptr, nullptr, nullptr),
              SQLITE_OK);
    EXPECT_EQ(KOVACredSessDBRecordUpdate(db.get(), id, MakeSess(id, "s", "t").get()), -1);
    EXPECT_TRUE(ErrorIs(KOVA_ERR_DB_READBACK, "cred_db", 563));
}

TEST_F(DatabaseTest, SessionRowsReplaceAndRemove) {
    DbPtr db = Open();
    int id = Add(db.get(), *MakeCred("h"));
    EXPECT_EQ(KOVACredSessDBRecordUpdate(db.get(), id, MakeSess(0, "s1", "t1").get()), 0);
    EXPECT_EQ(KOVACredSessDBRecordUpdate(db.get(), id, MakeSess(0, "s2", "t2").get()), 0);
    EXPECT_EQ(Query("SELECT id, access_token, csrf_token, extra_info FROM credential_sessions;"),
              (std::vector<Row>{{std::to_string(id), "s2", "t2", "extra-s2"}}));
    SessPtr sess = NewSess();
    EXPECT_EQ(KOVACredSessDBRecordGet(db.get(), id, sess.get()), 1);
    EXPECT_EQ(sess->access_token, "s2");
    SessPtr none = NewSess();
    EXPECT_EQ(KOVACredSessDBRecordGet(db.get(), id + 1, none.get()), 0);
    KOVA_CRED_SESS *list = KOVACredSessDBRecordGetList(db.get(), nullptr, nullptr, 0);
    ASSERT_NE(list, nullptr);
    EXPECT_EQ(list->id, id);
    EXPECT_EQ(list->next, nullptr);
    KOVACredSessListFree(&list);

    EXPECT_EQ(KOVACredSessDBRecordRemove(db.get(), id), 0);
    EXPECT_TRUE(Query("SELECT * FROM credential_sessions;").empty());
    EXPECT_EQ(Query("SELECT count(*) FROM credentials;"), (std::vector<Row>{{"1"}}));
    EXPECT_EQ(KOVACredSessDBRecordRemove(db.get(), id), 0);
}

TEST_F(DatabaseTest, SessionInsertNeedsACredentialWithTheNextRowId) {
    DbPtr db = Open();
    int sessId = -1;
    EXPECT_EQ(KOVACredSessDBRecordAdd(db.get(), MakeSess(-1, "s", "t").get(), &sessId), -1);
    EXPECT_EQ(sessId, -1);
    EXPECT_EQ(kova_test::LogCount("cred_db:414 Exec sql:[INSERT INTO credential_sessions "
                                  "(mtime, access_token, csrf_token, extra_info) \t\t\tVALUES "),
              1u)
        << kova_test::LogDump();
    Add(db.get(), *MakeCred("h"));
    EXPECT_EQ(KOVACredSessDBRecordAdd(db.get(), MakeSess(-1, "s", "t").get(), &sessId), 0);
    EXPECT_EQ(sessId, 1);
}

TEST_F(DatabaseTest, RemoveDeletesTheSessionFirst) {
    DbPtr db = Open();
    int id = Add(db.get(), *MakeCred("h"));
    Add(db.get(), *MakeCred("other"));
    ASSERT_EQ(KOVACredSessDBRecordUpdate(db.get(), id, MakeSess(id, "s", "t").get()), 0);
    // A plain DELETE of a credential that has a session breaks the foreign key.
    EXPECT_NE(
        sqlite3_exec(db.get(), "DELETE FROM credentials WHERE id=1;", nullptr, nullptr, nullptr),
        SQLITE_OK);
    EXPECT_EQ(KOVACredDBRecordRemove(db.get(), id), 0) << kova_test::LogDump();
    EXPECT_EQ(Query("SELECT host FROM credentials;"), (std::vector<Row>{{"other"}}));
    EXPECT_TRUE(Query("SELECT * FROM credential_sessions;").empty());
    EXPECT_EQ(KOVACredDBRecordRemove(db.get(), 77), 0);

    // A session row left under an id without a credential is removed too.
    ASSERT_EQ(sqlite3_exec(db.get(),
                           "PRAGMA foreign_keys = OFF; INSERT INTO credential_sessions (id, "
                           "access_token) VALUES (90, 'orphan'); PRAGMA foreign_keys = ON;",
                           nullptr, nullptr, nullptr),
              SQLITE_OK);
    EXPECT_EQ(KOVACredDBRecordRemove(db.get(), 90), 0);
    EXPECT_TRUE(Query("SELECT * FROM credential_sessions;").empty());
}

TEST_F(DatabaseTest, ArgumentErrorsCarryTheirLines) {
    DbPtr db = Open();
    CredPtr cred = NewCred();
    SessPtr sess = NewSess();
    ExpectArgErrors({
        {[&] { return KOVACredDBRecordAdd(nullptr, cred.get(), nullptr); }, "cred_db", 193,
         "__null != db"},
        {[&] { return KOVACredDBRecordAdd(db.get(), nullptr, nullptr); }, "cred_db", 193,
         "NULL != pCred"},
        {[&] { return KOVACredDBRecordGet(nullptr, 1, cred.get()); }, "cred_db", 235,
         "__null != db"},
        {[&] { return KOVACredDBRecordGet(db.get(), 1, nullptr); }, "cred_db", 235,
         "NULL != pCred"},
        {[&] { return KOVACredDBRecordGetList(nullptr, nullptr, nullptr, 0) ? 0L : -1L; },
         "cred_db", 265, "__null != db"},
        {[&] { return KOVACredDBRecordRemove(nullptr, 1); }, "cred_db", 312, "__null != db"},
        {[&] { return KOVACredDBRecordUpdate(nullptr, 1, cred.get()); }, "cred_db", 337,
         "__null != db"},
        {[&] { return KOVACredDBRecordUpdate(db.get(), 1, nullptr); }, "cred_db", 337,
         "NULL != pCred"},
        {[&] { return KOVACredSessDBRecordAdd(nullptr, sess.get(), nullptr); }, "cred_db", 401,
         "__null != db"},
        {[&] { return KOVACredSessDBRecordAdd(db.get(), nullptr, nullptr); }, "cred_db", 401,
         "NULL != pSess"},
        {[&] { return KOVACredSessDBRecordGet(nullptr, 1, sess.get()); }, "cred_db", 436,
         "__null != db"},
        {[&] { return KOVACredSessDBRecordGet(db.get(), 1, nullptr); }, "cred_db", 436,
         "NULL != pSess"},
        {[&] { return KOVACredSessDBRecordGetList(nullptr, "x", "y", 1) ? 0L : -1L; }, "cred_db",
         467, "__null != db"},
        {[&] { return KOVACredSessDBRecordRemove(nullptr, 1); }, "cred_db", 513, "__null != db"},
        {[&] { return KOVACredSessDBRecordUpdate(nullptr, 1, sess.get()); }, "cred_db", 539,
         "__null != db"},
        {[&] { return KOVACredSessDBRecordUpdate(db.get(), 1, nullptr); }, "cred_db", 539,
         "NULL != pSess"},
    });
}

TEST_F(DatabaseTest, StatementFailuresAreLoggedWithTheirLines) {
    DbPtr db = Open();
    // Without the tables every statement fails with SQLite's message.
    ASSERT_EQ(sqlite3_exec(db.get(), "DROP TABLE credential_sessions; DROP TABLE credentials;",
                           nullptr, nullptr, nullptr),
              SQLITE_OK);
    CredPtr cred = MakeCred("h");
    SessPtr sess = MakeSess(1, "s", "t");
    // Statement failures record no code.
    ASSERT_EQ(VLIBCErrGet(), 0);
    ExpectFailuresLogged({
        {[&] { return KOVACredDBRecordAdd(db.get(), cred.get(), nullptr); },
         "cred_db:214 Exec sql:[INSERT INTO credentials \t\t(ctime, mtime, host, owner, "
         "remote_account, remote_passwd, port, protocol, application, extra_info, pid) "
         "\t\tVALUES ("},
        {[&] { return KOVACredDBRecordGet(db.get(), 3, cred.get()); },
         "cred_db:242 Exec sql:[SELECT * FROM credentials WHERE id=3;] error: no such table: "
         "credentials\n"},
        {[&] { return KOVACredDBRecordGetList(db.get(), nullptr, nullptr, 0) ? 0L : -1L; },
         "cred_db:297 Exec sql:[SELECT * FROM credentials;] error: no such table: "
         "credentials\n"},
        {[&] { return KOVACredDBRecordUpdate(db.get(), 3, cred.get()); },
         "cred_db:356 Exec sql:[UPDATE credentials SET \t\tmtime="},
        {[&] { return KOVACredSessDBRecordAdd(db.get(), sess.get(), nullptr); },
         "cred_db:414 Exec sql:[INSERT INTO credential_sessions"},
        {[&] { return KOVACredSessDBRecordGet(db.get(), 4, sess.get()); },
         "cred_db:443 Exec sql:[SELECT * FROM credential_sessions WHERE id=4;] error: no such "
         "table: credential_sessions\n"},
        {[&] { return KOVACredSessDBRecordGetList(db.get(), "id > 1", nullptr, 0) ? 0L : -1L; },
         "cred_db:498 Exec sql:[SELECT * FROM credential_sessions WHERE id > 1 ;] error: no "
         "such table: credential_sessions\n"},
        {[&] { return KOVACredSessDBRecordRemove(db.get(), 5); },
         "cred_db:520 Exec sql:[DELETE FROM credential_sessions WHERE id=5;] error: no such "
         "table: credential_sessions\n"},
        {[&] { return KOVACredSessDBRecordUpdate(db.get(), 6, sess.get()); },
         "cred_db:550 Exec sql:[REPLACE INTO credential_sessions (id, mtime, access_token, "
         "csrf_token, extra_info) \t\t\tVALUES (6, "},
        {[&] { return KOVACredDBRecordRemove(db.get(), 7); },
         "cred_db:319 Exec sql:[DELETE FROM credentials WHERE id=7;] error: no such table: "
         "credentials\n"},
    });
    EXPECT_EQ(VLIBCErrGet(), 0);
}

// Text with every character that could end a quoted SQL literal or a format.
const std::string kHostile[] = {
    "x'); DROP TABLE credentials; --",
    "it's \"quoted\" \\ back\\slash %s %d %q %% 100%",
    "line1\nline2\r\n\ttab",
    "\xc3\xa9\xe2\x82\xac\xf0\x9f\x94\x91 \xff\xfe raw bytes",
    "'; DELETE FROM credential_sessions; SELECT '",
};

TEST_F(DatabaseTest, HostileTextRoundTripsAndInjectsNothing) {
    DbPtr db = Open();
    Add(db.get(), *MakeCred("bystander"));
    for (const auto &text : kHostile) {
        SCOPED_TRACE(text);
        CredPtr cred = NewCred();
        int n = 0;
        for (auto member :
             {&KOVA_CRED::host, &KOVA_CRED::remote_account, &KOVA_CRED::remote_passwd,
              &KOVA_CRED::protocol, &KOVA_CRED::application, &KOVA_CRED::extra_info}) {
            cred.get()->*member = text + "|" + std::to_string(n++);
        }
        int id = Add(db.get(), *cred);
        CredPtr loaded = NewCred();
        ASSERT_EQ(KOVACredDBRecordGet(db.get(), id, loaded.get()), 1);
        for (auto member :
             {&KOVA_CRED::host, &KOVA_CRED::remote_account, &KOVA_CRED::remote_passwd,
              &KOVA_CRED::protocol, &KOVA_CRED::application, &KOVA_CRED::extra_info}) {
            EXPECT_EQ(loaded.get()->*member, cred.get()->*member);
        }
        // The update and its read-back match the same bytes.
        cred->host = text + " updated";
        EXPECT_EQ(KOVACredDBRecordUpdate(db.get(), id, cred.get()), 0) << kova_test::LogDump();
        SessPtr sess = MakeSess(id, text, text + "t");
        sess->extra_info = text + "e";
        EXPECT_EQ(KOVACredSessDBRecordUpdate(db.get(), id, sess.get()), 0);
        SessPtr back = NewSess();
        ASSERT_EQ(KOVACredSessDBRecordGet(db.get(), id, back.get()), 1);
        EXPECT_EQ(back->access_token, text);
        EXPECT_EQ(back->csrf_token, text + "t");
        EXPECT_EQ(back->extra_info, text + "e");
        CredPtr updated = NewCred();
        ASSERT_EQ(KOVACredDBRecordGet(db.get(), id, updated.get()), 1);
        EXPECT_EQ(updated->host, text + " updated");
    }
    EXPECT_EQ(Query("SELECT count(*) FROM credentials;"), (std::vector<Row>{{"6"}}));
    EXPECT_EQ(Query("SELECT count(*) FROM credential_sessions;"), (std::vector<Row>{{"5"}}));
    EXPECT_EQ(Query("SELECT host FROM credentials WHERE id=1;"), (std::vector<Row>{{"bystander"}}));
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

// ---- A broken environment: every case ends in a clean failure with its log, never a crash.

TEST_F(DatabaseTest, FolderThatCannotBeMade) {
    const std::string path = BlockDatabase();
    EXPECT_EQ(KOVACredDBInit(), nullptr);
    EXPECT_TRUE(ErrorIs(KOVA_ERR_DB_OPEN, "cred_db", 169));
    EXPECT_EQ(kova_test::LogCount("cred_db:165 " + path + " chmod failed. errno=[0x0014]"), 1u)
        << kova_test::LogDump();  // ENOTDIR
    EXPECT_EQ(kova_test::LogCount("cred_db:170 Can't open database: "), 1u) << kova_test::LogDump();

    kova_test::ClearLog();
    CredPtr cred = MakeCred("h");
    EXPECT_EQ(KOVACredAdd(cred.get()), -1);
    EXPECT_EQ(cred->id, -1);
    EXPECT_EQ(kova_test::LogCount("cred_add:16 Init sqlite failed. [0x0900 cred_db:169]"), 1u)
        << kova_test::LogDump();
    KOVA_CRED *list = nullptr;
    EXPECT_EQ(KOVACredListGet(&list, nullptr, nullptr), -1);
    EXPECT_EQ(list, nullptr);
    EXPECT_EQ(KOVACredIDGetByApplication("app"), -1);
}

TEST_F(DatabaseTest, FileThatIsNotADatabase) {
    {
        FILE *f = fopen(DbPath().c_str(), "w");
        ASSERT_NE(f, nullptr);
        std::string junk(8192, 'J');
        fwrite(junk.data(), 1, junk.size(), f);
        fclose(f);
    }
    EXPECT_EQ(KOVACredDBInit(), nullptr);
    // The open succeeds: SQLite reads the file at the first statement that needs the schema.
    EXPECT_EQ(kova_test::LogRecords(),
              (std::vector<std::string>{
                  "cred_db:175 Exec sql:[CREATE TABLE if not exists credentials (id INTEGER "
                  "PRIMARY KEY ASC, \t\t\t\t\t\t ctime INTEGER, mtime INTEGER, host TEXT, owner "
                  "INTEGER, remote_account TEXT, \t\t\t\t\t\t remote_passwd TEXT, port INTEGER, "
                  "protocol TEXT, application TEXT, extra_info TEXT, pid INTEGER);] error: file is "
                  "not a database\n"}));

    kova_test::ClearLog();
    CredPtr cred = NewCred();
    EXPECT_EQ(KOVACredGetByID(1, cred.get()), -1);
    EXPECT_EQ(kova_test::LogCount("cred_get:15 Init sqlite failed. "), 1u) << kova_test::LogDump();
    EXPECT_EQ(KOVACredRemoveByID(1), -1);
    SessPtr sess = MakeSess(1, "s", "t");
    EXPECT_EQ(KOVACredSessSetByID(1, sess.get()), -1);
    EXPECT_EQ(kova_test::LogCount("cred_sess_set:15 Init sqlite failed. "), 1u);
    // The file is left as it was.
    struct stat st;
    ASSERT_EQ(stat(DbPath().c_str(), &st), 0);
    EXPECT_EQ(st.st_size, 8192);
}

TEST_F(DatabaseTest, FileThatCannotBeRead) {
    {
        DbPtr db = Open();
        Add(db.get(), *MakeCred("h"));
    }
    if (geteuid() == 0) {
        // Root reads any file whatever its mode; a child that gives up root shows the case.
        ASSERT_EQ(chmod(db_.dir().path().c_str(), 0755), 0);
        pid_t pid = fork();
        ASSERT_GE(pid, 0);
        if (pid == 0) {
            if (setgid(65534) != 0 || setuid(65534) != 0) {
                _exit(10);
            }
            kova_test::ClearLog();
            ResetErrorSlot();
            bool ok = KOVACredDBInit() == nullptr;
            ok = ok && VLIBCErrGet() == KOVA_ERR_DB_OPEN && VLIBCErrorGetLine() == 169;
            ok = ok && kova_test::LogCount("cred_db:165 ") == 1;  // not the owner: chmod fails
            ok = ok && kova_test::LogCount("cred_db:170 Can't open database: ") == 1;
            CredPtr cred = NewCred();
            ok = ok && KOVACredGetByID(1, cred.get()) == -1 && cred->id == -1;
            _exit(ok ? 0 : 11);
        }
        int status = 0;
        ASSERT_EQ(waitpid(pid, &status, 0), pid);
        ASSERT_TRUE(WIFEXITED(status));
        EXPECT_EQ(WEXITSTATUS(status), 0) << "the unprivileged child saw a different outcome";
        return;
    }
    // The owner may always chmod its file back to 0600, so the folder is made unsearchable.
    ASSERT_EQ(chmod(db_.dir().path().c_str(), 0600), 0);
    EXPECT_EQ(KOVACredDBInit(), nullptr);
    EXPECT_TRUE(ErrorIs(KOVA_ERR_DB_OPEN, "cred_db", 169));
    EXPECT_EQ(kova_test::LogCount("cred_db:170 Can't open database: "), 1u) << kova_test::LogDump();
    chmod(db_.dir().path().c_str(), 0700);
}

}  // namespace
