// Helpers shared by the credential store tests: a fixture with a fresh database per test,
// record builders, raw SQLite access to look at what the library wrote, and checks of the
// error slot.
#ifndef KOVA_TESTS_STORE_FIXTURE_H
#define KOVA_TESTS_STORE_FIXTURE_H

#include <sqlite3.h>

#include <stdio.h>
#include <sys/wait.h>
#include <unistd.h>

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "kovacredential/kovacredential.h"
#include "support/interpose.h"
#include "support/temp_dir.h"

namespace store_test {

struct CredDeleter {
    void operator()(KOVA_CRED *p) const { KOVACredFree(p); }
};
struct SessDeleter {
    void operator()(KOVA_CRED_SESS *p) const { KOVACredSessFree(p); }
};
struct DbCloser {
    void operator()(sqlite3 *db) const { sqlite3_close(db); }
};
using CredPtr = std::unique_ptr<KOVA_CRED, CredDeleter>;
using SessPtr = std::unique_ptr<KOVA_CRED_SESS, SessDeleter>;
using DbPtr = std::unique_ptr<sqlite3, DbCloser>;

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

using Row = std::vector<std::string>;  // column texts; NULL reads as "<NULL>"

// Runs `sql` on its own connection and returns every row.
inline std::vector<Row> RawQuery(const std::string &dbPath, const std::string &sql) {
    std::vector<Row> rows;
    sqlite3 *db = nullptr;
    if (sqlite3_open(dbPath.c_str(), &db) != SQLITE_OK) {
        sqlite3_close(db);
        ADD_FAILURE() << "cannot open " << dbPath;
        return rows;
    }
    char *err = nullptr;
    auto collect = [](void *arg, int n, char **vals, char **) -> int {
        auto *out = static_cast<std::vector<Row> *>(arg);
        Row row;
        for (int i = 0; i < n; ++i) {
            row.emplace_back(vals[i] ? vals[i] : "<NULL>");
        }
        out->push_back(row);
        return 0;
    };
    if (sqlite3_exec(db, sql.c_str(), collect, &rows, &err) != SQLITE_OK) {
        ADD_FAILURE() << sql << ": " << (err ? err : "?");
    }
    sqlite3_free(err);
    sqlite3_close(db);
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
    auto records = kova_test::LogRecords();
    size_t matches = 0;
    for (const auto &r : records) {
        if (r == record) {
            ++matches;
        }
    }
    if (matches != 1) {
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

// One call that must fail with -1 and leave exactly one log record beginning with `record`.
struct FailureCase {
    std::function<long()> call;
    std::string record;
};

inline size_t LogCountPrefix(const std::string &prefix) {
    size_t found = 0;
    for (const auto &r : kova_test::LogRecords()) {
        found += r.rfind(prefix, 0) == 0 ? 1 : 0;
    }
    return found;
}

// `suffix` is appended to every case's record (such as the inner error's "[0x0900 cred_db:169]").
inline void ExpectFailuresLogged(const std::vector<FailureCase> &cases,
                                 const std::string &suffix = "") {
    for (const auto &c : cases) {
        SCOPED_TRACE(c.record);
        kova_test::ClearLog();
        EXPECT_EQ(c.call(), -1);
        EXPECT_EQ(LogCountPrefix(c.record + suffix), 1u) << kova_test::LogDump();
    }
}

// Runs `body` in a forked child that an alarm ends after `seconds`, so that a crash or a hang
// fails one test. The child's expectations print as usual; returns 0 when none failed, else
// its exit status or 128 + the signal that ended it.
template <typename Body>
int RunInChild(Body body, unsigned seconds = 60) {
    fflush(nullptr);
    const pid_t pid = fork();
    if (pid == 0) {
        alarm(seconds);
        kova_test::ClearLog();
        VLIBCErrSetEx(0, "", 0);
        body();
        fflush(nullptr);
        _exit(::testing::Test::HasFailure() ? 1 : 0);
    }
    int status = 0;
    if (pid < 0 || waitpid(pid, &status, 0) != pid) {
        return -1;
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
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

    // Points the database below a regular file, where neither a folder nor the file can be
    // made; returns that database path.
    std::string BlockDatabase() {
        const std::string blocker = db_.dir().File("plainfile");
        FILE *f = fopen(blocker.c_str(), "w");
        EXPECT_NE(f, nullptr);
        if (f != nullptr) {
            fclose(f);
        }
        const std::string path = blocker + "/sub/credentials.sqlite";
        setenv("kovacredential_db", path.c_str(), 1);
        return path;
    }

    kova_test::TempDatabase db_;
};

}  // namespace store_test

#endif  // KOVA_TESTS_STORE_FIXTURE_H
