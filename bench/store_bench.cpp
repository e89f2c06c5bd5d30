// Credential store throughput against raw SQLite. Every library call opens the database
// (pragma and both schema statements), runs one statement and closes it; the baseline runs
// the same sequence with plain sqlite3 calls and keeps the rows it reads as a hand-written
// client would (columns by position into a vector), so the ratio shows what the library adds.
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <functional>
#include <string>
#include <vector>

#include <sqlite3.h>

#include "kovacredential/kovacredential.h"

namespace {

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
constexpr const char kInsert[] =
    "INSERT INTO credentials \t\t(ctime, mtime, host, owner, remote_account, remote_passwd, port, "
    "protocol, application, extra_info, pid) \t\tVALUES (%ld, %ld, '%q', %ld, '%q', '%q', '%ld', "
    "'%q', '%q', '%q', %ld);";
constexpr int kApplications = 10;
constexpr double kSecondsPerRun = 0.12;
constexpr int kRounds = 15;

sqlite3 *RawOpen(const std::string &path) {
    sqlite3 *db = nullptr;
    if (sqlite3_open(path.c_str(), &db) != SQLITE_OK ||
        sqlite3_exec(db, kPragma, nullptr, nullptr, nullptr) != SQLITE_OK ||
        sqlite3_exec(db, kCredSchema, nullptr, nullptr, nullptr) != SQLITE_OK ||
        sqlite3_exec(db, kSessSchema, nullptr, nullptr, nullptr) != SQLITE_OK) {
        fprintf(stderr, "store_bench: cannot open %s\n", path.c_str());
        exit(1);
    }
    return db;
}

int RawExec(const std::string &path, const char *sql, sqlite3_callback callback, void *arg) {
    sqlite3 *db = RawOpen(path);
    int rc = sqlite3_exec(db, sql, callback, arg, nullptr);
    sqlite3_close(db);
    return rc;
}

void RawInsert(sqlite3 *db, int i) {
    const long now = static_cast<long>(time(nullptr));
    char *sql = sqlite3_mprintf(kInsert, now, now, ("host" + std::to_string(i)).c_str(), 1024L,
                                "admin", "secret", 5001L, "https",
                                ("app" + std::to_string(i % kApplications)).c_str(), "{}",
                                static_cast<long>(getpid()));
    sqlite3_exec(db, sql, nullptr, nullptr, nullptr);
    sqlite3_free(sql);
}

// What a raw sqlite3 client keeps of a row: the columns by their fixed positions.
struct RawRow {
    long id, ctime, mtime, owner, port;
    std::string host, account, passwd, protocol, application, extra;
};

long IntAt(char **vals, int i) {
    return vals[i] ? strtol(vals[i], nullptr, 10) : 0;
}
const char *TextAt(char **vals, int i) {
    return vals[i] ? vals[i] : "";
}

int CollectRow(void *arg, int n, char **vals, char **) {
    if (n < 11) {
        return 0;
    }
    static_cast<std::vector<RawRow> *>(arg)->push_back(
        RawRow{IntAt(vals, 0), IntAt(vals, 1), IntAt(vals, 2), IntAt(vals, 4), IntAt(vals, 7),
               TextAt(vals, 3), TextAt(vals, 5), TextAt(vals, 6), TextAt(vals, 8), TextAt(vals, 9),
               TextAt(vals, 10)});
    return 0;
}

// A fresh database file holding `rows` credentials.
std::string MakeDatabase(const std::string &dir, const std::string &name, int rows) {
    const std::string path = dir + "/" + name;
    sqlite3 *db = RawOpen(path);
    sqlite3_exec(db, "BEGIN;", nullptr, nullptr, nullptr);
    for (int i = 0; i < rows; ++i) {
        RawInsert(db, i);
    }
    sqlite3_exec(db, "COMMIT;", nullptr, nullptr, nullptr);
    sqlite3_close(db);
    return path;
}

// Calls per second of `op` over about kSecondsPerRun.
double Rate(const std::function<void()> &op) {
    using Clock = std::chrono::steady_clock;
    long calls = 0;
    const auto start = Clock::now();
    double elapsed = 0;
    do {
        op();
        ++calls;
        elapsed = std::chrono::duration<double>(Clock::now() - start).count();
    } while (elapsed < kSecondsPerRun);
    return calls / elapsed;
}

struct Result {
    std::string name;
    double library = 0;  // median calls per second
    double raw = 0;
    double ratio = 0;  // median of the rounds' ratios
};

double Median(std::vector<double> values) {
    std::sort(values.begin(), values.end());
    return values[values.size() / 2];
}

// kRounds runs for each side, alternating so that both see the same machine; the ratio is the
// median of the rounds' ratios, which one disturbed round cannot move.
Result Compare(const std::string &name, const std::function<void()> &library,
               const std::function<void()> &raw) {
    std::vector<double> lib, base, ratios;
    for (int i = 0; i < kRounds; ++i) {
        lib.push_back(Rate(library));
        base.push_back(Rate(raw));
        ratios.push_back(lib.back() / base.back());
    }
    return Result{name, Median(lib), Median(base), Median(ratios)};
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

}  // namespace

int main() {
    const std::string dir = BenchFolder();
    std::vector<Result> results;

    // Add: each side into its own database that starts empty.
    {
        const std::string libPath = dir + "/add-lib.sqlite";
        const std::string rawPath = dir + "/add-raw.sqlite";
        setenv("kovacredential_db", libPath.c_str(), 1);
        KOVA_CRED *cred = KOVACredAlloc();
        KOVACredItemSetHost(cred, "nas.example");
        KOVACredItemSetPort(cred, 5001);
        KOVACredItemSetProtocol(cred, "https");
        KOVACredItemSetRemoteAccount(cred, "admin");
        KOVACredItemSetRemotePasswd(cred, "secret");
        KOVACredItemSetApplication(cred, "app1");
        KOVACredItemSetExtraInfo(cred, "{}");
        int counter = 0;
        results.push_back(Compare(
            "KOVACredAdd",
            [&] {
                cred->id = -1;
                if (KOVACredAdd(cred) != 0) {
                    fprintf(stderr, "KOVACredAdd failed\n");
                    exit(1);
                }
            },
            [&] {
                sqlite3 *db = RawOpen(rawPath);
                RawInsert(db, ++counter);
                sqlite3_last_insert_rowid(db);
                sqlite3_close(db);
            }));
        KOVACredFree(cred);
    }

    // Reads of a table of 1,000 rows.
    {
        const std::string path = MakeDatabase(dir, "rows1000.sqlite", 1000);
        setenv("kovacredential_db", path.c_str(), 1);
        unsigned next = 1;
        auto nextId = [&next] {
            next = next * 1103515245u + 12345u;
            return static_cast<long>(next % 1000 + 1);
        };
        results.push_back(Compare(
            "KOVACredGetByID (1,000 rows)",
            [&] {
                KOVA_CRED *cred = KOVACredAlloc();
                KOVACredGetByID(nextId(), cred);
                KOVACredFree(cred);
            },
            [&] {
                char *sql = sqlite3_mprintf("SELECT * FROM credentials WHERE id=%ld;", nextId());
                std::vector<RawRow> rows;
                RawExec(path, sql, CollectRow, &rows);
                sqlite3_free(sql);
            }));
        results.push_back(Compare(
            "KOVACredListGet (1,000 rows)",
            [&] {
                KOVA_CRED *list = nullptr;
                KOVACredListGet(&list, nullptr, nullptr);
                KOVACredListFree(&list);
            },
            [&] {
                std::vector<RawRow> rows;
                RawExec(path, "SELECT * FROM credentials;", CollectRow, &rows);
            }));
    }

    // Look-up by application: both read every row and keep the newest match.
    for (int rows : {100, 1000, 10000}) {
        const std::string path = MakeDatabase(dir, "app" + std::to_string(rows) + ".sqlite", rows);
        setenv("kovacredential_db", path.c_str(), 1);
        char label[64];
        snprintf(label, sizeof(label), "KOVACredIDGetByApplication (%d rows)", rows);
        results.push_back(Compare(
            label, [] { KOVACredIDGetByApplication("app3"); },
            [&] {
                std::vector<RawRow> all;
                RawExec(path, "SELECT * FROM credentials;", CollectRow, &all);
                long id = -1;
                for (const auto &row : all) {
                    if (row.application == "app3" && row.id > id) {
                        id = row.id;
                    }
                }
            }));
    }

    printf("%-44s %14s %14s %7s\n", "operation", "library/s", "raw sqlite3/s", "ratio");
    bool allMet = true;
    for (const auto &r : results) {
        const double ratio = r.ratio;
        allMet = allMet && ratio >= 0.9;
        printf("%-44s %14.0f %14.0f %7.2f%s\n", r.name.c_str(), r.library, r.raw, ratio,
               ratio >= 0.9 ? "" : "  (below 0.90)");
    }
    printf("%s\n", allMet ? "every ratio is at least 0.90" : "some ratios are below 0.90");

    std::error_code ec;
    std::filesystem::remove_all(dir, ec);
    return 0;
}
