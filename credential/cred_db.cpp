// The credential database: opening it (file, mode, schema), the lock retry every statement
// runs under, and the record-level operations on an open connection.
#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
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
#include "platform/kova_log.h"
#include "platform/vlibc.h"

namespace kova {
namespace cred {
namespace {

constexpr const char kUnit[] = "cred_db";

// Lines that the messages of this unit carry.
constexpr int kLineChmodFailed = 165;
constexpr int kLineRefused = 167;
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

// ExecWithRetry that logs a lasting failure as "<unit>:<line> Exec sql:[<text>] error: <msg>",
// where the text is what logText() returns (made only when there is something to log).
template <typename LogText>
bool ExecLoggedAs(sqlite3 *db, const char *sql, sqlite3_callback callback, void *arg, int line,
                  LogText logText) {
    SqlText message;
    const ExecResult result = ExecWithRetry(db, sql, callback, arg, &message);
    if (result == ExecResult::kFailed) {
        const auto shown = logText();
        Log("%s:%d Exec sql:[%s] error: %s\n", kUnit, line, Text(shown), message.get());
    }
    return result == ExecResult::kOk;
}

// For statements without a secret: the log shows the statement itself.
bool ExecLogged(sqlite3 *db, const char *sql, sqlite3_callback callback, void *arg, int line) {
    return ExecLoggedAs(db, sql, callback, arg, line, [sql] { return sql; });
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

struct FreeDeleter {
    void operator()(char *p) const { free(p); }
};

// The path with its folder resolved to a path free of symbolic links; the path as it is when
// the folder cannot be resolved.
std::string ResolveFolder(const std::string &path) {
    const size_t slash = path.rfind('/');
    if (slash == std::string::npos || slash + 1 == path.size()) {
        return path;
    }
    std::unique_ptr<char, FreeDeleter> folder(
        realpath(slash == 0 ? "/" : path.substr(0, slash).c_str(), nullptr));
    if (!folder) {
        return path;
    }
    return std::string(folder.get()) + (folder.get()[1] == '\0' ? "" : "/") +
           path.substr(slash + 1);
}

// sqlite3_open_v2 of an existing file for reading and writing, never through a link.
int OpenNoFollow(const char *path, sqlite3 **db) {
    *db = nullptr;
    return sqlite3_open_v2(path, db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOFOLLOW, nullptr);
}

// Refuses to open the database file: logs why and fails as a failed open does.
sqlite3 *Refuse(const std::string &path, const char *why) {
    Log("%s:%d %s %s, not opened.\n", kUnit, kLineRefused, path.c_str(), why);
    VLIBCErrSetEx(KOVA_ERR_DB_OPEN, kUnit, kLineOpenError);
    return nullptr;
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
    ExecLogged(db, sql.get(), ListReader<Record>::Row, &reader, line);
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
        ExecLogged(db, sql.get(), ApplicationMatch::Row, &match, kLineGetListExec);
    }
    return match.id;
}

std::string DatabasePath() {
    const char *path = secure_getenv("kovacredential_db");
    return (path != nullptr && *path != '\0') ? path : kDefaultDatabasePath;
}

uint32_t LockBackoffMicros(int randomValue) {
    const int32_t shifted = static_cast<int32_t>(static_cast<uint32_t>(randomValue) << 5);
    const int32_t sum = shifted % 1000000 + 100000;
    return static_cast<uint32_t>(sum) <= 999999u ? static_cast<uint32_t>(sum) : 999999u;
}

ExecResult ExecWithRetry(sqlite3 *db, const char *sql, sqlite3_callback callback, void *arg,
                         SqlText *errorMessage) {
    int attemptsLeft = kLockAttempts;
    for (;;) {
        char *raw = nullptr;
        if (sqlite3_exec(db, sql, callback, arg, &raw) == SQLITE_OK) {
            sqlite3_free(raw);
            return ExecResult::kOk;
        }
        SqlText message(raw);
        if (!message) {
            return ExecResult::kFailedSilently;
        }
        if (strstr(message.get(), kLockedMessage) == nullptr || --attemptsLeft == 0) {
            *errorMessage = std::move(message);
            return ExecResult::kFailed;
        }
        usleep(LockBackoffMicros(rand()));
    }
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
    // Only a regular file is opened, and its mode is set on the file a descriptor holds, so that
    // whoever names the path cannot have another file changed. O_PATH with O_NOFOLLOW holds a
    // link itself rather than its target, opens a FIFO or device without touching it, and needs
    // no read permission, so a file whose mode lost its read bits is still set back to 0600.
    // Where nothing can be held the file is missing: it is made, and a failure to make it shows
    // up below, where setting the mode and the open fail.
    FileDescriptor file(open(path.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
    if (file.get() < 0) {
        VLIBCFileTouch(path.c_str());
        file.reset(open(path.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
    }
    struct stat st;
    const bool opened = file.get() >= 0 && fstat(file.get(), &st) == 0;
    if (opened && !S_ISREG(st.st_mode)) {
        return Refuse(path, S_ISLNK(st.st_mode) ? "is a symbolic link" : "is not a regular file");
    }
    int modeError = opened ? 0 : errno;
    if (opened) {
        // fchmod does not take an O_PATH descriptor; its /proc name leads to that file only.
        char held[64];
        snprintf(held, sizeof(held), "/proc/self/fd/%d", file.get());
        modeError = chmod(held, 0600) == 0 ? 0 : errno;
    }
    if (modeError != 0) {
        kova::Log("%s:%d %s chmod failed. errno=[0x%04X]", kUnit, kLineChmodFailed, path.c_str(),
                  modeError);
    }
    // The file exists by now, so SQLite is not asked to create one (it would not set the mode).
    // SQLite's NOFOLLOW open refuses a link anywhere in the path, while a linked folder is a
    // normal set-up: such a path is opened again with its folder resolved.
    sqlite3 *raw = nullptr;
    int rc = OpenNoFollow(path.c_str(), &raw);
    if (rc != SQLITE_OK && sqlite3_extended_errcode(raw) == SQLITE_CANTOPEN_SYMLINK) {
        sqlite3_close(raw);
        try {
            rc = OpenNoFollow(ResolveFolder(path).c_str(), &raw);
        } catch (const std::bad_alloc &) {
            VLIBCErrSetEx(KOVA_ERR_OUT_OF_MEMORY, kUnit, kLineOpenError);
            return nullptr;
        }
    }
    if (rc != SQLITE_OK) {
        VLIBCErrSetEx(KOVA_ERR_DB_OPEN, kUnit, kLineOpenError);
        kova::Log("%s:%d Can't open database: %s\n", kUnit, kLineOpenLog, sqlite3_errmsg(raw));
        sqlite3_close(raw);
        return nullptr;
    }
    Database db(raw);
    // The file SQLite opened must be the one whose mode was set, not one swapped in since.
    struct stat now;
    if (opened &&
        (lstat(path.c_str(), &now) != 0 || now.st_dev != st.st_dev || now.st_ino != st.st_ino)) {
        return Refuse(path, "was replaced while being opened");
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
