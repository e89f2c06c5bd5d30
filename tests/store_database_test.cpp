// The credential database: file, mode and schema; the record-level operations on an open
// connection; their argument and statement errors (logged without secrets); hostile text; a
// hostile or broken environment.
#include <fcntl.h>
#include <string.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include <gtest/gtest.h>

#include "store_fixture.h"
#include "support/child.h"

// While set, fchmod moves the first file over the second right after setting the mode, as
// another process could between the library's checks and SQLite's open; with `swapBack` the
// two are exchanged instead, and exchanged back right after SQLite opened the path.
struct Swap {
    std::string impostor, path;
    bool swapBack = false;
} gSwap;
bool gSwapBackAfterSqliteOpen = false;

int Exchange(const std::string &a, const std::string &b) {
    return static_cast<int>(
        syscall(SYS_renameat2, AT_FDCWD, a.c_str(), AT_FDCWD, b.c_str(), RENAME_EXCHANGE));
}

extern "C" int fchmod(int fd, mode_t mode) {
    const int rc = static_cast<int>(syscall(SYS_fchmod, fd, mode));
    if (!gSwap.path.empty()) {
        if (gSwap.swapBack) {
            gSwapBackAfterSqliteOpen = Exchange(gSwap.impostor, gSwap.path) == 0;
        } else {
            rename(gSwap.impostor.c_str(), gSwap.path.c_str());
            gSwap = {};
        }
    }
    return rc;
}

// The open of SQLite's unix VFS, for the exchange back.
sqlite3_syscall_ptr gSqliteOpen = nullptr;

int SqliteOpenThenSwapBack(const char *path, int flags, int mode) {
    // At the connection's open, SQLite opens the database file alone.
    const int fd =
        reinterpret_cast<int (*)(const char *, int, int)>(gSqliteOpen)(path, flags, mode);
    if (gSwapBackAfterSqliteOpen) {
        Exchange(gSwap.impostor, gSwap.path);
        gSwapBackAfterSqliteOpen = false;
        gSwap = {};
    }
    return fd;
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
    static void Exec(sqlite3 *db, const char *sql) {
        ASSERT_EQ(sqlite3_exec(db, sql, nullptr, nullptr, nullptr), SQLITE_OK) << sql;
    }
};

mode_t ModeOf(const std::string &path) {
    struct stat st;
    return stat(path.c_str(), &st) == 0 ? (st.st_mode & 07777) : 0;
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
    EXPECT_EQ((std::vector<mode_t>{ModeOf(real + "/one"), ModeOf(real + "/one/two"), ModeOf(path)}),
              (std::vector<mode_t>{0700, 0700, 0600}));
    // The schema as written, tabs included.
    EXPECT_EQ(
        RawQuery(path, "SELECT sql FROM sqlite_master WHERE type='table' ORDER BY name;"),
        (std::vector<Row>{
            {"CREATE TABLE credential_sessions (id INTEGER PRIMARY KEY, \t\t\t\t\t\t mtime "
             "INTEGER, "
             "access_token TEXT, csrf_token TEXT, extra_info TEXT, FOREIGN KEY (id) REFERENCES "
             "credentials (id))"},
            {"CREATE TABLE credentials (id INTEGER PRIMARY KEY ASC, \t\t\t\t\t\t ctime INTEGER, "
             "mtime INTEGER, host TEXT, owner INTEGER, remote_account TEXT, \t\t\t\t\t\t "
             "remote_passwd TEXT, port INTEGER, protocol TEXT, application TEXT, extra_info TEXT, "
             "pid INTEGER)"}}));
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();

    // Opening again keeps the rows and sets the mode back, even one that allows no reading.
    ASSERT_EQ(chmod(path.c_str(), 0), 0);
    { DbPtr db = Open(); }
    EXPECT_EQ(ModeOf(path), 0600u);
    EXPECT_EQ(RawQuery(path, "SELECT host FROM credentials;"), (std::vector<Row>{{"a.example"}}));

    // A link to the file, as deployments that keep it elsewhere have: the file it leads to is
    // opened and gets the mode; the link stays.
    const std::string link = db_.dir().File("link.sqlite");
    ASSERT_EQ(symlink(path.c_str(), link.c_str()), 0);
    ASSERT_EQ(chmod(path.c_str(), 0644), 0);
    setenv("kovacredential_db", link.c_str(), 1);
    DbPtr db = Open();
    ASSERT_NE(db, nullptr);
    Add(db.get(), *MakeCred("b.example"));
    EXPECT_EQ(ModeOf(path), 0600u);
    struct stat st;
    EXPECT_TRUE(lstat(link.c_str(), &st) == 0 && S_ISLNK(st.st_mode));
    EXPECT_EQ(RawQuery(path, "SELECT host FROM credentials ORDER BY id;"),
              (std::vector<Row>{{"a.example"}, {"b.example"}}));
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

TEST_F(DatabaseTest, AddWritesEveryColumnAndGetReadsTheRow) {
    DbPtr db = Open();
    CredPtr cred = MakeCred("nas.example", "backup", 5001);
    cred->id = 99;  // never written: SQLite assigns the id
    cred->ctime = 5;
    cred->mtime = 6;
    const long before = time(nullptr);
    const int id = Add(db.get(), *cred);
    const long after = time(nullptr);
    EXPECT_EQ(id, 1);
    EXPECT_EQ(Add(db.get(), *cred), 2);
    EXPECT_EQ(KOVACredDBRecordAdd(db.get(), cred.get(), nullptr), 0);
    auto rows = Query(
        "SELECT ctime, mtime, id, host, owner, remote_account, remote_passwd, port, protocol, "
        "application, extra_info, pid, typeof(port) FROM credentials WHERE id=1;");
    ASSERT_EQ(rows.size(), 1u);
    Row r = rows[0];
    const long ctime = std::stol(r[0]);
    EXPECT_GE(ctime, before);
    EXPECT_LE(ctime, after);
    EXPECT_EQ(r[0], r[1]);
    r.erase(r.begin(), r.begin() + 2);
    EXPECT_EQ(r, (Row{"1", "nas.example", "1024", "admin", "pw-nas.example", "5001", "https",
                      "backup", "{\"k\":1}", std::to_string(getpid()), "integer"}));

    CredPtr loaded = NewCred();
    EXPECT_EQ(KOVACredDBRecordGet(db.get(), id, loaded.get()), 1);
    EXPECT_EQ((std::vector<long>{loaded->id, loaded->owner, loaded->ctime}),
              (std::vector<long>{id, 1024, ctime}));
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
    // Rows come in id order and every node is linked in front: newest first. Ascending port
    // 1,2,3 is ids 2,3,1, reversed by the list.
    const struct {
        const char *where;
        const char *order;
        int ascending;
        std::vector<int> ids;
    } cases[] = {{nullptr, nullptr, 0, {3, 2, 1}}, {"", "", 1, {3, 2, 1}},
                 {"port > 1", nullptr, 0, {3, 1}}, {nullptr, "port", 1, {1, 3, 2}},
                 {"id >= 2", "port", 0, {2, 3}},   {"id > 100", nullptr, 0, {}}};
    for (const auto &c : cases) {
        KOVA_CRED *head = KOVACredDBRecordGetList(db.get(), c.where, c.order, c.ascending);
        EXPECT_EQ(Ids(head), c.ids)
            << (c.where ? c.where : "-") << " " << (c.order ? c.order : "-");
        KOVACredListFree(&head);
    }
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

// An update rewrites the row and reads it back; a removal deletes the session first.
TEST_F(DatabaseTest, UpdateVerifiesTheRowAndRemoveDeletesTheSessionFirst) {
    DbPtr db = Open();
    const int id = Add(db.get(), *MakeCred("old"));
    Exec(db.get(), "UPDATE credentials SET ctime=10, mtime=10, pid=1;");
    CredPtr cred = MakeCred("new", "app2", 6001);
    cred->id = 555;  // the argument names the row, not the record
    cred->owner = -1;
    const long before = time(nullptr);
    EXPECT_EQ(KOVACredDBRecordUpdate(db.get(), id, cred.get()), 0) << kova_test::LogDump();
    auto rows =
        Query("SELECT mtime, id, ctime, host, owner, port, application, pid FROM credentials;");
    ASSERT_EQ(rows.size(), 1u);
    EXPECT_GE(std::stol(rows[0][0]), before);
    // ctime and pid stay
    EXPECT_EQ(Row(rows[0].begin() + 1, rows[0].end()),
              (Row{std::to_string(id), "10", "new", "-1", "6001", "app2", "1"}));

    // Writes not found on the read-back fail with 2816: a missing row, and a session token that
    // a trigger rewrites behind the writer's back.
    EXPECT_EQ(KOVACredDBRecordUpdate(db.get(), 42, cred.get()), -1);
    EXPECT_TRUE(ErrorIs(KOVA_ERR_DB_READBACK, "cred_db", 377));
    Exec(db.get(),
         "CREATE TRIGGER mangle AFTER INSERT ON credential_sessions BEGIN UPDATE "
         "credential_sessions SET csrf_token='changed' WHERE id=NEW.id; END;");
    EXPECT_EQ(KOVACredSessDBRecordUpdate(db.get(), id, MakeSess(id, "s", "t").get()), -1);
    EXPECT_TRUE(ErrorIs(KOVA_ERR_DB_READBACK, "cred_db", 563));
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();

    Exec(db.get(), "DROP TRIGGER mangle;");
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
    Exec(db.get(),
         "PRAGMA foreign_keys = OFF; INSERT INTO credential_sessions (id, access_token) VALUES "
         "(90, 'orphan'); PRAGMA foreign_keys = ON;");
    EXPECT_EQ(KOVACredDBRecordRemove(db.get(), 90), 0);
    EXPECT_TRUE(Query("SELECT * FROM credential_sessions;").empty());
}

TEST_F(DatabaseTest, ArgumentErrorsCarryTheirLines) {
    const DbPtr db = Open();
    sqlite3 *d = db.get();
    const CredPtr cred = NewCred();
    KOVA_CRED *c = cred.get();
    const SessPtr sess = NewSess();
    KOVA_CRED_SESS *s = sess.get();
    auto arg = [](std::function<long()> call, int line, const char *check) {
        return ArgCase{std::move(call), "cred_db", line, check};
    };
    ExpectArgErrors({
        arg([&] { return KOVACredDBRecordAdd(nullptr, c, nullptr); }, 193, "__null != db"),
        arg([&] { return KOVACredDBRecordAdd(d, nullptr, nullptr); }, 193, "NULL != pCred"),
        arg([&] { return KOVACredDBRecordGet(nullptr, 1, c); }, 235, "__null != db"),
        arg([&] { return KOVACredDBRecordGet(d, 1, nullptr); }, 235, "NULL != pCred"),
        arg([] { return KOVACredDBRecordGetList(nullptr, nullptr, nullptr, 0) ? 0L : -1L; }, 265,
            "__null != db"),
        arg([] { return KOVACredDBRecordRemove(nullptr, 1); }, 312, "__null != db"),
        arg([&] { return KOVACredDBRecordUpdate(nullptr, 1, c); }, 337, "__null != db"),
        arg([&] { return KOVACredDBRecordUpdate(d, 1, nullptr); }, 337, "NULL != pCred"),
        arg([&] { return KOVACredSessDBRecordAdd(nullptr, s, nullptr); }, 401, "__null != db"),
        arg([&] { return KOVACredSessDBRecordAdd(d, nullptr, nullptr); }, 401, "NULL != pSess"),
        arg([&] { return KOVACredSessDBRecordGet(nullptr, 1, s); }, 436, "__null != db"),
        arg([&] { return KOVACredSessDBRecordGet(d, 1, nullptr); }, 436, "NULL != pSess"),
        arg([] { return KOVACredSessDBRecordGetList(nullptr, "x", "y", 1) ? 0L : -1L; }, 467,
            "__null != db"),
        arg([] { return KOVACredSessDBRecordRemove(nullptr, 1); }, 513, "__null != db"),
        arg([&] { return KOVACredSessDBRecordUpdate(nullptr, 1, s); }, 539, "__null != db"),
        arg([&] { return KOVACredSessDBRecordUpdate(d, 1, nullptr); }, 539, "NULL != pSess"),
    });
}

// `pattern` with every `key` replaced by `value`.
std::string Fill(std::string pattern, const std::string &key, const std::string &value) {
    for (size_t at; (at = pattern.find(key)) != std::string::npos;) {
        pattern.replace(at, key.size(), value);
    }
    return pattern;
}

// The record logged at some second between `before` and `after`, "{now}" standing for it.
::testing::AssertionResult LoggedAtSomeTime(const std::string &pattern, long before, long after) {
    for (long now = before; now <= after; ++now) {
        if (kova_test::LogCount(Fill(pattern, "{now}", std::to_string(now))) == 1) {
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
    Exec(db.get(), "DROP TABLE credential_sessions; DROP TABLE credentials;");
    ASSERT_EQ(VLIBCErrGet(), 0);  // statement failures record no code
    ExpectFailuresLogged({
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
    std::string KOVA_CRED::*const members[] = {
        &KOVA_CRED::host,     &KOVA_CRED::remote_account, &KOVA_CRED::remote_passwd,
        &KOVA_CRED::protocol, &KOVA_CRED::application,    &KOVA_CRED::extra_info};
    for (const auto &text : kHostile) {
        SCOPED_TRACE(text);
        CredPtr cred = NewCred();
        for (size_t n = 0; n < std::size(members); ++n) {
            cred.get()->*members[n] = text + "|" + std::to_string(n);
        }
        const int id = Add(db.get(), *cred);
        CredPtr loaded = NewCred();
        ASSERT_EQ(KOVACredDBRecordGet(db.get(), id, loaded.get()), 1);
        for (auto member : members) {
            EXPECT_EQ(loaded.get()->*member, cred.get()->*member);
        }
        // The updates and their read-back match the same bytes.
        cred->host = text + " updated";
        EXPECT_EQ(KOVACredDBRecordUpdate(db.get(), id, cred.get()), 0) << kova_test::LogDump();
        SessPtr sess = MakeSess(id, text, text + "t");
        sess->extra_info = text + "e";
        EXPECT_EQ(KOVACredSessDBRecordUpdate(db.get(), id, sess.get()), 0);
        SessPtr back = NewSess();
        ASSERT_EQ(KOVACredSessDBRecordGet(db.get(), id, back.get()), 1);
        CredPtr updated = NewCred();
        ASSERT_EQ(KOVACredDBRecordGet(db.get(), id, updated.get()), 1);
        EXPECT_EQ((Texts{back->access_token, back->csrf_token, back->extra_info, updated->host}),
                  (Texts{text, text + "t", text + "e", text + " updated"}));
    }
    EXPECT_EQ(Query("SELECT count(*) FROM credentials;"), (std::vector<Row>{{"6"}}));
    EXPECT_EQ(Query("SELECT count(*) FROM credential_sessions;"), (std::vector<Row>{{"5"}}));
    EXPECT_EQ(Query("SELECT host FROM credentials WHERE id=1;"), (std::vector<Row>{{"bystander"}}));
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

// ---- A hostile or broken environment: the open fails cleanly with its log, the callers report
// the inner error, and nothing is changed or created through a link.

using kova_test::ReadFile;
using kova_test::WriteFile;

struct PathCase {
    const char *name;
    int code;                                                  // left in the error slot
    Texts records;                                             // "{path}" stands for the path
    std::function<std::string(const std::string &base)> make;  // the path, empty on failure
};

// A socket bound at `path`, left in the file system when its descriptor closes.
bool BindSocket(const std::string &path) {
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    if (path.size() >= sizeof(addr.sun_path)) {
        return false;
    }
    memcpy(addr.sun_path, path.c_str(), path.size() + 1);
    const int fd = socket(AF_UNIX, SOCK_STREAM, 0);
    const bool bound = fd >= 0 && bind(fd, reinterpret_cast<sockaddr *>(&addr), sizeof(addr)) == 0;
    close(fd);
    return bound;
}

TEST_F(DatabaseTest, PathsThatAreNotOpened) {
    const std::string missing = db_.dir().File("missing");
    const std::string fifo = db_.dir().File("fifo");
    ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
    const std::string link = "cred_db:167 {path} is a symbolic link, not opened.\n";
    const std::string kind = "cred_db:167 {path} is not a regular file, not opened.\n";
    const int open = KOVA_ERR_DB_OPEN;
    auto linkTo = [](const std::string &target) {
        return [target](auto &p) { return symlink(target.c_str(), p.c_str()) ? "" : p; };
    };
    // Opening a FIFO could block: every case runs in a child bounded in time. SQLite reads a
    // file only at the first statement that needs the schema.
    const std::vector<PathCase> cases = {
        {"dangling link", open, {link}, linkTo(missing)},
        {"folder", open, {kind}, [](auto &p) { return mkdir(p.c_str(), 0700) ? "" : p; }},
        {"FIFO", open, {kind}, [](auto &p) { return mkfifo(p.c_str(), 0600) ? "" : p; }},
        {"link to a FIFO", open, {kind}, linkTo(fifo)},
        {"link to a device", open, {kind}, linkTo("/dev/null")},
        {"link to a folder", open, {kind}, linkTo(db_.dir().path())},
        {"socket", open, {kind}, [](auto &p) { return BindSocket(p) ? p : ""; }},
        {"folder that cannot be made",
         open,
         {"cred_db:165 {path} chmod failed. errno=[0x0014]",  // ENOTDIR
          "cred_db:170 Can't open database: unable to open database file\n"},
         [](auto &p) { return WriteFile(p, "", 0600) ? p + "/sub/db.sqlite" : ""; }},
        {"file that is not a database",
         0,
         {"cred_db:175 Exec sql:[" + std::string(kCredSchema) +
          "] error: file is not a database\n"},
         [](auto &p) { return WriteFile(p, std::string(8192, 'J'), 0600) ? p : ""; }},
    };
    for (size_t i = 0; i < cases.size(); ++i) {
        const PathCase &c = cases[i];
        SCOPED_TRACE(c.name);
        const std::string path = c.make(db_.dir().File("case" + std::to_string(i)));
        ASSERT_FALSE(path.empty());
        setenv("kovacredential_db", path.c_str(), 1);
        Texts records;
        for (const auto &r : c.records) {
            records.push_back(Fill(r, "{path}", path));
        }
        const std::string inner = c.code != 0 ? "[0x0900 cred_db:169]" : "[0x0000 :0]";
        auto refused = [&] {
            EXPECT_EQ(KOVACredDBInit(), nullptr);
            EXPECT_EQ(kova_test::LogRecords(), records);
            EXPECT_EQ(VLIBCErrGet(), c.code);
            kova_test::ClearLog();
            CredPtr cred = MakeCred("h");
            EXPECT_EQ(KOVACredAdd(cred.get()), -1);
            EXPECT_EQ(cred->id, -1);
            EXPECT_EQ(LogCountPrefix("cred_add:16 Init sqlite failed. " + inner), 1u)
                << kova_test::LogDump();
            return ::testing::Test::HasFailure() ? 1 : 0;
        };
        EXPECT_EQ(kova_test::RunInChild(60, refused), "exit 0");
    }
    EXPECT_NE(access(missing.c_str(), F_OK), 0);
    EXPECT_EQ(ModeOf(fifo), 0600u);
    EXPECT_EQ(ReadFile(db_.dir().File("case" + std::to_string(cases.size() - 1))),
              std::string(8192, 'J'));
}

TEST_F(DatabaseTest, FileSwappedInBeforeSQLiteOpensIsRefused) {
    { DbPtr db = Open(); }
    const std::string impostor = db_.dir().File("impostor");
    const std::string replaced =
        "cred_db:167 " + DbPath() + " was replaced while being opened, not opened.\n";
    // The file SQLite holds is compared, not the one the path names afterwards: a file swapped
    // in and back again once SQLite opened it is refused too.
    sqlite3_vfs *unixVfs = sqlite3_vfs_find("unix");
    ASSERT_NE(unixVfs, nullptr);
    gSqliteOpen = unixVfs->xGetSystemCall(unixVfs, "open");
    ASSERT_EQ(unixVfs->xSetSystemCall(
                  unixVfs, "open", reinterpret_cast<sqlite3_syscall_ptr>(SqliteOpenThenSwapBack)),
              SQLITE_OK);
    ASSERT_TRUE(WriteFile(impostor, "", 0644));
    gSwap = {impostor, DbPath(), true};
    EXPECT_EQ(KOVACredDBInit(), nullptr);
    unixVfs->xSetSystemCall(unixVfs, "open", gSqliteOpen);
    EXPECT_TRUE(gSwap.path.empty()) << "not swapped back";
    EXPECT_TRUE(ErrorIs(KOVA_ERR_DB_OPEN, "cred_db", 169));
    EXPECT_EQ(kova_test::LogRecords(), Texts{replaced});
    EXPECT_EQ(ModeOf(impostor), 0644u);
    EXPECT_EQ(ReadFile(impostor), "");

    // A file swapped in for good.
    kova_test::ClearLog();
    gSwap = {impostor, DbPath(), false};
    EXPECT_EQ(KOVACredDBInit(), nullptr);
    EXPECT_TRUE(gSwap.path.empty()) << "the library set no mode";
    EXPECT_TRUE(ErrorIs(KOVA_ERR_DB_OPEN, "cred_db", 169));
    EXPECT_EQ(kova_test::LogRecords(), Texts{replaced});
    // The impostor got neither the mode nor the tables.
    EXPECT_EQ(ModeOf(DbPath()), 0644u);
    EXPECT_EQ(ReadFile(DbPath()), "");
}

// ---- Whose file it is and what its mode can be. These need root: files of other users, user
// ids taken in a forked child, private mounts.

// Creates an empty file owned by `uid` with `mode`.
bool MakeFileOf(const std::string &path, uid_t uid, mode_t mode) {
    const int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
    const bool made = fd >= 0 && fchown(fd, uid, uid) == 0 && fchmod(fd, mode) == 0;
    if (fd >= 0) {
        close(fd);
    }
    return made;
}

uid_t OwnerOf(const std::string &path) {
    struct stat st;
    return stat(path.c_str(), &st) == 0 ? st.st_uid : static_cast<uid_t>(-1);
}

class PrivilegedDatabaseTest : public DatabaseTest {
  protected:
    void SetUp() override {
        DatabaseTest::SetUp();
        if (geteuid() != 0) {
            GTEST_SKIP() << "needs root, as CI runs it";
        }
    }
};

TEST_F(PrivilegedDatabaseTest, FileOfAnotherUserIsRefusedAndOwnFilesGetTheirMode) {
    constexpr uid_t kOther = 1000;
    constexpr uid_t kNobody = 65534;
    ASSERT_EQ(chmod(db_.dir().path().c_str(), 0711), 0);
    const std::string shared = db_.dir().File("shared");
    ASSERT_EQ(mkdir(shared.c_str(), 0700), 0);
    ASSERT_EQ(chmod(shared.c_str(), 01777), 0);
    const std::string victim = shared + "/victim.sqlite";
    const std::string own = shared + "/own.sqlite";
    const std::string unreadable = shared + "/unreadable.sqlite";
    ASSERT_TRUE(MakeFileOf(victim, kOther, 0666));
    ASSERT_TRUE(MakeFileOf(own, kNobody, 0644));
    ASSERT_TRUE(MakeFileOf(unreadable, kNobody, 0));
    auto refused = [&](uid_t euid) {
        return Texts{"cred_db:166 " + victim + " belongs to uid 1000, not to the effective uid " +
                     std::to_string(euid) + ", not opened.\n"};
    };
    // Another user's file, however open its mode, is refused to root and to a third user.
    setenv("kovacredential_db", victim.c_str(), 1);
    EXPECT_EQ(KOVACredAdd(MakeCred("h").get()), -1);
    EXPECT_EQ(LogCountPrefix(refused(0)[0]), 1u) << kova_test::LogDump();
    const pid_t child = StartChild(
        [&] {
            ASSERT_EQ(setresgid(kNobody, kNobody, kNobody), 0);
            ASSERT_EQ(setresuid(kNobody, kNobody, kNobody), 0);
            kova_test::ClearLog();
            EXPECT_EQ(KOVACredDBInit(), nullptr);
            EXPECT_TRUE(ErrorIs(KOVA_ERR_DB_OPEN, "cred_db", 169));
            EXPECT_EQ(kova_test::LogRecords(), refused(kNobody));
            // The user's own files are used and get mode 0600, one without any permission too.
            for (const std::string &path : {own, unreadable}) {
                setenv("kovacredential_db", path.c_str(), 1);
                CredPtr cred = MakeCred("h");
                EXPECT_EQ(KOVACredAdd(cred.get()), 0) << path << kova_test::LogDump();
                EXPECT_EQ(ModeOf(path), 0600u) << path;
            }
        },
        60);
    EXPECT_EQ(WaitChild(child), 0);
    EXPECT_EQ((std::vector<unsigned long>{OwnerOf(victim), ModeOf(victim)}),
              (std::vector<unsigned long>{1000, 0666}));
    EXPECT_EQ(ReadFile(victim), "");
    EXPECT_EQ(RawQuery(own, "SELECT host FROM credentials;"), (std::vector<Row>{{"h"}}));
}

TEST_F(PrivilegedDatabaseTest, ModeIsSetWithoutProcAndAModeThatCannotBeSetIsRefused) {
    const std::string mount = db_.dir().File("mount");
    ASSERT_EQ(mkdir(mount.c_str(), 0700), 0);
    const std::string wide = mount + "/wide.sqlite";
    const std::string tight = mount + "/tight.sqlite";
    const pid_t child = StartChild(
        [&] {
            // A private mount namespace: an empty /proc, and a file system that turns read-only.
            ASSERT_EQ(unshare(CLONE_NEWNS), 0) << strerror(errno);
            ASSERT_EQ(::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr), 0);
            ASSERT_EQ(::mount("none", "/proc", "tmpfs", 0, nullptr), 0);
            ASSERT_EQ(::mount("none", mount.c_str(), "tmpfs", 0, "mode=0700"), 0);
            ASSERT_NE(access("/proc/self/fd", F_OK), 0);
            ASSERT_TRUE(WriteFile(DbPath(), "", 0644));
            AddCred("h");
            EXPECT_EQ(ModeOf(DbPath()), 0600u);
            EXPECT_EQ(kova_test::LogRecords(), Texts{});

            for (const std::string &path : {wide, tight}) {
                setenv("kovacredential_db", path.c_str(), 1);
                AddCred("ro");
            }
            ASSERT_EQ(chmod(wide.c_str(), 0644), 0);
            ASSERT_EQ(::mount(nullptr, mount.c_str(), nullptr, MS_REMOUNT | MS_RDONLY, nullptr), 0);
            // On a read-only mount a file that is at 0600 already is read; a wider one is
            // refused.
            kova_test::ClearLog();
            KOVA_CRED *list = nullptr;
            EXPECT_EQ(KOVACredListGet(&list, nullptr, nullptr), 1) << kova_test::LogDump();
            KOVACredListFree(&list);
            EXPECT_EQ(kova_test::LogRecords(),
                      Texts{"cred_db:165 " + tight + " chmod failed. errno=[0x001E]"});  // EROFS
            kova_test::ClearLog();
            setenv("kovacredential_db", wide.c_str(), 1);
            EXPECT_EQ(KOVACredDBInit(), nullptr);
            EXPECT_TRUE(ErrorIs(KOVA_ERR_DB_OPEN, "cred_db", 169));
            EXPECT_EQ(kova_test::LogRecords(),
                      (Texts{"cred_db:165 " + wide + " chmod failed. errno=[0x001E]",
                             "cred_db:168 " + wide + " cannot be given mode 0600, not opened.\n"}));
        },
        60);
    EXPECT_EQ(WaitChild(child), 0);
}

// ---- The environment rule: a process in secure-execution mode ignores the variables, and says
// so once per variable.

// A copy of the program at `from` at `to` with `mode`, owned by root and group `gid`.
bool CopyProgram(const std::string &from, const std::string &to, gid_t gid, mode_t mode) {
    const std::string bytes = ReadFile(from);
    return !bytes.empty() && WriteFile(to, bytes, 0700) && chown(to.c_str(), 0, gid) == 0 &&
           chmod(to.c_str(), mode) == 0;
}

TEST_F(PrivilegedDatabaseTest, SetGroupIdProgramIgnoresTheVariablesAndLogsThem) {
    if (getenv("KOVA_TEST_LAUNCHER") != nullptr) {
        GTEST_SKIP() << "an emulator runs the program as a plain file: no secure-execution mode";
    }
    // A set-group-ID bit takes effect only where the file system is not mounted nosuid.
    auto dir = std::make_unique<kova_test::TempDir>();
    struct statvfs fs;
    if (statvfs(dir->path().c_str(), &fs) != 0 || (fs.f_flag & ST_NOSUID) != 0) {
        dir = std::make_unique<kova_test::TempDir>(KOVA_BINARY_DIR);
    }
    ASSERT_EQ(statvfs(dir->path().c_str(), &fs), 0);
    ASSERT_EQ(fs.f_flag & ST_NOSUID, 0u) << dir->path();
    const gid_t group = getgid() == 65534 ? 1 : 65534;
    const std::string setgid = dir->File("probe-setgid");
    const std::string plain = dir->File("probe-plain");
    ASSERT_TRUE(CopyProgram(STORE_ENV_PROBE_BIN, setgid, group, 02755));
    ASSERT_TRUE(CopyProgram(STORE_ENV_PROBE_BIN, plain, getgid(), 0755));
    const std::string named = dir->File("named.sqlite");
    auto run = [&](const std::string &program) {
        std::string out;
        EXPECT_EQ(kova_test::RunCommand("env kovacredential_db='" + named +
                                            "' kovacredential_debug=1 "
                                            "kovacredential_farlink_server=dir.example "
                                            "kovacredential_farlink_global=global.example '" +
                                            program + "'",
                                        &out),
                  0);
        return out;
    };
    std::string expected = "secure 1\npath /usr/kova/etc/private/credentials.sqlite\n";
    for (const char *name : {"kovacredential_db", "kovacredential_debug",
                             "kovacredential_farlink_server", "kovacredential_farlink_global"}) {
        expected += std::string("log kova_env:21 ") + name +
                    " is set but ignored: the process runs in secure-execution mode "
                    "(set-user-ID, set-group-ID or file capabilities)\n";
    }
    EXPECT_EQ(run(setgid), expected);
    EXPECT_NE(access(named.c_str(), F_OK), 0) << "the set-group-ID program used the variable";

    // The same program without the bit takes the variables, and nothing is logged.
    EXPECT_EQ(run(plain), "secure 0\npath " + named + "\n");
    EXPECT_EQ(ModeOf(named), 0600u);
}

}  // namespace
