// The database row callbacks on arbitrary rows: any column names (known, unknown, empty) and
// values (NULL, non-numeric, huge) must fill records without crashing or leaking. The same
// bytes also make a table of typed values (integers, reals, texts, blobs, NULL) under declared
// types of every affinity, whose list reads, which read the stepped statement, must give the
// records the text rows of sqlite3_exec give through the row callbacks.
#include <stddef.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>

#include <algorithm>
#include <string>
#include <vector>

#include <sqlite3.h>

#include "credential/cred_internal.h"
#include "kovacredential/kovacred.h"
#include "kovacredential/kovacred_db.h"

namespace {

const char *const kNames[] = {"id",
                              "ctime",
                              "mtime",
                              "host",
                              "owner",
                              "remote_account",
                              "remote_passwd",
                              "protocol",
                              "port",
                              "application",
                              "extra_info",
                              "access_token",
                              "csrf_token",
                              "pid",
                              ""};

const char *const kDeclaredTypes[] = {"INTEGER", "TEXT", "REAL", ""};

// Reads the input byte by byte; past its end every byte is 0.
struct Bytes {
    const uint8_t *data;
    size_t size;
    size_t pos = 0;
    uint8_t Next() { return pos < size ? data[pos++] : 0; }
    std::string Take(size_t n) {
        std::string out;
        for (size_t i = 0; i < n; ++i) {
            out.push_back(static_cast<char>(Next()));
        }
        return out;
    }
};

void Require(bool holds) {
    if (!holds) {
        abort();
    }
}

bool Same(const KOVA_CRED &a, const KOVA_CRED &b) {
    return a.filled == b.filled && a.id == b.id && a.ctime == b.ctime && a.mtime == b.mtime &&
           a.owner == b.owner && a.port == b.port && a.host == b.host &&
           a.remote_account == b.remote_account && a.remote_passwd == b.remote_passwd &&
           a.protocol == b.protocol && a.application == b.application &&
           a.extra_info == b.extra_info;
}

bool Same(const KOVA_CRED_SESS &a, const KOVA_CRED_SESS &b) {
    return a.filled == b.filled && a.id == b.id && a.access_token == b.access_token &&
           a.csrf_token == b.csrf_token && a.extra_info == b.extra_info;
}

// The list read of `table` against sqlite3_exec's rows through `append`, record by record.
template <typename Record>
void CompareLists(sqlite3 *db, const char *table, Record *stepped, sqlite3_callback append) {
    Record *exec = nullptr;
    const std::string sql = std::string("SELECT * FROM ") + table + ";";
    Require(sqlite3_exec(db, sql.c_str(), append, &exec, nullptr) == SQLITE_OK);
    const Record *a = stepped;
    const Record *b = exec;
    for (; a != nullptr && b != nullptr; a = a->next, b = b->next) {
        Require(Same(*a, *b));
    }
    Require(a == nullptr && b == nullptr);
    for (Record *left : {stepped, exec}) {
        while (left != nullptr) {
            Record *next = left->next;
            delete left;
            left = next;
        }
    }
}

// A table of up to 8 columns with names of the records' members, declared types of every
// affinity and up to 4 rows of typed values, in an in-memory database.
void TypedTable(Bytes in) {
    const uint8_t shape = in.Next();
    const bool sessions = (shape & 0x80) != 0;
    const char *table = sessions ? "credential_sessions" : "credentials";
    std::vector<std::string> columns;
    std::string create = std::string("CREATE TABLE ") + table + " (";
    for (int i = 0, count = 1 + shape % 8; i < count; ++i) {
        const uint8_t pick = in.Next();
        const std::string name = kNames[pick % (sizeof(kNames) / sizeof(kNames[0]) - 1)];
        if (std::find(columns.begin(), columns.end(), name) != columns.end()) {
            continue;
        }
        create += (columns.empty() ? "" : ", ") + name + " " + kDeclaredTypes[(pick >> 4) % 4];
        columns.push_back(name);
    }
    create += ");";
    sqlite3 *db = nullptr;
    Require(sqlite3_open(":memory:", &db) == SQLITE_OK);
    Require(sqlite3_exec(db, create.c_str(), nullptr, nullptr, nullptr) == SQLITE_OK);
    std::string insert = std::string("INSERT INTO ") + table + " VALUES (";
    for (size_t i = 0; i < columns.size(); ++i) {
        insert += i == 0 ? "?" : ", ?";
    }
    insert += ");";
    sqlite3_stmt *stmt = nullptr;
    Require(sqlite3_prepare_v2(db, insert.c_str(), -1, &stmt, nullptr) == SQLITE_OK);
    for (int row = 0, rows = in.Next() % 5; row < rows; ++row) {
        for (int i = 1; i <= static_cast<int>(columns.size()); ++i) {
            const uint8_t kind = in.Next();
            if (kind % 5 == 1) {
                int64_t value = 0;
                memcpy(&value, in.Take(sizeof(value)).data(), sizeof(value));
                sqlite3_bind_int64(stmt, i, kind & 0x80 ? value : value % 100000);
            } else if (kind % 5 == 2) {
                double value = 0;
                memcpy(&value, in.Take(sizeof(value)).data(), sizeof(value));
                sqlite3_bind_double(stmt, i, kind & 0x80 ? value : (value > 0 ? 1e30 : -7.5));
            } else if (kind % 5 == 3 || kind % 5 == 4) {
                const std::string bytes = in.Take(in.Next() % 24);
                if (kind % 5 == 3) {
                    sqlite3_bind_text(stmt, i, bytes.data(), static_cast<int>(bytes.size()),
                                      SQLITE_TRANSIENT);
                } else {
                    sqlite3_bind_blob(stmt, i, bytes.data(), static_cast<int>(bytes.size()),
                                      SQLITE_TRANSIENT);
                }
            } else {
                sqlite3_bind_null(stmt, i);
            }
        }
        sqlite3_step(stmt);
        sqlite3_reset(stmt);
    }
    sqlite3_finalize(stmt);
    if (sessions) {
        CompareLists(db, table, KOVACredSessDBRecordGetList(db, nullptr, nullptr, 0),
                     CredSessRowAppend);
    } else {
        CompareLists(db, table, KOVACredDBRecordGetList(db, nullptr, nullptr, 0), CredRowAppend);
        // The newest of an application is the first of the list's records that carries it.
        KOVA_CRED *list = KOVACredDBRecordGetList(db, nullptr, nullptr, 0);
        for (const char *application : {"", "a", "app"}) {
            const KOVA_CRED *first = list;
            while (first != nullptr && first->application != application) {
                first = first->next;
            }
            const int expected = first != nullptr ? first->id : -1;
            Require(kova::cred::NewestCredIdByApplication(db, application) == expected);
        }
        KOVACredListFree(&list);
    }
    sqlite3_close(db);
}

}  // namespace

// Input: a sequence of columns, each a name selector byte, a value length byte (255 = NULL)
// and that many value bytes. Every fourth column starts a new row.
extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    constexpr size_t kMaxColumns = 64;
    std::vector<std::string> values;
    values.reserve(kMaxColumns);  // the texts point into it
    std::vector<const char *> names;
    std::vector<char *> texts;
    for (size_t pos = 0; pos + 2 <= size && names.size() < kMaxColumns;) {
        names.push_back(kNames[data[pos] % (sizeof(kNames) / sizeof(kNames[0]))]);
        const uint8_t length = data[pos + 1];
        pos += 2;
        const size_t take = length == 255 ? 0 : std::min<size_t>(length, size - pos);
        values.emplace_back(reinterpret_cast<const char *>(data + pos), take);
        texts.push_back(length == 255 ? nullptr : &values.back()[0]);
        pos += take;
    }
    const int nCol = static_cast<int>(names.size());
    KOVA_CRED cred;
    KOVA_CRED_SESS sess;
    KOVA_CRED *credList = nullptr;
    KOVA_CRED_SESS *sessList = nullptr;
    for (int start = 0; start == 0 || start < nCol; start += 4) {
        const int n = std::min(4, nCol - start);
        char **vals = texts.data() + start;
        char **cols = const_cast<char **>(names.data()) + start;
        CredRowFirst(&cred, n, vals, cols);
        CredRowAppend(&credList, n, vals, cols);
        CredSessRowFirst(&sess, n, vals, cols);
        CredSessRowAppend(&sessList, n, vals, cols);
    }
    KOVACredListFree(&credList);
    KOVACredSessListFree(&sessList);
    TypedTable(Bytes{data, size});
    return 0;
}
