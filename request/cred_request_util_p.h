// Internal operations of KOVA::CredRequestUtil that other units of the library share: the
// steps that read what a server sent, apart from the transfers that fetch it (each operation
// runs its transfer and hands the answer to one of these, and the fuzz targets call them
// directly; each logs and reports exactly as the operation it serves), and the reservation of
// the request manager's pseudo-ids in the description cache.
#ifndef KOVA_REQUEST_CRED_REQUEST_UTIL_P_H
#define KOVA_REQUEST_CRED_REQUEST_UTIL_P_H

#include <string>

#include <json/value.h>

#include "kovacredential/kovacred.h"

namespace KOVA {

// The process-wide last error of the utilities (CredRequestUtil::m_errCode), stored and loaded
// atomically so that threads of the library never race on the plain exported int.
void SetUtilError(int code);
int UtilError();

// The first of -1, -2, -3, ... that has no entry in the description cache, reserved there with
// an empty entry in the same locked step, so that no other thread hands it out too. The entry
// is filled by the first look-up under that id and freed by RemoveWebAPIDesc.
long ReserveUncachedCredId();

// The discovery answer: stores its "data" as the description of credential `key` when it is
// JSON whose "success" is true. False, with "Query response is invalid" or "Query request
// fail!" logged, otherwise; the cache is then unchanged.
bool StoreWebAPIDescAnswer(const std::string &key, const std::string &body);

// The "data" of an encryption answer (lenient JSON, an object with "data"; "success" is not
// looked at). False, with "encryption response is invalid" logged, otherwise.
bool ReadEncInfoAnswer(const std::string &body, Json::Value &info);

// A login answer: true when it parses, its "success" is true and its "data" is an object; then
// `session` is filled (filled 1, "sid" and "kovatoken" as text). `response`, when given,
// receives the parsed answer whatever it says. Logs nothing.
bool ReadLoginAnswer(const std::string &body, Json::Value *response, KOVA_CRED_SESS &session);

// Whether a logout answer is strict JSON, an object, and its "success" is true.
bool IsLogoutAnswerOk(const std::string &body);

// Moves `cred` (in memory) to the "Location" of a 302 answer's headers, as collected in the
// JSON header mode: scheme, host and port (the port text read with strtol). False, with the
// reason logged, when the headers are empty, hold no usable "Location" or it cannot be split.
bool ApplyRedirectLocation(KOVA_CRED *cred, const Json::Value &headers);

}  // namespace KOVA

#endif  // KOVA_REQUEST_CRED_REQUEST_UTIL_P_H
