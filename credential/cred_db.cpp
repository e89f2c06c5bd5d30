// The credential database: opening it (file, mode, schema), the lock retry every statement
// runs under, and the record-level operations on an open connection.
#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
#include <stddef.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <memory>
#include <string>

#include "credential/cred_internal.h"
#include "kovacredential/kovacred_db.h"
#include "platform/kova_env.h"
#include "platform/kova_log.h"
#include "platform/vlibc.h"

namespace kova {
namespace cred {
namespace {

constexpr const char kUnit[] = "cred_db";

// Lines that the messages of this unit carry.
constexpr int kLineChmodFailed = 165;
constexpr int kLineOtherOwner = 166;
constexpr int kLineRefused = 167;
constexpr int kLineModeRefused = 168;
constexpr int kLineOpenError = 169;
constexpr int kLineOpenLog = 170;
constexpr int kLinePragma = 174;
constexpr int kLineCredSchema = 175;
constexpr int kLineSessSchema = 176;
constexpr int kLineAddArg = 193;
constexpr int kLineAddExec = 214;
constexpr int kLineGetArg = 235;
constexpr int kLineGetExec = 242;
constexpr int kLineGetListArg = 265;
constexpr int kLineGetListExec = 297;
constexpr int kLineRemoveArg = 312;
constexpr int kLineRemoveExec = 319;
constexpr int kLineUpdateArg = 337;
constexpr int kLineUpdateExec = 356;
constexpr int kLineUpdateCheckExec = 374;
constexpr int kLineUpdateReadBack = 377;
constexpr int kLineSessAddArg = 401;
constexpr int kLineSessAddExec = 414;
constexpr int kLineSessGetArg = 436;
constexpr int kLineSessGetExec = 443;
constexpr int kLineSessGetListArg = 467;
constexpr int kLineSessGetListExec = 498;
constexpr int kLineSessRemoveArg = 513;
constexpr int kLineSessRemoveExec = 520;
constexpr int kLineSessUpdateArg = 539;
constexpr int kLineSessUpdateExec = 550;
constexpr int kLineSessUpdateCheckExec = 560;
constexpr int kLineSessUpdateReadBack = 563;

constexpr const char kPragmaForeignKeys[] = "PRAGMA foreign_keys = ON;";
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
constexpr const char kCredSelectAll[] = "SELECT * FROM credentials";
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
constexpr const char kSessSelectAll[] = "SELECT * FROM credential_sessions";
constexpr const char kSessReplace[] =
    "REPLACE INTO credential_sessions (id, mtime, access_token, csrf_token, extra_info) "
    "\t\t\tVALUES (%ld, %ld, '%q', '%q', '%q');";
constexpr const char kSessUpdateCheck[] =
    "SELECT * FROM credential_sessions WHERE id=%ld AND access_token='%q' AND csrf_token='%q' "
    "AND extra_info='%q';";
constexpr const char kSessDelete[] = "DELETE FROM credential_sessions WHERE id=%ld;";

constexpr const char kLockedMessage[] = "database is locked";

// What the log shows in place of a password, session id or token.
constexpr const char kRedacted[] = "***";

// Whether this process has seeded rand(). A forked child starts unseeded, so that forked
// workers do not share back-off sequences; the flag is cleared by a fork handler rather than
// by comparing process ids, which would cost a system call on every store call.
std::atomic<bool> gSeeded{false};

void ForgetSeedInChild() {
    gSeeded.store(false, std::memory_order_relaxed);
}

// Registers the handler when the library is loaded.
struct SeedForkHandler {
    SeedForkHandler() { pthread_atfork(nullptr, nullptr, ForgetSeedInChild); }
} gSeedForkHandler;

long Now() {
    return static_cast<long>(time(nullptr));
}

// The statements that carry secrets are formatted by one function each, once with the
// secret values for SQLite and once more with kRedacted in their place for the log.
SqlText FormatCredInsert(const KOVA_CRED &cred, long now, const char *passwd) {
    return SqlText(sqlite3_mprintf(
        kCredInsert, now, now, cred.host.c_str(), static_cast<long>(cred.owner),
        cred.remote_account.c_str(), passwd, static_cast<long>(cred.port), cred.protocol.c_str(),
        cred.application.c_str(), cred.extra_info.c_str(), static_cast<long>(getpid())));
}

SqlText FormatCredUpdate(long id, const KOVA_CRED &cred, long now, const char *passwd) {
    return SqlText(sqlite3_mprintf(kCredUpdate, now, cred.host.c_str(),
                                   static_cast<long>(cred.owner), cred.remote_account.c_str(),
                                   passwd, static_cast<long>(cred.port), cred.protocol.c_str(),
                                   cred.application.c_str(), cred.extra_info.c_str(), id));
}

SqlText FormatCredUpdateCheck(long id, const KOVA_CRED &cred, long now, const char *passwd) {
    return SqlText(sqlite3_mprintf(kCredUpdateCheck, id, now, cred.host.c_str(),
                                   static_cast<long>(cred.owner), cred.remote_account.c_str(),
                                   passwd, static_cast<long>(cred.port), cred.protocol.c_str(),
                                   cred.application.c_str(), cred.extra_info.c_str()));
}

SqlText FormatSessInsert(const KOVA_CRED_SESS &sess, long now, const char *sid, const char *token) {
    return SqlText(sqlite3_mprintf(kSessInsert, now, sid, token, sess.extra_info.c_str()));
}

SqlText FormatSessReplace(long id, const KOVA_CRED_SESS &sess, long now, const char *sid,
                          const char *token) {
    return SqlText(sqlite3_mprintf(kSessReplace, id, now, sid, token, sess.extra_info.c_str()));
}

SqlText FormatSessUpdateCheck(long id, const KOVA_CRED_SESS &sess, const char *sid,
                              const char *token) {
    return SqlText(sqlite3_mprintf(kSessUpdateCheck, id, sid, token, sess.extra_info.c_str()));
}

const char *Text(const char *sql) {
    return sql;
}
const char *Text(const SqlText &sql) {
    return sql ? sql.get() : "";
}

// Logs a lasting failure of `run` (ExecWithRetry or StepWithRetry bound to its statement) as
// "<unit>:<line> Exec sql:[<text>] error: <msg>", where the text is what logText() returns
// (made only when there is something to log).
template <typename Run, typename LogText>
bool RunLogged(Run run, int line, LogText logText) {
    SqlText message;
    const ExecResult result = run(&message);
    if (result == ExecResult::kFailed) {
        const auto shown = logText();
        Log("%s:%d Exec sql:[%s] error: %s\n", kUnit, line, Text(shown), message.get());
    }
    return result == ExecResult::kOk;
}

template <typename LogText>
bool ExecLoggedAs(sqlite3 *db, const char *sql, sqlite3_callback callback, void *arg, int line,
                  LogText logText) {
    return RunLogged(
        [&](SqlText *message) { return ExecWithRetry(db, sql, callback, arg, message); }, line,
        logText);
}

// For statements without a secret: the log shows the statement itself.
bool ExecLogged(sqlite3 *db, const char *sql, sqlite3_callback callback, void *arg, int line) {
    return ExecLoggedAs(db, sql, callback, arg, line, [sql] { return sql; });
}

// ExecLogged for a single statement whose rows `row` reads from the statement.
bool StepLogged(sqlite3 *db, const char *sql, StatementRow row, void *arg, int line) {
    return RunLogged([&](SqlText *message) { return StepWithRetry(db, sql, row, arg, message); },
                     line, [sql] { return sql; });
}

// An open file descriptor, closed when the owner goes.
class FileDescriptor {
  public:
    explicit FileDescriptor(int fd) : fd_(fd) {}
    ~FileDescriptor() {
        if (fd_ >= 0) {
            close(fd_);
        }
    }
    FileDescriptor(const FileDescriptor &) = delete;
    FileDescriptor &operator=(const FileDescriptor &) = delete;
    int get() const { return fd_; }
    void reset(int fd) {
        if (fd_ >= 0) {
            close(fd_);
        }
        fd_ = fd;
    }

  private:
    int fd_;
};

// Refuses to open the database file: logs why at `line` and fails as a failed open does.
sqlite3 *Refuse(int line, const std::string &path, const char *why) {
    Log("%s:%d %s %s, not opened.\n", kUnit, line, path.c_str(), why);
    VLIBCErrSetEx(KOVA_ERR_DB_OPEN, kUnit, kLineOpenError);
    return nullptr;
}

bool SameFile(const struct stat &a, const struct stat &b) {
    return a.st_dev == b.st_dev && a.st_ino == b.st_ino;
}

// A descriptor of the file at `path` that fchmod takes: for reading and writing, or for
// reading where writing is refused (a read-only mount). O_NONBLOCK, so that a FIFO swapped in
// since the type check cannot make the open wait. -1 with errno set when there is none.
int OpenForMode(const std::string &path) {
    constexpr int kFlags = O_NONBLOCK | O_NOCTTY | O_CLOEXEC;
    const int fd = open(path.c_str(), O_RDWR | kFlags);
    return fd >= 0 ? fd : open(path.c_str(), O_RDONLY | kFlags);
}

// Sets mode 0600 on the regular file `checked` describes, reached through `path`; the file
// must still be that one. Returns 0, or the errno of the failure (ESTALE when another file
// took its place).
int SetMode(const std::string &path, const struct stat &checked) {
    FileDescriptor file(OpenForMode(path));
    // A file of ours that lost its read and write bits cannot be opened: its mode is set through
    // the path, which can change only a file of ours (the caller is its owner), and the file
    // opened then is compared like any other.
    if (file.get() < 0 && errno == EACCES && chmod(path.c_str(), 0600) == 0) {
        file.reset(OpenForMode(path));
    }
    struct stat now;
    if (file.get() < 0 || fstat(file.get(), &now) != 0) {
        return errno;
    }
    if (!SameFile(now, checked)) {
        return ESTALE;
    }
    return fchmod(file.get(), 0600) == 0 ? 0 : errno;
}

// The descriptor through which SQLite reads and writes the main database of `db`, or -1 when
// `db` does not use one of SQLite's unix VFSs. SQLite has no interface that gives it; the file
// object of every unix VFS (unixFile in SQLite's os_unix.c) begins with its methods, its VFS,
// its inode record and then the descriptor, a layout that has not changed since SQLite 3.7.
int SqliteDescriptor(sqlite3 *db) {
    struct UnixFileHead {
        const sqlite3_io_methods *methods;
        sqlite3_vfs *vfs;
        void *inode;
        int fd;
    };
    sqlite3_vfs *vfs = nullptr;
    sqlite3_file *file = nullptr;
    if (sqlite3_file_control(db, "main", SQLITE_FCNTL_VFS_POINTER, &vfs) != SQLITE_OK ||
        vfs == nullptr || vfs->zName == nullptr ||
        (strcmp(vfs->zName, "unix") != 0 && strncmp(vfs->zName, "unix-", 5) != 0) ||
        sqlite3_file_control(db, "main", SQLITE_FCNTL_FILE_POINTER, &file) != SQLITE_OK ||
        file == nullptr || file->pMethods == nullptr) {
        return -1;
    }
    int fd = -1;
    memcpy(&fd, reinterpret_cast<const char *>(file) + offsetof(UnixFileHead, fd), sizeof(fd));
    return fd;
}

// Whether SQLite's connection `db` holds the file `checked` describes. Where SQLite's
// descriptor cannot be had (a VFS of the caller's), the file the path names now is compared.
bool HoldsFile(sqlite3 *db, const std::string &path, const struct stat &checked) {
    struct stat opened;
    const int fd = SqliteDescriptor(db);
    const int rc = fd >= 0 ? fstat(fd, &opened) : stat(path.c_str(), &opened);
    return rc == 0 && SameFile(opened, checked);
}

bool Given(const char *text) {
    return text != nullptr && *text != '\0';
}

// The list statement: the base text, the condition and ordering parts (each left as an
// empty "%q" when not given), and the end.
SqlText FormatListStatement(const char *base, const char *whereFormat, const char *szCondition,
                            const char *szOrderBy, int blAscending) {
    const bool hasCondition = Given(szCondition);
    const bool hasOrder = Given(szOrderBy);
    std::string format;
    try {
        format = base;
        format += hasCondition ? whereFormat : "%q";
        format += hasOrder ? (blAscending ? " ORDER BY %q ASC" : " ORDER BY %q DESC") : "%q";
        format += ";";
    } catch (const std::bad_alloc &) {
        return nullptr;
    }
    return SqlText(sqlite3_mprintf(format.c_str(), hasCondition ? szCondition : "",
                                   hasOrder ? szOrderBy : ""));
}

// A list read. The statement of the interface's reads, without condition and ordering, is a
// single SELECT, whose rows a ListReader copies; a caller's condition could hold more than one
// statement, whose rows `append` copies by name.
template <typename Record>
Record *ReadList(sqlite3 *db, const char *base, const char *whereFormat, const char *szCondition,
                 const char *szOrderBy, int blAscending, sqlite3_callback append, int line) {
    SqlText sql = FormatListStatement(base, whereFormat, szCondition, szOrderBy, blAscending);
    if (!sql) {
        return nullptr;
    }
    if (Given(szCondition) || Given(szOrderBy)) {
        Record *head = nullptr;
        ExecLogged(db, sql.get(), append, &head, line);
        return head;
    }
    ListReader<Record> reader;
    StepLogged(db, sql.get(), ListReader<Record>::Row, &reader, line);
    return reader.head;
}

// The callback of the update checks, which only need to know whether a row came.
int RowFound(void *found, int, char **, char **) {
    *static_cast<bool *>(found) = true;
    return 0;
}

}  // namespace

int NewestCredIdByApplication(sqlite3 *db, const char *application) {
    SqlText sql = FormatListStatement(kCredSelectAll, " WHERE %q", nullptr, nullptr, 0);
    ApplicationMatch match(application);
    if (sql) {
        StepLogged(db, sql.get(), ApplicationMatch::Row, &match, kLineGetListExec);
    }
    return match.id;
}

std::string DatabasePath() {
    const char *path = kova::SecureEnv(kova::kEnvDatabase);
    return (path != nullptr && *path != '\0') ? path : kDefaultDatabasePath;
}

void SleepFully(uint32_t micros) {
    timespec start;
    clock_gettime(CLOCK_MONOTONIC, &start);
    for (uint32_t left = micros; usleep(left) != 0 && errno == EINTR;) {
        timespec now;
        clock_gettime(CLOCK_MONOTONIC, &now);
        const int64_t slept = (static_cast<int64_t>(now.tv_sec) - start.tv_sec) * 1000000 +
                              (now.tv_nsec - start.tv_nsec) / 1000;
        if (slept >= static_cast<int64_t>(micros)) {
            break;
        }
        left = micros - static_cast<uint32_t>(slept);
    }
}

uint32_t LockBackoffMicros(int randomValue) {
    const int32_t shifted = static_cast<int32_t>(static_cast<uint32_t>(randomValue) << 5);
    const int32_t sum = shifted % 1000000 + 100000;
    return static_cast<uint32_t>(sum) <= 999999u ? static_cast<uint32_t>(sum) : 999999u;
}

namespace {

// Runs `runOnce` (true on success, else SQLite's message in its argument, null when there is
// none) until it succeeds, fails otherwise than on a locked database, or has run
// kLockAttempts times.
template <typename RunOnce>
ExecResult RetryWhileLocked(RunOnce runOnce, SqlText *errorMessage) {
    int attemptsLeft = kLockAttempts;
    for (;;) {
        SqlText message;
        if (runOnce(&message)) {
            return ExecResult::kOk;
        }
        if (!message) {
            return ExecResult::kFailedSilently;
        }
        if (strstr(message.get(), kLockedMessage) == nullptr || --attemptsLeft == 0) {
            *errorMessage = std::move(message);
            return ExecResult::kFailed;
        }
        SleepFully(LockBackoffMicros(rand()));
    }
}

// One run of a single statement with sqlite3_exec's outcome: true, or false with the message
// sqlite3_exec would give (a copy of sqlite3_errmsg, "out of memory" where a row was aborted).
bool StepOnce(sqlite3 *db, const char *sql, StatementRow row, void *arg, SqlText *message) {
    sqlite3_stmt *stmt = nullptr;
    int rc = sqlite3_prepare_v2(db, sql, -1, &stmt, nullptr);
    bool aborted = false;
    if (rc == SQLITE_OK && stmt != nullptr) {
        while ((rc = sqlite3_step(stmt)) == SQLITE_ROW) {
            if (!row(arg, stmt)) {
                aborted = true;
                break;
            }
        }
        sqlite3_finalize(stmt);
    }
    if (rc == SQLITE_OK || (rc == SQLITE_DONE && !aborted)) {
        return true;
    }
    message->reset(sqlite3_mprintf("%s", aborted ? "out of memory" : sqlite3_errmsg(db)));
    return false;
}

}  // namespace

ExecResult ExecWithRetry(sqlite3 *db, const char *sql, sqlite3_callback callback, void *arg,
                         SqlText *errorMessage) {
    return RetryWhileLocked(
        [&](SqlText *message) {
            char *raw = nullptr;
            const bool ok = sqlite3_exec(db, sql, callback, arg, &raw) == SQLITE_OK;
            message->reset(raw);
            return ok;
        },
        errorMessage);
}

ExecResult StepWithRetry(sqlite3 *db, const char *sql, StatementRow row, void *arg,
                         SqlText *errorMessage) {
    return RetryWhileLocked([&](SqlText *message) { return StepOnce(db, sql, row, arg, message); },
                            errorMessage);
}

}  // namespace cred
}  // namespace kova

using kova::ArgInvalid;
using namespace kova::cred;

void KOVACredRandInit(void) {
    // Threads that meet an unseeded process at once all seed with the same value, which is
    // harmless; the flag itself is atomic, and a lock here could be inherited held by a forked
    // child.
    if (!gSeeded.load(std::memory_order_acquire)) {
        srand(static_cast<unsigned>(time(nullptr) + getpid()));
        gSeeded.store(true, std::memory_order_release);
    }
}

sqlite3 *KOVACredDBInit(void) {
    KOVACredRandInit();
    std::string path;
    try {
        path = DatabasePath();
    } catch (const std::bad_alloc &) {
        VLIBCErrSetEx(KOVA_ERR_OUT_OF_MEMORY, kUnit, kLineOpenError);
        return nullptr;
    }
    // Only a regular file of the effective user is opened, a link to one included. It is held
    // by an O_PATH descriptor, which touches no FIFO or device and needs no permission, for the
    // checks; its mode is set through a descriptor of the same file; and SQLite's own
    // descriptor must hold it too, so that a file swapped in at the path meanwhile is refused.
    // The held descriptor stays open until the end, so the checked file cannot go and leave
    // its inode number to another; closing it releases none of SQLite's locks, as an O_PATH
    // descriptor holds none. Where nothing can be held the file is missing: it is made (never
    // through a dangling link), and a failure to make it shows up below, where the open fails.
    FileDescriptor held(open(path.c_str(), O_PATH | O_CLOEXEC));
    if (held.get() < 0 && errno == ENOENT) {
        if (VLIBCFileTouch(path.c_str()) != 0 && errno == ELOOP) {
            return Refuse(kLineRefused, path, "is a symbolic link");
        }
        held.reset(open(path.c_str(), O_PATH | O_CLOEXEC));
    }
    struct stat st;
    const bool checked = held.get() >= 0 && fstat(held.get(), &st) == 0;
    int modeError = errno;
    if (checked) {
        if (!S_ISREG(st.st_mode)) {
            return Refuse(kLineRefused, path, "is not a regular file");
        }
        if (st.st_uid != geteuid()) {
            kova::Log("%s:%d %s belongs to uid %lu, not to the effective uid %lu, not opened.\n",
                      kUnit, kLineOtherOwner, path.c_str(), static_cast<unsigned long>(st.st_uid),
                      static_cast<unsigned long>(geteuid()));
            VLIBCErrSetEx(KOVA_ERR_DB_OPEN, kUnit, kLineOpenError);
            return nullptr;
        }
        modeError = SetMode(path, st);
        if (modeError == ESTALE) {
            return Refuse(kLineRefused, path, "was replaced while being opened");
        }
    }
    if (modeError != 0) {
        kova::Log("%s:%d %s chmod failed. errno=[0x%04X]", kUnit, kLineChmodFailed, path.c_str(),
                  modeError);
    }
    // Credentials never go into a file that others may read: a file whose mode stays wider is
    // refused (one already at 0600 on a read-only mount is used).
    struct stat now;
    if (checked && modeError != 0 &&
        (fstat(held.get(), &now) != 0 || (now.st_mode & 07777) != 0600)) {
        return Refuse(kLineModeRefused, path, "cannot be given mode 0600");
    }
    // The file exists by now, so SQLite is not asked to create one (it would not set the mode).
    sqlite3 *raw = nullptr;
    if (sqlite3_open_v2(path.c_str(), &raw, SQLITE_OPEN_READWRITE, nullptr) != SQLITE_OK) {
        VLIBCErrSetEx(KOVA_ERR_DB_OPEN, kUnit, kLineOpenError);
        kova::Log("%s:%d Can't open database: %s\n", kUnit, kLineOpenLog, sqlite3_errmsg(raw));
        sqlite3_close(raw);
        return nullptr;
    }
    Database db(raw);
    if (!checked || !HoldsFile(db.get(), path, st)) {
        return Refuse(kLineRefused, path, "was replaced while being opened");
    }
    // SQLite reads the file only at the first statement, so a file that is not a database
    // fails here rather than at the open.
    if (!ExecLogged(db.get(), kPragmaForeignKeys, nullptr, nullptr, kLinePragma) ||
        !ExecLogged(db.get(), kCredSchema, nullptr, nullptr, kLineCredSchema) ||
        !ExecLogged(db.get(), kSessSchema, nullptr, nullptr, kLineSessSchema)) {
        return nullptr;
    }
    return db.release();
}

int KOVACredDBRecordAdd(sqlite3 *db, const KOVA_CRED *pCred, int *pId) {
    if (db == nullptr) {
        return ArgInvalid(kUnit, kLineAddArg, "__null != db");
    }
    if (pCred == nullptr) {
        return ArgInvalid(kUnit, kLineAddArg, "NULL != pCred");
    }
    const long now = Now();
    SqlText sql = FormatCredInsert(*pCred, now, pCred->remote_passwd.c_str());
    if (!sql || !ExecLoggedAs(db, sql.get(), nullptr, nullptr, kLineAddExec,
                              [&] { return FormatCredInsert(*pCred, now, kRedacted); })) {
        return -1;
    }
    if (pId != nullptr) {
        *pId = static_cast<int>(sqlite3_last_insert_rowid(db));
    }
    return 0;
}

int KOVACredDBRecordGet(sqlite3 *db, long id, KOVA_CRED *pCred) {
    if (db == nullptr) {
        return ArgInvalid(kUnit, kLineGetArg, "__null != db");
    }
    if (pCred == nullptr) {
        return ArgInvalid(kUnit, kLineGetArg, "NULL != pCred");
    }
    SqlText sql(sqlite3_mprintf(kCredSelectById, id));
    if (!sql || !ExecLogged(db, sql.get(), CredRowFirst, pCred, kLineGetExec)) {
        return -1;
    }
    return pCred->filled != 0 ? 1 : 0;
}

KOVA_CRED *KOVACredDBRecordGetList(sqlite3 *db, const char *szCondition, const char *szOrderBy,
                                   int blAscending) {
    if (db == nullptr) {
        ArgInvalid(kUnit, kLineGetListArg, "__null != db");
        return nullptr;
    }
    return ReadList<KOVA_CRED>(db, kCredSelectAll, " WHERE %q", szCondition, szOrderBy, blAscending,
                               CredRowAppend, kLineGetListExec);
}

int KOVACredDBRecordUpdate(sqlite3 *db, long id, const KOVA_CRED *pCred) {
    if (db == nullptr) {
        return ArgInvalid(kUnit, kLineUpdateArg, "__null != db");
    }
    if (pCred == nullptr) {
        return ArgInvalid(kUnit, kLineUpdateArg, "NULL != pCred");
    }
    const long now = Now();
    SqlText sql = FormatCredUpdate(id, *pCred, now, pCred->remote_passwd.c_str());
    if (!sql || !ExecLoggedAs(db, sql.get(), nullptr, nullptr, kLineUpdateExec,
                              [&] { return FormatCredUpdate(id, *pCred, now, kRedacted); })) {
        return -1;
    }
    // The write is verified by finding exactly what was written, mtime included.
    SqlText check = FormatCredUpdateCheck(id, *pCred, now, pCred->remote_passwd.c_str());
    if (!check) {
        return -1;
    }
    bool found = false;
    // A check that could not run is logged; only a check that ran and found nothing fails.
    if (ExecLoggedAs(db, check.get(), RowFound, &found, kLineUpdateCheckExec,
                     [&] { return FormatCredUpdateCheck(id, *pCred, now, kRedacted); }) &&
        !found) {
        VLIBCErrSetEx(KOVA_ERR_DB_READBACK, kUnit, kLineUpdateReadBack);
        return -1;
    }
    return 0;
}

int KOVACredDBRecordRemove(sqlite3 *db, long id) {
    if (db == nullptr) {
        return ArgInvalid(kUnit, kLineRemoveArg, "__null != db");
    }
    // With foreign keys on, a credential that still has a session cannot be deleted.
    KOVACredSessDBRecordRemove(db, id);
    SqlText sql(sqlite3_mprintf(kCredDelete, id));
    if (!sql || !ExecLogged(db, sql.get(), nullptr, nullptr, kLineRemoveExec)) {
        return -1;
    }
    return 0;
}

int KOVACredSessDBRecordAdd(sqlite3 *db, const KOVA_CRED_SESS *pSess, int *pId) {
    if (db == nullptr) {
        return ArgInvalid(kUnit, kLineSessAddArg, "__null != db");
    }
    if (pSess == nullptr) {
        return ArgInvalid(kUnit, kLineSessAddArg, "NULL != pSess");
    }
    const long now = Now();
    SqlText sql =
        FormatSessInsert(*pSess, now, pSess->access_token.c_str(), pSess->csrf_token.c_str());
    if (!sql || !ExecLoggedAs(db, sql.get(), nullptr, nullptr, kLineSessAddExec, [&] {
            return FormatSessInsert(*pSess, now, kRedacted, kRedacted);
        })) {
        return -1;
    }
    if (pId != nullptr) {
        *pId = static_cast<int>(sqlite3_last_insert_rowid(db));
    }
    return 0;
}

int KOVACredSessDBRecordGet(sqlite3 *db, long id, KOVA_CRED_SESS *pSess) {
    if (db == nullptr) {
        return ArgInvalid(kUnit, kLineSessGetArg, "__null != db");
    }
    if (pSess == nullptr) {
        return ArgInvalid(kUnit, kLineSessGetArg, "NULL != pSess");
    }
    SqlText sql(sqlite3_mprintf(kSessSelectById, id));
    if (!sql || !ExecLogged(db, sql.get(), CredSessRowFirst, pSess, kLineSessGetExec)) {
        return -1;
    }
    return pSess->filled != 0 ? 1 : 0;
}

KOVA_CRED_SESS *KOVACredSessDBRecordGetList(sqlite3 *db, const char *szCondition,
                                            const char *szOrderBy, int blAscending) {
    if (db == nullptr) {
        ArgInvalid(kUnit, kLineSessGetListArg, "__null != db");
        return nullptr;
    }
    return ReadList<KOVA_CRED_SESS>(db, kSessSelectAll, " WHERE %q ", szCondition, szOrderBy,
                                    blAscending, CredSessRowAppend, kLineSessGetListExec);
}

int KOVACredSessDBRecordUpdate(sqlite3 *db, long id, const KOVA_CRED_SESS *pSess) {
    if (db == nullptr) {
        return ArgInvalid(kUnit, kLineSessUpdateArg, "__null != db");
    }
    if (pSess == nullptr) {
        return ArgInvalid(kUnit, kLineSessUpdateArg, "NULL != pSess");
    }
    const long now = Now();
    SqlText sql =
        FormatSessReplace(id, *pSess, now, pSess->access_token.c_str(), pSess->csrf_token.c_str());
    if (!sql || !ExecLoggedAs(db, sql.get(), nullptr, nullptr, kLineSessUpdateExec, [&] {
            return FormatSessReplace(id, *pSess, now, kRedacted, kRedacted);
        })) {
        return -1;
    }
    SqlText check =
        FormatSessUpdateCheck(id, *pSess, pSess->access_token.c_str(), pSess->csrf_token.c_str());
    if (!check) {
        return -1;
    }
    bool found = false;
    if (ExecLoggedAs(db, check.get(), RowFound, &found, kLineSessUpdateCheckExec,
                     [&] { return FormatSessUpdateCheck(id, *pSess, kRedacted, kRedacted); }) &&
        !found) {
        VLIBCErrSetEx(KOVA_ERR_DB_READBACK, kUnit, kLineSessUpdateReadBack);
        return -1;
    }
    return 0;
}

int KOVACredSessDBRecordRemove(sqlite3 *db, long id) {
    if (db == nullptr) {
        return ArgInvalid(kUnit, kLineSessRemoveArg, "__null != db");
    }
    SqlText sql(sqlite3_mprintf(kSessDelete, id));
    if (!sql || !ExecLogged(db, sql.get(), nullptr, nullptr, kLineSessRemoveExec)) {
        return -1;
    }
    return 0;
}
