// The credential store: credential and session records and the plain-function interface that
// keeps them in the SQLite database.
//
// Every function that touches the database opens it, performs one operation and closes it
// again. The database is "/usr/kova/etc/private/credentials.sqlite" unless the environment
// variable kovacredential_db names another file; it is read at every open.
//
// Status results are 0 on success and -1 on failure. A failure writes a line to the system
// log; the step that detected it records a code in the error slot (VLIBCErrGet,
// kovaplatform.h): 3328 invalid argument, 2304 database cannot be opened, 2816 written row
// not found on read-back, 512 out of memory. A statement SQLite rejects is logged with its
// message and records no code (the slot keeps what it held). A failure caused by an inner step
// records nothing new; its log line carries the inner code, file and line.
//
// Concurrency: every function may run on several threads and in several processes at once
// (the error slot is per thread; the database is shared through SQLite's lock). A record or
// list is used by one thread at a time.
#ifndef KOVACREDENTIAL_KOVACRED_H
#define KOVACREDENTIAL_KOVACRED_H

#include <stdint.h>

#include <string>

#include "kovacred_export.h"
#include "kovaplatform.h"

// A stored credential: how to reach and log in to one remote server. Also a node of a singly
// linked list through `next`. Strings are never null; the destructor releases the strings only
// and never follows `next`.
typedef struct KOVA_EXPORT _tag_kova_cred_ {
    struct _tag_kova_cred_ *next = nullptr;
    int32_t filled = 0;  // 1 once a database row was copied in; single-row reads skip it then
    int32_t id = -1;     // row id; -1 while the record is not stored
    int32_t ctime = 0;   // creation time (seconds since the Epoch), set by the database
    int32_t mtime = 0;   // last modification time, set by the database
    std::string host;
    int32_t owner = -1;  // owning user's id; -1 for none
    std::string remote_account;
    std::string remote_passwd;  // kept in clear text
    std::string protocol;
    int32_t port = 0;
    std::string application;  // tag of the owning application, used for look-ups
    std::string extra_info;

    _tag_kova_cred_();
    ~_tag_kova_cred_();
} KOVA_CRED;

// The session of one credential, stored under the credential's id.
typedef struct KOVA_EXPORT _tag_kova_cred_sess_ {
    struct _tag_kova_cred_sess_ *next = nullptr;
    int32_t filled = 0;
    int32_t id = -1;           // the owning credential's id
    std::string access_token;  // WebAPI session id, sent as "_sid" and the cookie "id"
    std::string csrf_token;    // sent as the query parameter "KovaToken"
    std::string extra_info;

    _tag_kova_cred_sess_();
    ~_tag_kova_cred_sess_();
} KOVA_CRED_SESS;

// List filters: return non-zero to keep the record, 0 to drop (and free) it.
typedef int (*KOVA_CRED_FILTER)(KOVA_CRED *pCred, void *pArg);
typedef int (*KOVA_CRED_SESS_FILTER)(KOVA_CRED_SESS *pSess, void *pArg);

// ---- Credentials ----

// A new record with the defaults (id -1, owner -1, empty strings), or null (error 512).
// The caller frees it with KOVACredFree.
KOVA_EXPORT KOVA_CRED *KOVACredAlloc(void);
// Destroys and releases one record; the records chained after it are not touched.
KOVA_EXPORT int KOVACredFree(KOVA_CRED *pCred);
// Frees the chain after the record and resets it to the allocation defaults. Null: -1, no log.
KOVA_EXPORT int KOVACredClear(KOVA_CRED *pCred);
// id -1 clears the record; any other id reads that row as KOVACredGetByID does.
// REQUIRES: id >= -1. The record is not cleared before a read by id.
KOVA_EXPORT int KOVACredLoad(long id, KOVA_CRED *pCred);
// Reads row `id` into the record. 0 whether or not the row exists: a fresh record keeps id -1
// when it does not. A record whose `filled` is already 1 is left unchanged.
KOVA_EXPORT int KOVACredGetByID(long id, KOVA_CRED *pCred);
// Updates row `id` from the record (mtime becomes now) and verifies it by reading it back;
// a missing row fails with 2816. The record itself is not changed.
KOVA_EXPORT int KOVACredSetByID(long id, const KOVA_CRED *pCred);
// Inserts the record as a new row and stores the new row id in its `id`.
KOVA_EXPORT int KOVACredAdd(KOVA_CRED *pCred);
// id -1: KOVACredAdd; otherwise KOVACredSetByID(pCred->id, pCred).
KOVA_EXPORT int KOVACredSave(KOVA_CRED *pCred);
// Reads every credential into a new list, newest id first, dropping those the filter (may be
// null) rejects. Returns the count kept; stores the head only when it is above 0. The caller
// owns the list (KOVACredListFree). A failed read of the table returns 0.
KOVA_EXPORT int KOVACredListGet(KOVA_CRED **ppCredList, KOVA_CRED_FILTER filter, void *pArg);
// Frees every record of the list; *ppCredList ends null. REQUIRES: ppCredList not null.
KOVA_EXPORT void KOVACredListFree(KOVA_CRED **ppCredList);
// The record's `next`; null for a null record.
KOVA_EXPORT KOVA_CRED *KOVACredNext(const KOVA_CRED *pCred);
// Removes the credential and its session. Removing a missing id succeeds.
KOVA_EXPORT int KOVACredRemoveByID(long id);
// The id of the newest credential whose application equals szApplication, or -1 (no match,
// empty table, failure, null text).
KOVA_EXPORT int KOVACredIDGetByApplication(const char *szApplication);
// List filter: 1 when the record's application equals the NUL-terminated text pArg exactly.
KOVA_EXPORT int KOVACredKeepByApplication(KOVA_CRED *pCred, void *pArg);

// ---- Sessions ----

// A new session record (id -1, empty strings), or null (error 512).
KOVA_EXPORT KOVA_CRED_SESS *KOVACredSessAlloc(void);
KOVA_EXPORT int KOVACredSessFree(KOVA_CRED_SESS *pSess);
// Frees the chain after the record and resets it. Null: -1, no log.
KOVA_EXPORT int KOVACredSessClear(KOVA_CRED_SESS *pSess);
// id -1 clears; otherwise KOVACredSessGetByID. REQUIRES: id >= -1.
KOVA_EXPORT int KOVACredSessLoad(long id, KOVA_CRED_SESS *pSess);
// Reads the session of credential `id`; 0 whether or not it exists.
KOVA_EXPORT int KOVACredSessGetByID(long id, KOVA_CRED_SESS *pSess);
// Writes the session of credential `id` (REPLACE, then read-back). Fails when no credential
// has that id (foreign key).
KOVA_EXPORT int KOVACredSessSetByID(long id, const KOVA_CRED_SESS *pSess);
// Inserts without an id: SQLite picks the next session row id, which must also be the id of an
// existing credential. On success stores that id in the record.
KOVA_EXPORT int KOVACredSessAdd(KOVA_CRED_SESS *pSess);
// id -1: KOVACredSessAdd; otherwise KOVACredSessSetByID(pSess->id, pSess).
KOVA_EXPORT int KOVACredSessSave(KOVA_CRED_SESS *pSess);
// As KOVACredListGet, over the sessions.
KOVA_EXPORT int KOVACredSessListGet(KOVA_CRED_SESS **ppSessList, KOVA_CRED_SESS_FILTER filter,
                                    void *pArg);
KOVA_EXPORT void KOVACredSessListFree(KOVA_CRED_SESS **ppSessList);
KOVA_EXPORT KOVA_CRED_SESS *KOVACredSessNext(const KOVA_CRED_SESS *pSess);
// Deletes the session row of credential `id`; the credential stays.
KOVA_EXPORT int KOVACredSessRemoveByID(long id);

#endif  // KOVACREDENTIAL_KOVACRED_H
