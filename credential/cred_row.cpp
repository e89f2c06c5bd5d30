// Row callbacks of the credential database: result rows of sqlite3_exec become records.
// SQLite calls them from C, so no exception may pass through them; each returns 0 so that a
// query is never aborted by a record it could not build.
#include <stdint.h>
#include <stdlib.h>
#include <string.h>

#include <algorithm>
#include <iterator>
#include <new>
#include <string>
#include <vector>

#include "credential/cred_internal.h"
#include "kovacredential/kovacred_db.h"

namespace kova {
namespace cred {
namespace {

// A column name with its length, so that a row's names are told apart mostly without a call.
struct ColumnName {
    template <size_t N>
    constexpr ColumnName(const char (&text)[N]) : name(text), length(N - 1) {}
    const char *name;
    size_t length;

    bool Is(const char *other, size_t otherLength) const {
        return length == otherLength && name[0] == other[0] && memcmp(name, other, length) == 0;
    }
};

template <typename Record>
struct IntColumn {
    ColumnName name;
    int32_t Record::*member;
};

template <typename Record>
struct StringColumn {
    ColumnName name;
    std::string Record::*member;
};

const IntColumn<KOVA_CRED> kCredIntColumns[] = {
    {"id", &KOVA_CRED::id},       {"ctime", &KOVA_CRED::ctime}, {"mtime", &KOVA_CRED::mtime},
    {"owner", &KOVA_CRED::owner}, {"port", &KOVA_CRED::port},
};
const StringColumn<KOVA_CRED> kCredStringColumns[] = {
    {"host", &KOVA_CRED::host},
    {"remote_account", &KOVA_CRED::remote_account},
    {"remote_passwd", &KOVA_CRED::remote_passwd},
    {"protocol", &KOVA_CRED::protocol},
    {"application", &KOVA_CRED::application},
    {"extra_info", &KOVA_CRED::extra_info},
};
const IntColumn<KOVA_CRED_SESS> kSessIntColumns[] = {
    {"id", &KOVA_CRED_SESS::id},
};
const StringColumn<KOVA_CRED_SESS> kSessStringColumns[] = {
    {"access_token", &KOVA_CRED_SESS::access_token},
    {"csrf_token", &KOVA_CRED_SESS::csrf_token},
    {"extra_info", &KOVA_CRED_SESS::extra_info},
};

// Integer columns are always written by the database layer; a NULL one reads as 0. The text
// converts as strtol does where long is 32 bits: a value beyond the range saturates rather
// than wrapping. Up to 18 digits after an optional minus sign, which covers everything this
// library stores, are read here; any other text goes through strtoll.
int32_t Saturated(int64_t value) {
    if (value > INT32_MAX) {
        return INT32_MAX;
    }
    if (value < INT32_MIN) {
        return INT32_MIN;
    }
    return static_cast<int32_t>(value);
}

int32_t ColumnInt(const char *text) {
    if (text == nullptr) {
        return 0;
    }
    const bool negative = *text == '-';
    const char *p = text + (negative ? 1 : 0);
    int64_t value = 0;
    int digits = 0;
    for (; digits < 18 && *p >= '0' && *p <= '9'; ++p, ++digits) {
        value = value * 10 + (*p - '0');
    }
    if (digits == 0 || (*p >= '0' && *p <= '9')) {
        value = strtoll(text, nullptr, 10);
    } else if (negative) {
        value = -value;
    }
    return Saturated(value);
}

// A column of the statement's current row as sqlite3_exec hands it over: its text, or null for
// NULL. False when SQLite could not make the text, where sqlite3_exec fails for want of memory.
inline bool ColumnText(sqlite3_stmt *stmt, int column, const char **text) {
    *text = reinterpret_cast<const char *>(sqlite3_column_text(stmt, column));
    return *text != nullptr || sqlite3_column_type(stmt, column) == SQLITE_NULL;
}

// The integer an integer member reads from a column: the stored integer itself where the
// column holds one (the number its decimal text reads as), else what ColumnInt makes of the
// text. False as for ColumnText.
inline bool ColumnInteger(sqlite3_stmt *stmt, int column, int32_t *value) {
    // The column's value object is only asked its type and integer, which neither convert nor
    // allocate: one call into SQLite where sqlite3_column_type and sqlite3_column_int64 take two.
    sqlite3_value *stored = sqlite3_column_value(stmt, column);
    if (sqlite3_value_type(stored) == SQLITE_INTEGER) {
        *value = Saturated(sqlite3_value_int64(stored));
        return true;
    }
    const char *text = nullptr;
    if (!ColumnText(stmt, column, &text)) {
        return false;
    }
    *value = ColumnInt(text);
    return true;
}

// Makes the empty string `empty` hold `text`, built in place as a new string is: the copy a
// move from a temporary takes, and the checks of an assignment, cost a list read a tenth of
// its time. If building throws, `empty` is left an empty string again.
inline void Rebuild(std::string &empty, const char *text) {
    empty.~basic_string();
    try {
        new (&empty) std::string(text);
    } catch (...) {
        new (&empty) std::string();
        throw;
    }
}

// The member a column fills: an index into the record's integer columns, then into its
// string columns after them; kNoMember for a column that fills none.
constexpr int kNoMember = -1;

template <typename Record, size_t NInt, size_t NString>
int MemberOf(const char *name, const IntColumn<Record> (&intColumns)[NInt],
             const StringColumn<Record> (&stringColumns)[NString]) {
    if (name == nullptr) {
        return kNoMember;
    }
    const size_t length = strlen(name);
    for (size_t i = 0; i < NInt; ++i) {
        if (intColumns[i].name.Is(name, length)) {
            return static_cast<int>(i);
        }
    }
    for (size_t i = 0; i < NString; ++i) {
        if (stringColumns[i].name.Is(name, length)) {
            return static_cast<int>(NInt + i);
        }
    }
    return kNoMember;
}

template <typename Record, size_t NInt, size_t NString>
void CopyColumn(Record *rec, int member, const char *value,
                const IntColumn<Record> (&intColumns)[NInt],
                const StringColumn<Record> (&stringColumns)[NString]) {
    if (member == kNoMember) {
        return;
    }
    if (static_cast<size_t>(member) < NInt) {
        rec->*intColumns[member].member = ColumnInt(value);
    } else {
        // A fresh string moved in costs less than assigning to an empty one.
        rec->*stringColumns[member - NInt].member = std::string(value != nullptr ? value : "");
    }
}

template <typename Record, size_t NInt, size_t NString>
void RowToRecord(Record *rec, int nCol, char **azVal, char **azCol,
                 const IntColumn<Record> (&intColumns)[NInt],
                 const StringColumn<Record> (&stringColumns)[NString]) {
    for (int i = 0; i < nCol; ++i) {
        CopyColumn(rec, MemberOf(azCol[i], intColumns, stringColumns), azVal[i], intColumns,
                   stringColumns);
    }
}

template <typename Record, typename CopyFn>
int RowFirst(void *pArg, int nCol, char **azVal, char **azCol, CopyFn copy) {
    auto *rec = static_cast<Record *>(pArg);
    if (rec == nullptr || rec->filled == 1) {
        return 0;
    }
    rec->filled = 1;
    try {
        copy(rec, nCol, azVal, azCol);
    } catch (const std::bad_alloc &) {
        // The record keeps what was copied before memory ran out.
    }
    return 0;
}

template <typename Record, typename CopyFn>
int RowAppend(void *pArg, int nCol, char **azVal, char **azCol, CopyFn copy) {
    auto **head = static_cast<Record **>(pArg);
    if (head == nullptr) {
        return 0;
    }
    Record *node = new (std::nothrow) Record();
    if (node == nullptr) {
        return 0;
    }
    node->filled = 1;
    try {
        copy(node, nCol, azVal, azCol);
    } catch (const std::bad_alloc &) {
        delete node;
        return 0;
    }
    node->next = *head;
    *head = node;
    return 0;
}

template <typename Record>
struct Columns;
template <>
struct Columns<KOVA_CRED> {
    static constexpr const auto &ints = kCredIntColumns;
    static constexpr const auto &strings = kCredStringColumns;
};
template <>
struct Columns<KOVA_CRED_SESS> {
    static constexpr const auto &ints = kSessIntColumns;
    static constexpr const auto &strings = kSessStringColumns;
};

}  // namespace

void CredRowToRecord(KOVA_CRED *pCred, int nCol, char **azVal, char **azCol) {
    RowToRecord(pCred, nCol, azVal, azCol, kCredIntColumns, kCredStringColumns);
}

void CredSessRowToRecord(KOVA_CRED_SESS *pSess, int nCol, char **azVal, char **azCol) {
    RowToRecord(pSess, nCol, azVal, azCol, kSessIntColumns, kSessStringColumns);
}

template <typename Record>
void ListReader<Record>::Learn(sqlite3_stmt *stmt) {
    static_assert(
        std::size(Columns<Record>::ints) + std::size(Columns<Record>::strings) <= kListMembers,
        "every member has a column slot");
    learnt_ = true;
    std::fill(std::begin(columns_), std::end(columns_), kNoMember);
    const int count = sqlite3_column_count(stmt);
    for (int i = 0; i < count; ++i) {
        const int member =
            MemberOf(sqlite3_column_name(stmt, i), Columns<Record>::ints, Columns<Record>::strings);
        if (member != kNoMember) {
            columns_[member] = i;  // as in a record, a later column of the same name wins
        }
    }
}

template <typename Record>
bool ListReader<Record>::Row(void *pArg, sqlite3_stmt *stmt) {
    constexpr auto &ints = Columns<Record>::ints;
    constexpr auto &strings = Columns<Record>::strings;
    constexpr size_t kInts = std::size(ints);
    auto *reader = static_cast<ListReader *>(pArg);
    if (!reader->learnt_) {
        reader->Learn(stmt);
    }
    // As in RowAppend: a record that cannot be made is left out and the rows go on.
    Record *node = new (std::nothrow) Record();
    if (node == nullptr) {
        return true;
    }
    node->filled = 1;
    bool copied = true;
    for (size_t m = 0; m < kInts && copied; ++m) {
        const int column = reader->columns_[m];
        copied = column == kNoMember || ColumnInteger(stmt, column, &(node->*ints[m].member));
    }
    try {
        for (size_t m = 0; m < std::size(strings) && copied; ++m) {
            const int column = reader->columns_[kInts + m];
            const char *text = nullptr;
            copied = column == kNoMember || ColumnText(stmt, column, &text);
            if (copied && column != kNoMember) {
                Rebuild(node->*strings[m].member, text != nullptr ? text : "");
            }
        }
    } catch (const std::bad_alloc &) {
        delete node;
        return true;
    }
    if (!copied) {
        delete node;
        return false;
    }
    node->next = reader->head;
    reader->head = node;
    return true;
}

template class ListReader<KOVA_CRED>;
template class ListReader<KOVA_CRED_SESS>;

namespace {
constexpr ColumnName kIdColumn("id");
constexpr ColumnName kApplicationColumn("application");
}  // namespace

bool ApplicationMatch::Row(void *pArg, sqlite3_stmt *stmt) {
    auto *match = static_cast<ApplicationMatch *>(pArg);
    if (!match->learnt_) {
        // As in a record, a later column of the same name wins.
        match->learnt_ = true;
        const int count = sqlite3_column_count(stmt);
        for (int i = 0; i < count; ++i) {
            const char *name = sqlite3_column_name(stmt, i);
            const size_t length = name != nullptr ? strlen(name) : 0;
            if (name != nullptr && kIdColumn.Is(name, length)) {
                match->idColumn_ = i;
            } else if (name != nullptr && kApplicationColumn.Is(name, length)) {
                match->applicationColumn_ = i;
            }
        }
    }
    const char *application = nullptr;
    if (match->applicationColumn_ >= 0 &&
        !ColumnText(stmt, match->applicationColumn_, &application)) {
        return false;
    }
    if (strcmp(application != nullptr ? application : "", match->application_) == 0) {
        int32_t id = -1;
        if (match->idColumn_ >= 0 && !ColumnInteger(stmt, match->idColumn_, &id)) {
            return false;
        }
        match->id = id;
    }
    return true;
}

}  // namespace cred
}  // namespace kova

int CredRowFirst(void *pArg, int nCol, char **azVal, char **azCol) {
    return kova::cred::RowFirst<KOVA_CRED>(pArg, nCol, azVal, azCol, kova::cred::CredRowToRecord);
}

int CredRowAppend(void *pArg, int nCol, char **azVal, char **azCol) {
    return kova::cred::RowAppend<KOVA_CRED>(pArg, nCol, azVal, azCol, kova::cred::CredRowToRecord);
}

int CredSessRowFirst(void *pArg, int nCol, char **azVal, char **azCol) {
    return kova::cred::RowFirst<KOVA_CRED_SESS>(pArg, nCol, azVal, azCol,
                                                kova::cred::CredSessRowToRecord);
}

int CredSessRowAppend(void *pArg, int nCol, char **azVal, char **azCol) {
    return kova::cred::RowAppend<KOVA_CRED_SESS>(pArg, nCol, azVal, azCol,
                                                 kova::cred::CredSessRowToRecord);
}
