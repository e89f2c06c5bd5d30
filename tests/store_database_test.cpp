// The credential database: file, mode and schema; the record-level operations on an open
// connection; their argument and statement errors (logged without secrets); hostile text; a
// hostile or broken environment.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <functional>
#include <string>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "store_fixture.h"

// While set, chmod renames the first file over the second right after setting the mode, as
// another process could between the library's checks and SQLite's open.
std::pair<std::string, std::string> gSwapAfterChmod;

extern "C" int chmod(const char *path, mode_t mode) {
    const int rc = static_cast<int>(syscall(SYS_fchmodat, AT_FDCWD, path, mode));
    if (!gSwapAfterChmod.first.empty()) {
        rename(gSwapAfterChmod.first.c_str(), gSwapAfterChmod.second.c_str());
        gSwapAfterChmod = {};
    }
    return rc;
}

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

TEST_F(DatabaseTest, CreatesFoldersFileAndTablesAndRestoresTheMode) {
    // A folder reached through a link is a normal set-up and works.
    const std::string real = db_.dir().File("real");
    ASSERT_EQ(mkdir(real.c_str(), 0700), 0);
    ASSERT_EQ(symlink(real.c_str(), db_.dir().File("linked").c_str()), 0);
    const std::string path = db_.dir().File("linked/one/two/credentials.sqlite");
    setenv("kovacredential_db", path.c_str(), 1);
    {
        DbPtr db = Open();
        ASSERT_NE(db, nullptr);
        Add(db.get(), *MakeCred("a.example"));
    }
    EXPECT_EQ(ModeOf(real + "/one"), 0700u);
    EXPECT_EQ(ModeOf(real + "/one/two"), 0700u);
    EXPECT_EQ(ModeOf(real + "/one/two/credentials.sqlite"), 0600u);
    EXPECT_EQ(ColumnsOf(path, "credentials"),
              (std::vector<std::string>{"id INTEGER PK", "ctime INTEGER", "mtime INTEGER",
                                        "host TEXT", "owner INTEGER", "remote_account TEXT",
                                        "remote_passwd TEXT", "port INTEGER", "protocol TEXT",
                                        "application TEXT", "extra_info TEXT", "pid INTEGER"}));
    EXPECT_EQ(ColumnsOf(path, "credential_sessions"),
              (std::vector<std::string>{"id INTEGER PK", "mtime INTEGER", "access_token TEXT",
                                        "csrf_token TEXT", "extra_info TEXT"}));
    auto fk = RawQuery(path, "PRAGMA foreign_key_list(credential_sessions);");
    ASSERT_EQ(fk.size(), 1u);
    EXPECT_EQ((Row{fk[0][2], fk[0][3], fk[0][4]}), (Row{"credentials", "id", "id"}));
    // The schema statements are stored as written, tabs included.
    auto sql = RawQuery(path, "SELECT sql FROM sqlite_master WHERE name='credentials';");
    ASSERT_EQ(sql.size(), 1u);
    EXPECT_NE(sql[0][0].find("ASC, \t\t\t\t\t\t ctime"), std::string::npos) << sql[0][0];
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();

    // Opening again keeps the rows and sets the mode back, even one that allows no reading.
    ASSERT_EQ(chmod(path.c_str(), 0), 0);
    DbPtr db = Open();
    EXPECT_EQ(ModeOf(path), 0600u);
    EXPECT_EQ(RawQuery(path, "SELECT host FROM credentials;"), (std::vector<Row>{{"a.example"}}));
}

TEST_F(DatabaseTest, AddWritesEveryColumnAndGetReadsTheRow) {
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

    CredPtr loaded = NewCred();
    EXPECT_EQ(KOVACredDBRecordGet(db.get(), id, loaded.get()), 1);
    EXPECT_EQ((std::vector<long>{loaded->id, loaded->owner, loaded->ctime}),
              (std::vector<long>{id, 1024, std::stol(r[1])}));
    EXPECT_EQ(loaded->remote_passwd, "pw-nas.example");

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

TEST_F(DatabaseTest, GetListOrderAndCondition) {
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

    // Both texts go through %q, so a condition cannot hold a quoted literal.
    EXPECT_EQ(KOVACredDBRecordGetList(db.get(), "host='h1'", nullptr, 0), nullptr);
    EXPECT_EQ(kova_test::LogCount("cred_db:297 Exec sql:[SELECT * FROM credentials WHERE "
                                  "host=''h1'';] error: "),
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

    // Writes not found on the read-back fail with 2816: a missing row, and a session token that
    // a trigger rewrites behind the writer's back.
    EXPECT_EQ(KOVACredDBRecordUpdate(db.get(), 42, cred.get()), -1);
    EXPECT_TRUE(ErrorIs(KOVA_ERR_DB_READBACK, "cred_db", 377));
    ASSERT_EQ(sqlite3_exec(db.get(),
                           "CREATE TRIGGER mangle AFTER INSERT ON credential_sessions BEGIN "
                           "UPDATE credential_sessions SET csrf_token='changed' WHERE id=NEW.id; "
                           "END;",
                           nullptr, nullptr, nullptr),
              SQLITE_OK);
    EXPECT_EQ(KOVACredSessDBRecordUpdate(db.get(), id, MakeSess(id, "s", "t").get()), -1);
    EXPECT_TRUE(ErrorIs(KOVA_ERR_DB_READBACK, "cred_db", 563));
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
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

// The record logged at some second between `before` and `after`, "{now}" standing for it.
::testing::AssertionResult LoggedAtSomeTime(const std::string &pattern, long before, long after) {
    for (long now = before; now <= after; ++now) {
        std::string record = pattern;
        for (size_t at; (at = record.find("{now}")) != std::string::npos;) {
            record.replace(at, 5, std::to_string(now));
        }
        if (kova_test::LogCount(record) == 1) {
            return ::testing::AssertionSuccess();
        }
    }
    return ::testing::AssertionFailure() << "no record " << pattern << " in\n"
                                         << kova_test::LogDump();
}

TEST_F(DatabaseTest, StatementFailuresAreLoggedWithoutSecrets) {
    DbPtr db = Open();
    CredPtr cred = MakeCred("h");
    cred->remote_passwd = "S3cret!";
    SessPtr sess = MakeSess(1, "SID-S3cret", "TOKEN-S3cret");
    sess->extra_info = "x";
    const std::string pid = std::to_string(getpid());
    const long before = time(nullptr);

    // A check that SQLite refuses to run is logged, and the write counts as done.
    const int id = Add(db.get(), *cred);
    sqlite3_set_authorizer(
        db.get(),
        [](void *, int action, const char *, const char *, const char *, const char *) {
            return action == SQLITE_SELECT ? SQLITE_DENY : SQLITE_OK;
        },
        nullptr);
    EXPECT_EQ(KOVACredDBRecordUpdate(db.get(), id, cred.get()), 0);
    EXPECT_EQ(KOVACredSessDBRecordUpdate(db.get(), id, sess.get()), 0);
    sqlite3_set_authorizer(db.get(), nullptr, nullptr);
    const std::string where = std::to_string(id);
    EXPECT_TRUE(LoggedAtSomeTime(
        "cred_db:374 Exec sql:[SELECT * FROM credentials WHERE \t\tid=" + where +
            " AND mtime={now} AND host='h' AND owner=1024 AND remote_account='admin' \t\tAND "
            "remote_passwd='***' AND port='5001' AND protocol='https' AND application='app' AND "
            "extra_info='{\"k\":1}';] error: not authorized\n",
        before, time(nullptr)));
    EXPECT_EQ(kova_test::LogCount("cred_db:560 Exec sql:[SELECT * FROM credential_sessions WHERE "
                                  "id=" +
                                  where +
                                  " AND access_token='***' AND csrf_token='***' AND "
                                  "extra_info='x';] error: not authorized\n"),
              1u);

    // Without the tables every statement fails with SQLite's message.
    ASSERT_EQ(sqlite3_exec(db.get(), "DROP TABLE credential_sessions; DROP TABLE credentials;",
                           nullptr, nullptr, nullptr),
              SQLITE_OK);
    // Statement failures record no code.
    ASSERT_EQ(VLIBCErrGet(), 0);
    ExpectFailuresLogged({
        {[&] { return KOVACredDBRecordGet(db.get(), 3, cred.get()); },
         "cred_db:242 Exec sql:[SELECT * FROM credentials WHERE id=3;] error: no such table: "
         "credentials\n"},
        {[&] { return KOVACredDBRecordGetList(db.get(), nullptr, nullptr, 0) ? 0L : -1L; },
         "cred_db:297 Exec sql:[SELECT * FROM credentials;] error: no such table: "
         "credentials\n"},
        {[&] { return KOVACredSessDBRecordGet(db.get(), 4, sess.get()); },
         "cred_db:443 Exec sql:[SELECT * FROM credential_sessions WHERE id=4;] error: no such "
         "table: credential_sessions\n"},
        {[&] { return KOVACredSessDBRecordGetList(db.get(), "id > 1", nullptr, 0) ? 0L : -1L; },
         "cred_db:498 Exec sql:[SELECT * FROM credential_sessions WHERE id > 1 ;] error: no "
         "such table: credential_sessions\n"},
        {[&] { return KOVACredSessDBRecordRemove(db.get(), 5); },
         "cred_db:520 Exec sql:[DELETE FROM credential_sessions WHERE id=5;] error: no such "
         "table: credential_sessions\n"},
        {[&] { return KOVACredDBRecordRemove(db.get(), 7); },
         "cred_db:319 Exec sql:[DELETE FROM credentials WHERE id=7;] error: no such table: "
         "credentials\n"},
    });
    // The writes show their statements with every password, session id and token as ***.
    kova_test::ClearLog();
    EXPECT_EQ(KOVACredDBRecordAdd(db.get(), cred.get(), nullptr), -1);
    EXPECT_EQ(KOVACredDBRecordUpdate(db.get(), 3, cred.get()), -1);
    EXPECT_EQ(KOVACredSessDBRecordAdd(db.get(), sess.get(), nullptr), -1);
    EXPECT_EQ(KOVACredSessDBRecordUpdate(db.get(), 6, sess.get()), -1);
    const long after = time(nullptr);
    EXPECT_EQ(kova_test::LogRecords().size(), 4u) << kova_test::LogDump();
    EXPECT_TRUE(LoggedAtSomeTime(
        "cred_db:214 Exec sql:[INSERT INTO credentials \t\t(ctime, mtime, host, owner, "
        "remote_account, remote_passwd, port, protocol, application, extra_info, pid) "
        "\t\tVALUES ({now}, {now}, 'h', 1024, 'admin', '***', '5001', 'https', 'app', "
        "'{\"k\":1}', " +
            pid + ");] error: no such table: credentials\n",
        before, after));
    EXPECT_TRUE(LoggedAtSomeTime(
        "cred_db:356 Exec sql:[UPDATE credentials SET \t\tmtime={now}, host='h', owner=1024, "
        "remote_account='admin', \t\tremote_passwd='***', port='5001', protocol='https', "
        "application='app', extra_info='{\"k\":1}' \t\tWHERE id=3;] error: no such table: "
        "credentials\n",
        before, after));
    EXPECT_TRUE(LoggedAtSomeTime(
        "cred_db:414 Exec sql:[INSERT INTO credential_sessions (mtime, access_token, csrf_token, "
        "extra_info) \t\t\tVALUES ({now}, '***', '***', 'x');] error: no such table: "
        "credential_sessions\n",
        before, after));
    EXPECT_TRUE(LoggedAtSomeTime(
        "cred_db:550 Exec sql:[REPLACE INTO credential_sessions (id, mtime, access_token, "
        "csrf_token, extra_info) \t\t\tVALUES (6, {now}, '***', '***', 'x');] error: no such "
        "table: credential_sessions\n",
        before, after));
    EXPECT_EQ(kova_test::LogCount("S3cret"), 0u);
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

// ---- A hostile or broken environment: the open fails cleanly with its log, the callers report
// the inner error, and nothing is changed or created through a link.

bool WriteFile(const std::string &path, const std::string &content, mode_t mode) {
    kova_test::File f(fopen(path.c_str(), "w"));
    return f && fwrite(content.data(), 1, content.size(), f.get()) == content.size() &&
           chmod(path.c_str(), mode) == 0;
}

// The whole content of a file (empty when it cannot be read).
std::string ReadFile(const std::string &path) {
    std::string content;
    kova_test::File f(fopen(path.c_str(), "r"));
    for (int c; f && (c = fgetc(f.get())) != EOF;) {
        content += static_cast<char>(c);
    }
    return content;
}

struct PathCase {
    const char *name;
    std::function<std::string(const std::string &base)> make;  // the path, empty on failure
    std::vector<std::string> records;                          // "{path}" stands for the path
    int code;                                                  // left in the error slot
};

TEST_F(DatabaseTest, PathsThatAreNotOpened) {
    const std::string victim = db_.dir().File("victim");
    const std::string missing = db_.dir().File("missing");
    ASSERT_TRUE(WriteFile(victim, "victim data", 0644));
    const std::string refusedLink = "cred_db:167 {path} is a symbolic link, not opened.\n";
    const std::string refusedKind = "cred_db:167 {path} is not a regular file, not opened.\n";
    const std::vector<PathCase> cases = {
        {"link to a file",
         [&](const std::string &p) { return symlink(victim.c_str(), p.c_str()) == 0 ? p : ""; },
         {refusedLink},
         KOVA_ERR_DB_OPEN},
        {"dangling link",
         [&](const std::string &p) { return symlink(missing.c_str(), p.c_str()) == 0 ? p : ""; },
         {refusedLink},
         KOVA_ERR_DB_OPEN},
        {"folder",
         [](const std::string &p) { return mkdir(p.c_str(), 0700) == 0 ? p : ""; },
         {refusedKind},
         KOVA_ERR_DB_OPEN},
        // Opening a FIFO could block; every case runs in a child bounded in time.
        {"FIFO",
         [](const std::string &p) { return mkfifo(p.c_str(), 0600) == 0 ? p : ""; },
         {refusedKind},
         KOVA_ERR_DB_OPEN},
        {"folder that cannot be made",
         [](const std::string &p) { return WriteFile(p, "", 0600) ? p + "/sub/db.sqlite" : ""; },
         {"cred_db:165 {path} chmod failed. errno=[0x0014]",  // ENOTDIR
          "cred_db:170 Can't open database: unable to open database file\n"},
         KOVA_ERR_DB_OPEN},
        // SQLite reads the file only at the first statement that needs the schema.
        {"file that is not a database",
         [](const std::string &p) { return WriteFile(p, std::string(8192, 'J'), 0600) ? p : ""; },
         {"cred_db:175 Exec sql:[CREATE TABLE if not exists credentials (id INTEGER PRIMARY KEY "
          "ASC, \t\t\t\t\t\t ctime INTEGER, mtime INTEGER, host TEXT, owner INTEGER, "
          "remote_account TEXT, \t\t\t\t\t\t remote_passwd TEXT, port INTEGER, protocol TEXT, "
          "application TEXT, extra_info TEXT, pid INTEGER);] error: file is not a database\n"},
         0},
    };
    for (size_t i = 0; i < cases.size(); ++i) {
        const PathCase &c = cases[i];
        SCOPED_TRACE(c.name);
        const std::string path = c.make(db_.dir().File("case" + std::to_string(i)));
        ASSERT_FALSE(path.empty());
        setenv("kovacredential_db", path.c_str(), 1);
        std::vector<std::string> records = c.records;
        for (auto &r : records) {
            const size_t at = r.find("{path}");
            if (at != std::string::npos) {
                r.replace(at, 6, path);
            }
        }
        const int status = RunInChild([&] {
            EXPECT_EQ(KOVACredDBInit(), nullptr);
            EXPECT_EQ(kova_test::LogRecords(), records);
            EXPECT_EQ(VLIBCErrGet(), c.code);
            kova_test::ClearLog();
            CredPtr cred = MakeCred("h");
            EXPECT_EQ(KOVACredAdd(cred.get()), -1);
            EXPECT_EQ(cred->id, -1);
            char inner[64];
            snprintf(inner, sizeof(inner), "[0x%04X %s]", c.code,
                     c.code != 0 ? "cred_db:169" : ":0");
            EXPECT_EQ(kova_test::LogCount("cred_add:16 Init sqlite failed. " + std::string(inner)),
                      1u)
                << kova_test::LogDump();
        });
        EXPECT_EQ(status, 0);
    }
    EXPECT_EQ(ModeOf(victim), 0644u);
    EXPECT_EQ(ReadFile(victim), "victim data");
    EXPECT_NE(access(missing.c_str(), F_OK), 0);
    EXPECT_EQ(ReadFile(db_.dir().File("case5")), std::string(8192, 'J'));
}

TEST_F(DatabaseTest, FileSwappedInBeforeSQLiteOpensIsRefused) {
    { DbPtr db = Open(); }
    const std::string impostor = db_.dir().File("impostor");
    ASSERT_TRUE(WriteFile(impostor, "", 0644));
    gSwapAfterChmod = {impostor, DbPath()};
    EXPECT_EQ(KOVACredDBInit(), nullptr);
    EXPECT_TRUE(gSwapAfterChmod.first.empty()) << "the library set no mode";
    EXPECT_TRUE(ErrorIs(KOVA_ERR_DB_OPEN, "cred_db", 169));
    EXPECT_EQ(kova_test::LogRecords(),
              (std::vector<std::string>{"cred_db:167 " + DbPath() +
                                        " was replaced while being opened, not opened.\n"}));
    // The impostor got neither the mode nor the tables.
    EXPECT_EQ(ModeOf(DbPath()), 0644u);
    EXPECT_EQ(ReadFile(DbPath()), "");
}

}  // namespace
