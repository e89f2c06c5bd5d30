// Helpers shared by the credential store tests: a fixture with a fresh database per test,
// record builders, raw SQLite access to look at what the library wrote, and checks of the
// error slot and the log.
#ifndef KOVA_TESTS_STORE_FIXTURE_H
#define KOVA_TESTS_STORE_FIXTURE_H

#include <sqlite3.h>
#include <stdio.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "kovacredential/kovacredential.h"
#include "support/interpose.h"
#include "support/temp_dir.h"

namespace store_test {

template <auto Free>
struct Deleter {
    template <typename T>
    void operator()(T *p) const {
        Free(p);
    }
};
using CredPtr = std::unique_ptr<KOVA_CRED, Deleter<KOVACredFree>>;
using SessPtr = std::unique_ptr<KOVA_CRED_SESS, Deleter<KOVACredSessFree>>;
using DbPtr = std::unique_ptr<sqlite3, Deleter<sqlite3_close>>;

inline CredPtr NewCred() {
    return CredPtr(KOVACredAlloc());
}
inline SessPtr NewSess() {
    return SessPtr(KOVACredSessAlloc());
}

inline CredPtr MakeCred(const std::string &host, const std::string &application = "app",
                        int port = 5001) {
    CredPtr cred = NewCred();
    cred->host = host;
    cred->port = port;
    cred->owner = 1024;
    cred->protocol = "https";
    cred->remote_account = "admin";
    cred->remote_passwd = "pw-" + host;
    cred->application = application;
    cred->extra_info = "{\"k\":1}";
    return cred;
}

inline SessPtr MakeSess(int id, const std::string &sid, const std::string &token) {
    SessPtr sess = NewSess();
    sess->id = id;
    sess->access_token = sid;
    sess->csrf_token = token;
    sess->extra_info = "extra-" + sid;
    return sess;
}

// The credential table's schema statement.
constexpr const char kCredSchema[] =
    "CREATE TABLE if not exists credentials (id INTEGER PRIMARY KEY ASC, \t\t\t\t\t\t ctime "
    "INTEGER, mtime INTEGER, host TEXT, owner INTEGER, remote_account TEXT, \t\t\t\t\t\t "
    "remote_passwd TEXT, port INTEGER, protocol TEXT, application TEXT, extra_info TEXT, pid "
    "INTEGER);";

using Ints = std::vector<int32_t>;
using Texts = std::vector<std::string>;
using Row = Texts;  // column texts; NULL reads as "<NULL>"

// Runs `sql` on its own connection and returns every row.
inline std::vector<Row> RawQuery(const std::string &dbPath, const std::string &sql) {
    std::vector<Row> rows;
    sqlite3 *raw = nullptr;
    const int rc = sqlite3_open(dbPath.c_str(), &raw);
    const DbPtr db(raw);
    auto collect = [](void *out, int n, char **vals, char **) -> int {
        Row row;
        for (int i = 0; i < n; ++i) {
            row.emplace_back(vals[i] ? vals[i] : "<NULL>");
        }
        static_cast<std::vector<Row> *>(out)->push_back(row);
        return 0;
    };
    if (rc != SQLITE_OK || sqlite3_exec(raw, sql.c_str(), collect, &rows, nullptr) != SQLITE_OK) {
        ADD_FAILURE() << dbPath << ": " << sql << ": " << sqlite3_errmsg(raw);
    }
    return rows;
}

// The error slot holds exactly this code, file and line.
inline ::testing::AssertionResult ErrorIs(int code, const std::string &file, int line) {
    if (VLIBCErrGet() == code && file == VLIBCErrorGetFile() && VLIBCErrorGetLine() == line) {
        return ::testing::AssertionSuccess();
    }
    return ::testing::AssertionFailure()
           << "error slot holds " << VLIBCErrGet() << " " << VLIBCErrorGetFile() << ":"
           << VLIBCErrorGetLine() << ", expected " << code << " " << file << ":" << line;
}

inline void ResetErrorSlot() {
    VLIBCErrSetEx(0, "", 0);
}

// The log holds exactly one argument-error record for this file, line and check, and the
// error slot holds 3328 with the same file and line.
inline ::testing::AssertionResult ArgErrorReported(const std::string &file, int line,
                                                   const std::string &check) {
    const std::string record =
        file + ":" + std::to_string(line) + " Invaild Argument (" + check + ")=[0]\n";
    const auto records = kova_test::LogRecords();
    if (std::count(records.begin(), records.end(), record) != 1) {
        return ::testing::AssertionFailure() << "expected one record \"" << record << "\", log:\n"
                                             << kova_test::LogDump();
    }
    return ErrorIs(KOVA_ERR_INVALID_ARGUMENT, file, line);
}

// The ids of a list from its head on.
template <typename Record>
std::vector<int> Ids(const Record *head) {
    std::vector<int> ids;
    for (const Record *p = head; p != nullptr; p = p->next) {
        ids.push_back(p->id);
    }
    return ids;
}

// One call that must fail with -1 and report an argument error.
struct ArgCase {
    std::function<long()> call;
    std::string file;
    int line;
    std::string check;
};

inline void ExpectArgErrors(const std::vector<ArgCase> &cases) {
    for (const auto &c : cases) {
        SCOPED_TRACE(c.file + ":" + std::to_string(c.line) + " " + c.check);
        kova_test::ClearLog();
        ResetErrorSlot();
        EXPECT_EQ(c.call(), -1);
        EXPECT_TRUE(ArgErrorReported(c.file, c.line, c.check));
    }
}

// Forks a child that runs `body` and that an alarm ends after `seconds`, so that a crash or a
// hang fails one test; the child exits with 1 when one of its expectations failed.
template <typename Body>
pid_t StartChild(Body body, unsigned seconds) {
    fflush(nullptr);
    const pid_t pid = fork();
    if (pid == 0) {
        alarm(seconds);
        body();
        fflush(nullptr);
        _exit(::testing::Test::HasFailure() ? 1 : 0);
    }
    return pid;
}

// The exit status of a child, or 128 + the signal that ended it.
inline int WaitChild(pid_t pid) {
    int status = 0;
    if (pid < 0 || waitpid(pid, &status, 0) != pid) {
        return -1;
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

inline size_t LogCountPrefix(const std::string &prefix) {
    const auto records = kova_test::LogRecords();
    return std::count_if(records.begin(), records.end(),
                         [&](const std::string &r) { return r.rfind(prefix, 0) == 0; });
}

// Calls that must fail with -1 and leave exactly one log record beginning with `record` and
// `suffix` (such as the inner error's "[0x0900 cred_db:169]").
struct FailureCase {
    std::function<long()> call;
    std::string record;
};

inline void ExpectFailuresLogged(const std::vector<FailureCase> &cases,
                                 const std::string &suffix = "") {
    for (const auto &c : cases) {
        SCOPED_TRACE(c.record);
        kova_test::ClearLog();
        EXPECT_EQ(c.call(), -1);
        EXPECT_EQ(LogCountPrefix(c.record + suffix), 1u) << kova_test::LogDump();
    }
}

// A clean log and error slot for every test.
class LogTest : public ::testing::Test {
  protected:
    void SetUp() override {
        kova_test::ClearLog();
        ResetErrorSlot();
    }
};

// ... and a fresh database (kovacredential_db).
class StoreTest : public LogTest {
  protected:
    const std::string &DbPath() const { return db_.path(); }
    std::vector<Row> Query(const std::string &sql) const { return RawQuery(db_.path(), sql); }

    // Stores a credential through the interface and returns its id.
    int AddCred(const std::string &host, const std::string &application = "app") {
        CredPtr cred = MakeCred(host, application);
        EXPECT_EQ(KOVACredAdd(cred.get()), 0) << kova_test::LogDump();
        return cred->id;
    }

    kova_test::TempDatabase db_;
};

}  // namespace store_test

#endif  // KOVA_TESTS_STORE_FIXTURE_H
