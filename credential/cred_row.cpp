// Row callbacks of the credential database: result rows of sqlite3_exec become records.
// SQLite calls them from C, so no exception may pass through them; each returns 0 so that a
// query is never aborted by a record it could not build.
#include <stdint.h>
#include <stdlib.h>
#include <string.h>

#include <new>
#include <string>

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
// than wrapping.
int32_t ColumnInt(const char *text) {
    if (text == nullptr) {
        return 0;
    }
    const long long value = strtoll(text, nullptr, 10);
    if (value > INT32_MAX) {
        return INT32_MAX;
    }
    if (value < INT32_MIN) {
        return INT32_MIN;
    }
    return static_cast<int32_t>(value);
}

template <typename Record, size_t NInt, size_t NString>
void RowToRecord(Record *rec, int nCol, char **azVal, char **azCol,
                 const IntColumn<Record> (&intColumns)[NInt],
                 const StringColumn<Record> (&stringColumns)[NString]) {
    for (int i = 0; i < nCol; ++i) {
        const char *name = azCol[i];
        const size_t length = strlen(name);
        bool matched = false;
        for (const auto &column : intColumns) {
            if (column.name.Is(name, length)) {
                rec->*column.member = ColumnInt(azVal[i]);
                matched = true;
                break;
            }
        }
        if (matched) {
            continue;
        }
        for (const auto &column : stringColumns) {
            if (column.name.Is(name, length)) {
                (rec->*column.member).assign(azVal[i] != nullptr ? azVal[i] : "");
                break;
            }
        }
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

}  // namespace

void CredRowToRecord(KOVA_CRED *pCred, int nCol, char **azVal, char **azCol) {
    RowToRecord(pCred, nCol, azVal, azCol, kCredIntColumns, kCredStringColumns);
}

void CredSessRowToRecord(KOVA_CRED_SESS *pSess, int nCol, char **azVal, char **azCol) {
    RowToRecord(pSess, nCol, azVal, azCol, kSessIntColumns, kSessStringColumns);
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
