// Helpers shared by the credential store tests: a fixture with a fresh database per test,
// record builders, raw SQLite access to look at what the library wrote, and checks of the
// error slot.
#ifndef KOVA_TESTS_STORE_FIXTURE_H
#define KOVA_TESTS_STORE_FIXTURE_H

#include <sqlite3.h>

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
using CredPtr = std::unique_ptr<KOVA_CRED, CredDeleter>;
using SessPtr = std::unique_ptr<KOVA_CRED_SESS, SessDeleter>;

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

// A fresh database (kovacredential_db) and a clean log and error slot for every test.
class StoreTest : public ::testing::Test {
  protected:
    void SetUp() override {
        kova_test::ClearLog();
        ResetErrorSlot();
    }
    const std::string &DbPath() const { return db_.path(); }
    std::vector<Row> Query(const std::string &sql) const { return RawQuery(db_.path(), sql); }

    kova_test::TempDatabase db_;
};

}  // namespace store_test

#endif  // KOVA_TESTS_STORE_FIXTURE_H
