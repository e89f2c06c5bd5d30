// Row callbacks of the credential database: result rows of sqlite3_exec become records.
// SQLite calls them from C, so no exception may pass through them; each returns 0 so that a
// query is never aborted by a record it could not build.
#include <stdint.h>
#include <stdlib.h>
#include <string.h>

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
    if (value > INT32_MAX) {
        return INT32_MAX;
    }
    if (value < INT32_MIN) {
        return INT32_MIN;
    }
    return static_cast<int32_t>(value);
}

// The member a column fills: an index into the record's integer columns, then into its
// string columns after them; kNoMember for a column that fills none.
constexpr int kNoMember = -1;

template <typename Record, size_t NInt, size_t NString>
int MemberOf(const char *name, const IntColumn<Record> (&intColumns)[NInt],
             const StringColumn<Record> (&stringColumns)[NString]) {
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
bool ListReader<Record>::Learn(int nCol, char **azCol) {
    if (azCol == names_ && static_cast<size_t>(nCol) == members_.size()) {
        return true;
    }
    names_ = nullptr;
    try {
        members_.resize(static_cast<size_t>(nCol));
    } catch (const std::bad_alloc &) {
        return false;
    }
    for (int i = 0; i < nCol; ++i) {
        members_[i] = MemberOf(azCol[i], Columns<Record>::ints, Columns<Record>::strings);
    }
    names_ = azCol;
    return true;
}

template <typename Record>
int ListReader<Record>::Row(void *pArg, int nCol, char **azVal, char **azCol) {
    auto *reader = static_cast<ListReader *>(pArg);
    const bool learnt = reader->Learn(nCol, azCol);
    return RowAppend<Record>(&reader->head, nCol, azVal, azCol,
                             [reader, learnt](Record *rec, int n, char **vals, char **names) {
                                 if (!learnt) {
                                     RowToRecord(rec, n, vals, names, Columns<Record>::ints,
                                                 Columns<Record>::strings);
                                     return;
                                 }
                                 for (int i = 0; i < n; ++i) {
                                     CopyColumn(rec, reader->members_[i], vals[i],
                                                Columns<Record>::ints, Columns<Record>::strings);
                                 }
                             });
}

template class ListReader<KOVA_CRED>;
template class ListReader<KOVA_CRED_SESS>;

namespace {
constexpr ColumnName kIdColumn("id");
constexpr ColumnName kApplicationColumn("application");
}  // namespace

int ApplicationMatch::Row(void *pArg, int nCol, char **azVal, char **azCol) {
    auto *match = static_cast<ApplicationMatch *>(pArg);
    if (azCol != match->names_ || nCol != match->count_) {
        // As in a record, a later column of the same name wins.
        match->idColumn_ = -1;
        match->applicationColumn_ = -1;
        for (int i = 0; i < nCol; ++i) {
            const size_t length = strlen(azCol[i]);
            if (kIdColumn.Is(azCol[i], length)) {
                match->idColumn_ = i;
            } else if (kApplicationColumn.Is(azCol[i], length)) {
                match->applicationColumn_ = i;
            }
        }
        match->names_ = azCol;
        match->count_ = nCol;
    }
    const char *application =
        match->applicationColumn_ >= 0 ? azVal[match->applicationColumn_] : nullptr;
    if (strcmp(application != nullptr ? application : "", match->application_) == 0) {
        match->id = match->idColumn_ >= 0 ? ColumnInt(azVal[match->idColumn_]) : -1;
    }
    return 0;
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
