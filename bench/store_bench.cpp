// Every call type of the credential store side by side with the raw SQLite sequence it implies.
//
// A library call opens the database, runs its statements and closes it again. The raw side
// does, for every call, exactly this:
//   1. open(path, O_PATH | O_CLOEXEC) and fstat: the path must name a regular file of the
//      effective user (the type and owner checks; nothing is opened for reading yet);
//   2. open(path, O_RDWR | O_NONBLOCK | O_NOCTTY | O_CLOEXEC), fstat, the device and inode
//      compared with those of step 1, fchmod(0600) and close: the mode is set on that file;
//   3. sqlite3_open_v2(path, SQLITE_OPEN_READWRITE);
//   4. stat(path), its device and inode compared with those of step 1, so that the file SQLite
//      opened is the one whose mode was set; the descriptor of step 1 is closed;
//   5. sqlite3_exec of "PRAGMA foreign_keys = ON;" and of both "CREATE TABLE if not exists"
//      statements;
//   6. the call's statements, formatted with sqlite3_mprintf as the library formats them, each
//      run once by sqlite3_exec: INSERT and sqlite3_last_insert_rowid (add); SELECT by id, the
//      first row kept (get); UPDATE or REPLACE, then the check SELECT that must find the row
//      (set); SELECT of all rows (list); the session's DELETE, then the credential's (remove);
//      SELECT of all rows, keeping the id of the last whose application matches (look-up by
//      application). A row is read by column position, integers with strtol, texts into
//      std::string, into a record of its own allocated with new, and a list links those newest
//      first: what the library's calls hand over, records the caller frees one by one;
//   7. sqlite3_close.
// It leaves out what its set-up makes unnecessary: the existence test and creation of a
// missing file, the lock retry and the log (the files exist and no other process uses them).
//
// Each comparison alternates kRounds runs of the library and the raw side; a run lasts
// kSecondsPerRun or kMaxCallsPerRun calls. Rates are medians of the runs, the ratio (library
// over raw, higher is better) the median of the rounds' ratios. With --instructions the
// program also runs every call (up to 100 times) under callgrind, library and raw side
// each in a fresh process, and prints the instructions per call: a figure that a loaded
// machine does not move (system calls are not counted in it).
#include <fcntl.h>
#include <spawn.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include <sqlite3.h>

#include "bench_support.h"
#include "kovacredential/kovacredential.h"

extern char **environ;

namespace {

using kova_bench::Median;

constexpr const char kPragma[] = "PRAGMA foreign_keys = ON;";
constexpr const char kCredSchema[] =
    "CREATE TABLE if not exists credentials (id INTEGER PRIMARY KEY ASC, \t\t\t\t\t\t ctime "
    "INTEGER, mtime INTEGER, host TEXT, owner INTEGER, remote_account TEXT, \t\t\t\t\t\t "
    "remote_passwd TEXT, port INTEGER, protocol TEXT, application TEXT, extra_info TEXT, pid "
    "INTEGER);";
constexpr const char kSessSchema[] =
    "CREATE TABLE if not exists credential_sessions (id INTEGER PRIMARY KEY, \t\t\t\t\t\t mtime "
    "INTEGER, access_token TEXT, csrf_token TEXT, extra_info TEXT, FOREIGN KEY (id) REFERENCES "
    "credentials (id));";
constexpr const char kCredInsert[] =
    "INSERT INTO credentials \t\t(ctime, mtime, host, owner, remote_account, remote_passwd, port, "
    "protocol, application, extra_info, pid) \t\tVALUES (%ld, %ld, '%q', %ld, '%q', '%q', '%ld', "
    "'%q', '%q', '%q', %ld);";
constexpr const char kCredSelectById[] = "SELECT * FROM credentials WHERE id=%ld;";
constexpr const char kCredSelectAll[] = "SELECT * FROM credentials;";
constexpr const char kCredUpdate[] =
    "UPDATE credentials SET \t\tmtime=%ld, host='%q', owner=%ld, remote_account='%q', "
    "\t\tremote_passwd='%q', port='%ld', protocol='%q', application='%q', extra_info='%q' "
    "\t\tWHERE id=%ld;";
constexpr const char kCredUpdateCheck[] =
    "SELECT * FROM credentials WHERE \t\tid=%ld AND mtime=%ld AND host='%q' AND owner=%ld AND "
    "remote_account='%q' \t\tAND remote_passwd='%q' AND port='%ld' AND protocol='%q' AND "
    "application='%q' AND extra_info='%q';";
constexpr const char kCredDelete[] = "DELETE FROM credentials WHERE id=%ld;";
constexpr const char kSessInsert[] =
    "INSERT INTO credential_sessions (mtime, access_token, csrf_token, extra_info) \t\t\tVALUES "
    "(%ld, '%q', '%q', '%q');";
constexpr const char kSessSelectById[] = "SELECT * FROM credential_sessions WHERE id=%ld;";
constexpr const char kSessSelectAll[] = "SELECT * FROM credential_sessions;";
constexpr const char kSessReplace[] =
    "REPLACE INTO credential_sessions (id, mtime, access_token, csrf_token, extra_info) "
    "\t\t\tVALUES (%ld, %ld, '%q', '%q', '%q');";
constexpr const char kSessUpdateCheck[] =
    "SELECT * FROM credential_sessions WHERE id=%ld AND access_token='%q' AND csrf_token='%q' "
    "AND extra_info='%q';";
constexpr const char kSessDelete[] = "DELETE FROM credential_sessions WHERE id=%ld;";

constexpr int kApplications = 10;
constexpr const char kLookedUpApplication[] = "app3";
constexpr int kReadRows = 1000;
// Rows that the consuming calls (remove, session add) use up: more than all their runs take.
constexpr int kConsumableRows = 50000;
constexpr double kSecondsPerRun = 0.12;
constexpr long kMaxCallsPerRun = 1500;
constexpr int kRounds = 15;
constexpr double kTarget = 0.95;

// Calls counted under callgrind: fewer for the calls that read many rows.
int InstructionCalls(int rows) {
    return std::max(3, 10000 / (100 + rows));
}

void Fail(const char *what) {
    fprintf(stderr, "store_bench: %s\n", what);
    exit(1);
}

// The credential every write uses, with the values of a typical stored account.
struct Account {
    const char *host = "nas.example";
    long owner = 1024;
    const char *account = "admin";
    const char *passwd = "secret";
    long port = 5001;
    const char *protocol = "https";
    const char *application = "app1";
    const char *extra = "{\"k\":1}";
};
constexpr Account kAccount;

struct Session {
    const char *sid = "sid-0123456789abcdef";
    const char *token = "token-0123456789";
    const char *extra = "{}";
};
constexpr Session kSession;

// ---- The raw side

struct SqliteClose {
    void operator()(sqlite3 *db) const { sqlite3_close(db); }
};
using RawDb = std::unique_ptr<sqlite3, SqliteClose>;
struct SqliteFree {
    void operator()(char *p) const { sqlite3_free(p); }
};
using SqlText = std::unique_ptr<char, SqliteFree>;

// Steps 1 to 5 of the header comment.
RawDb RawOpen(const char *path) {
    const int held = open(path, O_PATH | O_CLOEXEC);
    struct stat checked;
    if (held < 0 || fstat(held, &checked) != 0 || !S_ISREG(checked.st_mode) ||
        checked.st_uid != geteuid()) {
        Fail("the raw open found no regular file of ours");
    }
    const int file = open(path, O_RDWR | O_NONBLOCK | O_NOCTTY | O_CLOEXEC);
    struct stat opened;
    if (file < 0 || fstat(file, &opened) != 0 || opened.st_dev != checked.st_dev ||
        opened.st_ino != checked.st_ino || fchmod(file, 0600) != 0) {
        Fail("the raw open could not set the mode");
    }
    close(file);
    sqlite3 *raw = nullptr;
    const int rc = sqlite3_open_v2(path, &raw, SQLITE_OPEN_READWRITE, nullptr);
    RawDb db(raw);
    struct stat now;
    if (rc != SQLITE_OK || stat(path, &now) != 0 || now.st_dev != checked.st_dev ||
        now.st_ino != checked.st_ino) {
        Fail("the raw open failed");
    }
    close(held);
    if (sqlite3_exec(db.get(), kPragma, nullptr, nullptr, nullptr) != SQLITE_OK ||
        sqlite3_exec(db.get(), kCredSchema, nullptr, nullptr, nullptr) != SQLITE_OK ||
        sqlite3_exec(db.get(), kSessSchema, nullptr, nullptr, nullptr) != SQLITE_OK) {
        Fail("the raw schema statements failed");
    }
    return db;
}

void RawExec(sqlite3 *db, const char *sql, sqlite3_callback callback = nullptr,
             void *arg = nullptr) {
    if (sql == nullptr || sqlite3_exec(db, sql, callback, arg, nullptr) != SQLITE_OK) {
        Fail("a raw statement failed");
    }
}

long IntAt(char **vals, int i) {
    return vals[i] != nullptr ? strtol(vals[i], nullptr, 10) : 0;
}
const char *TextAt(char **vals, int i) {
    return vals[i] != nullptr ? vals[i] : "";
}

// A credential row by the columns' fixed positions (id, ctime, mtime, host, owner,
// remote_account, remote_passwd, port, protocol, application, extra_info, pid), in a record of
// its own on the heap, linked to the next.
struct RawCred {
    RawCred *next;
    long id, ctime, mtime, owner, port;
    std::string host, account, passwd, protocol, application, extra;
};
RawCred *CredAt(char **vals, RawCred *next) {
    return new RawCred{next,
                       IntAt(vals, 0),
                       IntAt(vals, 1),
                       IntAt(vals, 2),
                       IntAt(vals, 4),
                       IntAt(vals, 7),
                       TextAt(vals, 3),
                       TextAt(vals, 5),
                       TextAt(vals, 6),
                       TextAt(vals, 8),
                       TextAt(vals, 9),
                       TextAt(vals, 10)};
}

// A session row: id, mtime, access_token, csrf_token, extra_info.
struct RawSess {
    RawSess *next;
    long id;
    std::string sid, token, extra;
};
RawSess *SessAt(char **vals, RawSess *next) {
    return new RawSess{next, IntAt(vals, 0), TextAt(vals, 2), TextAt(vals, 3), TextAt(vals, 4)};
}

// Rows as the library's calls hand them over: a record per row, the newest first, each
// freed on its own.
template <typename Row>
struct RawList {
    Row *head = nullptr;
    ~RawList() {
        while (head != nullptr) {
            Row *next = head->next;
            delete head;
            head = next;
        }
    }
};

template <typename Row, Row *(*At)(char **, Row *), int Columns>
int KeepFirst(void *arg, int n, char **vals, char **) {
    auto *rows = static_cast<RawList<Row> *>(arg);
    if (n >= Columns && rows->head == nullptr) {
        rows->head = At(vals, nullptr);
    }
    return 0;
}

template <typename Row, Row *(*At)(char **, Row *), int Columns>
int KeepAll(void *arg, int n, char **vals, char **) {
    auto *rows = static_cast<RawList<Row> *>(arg);
    if (n >= Columns) {
        rows->head = At(vals, rows->head);
    }
    return 0;
}

int Found(void *arg, int, char **, char **) {
    *static_cast<bool *>(arg) = true;
    return 0;
}

int LastMatchingApplication(void *arg, int n, char **vals, char **) {
    if (n >= 10 && strcmp(TextAt(vals, 9), kLookedUpApplication) == 0) {
        *static_cast<long *>(arg) = IntAt(vals, 0);
    }
    return 0;
}

long Now() {
    return static_cast<long>(time(nullptr));
}

SqlText CredInsert(const std::string &host, const std::string &application) {
    const long now = Now();
    return SqlText(sqlite3_mprintf(kCredInsert, now, now, host.c_str(), kAccount.owner,
                                   kAccount.account, kAccount.passwd, kAccount.port,
                                   kAccount.protocol, application.c_str(), kAccount.extra,
                                   static_cast<long>(getpid())));
}

SqlText SessReplace(long id) {
    return SqlText(
        sqlite3_mprintf(kSessReplace, id, Now(), kSession.sid, kSession.token, kSession.extra));
}

// ---- The library side

struct CredFree {
    void operator()(KOVA_CRED *p) const { KOVACredFree(p); }
};
struct SessFree {
    void operator()(KOVA_CRED_SESS *p) const { KOVACredSessFree(p); }
};
using Cred = std::unique_ptr<KOVA_CRED, CredFree>;
using Sess = std::unique_ptr<KOVA_CRED_SESS, SessFree>;

Cred AccountRecord() {
    Cred cred(KOVACredAlloc());
    KOVACredItemSetHost(cred.get(), kAccount.host);
    KOVACredItemSetOwner(cred.get(), static_cast<int32_t>(kAccount.owner));
    KOVACredItemSetRemoteAccount(cred.get(), kAccount.account);
    KOVACredItemSetRemotePasswd(cred.get(), kAccount.passwd);
    KOVACredItemSetPort(cred.get(), static_cast<int32_t>(kAccount.port));
    KOVACredItemSetProtocol(cred.get(), kAccount.protocol);
    KOVACredItemSetApplication(cred.get(), kAccount.application);
    KOVACredItemSetExtraInfo(cred.get(), kAccount.extra);
    return cred;
}

Sess SessionRecord() {
    Sess sess(KOVACredSessAlloc());
    KOVACredSessItemSetAccessToken(sess.get(), kSession.sid);
    KOVACredSessItemSetCsrfToken(sess.get(), kSession.token);
    KOVACredSessItemSetExtraInfo(sess.get(), kSession.extra);
    return sess;
}

void Check(bool ok, const char *call) {
    if (!ok) {
        fprintf(stderr, "store_bench: %s failed\n", call);
        exit(1);
    }
}

// ---- The databases and the calls

// A database file holding `creds` credentials (ids 1 to creds, applications app0 to app9 in
// turn) and, when `withSessions`, a session for each.
void MakeDatabase(const std::string &path, int creds, bool withSessions) {
    FILE *f = fopen(path.c_str(), "w");
    if (f == nullptr) {
        Fail("cannot make a database file");
    }
    fclose(f);
    RawDb db = RawOpen(path.c_str());
    RawExec(db.get(), "BEGIN;");
    for (int i = 1; i <= creds; ++i) {
        RawExec(db.get(),
                CredInsert("host" + std::to_string(i), "app" + std::to_string(i % kApplications))
                    .get());
        if (withSessions) {
            RawExec(db.get(), SessReplace(i).get());
        }
    }
    RawExec(db.get(), "COMMIT;");
}

// The smallest id left in a table (1 for an empty one).
long FirstId(const std::string &path, const char *table) {
    RawDb db = RawOpen(path.c_str());
    long id = 0;
    SqlText sql(sqlite3_mprintf("SELECT min(id) FROM %s;", table));
    RawExec(
        db.get(), sql.get(),
        [](void *arg, int, char **vals, char **) {
            *static_cast<long *>(arg) = IntAt(vals, 0);
            return 0;
        },
        &id);
    return id > 0 ? id : 1;
}

struct Call {
    std::string name;
    std::string path;  // the database both sides use
    int rows = 0;      // rows each call reads through
    std::function<void()> library;
    std::function<void()> raw;
};

// Pseudo-random ids 1 to kReadRows; both sides draw from one sequence.
struct IdSequence {
    unsigned next = 1;
    long operator()() {
        next = next * 1103515245u + 12345u;
        return static_cast<long>((next >> 8) % kReadRows + 1);
    }
};

const std::vector<int> kApplicationRows = {0, 100, 1000, 10000};

std::string DatabaseName(const std::string &dir, const std::string &name) {
    return dir + "/" + name + ".sqlite";
}

void MakeDatabases(const std::string &dir) {
    MakeDatabase(DatabaseName(dir, "add"), 0, false);
    MakeDatabase(DatabaseName(dir, "read"), kReadRows, true);
    MakeDatabase(DatabaseName(dir, "write"), kReadRows, true);
    MakeDatabase(DatabaseName(dir, "remove"), kConsumableRows, true);
    MakeDatabase(DatabaseName(dir, "sessremove"), kConsumableRows, true);
    MakeDatabase(DatabaseName(dir, "sessadd"), kConsumableRows, false);
    for (int rows : kApplicationRows) {
        MakeDatabase(DatabaseName(dir, "app" + std::to_string(rows)), rows, false);
    }
}

// The calls over the databases in `dir`. Library and raw side share each call's database and
// its sequence of ids, so that alternating runs see the same tables.
std::vector<Call> Calls(const std::string &dir) {
    std::vector<Call> calls;
    auto add = [&](const std::string &name, const std::string &db, std::function<void()> library,
                   std::function<void(sqlite3 *)> raw, int rows = 0) {
        const std::string path = DatabaseName(dir, db);
        calls.push_back(Call{name, path, rows, std::move(library), [path, raw] {
                                 RawDb conn = RawOpen(path.c_str());
                                 raw(conn.get());
                             }});
    };
    auto ids = std::make_shared<IdSequence>();

    add(
        "KOVACredAdd", "add",
        [] {
            Cred cred = AccountRecord();
            Check(KOVACredAdd(cred.get()) == 0, "KOVACredAdd");
        },
        [](sqlite3 *db) {
            RawExec(db, CredInsert(kAccount.host, kAccount.application).get());
            sqlite3_last_insert_rowid(db);
        });
    add(
        "KOVACredGetByID", "read",
        [ids] {
            Cred cred(KOVACredAlloc());
            Check(KOVACredGetByID((*ids)(), cred.get()) == 0 && cred->id > 0, "KOVACredGetByID");
        },
        [ids](sqlite3 *db) {
            RawList<RawCred> row;
            RawExec(db, SqlText(sqlite3_mprintf(kCredSelectById, (*ids)())).get(),
                    KeepFirst<RawCred, CredAt, 11>, &row);
        });
    add(
        "KOVACredSetByID", "write",
        [ids] {
            Cred cred = AccountRecord();
            Check(KOVACredSetByID((*ids)(), cred.get()) == 0, "KOVACredSetByID");
        },
        [ids](sqlite3 *db) {
            const long id = (*ids)();
            const long now = Now();
            RawExec(db, SqlText(sqlite3_mprintf(kCredUpdate, now, kAccount.host, kAccount.owner,
                                                kAccount.account, kAccount.passwd, kAccount.port,
                                                kAccount.protocol, kAccount.application,
                                                kAccount.extra, id))
                            .get());
            bool found = false;
            RawExec(
                db,
                SqlText(sqlite3_mprintf(kCredUpdateCheck, id, now, kAccount.host, kAccount.owner,
                                        kAccount.account, kAccount.passwd, kAccount.port,
                                        kAccount.protocol, kAccount.application, kAccount.extra))
                    .get(),
                Found, &found);
            if (!found) {
                Fail("the raw update check found no row");
            }
        });
    add(
        "KOVACredListGet (1,000 rows)", "read",
        [] {
            KOVA_CRED *list = nullptr;
            Check(KOVACredListGet(&list, nullptr, nullptr) == kReadRows, "KOVACredListGet");
            KOVACredListFree(&list);
        },
        [](sqlite3 *db) {
            RawList<RawCred> rows;
            RawExec(db, kCredSelectAll, KeepAll<RawCred, CredAt, 11>, &rows);
        },
        kReadRows);
    // Both sides remove the next credential (with its session), and the next session of
    // another table; the first id is read when the first call runs, after what the counting
    // children used up.
    auto nextCred = std::make_shared<long>(-1);
    auto nextSess = std::make_shared<long>(-1);
    const auto next = [dir](const std::shared_ptr<long> &slot, const char *db, const char *table) {
        return [=] {
            if (*slot < 0) {
                *slot = FirstId(DatabaseName(dir, db), table);
            }
            return (*slot)++;
        };
    };
    const auto credToRemove = next(nextCred, "remove", "credentials");
    const auto sessToRemove = next(nextSess, "sessremove", "credential_sessions");
    add(
        "KOVACredRemoveByID", "remove",
        [credToRemove] { Check(KOVACredRemoveByID(credToRemove()) == 0, "KOVACredRemoveByID"); },
        [credToRemove](sqlite3 *db) {
            const long id = credToRemove();
            RawExec(db, SqlText(sqlite3_mprintf(kSessDelete, id)).get());
            RawExec(db, SqlText(sqlite3_mprintf(kCredDelete, id)).get());
        });
    for (int rows : kApplicationRows) {
        char name[64];
        snprintf(name, sizeof(name), "KOVACredIDGetByApplication (%d rows)", rows);
        // The newest credential of app3 is the largest id below `rows` that ends in 3.
        const int expected = rows > 3 ? (rows - 7) : -1;
        add(
            name, "app" + std::to_string(rows),
            [expected] {
                Check(KOVACredIDGetByApplication(kLookedUpApplication) == expected,
                      "KOVACredIDGetByApplication");
            },
            [](sqlite3 *db) {
                long id = -1;
                RawExec(db, kCredSelectAll, LastMatchingApplication, &id);
            },
            rows);
    }
    add(
        "KOVACredSessAdd", "sessadd",
        [] {
            Sess sess = SessionRecord();
            Check(KOVACredSessAdd(sess.get()) == 0, "KOVACredSessAdd");
        },
        [](sqlite3 *db) {
            RawExec(db, SqlText(sqlite3_mprintf(kSessInsert, Now(), kSession.sid, kSession.token,
                                                kSession.extra))
                            .get());
            sqlite3_last_insert_rowid(db);
        });
    add(
        "KOVACredSessGetByID", "read",
        [ids] {
            Sess sess(KOVACredSessAlloc());
            Check(KOVACredSessGetByID((*ids)(), sess.get()) == 0 && sess->id > 0,
                  "KOVACredSessGetByID");
        },
        [ids](sqlite3 *db) {
            RawList<RawSess> row;
            RawExec(db, SqlText(sqlite3_mprintf(kSessSelectById, (*ids)())).get(),
                    KeepFirst<RawSess, SessAt, 5>, &row);
        });
    add(
        "KOVACredSessSetByID", "write",
        [ids] {
            Sess sess = SessionRecord();
            Check(KOVACredSessSetByID((*ids)(), sess.get()) == 0, "KOVACredSessSetByID");
        },
        [ids](sqlite3 *db) {
            const long id = (*ids)();
            RawExec(db, SessReplace(id).get());
            bool found = false;
            RawExec(db,
                    SqlText(sqlite3_mprintf(kSessUpdateCheck, id, kSession.sid, kSession.token,
                                            kSession.extra))
                        .get(),
                    Found, &found);
            if (!found) {
                Fail("the raw session check found no row");
            }
        });
    add(
        "KOVACredSessListGet (1,000 rows)", "read",
        [] {
            KOVA_CRED_SESS *list = nullptr;
            Check(KOVACredSessListGet(&list, nullptr, nullptr) == kReadRows, "KOVACredSessListGet");
            KOVACredSessListFree(&list);
        },
        [](sqlite3 *db) {
            RawList<RawSess> rows;
            RawExec(db, kSessSelectAll, KeepAll<RawSess, SessAt, 5>, &rows);
        },
        kReadRows);
    add(
        "KOVACredSessRemoveByID", "sessremove",
        [sessToRemove] {
            Check(KOVACredSessRemoveByID(sessToRemove()) == 0, "KOVACredSessRemoveByID");
        },
        [sessToRemove](sqlite3 *db) {
            RawExec(db, SqlText(sqlite3_mprintf(kSessDelete, sessToRemove())).get());
        });
    return calls;
}

// ---- Measuring

using Clock = std::chrono::steady_clock;

// Calls per second of `op` over kSecondsPerRun or kMaxCallsPerRun calls.
double Rate(const Call &call, const std::function<void()> &op) {
    setenv("kovacredential_db", call.path.c_str(), 1);
    long calls = 0;
    const auto start = Clock::now();
    double elapsed = 0;
    do {
        op();
        ++calls;
        elapsed = std::chrono::duration<double>(Clock::now() - start).count();
    } while (elapsed < kSecondsPerRun && calls < kMaxCallsPerRun);
    return calls / elapsed;
}

struct Result {
    double library = 0;  // median calls per second
    double raw = 0;
    double ratio = 0;  // median of the rounds' ratios
    double libraryInstructions = 0;
    double rawInstructions = 0;
};

Result Compare(const Call &call) {
    std::vector<double> lib, base, ratios;
    for (int i = 0; i < kRounds; ++i) {
        lib.push_back(Rate(call, call.library));
        base.push_back(Rate(call, call.raw));
        ratios.push_back(lib.back() / base.back());
    }
    return Result{Median(lib), Median(base), Median(ratios)};
}

// `count` calls of one side, the only code callgrind counts (--toggle-collect).
__attribute__((noinline)) void MeasuredCalls(const std::function<void()> &op, int count) {
    for (int i = 0; i < count; ++i) {
        op();
    }
    asm volatile("" ::: "memory");
}

// Instructions per call of one side, counted by callgrind in a fresh process running this
// program with --count; 0 when valgrind cannot be run.
double CountInstructions(const std::string &dir, size_t index, int rows, const char *side) {
    const std::string out = dir + "/callgrind.out";
    const std::string outOption = "--callgrind-out-file=" + out;
    const std::string self = std::filesystem::read_symlink("/proc/self/exe").string();
    const std::string which = std::to_string(index);
    const char *argv[] = {"valgrind",
                          "--tool=callgrind",
                          "--toggle-collect=*MeasuredCalls*",
                          outOption.c_str(),
                          "--log-file=/dev/null",
                          self.c_str(),
                          "--count",
                          dir.c_str(),
                          which.c_str(),
                          side,
                          nullptr};
    pid_t pid = 0;
    if (posix_spawnp(&pid, "valgrind", nullptr, nullptr, const_cast<char **>(argv), environ) != 0) {
        return 0;
    }
    int status = 0;
    if (waitpid(pid, &status, 0) != pid || !WIFEXITED(status) || WEXITSTATUS(status) != 0) {
        return 0;
    }
    std::ifstream in(out);
    for (std::string line; std::getline(in, line);) {
        if (line.rfind("totals:", 0) == 0 || line.rfind("summary:", 0) == 0) {
            return std::stod(line.substr(line.find(':') + 1)) / InstructionCalls(rows);
        }
    }
    return 0;
}

// The child of CountInstructions: one warm-up call, then the measured ones.
int RunCount(const std::string &dir, size_t index, const std::string &side) {
    std::vector<Call> calls = Calls(dir);
    if (index >= calls.size()) {
        return 1;
    }
    const Call &call = calls[index];
    setenv("kovacredential_db", call.path.c_str(), 1);
    const std::function<void()> &op = side == "library" ? call.library : call.raw;
    op();
    MeasuredCalls(op, InstructionCalls(call.rows));
    return 0;
}

std::string BenchFolder() {
    const char *base = access("/dev/shm", W_OK) == 0 ? "/dev/shm" : "/tmp";
    std::string tmpl = std::string(base) + "/kovabench.XXXXXX";
    if (mkdtemp(tmpl.data()) == nullptr) {
        perror("mkdtemp");
        exit(1);
    }
    return tmpl;
}

void PrintApplicationScaling(const std::vector<Call> &calls, const std::vector<Result> &results) {
    const Result *empty = nullptr;
    for (size_t i = 0; i < calls.size(); ++i) {
        if (calls[i].name.rfind("KOVACredIDGetByApplication", 0) == 0 && calls[i].rows == 0) {
            empty = &results[i];
        }
    }
    if (empty == nullptr) {
        return;
    }
    printf(
        "\nKOVACredIDGetByApplication by table size: time per call, per row, and per row "
        "beyond the call on an empty table\n");
    printf("%8s %12s %12s %14s %14s %16s\n", "rows", "library us", "raw us", "library us/row",
           "added us/row", "added instr/row");
    for (size_t i = 0; i < calls.size(); ++i) {
        const Result &r = results[i];
        if (calls[i].name.rfind("KOVACredIDGetByApplication", 0) != 0 || calls[i].rows == 0) {
            continue;
        }
        const double rows = calls[i].rows;
        const double us = 1e6 / r.library;
        const double emptyUs = 1e6 / empty->library;
        char instructions[32] = "-";
        if (r.libraryInstructions > 0 && empty->libraryInstructions > 0) {
            snprintf(instructions, sizeof(instructions), "%.0f",
                     (r.libraryInstructions - empty->libraryInstructions) / rows);
        }
        printf("%8d %12.1f %12.1f %14.3f %14.3f %16s\n", calls[i].rows, us, 1e6 / r.raw, us / rows,
               (us - emptyUs) / rows, instructions);
    }
}

}  // namespace

int main(int argc, char **argv) {
    if (argc == 5 && strcmp(argv[1], "--count") == 0) {
        return RunCount(argv[2], strtoul(argv[3], nullptr, 10), argv[4]);
    }
    const bool instructions = argc == 2 && strcmp(argv[1], "--instructions") == 0;
    if (argc > 1 && !instructions) {
        fprintf(stderr, "usage: store_bench [--instructions]\n");
        return 2;
    }
    const std::string dir = BenchFolder();
    MakeDatabases(dir);
    std::vector<Call> calls = Calls(dir);
    std::vector<Result> results;
    bool counted = instructions;
    for (size_t i = 0; i < calls.size(); ++i) {
        // Instructions first: the counting children use up rows the timed runs then skip.
        double libraryInstructions = 0;
        double rawInstructions = 0;
        if (counted) {
            libraryInstructions = CountInstructions(dir, i, calls[i].rows, "library");
            rawInstructions = CountInstructions(dir, i, calls[i].rows, "raw");
            counted = libraryInstructions > 0 && rawInstructions > 0;
            if (!counted) {
                fprintf(stderr, "store_bench: valgrind could not count instructions\n");
            }
        }
        results.push_back(Compare(calls[i]));
        results.back().libraryInstructions = libraryInstructions;
        results.back().rawInstructions = rawInstructions;
    }

    printf(
        "store_bench: %d alternating rounds per call, %.2f s or %ld calls per run; ratio = "
        "library / raw (median of the rounds)\n",
        kRounds, kSecondsPerRun, kMaxCallsPerRun);
    printf("%-40s %11s %11s %7s", "call", "library/s", "raw/s", "ratio");
    if (counted) {
        printf(" %13s %13s %7s", "library instr", "raw instr", "ratio");
    }
    printf("\n");
    bool allMet = true;
    for (size_t i = 0; i < calls.size(); ++i) {
        const Result &r = results[i];
        allMet = allMet && r.ratio >= kTarget;
        printf("%-40s %11.0f %11.0f %7.2f", calls[i].name.c_str(), r.library, r.raw, r.ratio);
        if (counted) {
            printf(" %13.0f %13.0f %7.2f", r.libraryInstructions, r.rawInstructions,
                   r.rawInstructions / r.libraryInstructions);
        }
        printf("%s\n", r.ratio >= kTarget ? "" : "  (below target)");
    }
    printf("%s %.2f\n", allMet ? "every ratio is at least" : "some ratios are below", kTarget);
    PrintApplicationScaling(calls, results);

    std::error_code ec;
    std::filesystem::remove_all(dir, ec);
    return 0;
}
