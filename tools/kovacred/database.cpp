// kovacred's checks of the credential database before the library opens it. The library
// creates a missing database (and its folders) and adds its tables to any SQLite file it
// opens; the tool lets only the commands that store something do that, and never to a file
// that holds something else.
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <memory>
#include <set>
#include <string>

#include <sqlite3.h>

#include <kovacredential/kovacredential.h>

#include "commands.h"

namespace kovacred {

namespace {

constexpr char kSystemDatabase[] = "/usr/kova/etc/private/credentials.sqlite";

struct SqliteCloser {
    void operator()(sqlite3 *db) const { sqlite3_close(db); }
};

int CollectTable(void *tables, int columns, char **values, char **) {
    if (columns > 0 && values[0] != nullptr) {
        static_cast<std::set<std::string> *>(tables)->insert(values[0]);
    }
    return 0;
}

// The names of the tables in the SQLite file at `path`, read without writing anything;
// false with SQLite's reason when it is not a database.
bool ReadTables(const std::string &path, std::set<std::string> &tables, std::string &reason) {
    sqlite3 *raw = nullptr;
    const int opened = sqlite3_open_v2(path.c_str(), &raw, SQLITE_OPEN_READONLY, nullptr);
    std::unique_ptr<sqlite3, SqliteCloser> db(raw);
    if (opened != SQLITE_OK) {
        reason = raw != nullptr ? sqlite3_errmsg(raw) : sqlite3_errstr(opened);
        return false;
    }
    if (sqlite3_exec(db.get(), "SELECT name FROM sqlite_master WHERE type='table';", CollectTable,
                     &tables, nullptr) != SQLITE_OK) {
        reason = sqlite3_errmsg(db.get());
        return false;
    }
    return true;
}

}  // namespace

std::string DatabasePath() {
    const char *path = secure_getenv("kovacredential_db");
    return path != nullptr && *path != '\0' ? path : kSystemDatabase;
}

bool CheckDatabase(DatabaseUse use) {
    const std::string path = DatabasePath();
    struct stat st;
    if (lstat(path.c_str(), &st) != 0) {
        if (use == DatabaseUse::kCreate) {
            return true;
        }
        FailText("no credential database at " + path);
        return false;
    }
    if (!S_ISREG(st.st_mode)) {
        FailText(path + " is not a credential database (not a regular file)");
        return false;
    }
    std::set<std::string> tables;
    std::string reason;
    if (!ReadTables(path, tables, reason)) {
        FailText(path + " is not a credential database (" + reason + ")");
        return false;
    }
    const bool credentials = tables.count("credentials") != 0;
    const bool sessions = tables.count("credential_sessions") != 0;
    if (credentials && sessions) {
        return true;
    }
    if (tables.empty()) {
        if (use == DatabaseUse::kCreate) {
            return true;
        }
        FailText("no credential database at " + path + " (the file is empty)");
        return false;
    }
    FailText(path + " is not a credential database (it has no " +
             (credentials ? "credential_sessions" : "credentials") + " table)");
    return false;
}

int FailStore(const std::string &what) {
    const int code = VLIBCErrGet();
    const std::string where = what + " failed on " + DatabasePath();
    if (code == 0) {
        return FailText(where + ": the database could not be used (kovacred -v shows why)");
    }
    fprintf(stderr, "kovacred: %s (%s)\n", where.c_str(), ErrorText(code).c_str());
    gExitCode = code >= 1 && code <= 255 ? code : 1;
    return gExitCode;
}

}  // namespace kovacred
