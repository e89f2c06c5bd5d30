// Record-level operations on an open credential database. The interface of kovacred.h opens
// the database with KOVACredDBInit, calls one of these and closes it with sqlite3_close; a
// program may do the same to run several operations on one connection.
//
// Every statement is retried while SQLite reports "database is locked": it is executed at
// most 101 times, with a random pause below one second before each retry.
//
// Concurrency: separate connections may be used on separate threads at once; one connection
// is used by one thread at a time.
#ifndef KOVACREDENTIAL_KOVACRED_DB_H
#define KOVACREDENTIAL_KOVACRED_DB_H

#include "kovacred.h"

struct sqlite3;

// Seeds rand() once per process with time(NULL) + getpid(); a forked child seeds again on its
// first call. Safe to call from several threads at once.
KOVA_EXPORT void KOVACredRandInit(void);

// Opens the database named by $kovacredential_db (ignored in secure-execution mode) or the
// default one, creating the file, its missing folders and both tables; sets mode 0600 on the
// file (through a symbolic link to it too) and turns foreign keys on. Null on failure: error
// 2304 when SQLite cannot open it, and also, logged with the reason, when the path leads to
// anything but a regular file or to none (a dangling link), when the file belongs to another
// user than the effective one, when its mode cannot be made 0600 (a file at 0600 already is
// used), or when another file took its place while it was being opened. The caller closes
// the connection with sqlite3_close.
KOVA_EXPORT sqlite3 *KOVACredDBInit(void);

// Inserts the record; stores the new row id in *pId when pId is not null.
KOVA_EXPORT int KOVACredDBRecordAdd(sqlite3 *db, const KOVA_CRED *pCred, int *pId);
// Reads row id into the record: 1 found (or the record was already filled), 0 not found,
// -1 failure.
KOVA_EXPORT int KOVACredDBRecordGet(sqlite3 *db, long id, KOVA_CRED *pCred);
// Reads rows into a new list (reverse of the rows' order). szCondition and szOrderBy may be
// null or empty; both are quoted with %q, so they cannot hold quoted literals. Null for an
// empty result and for a failure.
KOVA_EXPORT KOVA_CRED *KOVACredDBRecordGetList(sqlite3 *db, const char *szCondition,
                                               const char *szOrderBy, int blAscending);
// Updates row id from the record and reads it back; a mismatch fails with 2816.
KOVA_EXPORT int KOVACredDBRecordUpdate(sqlite3 *db, long id, const KOVA_CRED *pCred);
// Deletes the session of id, then the credential row.
KOVA_EXPORT int KOVACredDBRecordRemove(sqlite3 *db, long id);

KOVA_EXPORT int KOVACredSessDBRecordAdd(sqlite3 *db, const KOVA_CRED_SESS *pSess, int *pId);
KOVA_EXPORT int KOVACredSessDBRecordGet(sqlite3 *db, long id, KOVA_CRED_SESS *pSess);
KOVA_EXPORT KOVA_CRED_SESS *KOVACredSessDBRecordGetList(sqlite3 *db, const char *szCondition,
                                                        const char *szOrderBy, int blAscending);
// REPLACE of the session row id, then read-back; a mismatch fails with 2816.
KOVA_EXPORT int KOVACredSessDBRecordUpdate(sqlite3 *db, long id, const KOVA_CRED_SESS *pSess);
KOVA_EXPORT int KOVACredSessDBRecordRemove(sqlite3 *db, long id);

// Row callbacks for sqlite3_exec; each always returns 0.
// CredRowFirst/CredSessRowFirst fill the record given as pArg unless it is already filled.
// CredRowAppend/CredSessRowAppend link a new record per row in front of the list whose head
// pointer is pArg (a failed allocation drops the row).
KOVA_EXPORT int CredRowFirst(void *pArg, int nCol, char **azVal, char **azCol);
KOVA_EXPORT int CredRowAppend(void *pArg, int nCol, char **azVal, char **azCol);
KOVA_EXPORT int CredSessRowFirst(void *pArg, int nCol, char **azVal, char **azCol);
KOVA_EXPORT int CredSessRowAppend(void *pArg, int nCol, char **azVal, char **azCol);

#endif  // KOVACREDENTIAL_KOVACRED_DB_H
