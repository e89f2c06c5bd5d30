// Pieces shared by the credential store's units: where the database lives, owning wrappers
// for SQLite resources, the lock-retrying statement execution and the record accessors'
// common bodies.
#ifndef KOVA_CREDENTIAL_CRED_INTERNAL_H
#define KOVA_CREDENTIAL_CRED_INTERNAL_H

#include <stdint.h>
#include <stdio.h>

#include <memory>
#include <new>
#include <string>
#include <vector>

#include <sqlite3.h>

#include "kovacredential/kovacred.h"
#include "kovacredential/kovacred_db.h"
#include "platform/kova_log.h"

namespace kova {
namespace cred {

constexpr const char kDefaultDatabasePath[] = "/usr/kova/etc/private/credentials.sqlite";

// The database file: $kovacredential_db when set and not empty, else the default. Read at
// every open so that a caller may switch databases between calls.
std::string DatabasePath();

struct SqliteCloser {
    void operator()(sqlite3 *db) const { sqlite3_close(db); }
};
// An open connection, closed when the owner goes.
using Database = std::unique_ptr<sqlite3, SqliteCloser>;

struct SqliteFree {
    void operator()(void *p) const { sqlite3_free(p); }
};
// A text from sqlite3_mprintf or an error message from sqlite3_exec.
using SqlText = std::unique_ptr<char, SqliteFree>;

// How many times one statement is executed at most while the database stays locked.
constexpr int kLockAttempts = 101;

// The pause before retrying a locked statement, in microseconds, from one rand() value:
// the value shifted left by 5 in 32-bit arithmetic (wrapping to a possibly negative number),
// its truncated remainder by 1000000, plus 100000, capped at 999999 when compared unsigned.
// So a negative sum becomes 999999 and the pause is always in [0, 999999].
uint32_t LockBackoffMicros(int randomValue);

// usleep(micros), resumed with the time still left whenever a signal ends it early, so that the
// whole pause passes whatever signals arrive.
void SleepFully(uint32_t micros);

enum class ExecResult {
    kOk,
    kFailedSilently,  // SQLite gave no message; callers give up without a log
    kFailed,          // the message is in the out parameter
};

// Executes `sql` with sqlite3_exec, retrying while SQLite reports "database is locked"
// (kLockAttempts executions at most, a LockBackoffMicros pause slept in full before each
// retry). On kFailed, *errorMessage holds SQLite's message of the last attempt.
ExecResult ExecWithRetry(sqlite3 *db, const char *sql, sqlite3_callback callback, void *arg,
                         SqlText *errorMessage);

// A row callback that reads the current row of a statement with sqlite3_column_*; false
// aborts the statement as a failed allocation inside sqlite3_exec does.
using StatementRow = bool (*)(void *arg, sqlite3_stmt *stmt);

// ExecWithRetry for a text that holds a single statement, whose rows `row` reads from the
// statement itself: typed columns need no round trip through text. The outcome, the retry
// and the messages are those of sqlite3_exec running the same text.
ExecResult StepWithRetry(sqlite3 *db, const char *sql, StatementRow row, void *arg,
                         SqlText *errorMessage);

// Opens the database for one call of the interface, as KOVACredDBInit does, owning the
// connection; a failed open is logged as "<unit>:<line> Init sqlite failed. " with the inner
// error, and the result is empty.
inline Database OpenDatabase(const char *unit, int line) {
    KOVACredRandInit();
    Database db(KOVACredDBInit());
    if (!db) {
        LogInnerFailure(unit, line, "Init sqlite failed. ");
    }
    return db;
}

// The id of the newest credential whose application equals `application`, or -1: the list
// statement of KOVACredDBRecordGetList without condition and ordering, run and logged as that
// function runs it, with an ApplicationMatch instead of a list.
int NewestCredIdByApplication(sqlite3 *db, const char *application);

// What KOVACredIDGetByApplication returns for a tag that is not null: KOVACredListGet's open
// (with its log when that fails, and then -1) and NewestCredIdByApplication.
int ListNewestCredIdByApplication(const char *application);

// Copies one result row into a record by column name; unknown columns are ignored.
void CredRowToRecord(KOVA_CRED *pCred, int nCol, char **azVal, char **azCol);
void CredSessRowToRecord(KOVA_CRED_SESS *pSess, int nCol, char **azVal, char **azCol);

// Reads the rows of one SELECT into a list, newest row first, with the records CredRowAppend
// and CredSessRowAppend make of the same rows, but finds the member each column fills once
// per statement. An integer column is read as an integer, not through its text. Run it with
// StepWithRetry, the reader as the argument.
constexpr size_t kListMembers = 12;
template <typename Record>
class ListReader {
  public:
    static bool Row(void *reader, sqlite3_stmt *stmt);
    Record *head = nullptr;

  private:
    // Learns which column fills each member (the record's integer members, then its strings).
    void Learn(sqlite3_stmt *stmt);
    bool learnt_ = false;
    int columns_[kListMembers];
};
extern template class ListReader<KOVA_CRED>;
extern template class ListReader<KOVA_CRED_SESS>;

// Finds among the credential rows of one SELECT the id of the last whose application equals
// `application` byte for byte (a NULL column reads as ""): the id a list of those rows,
// filtered by KOVACredKeepByApplication, starts with. `id` stays -1 when none matches. Run it
// with StepWithRetry, the match as the argument.
class ApplicationMatch {
  public:
    explicit ApplicationMatch(const char *application) : application_(application) {}
    static bool Row(void *match, sqlite3_stmt *stmt);
    int id = -1;

  private:
    const char *application_;
    bool learnt_ = false;
    int idColumn_ = -1;
    int applicationColumn_ = -1;
};

// Resets a record to the allocation defaults (the chain after it must already be freed).
void ResetCred(KOVA_CRED *pCred);
void ResetSess(KOVA_CRED_SESS *pSess);

// ---- Accessor bodies. `file` is the header that declares the accessor, `line` its number
// there, `recordCheck` the text reported for a null record.

template <typename Record>
int SetIntMember(Record *rec, int32_t Record::*member, int32_t val, const char *file, int line,
                 const char *recordCheck) {
    if (rec == nullptr) {
        return ArgInvalid(file, line, recordCheck);
    }
    rec->*member = val;
    return 0;
}

template <typename Record>
int SetStringMember(Record *rec, std::string Record::*member, const char *szVal, const char *file,
                    int line, const char *recordCheck) {
    if (szVal == nullptr) {
        return ArgInvalid(file, line, "__null != szVal");
    }
    if (rec == nullptr) {
        return ArgInvalid(file, line, recordCheck);
    }
    try {
        (rec->*member).assign(szVal);
    } catch (const std::bad_alloc &) {
        VLIBCErrSetEx(KOVA_ERR_OUT_OF_MEMORY, file, line);
        return -1;
    }
    return 0;
}

template <typename Record>
int GetIntMember(int32_t *pVal, const Record *rec, int32_t Record::*member, const char *file,
                 int line, const char *recordCheck) {
    if (pVal == nullptr) {
        return ArgInvalid(file, line, "__null != pVal");
    }
    if (rec == nullptr) {
        return ArgInvalid(file, line, recordCheck);
    }
    *pVal = rec->*member;
    return 0;
}

template <typename Record>
int GetStringMember(char *szBuf, size_t cbBuf, const Record *rec, std::string Record::*member,
                    const char *file, int line, const char *recordCheck) {
    if (szBuf == nullptr) {
        return ArgInvalid(file, line, "__null != szBuf");
    }
    if (cbBuf == 0) {
        return ArgInvalid(file, line, "0 < cbBuf");
    }
    if (rec == nullptr) {
        return ArgInvalid(file, line, recordCheck);
    }
    snprintf(szBuf, cbBuf, "%s", (rec->*member).c_str());
    return 0;
}

}  // namespace cred
}  // namespace kova

#endif  // KOVA_CREDENTIAL_CRED_INTERNAL_H
