// KOVA::CredRequestUtil: static WebAPI knowledge shared by all requests: URL parsing and
// building, the per-credential cache of API descriptions, the server's encryption parameters,
// RSA and AES helpers, and the login, token and logout flows.
//
// Concurrency: every operation may run on several threads at once. The description cache
// (m_jsData) is process-wide; the library's own reads and writes of it take a lock, while a
// caller that touches m_jsData directly must serialise that access itself. The last error
// (m_errCode) is process-wide.
//
// Transport: the operations make requests of their own (the redirect probe, the description
// query, the encryption information, the login and logout posts), which by default check no
// certificate and have no total deadline. The overloads that take a `transport` request give
// each of those inner requests the transport's settings: certificate and host checks
// (SetHTTPSVerify), the TLS context callback (SetSSLVerify), the CA file, the pinned public key,
// the connect time-out (SetDefaultTimeout), the response time-out when one was set, and, as
// its total time-out, what is left of the transport's total time-out counted from the start of
// the call, so that SetTotalTimeout bounds the operation as a whole. The transport is not
// processed and nothing else of it is used (URL, parameters, streams). At the start of the call
// its error, libcurl code and text and transfer facts are cleared; when an inner transfer fails
// the operation, they become those of that request (the first one that failed), so that the
// caller can name the cause (GetError, GetCurlCode, GetCurlErrorText, GetTransferInfo). A
// failure that was not a transfer (an answer that cannot be used, an API the server does not
// offer) leaves them clear. A null transport gives the overloads without one. The transport is
// used by the calling thread only, for the time of the call: it must not be used on another
// thread meanwhile; calls with different transports may run on several threads at once.
#ifndef KOVACREDENTIAL_CRED_REQUEST_UTIL_H
#define KOVACREDENTIAL_CRED_REQUEST_UTIL_H

#include <string>

#include <json/value.h>
#include <openssl/evp.h>

#include "cred_request.h"
#include "kovacred.h"

namespace KOVA {

class KOVA_EXPORT CredRequestUtil {
  public:
    // {"webapiDesc": {"<credential id>": <the server's "data" answer to KOVA.API.Info>}}
    static Json::Value m_jsData;
    // Last error of these operations in the process (CRED_REQ_ERR_QUERY_FAIL,
    // CRED_REQ_ERR_NO_SUCH_API); never reset by them. A plain process-wide int: the library
    // stores and loads it atomically, so threads do not race on it, but with several threads
    // the value is the last one any of them left.
    static int m_errCode;

    // ---- URLs.
    // Splits url into scheme ("http"/"https"), host (IPv6 brackets kept) and port (defaults
    // "80"/"443"). False only for an empty url (outputs untouched) or a "[" without "]".
    static bool ParseURL(const std::string &url, std::string &scheme, std::string &host,
                         std::string &port);
    // scheme://host:port/path; IPv6 literals get brackets; scheme "fld" gives
    // https://host:port/direct/path.
    static std::string GetURL(const std::string &scheme, const std::string &host, int port,
                              const std::string &path);
    // Whether a GET of url completes with status 200 (10-second connect time-out). A failed
    // transfer sets m_errCode to CRED_REQ_ERR_QUERY_FAIL.
    static bool TestURL(const std::string &url);

    // ---- API description cache.
    // Queries the credential's server ("KOVA.API.Info") and caches the answer under its id.
    static bool GetWebAPIDesc(const KOVA_CRED *cred);
    // The same query over `transport`'s settings (see Transport above).
    static bool GetWebAPIDesc(const KOVA_CRED *cred, KOVA::CredRequest *transport);
    static void RemoveWebAPIDesc(const KOVA_CRED *cred);
    static bool IsCredIdCached(long id);
    // The API's CGI path relative to "webapi/"; "" on failure (CRED_REQ_ERR_NO_SUCH_API when
    // the server does not offer it).
    static std::string GetWebAPIPath(const KOVA_CRED *cred, const std::string &api);
    static std::string GetWebAPIPath(long id, const std::string &api);
    static bool GetWebAPIRequestFormat(const KOVA_CRED *cred, const std::string &api,
                                       std::string &format);
    static std::string GetWebAPIRequestFormat(const KOVA_CRED *cred, const std::string &api);
    static std::string GetWebAPIRequestFormat(long id, const std::string &api);

    // ---- Encryption.
    // The "data" of the server's KOVA.API.Encryption answer (not cached).
    static bool GetEncInfo(const std::string &url, Json::Value &info);
    static bool GetEncInfo(const KOVA_CRED *cred, Json::Value &info);
    static bool GetEncInfo(long id, Json::Value &info);
    // RSA (PKCS#1 v1.5, exponent 65537) of at most 512 bytes under the hexadecimal modulus
    // publicKey, Base64-encoded. The keys of the last few servers stay imported in a
    // process-wide cache with a lock of its own; this and the AES helpers below may run on
    // several threads at once.
    static bool GetEncString(const std::string &publicKey, const std::string &plain,
                             std::string &cipher);
    // AES-256-CBC under a key and IV derived from the pass phrase alone (EVP_BytesToKey, SHA-1,
    // no salt, 5 rounds), Base64-encoded: the same input always gives the same text.
    static bool GetEncryptAESString(const std::string &passphrase, const std::string &plain,
                                    std::string &cipher);
    static bool GetDecryptAESString(const std::string &passphrase, const std::string &cipher,
                                    std::string &plain);

    // ---- Authentication.
    // Sets the request's URL, encryption URL, format and the "api"/"version"/"method"
    // parameters for calling `method` of `api` on the credential's server.
    static bool SetWebAPIURL(const KOVA_CRED *cred, const std::string &api, int version,
                             const std::string &method, KOVA::CredRequest *request);
    // For a plain-HTTP credential, follows a 302 of the server by rewriting the credential's
    // protocol, host and port in memory.
    static bool CheckRedirect(KOVA_CRED *cred);
    // Logs in (KOVA.API.Auth login, RSA-encrypted parameters) and stores the session under the
    // credential's id when it is stored. sess and response may be null.
    static bool LoginWithOTP(KOVA_CRED *cred, const std::string &otpCode, KOVA_CRED_SESS *sess,
                             Json::Value *response);
    // The same login, every request of it (redirect probe, description query when the cache
    // lacks it, encryption information, the post of the password) over `transport`'s settings
    // (see Transport above): with certificate checks or a pinned key, the password is sent only
    // to a server that passes them.
    static bool LoginWithOTP(KOVA_CRED *cred, const std::string &otpCode, KOVA_CRED_SESS *sess,
                             Json::Value *response, KOVA::CredRequest *transport);
    static bool Login(KOVA_CRED *cred, KOVA_CRED_SESS *sess);
    static bool Login(long id, KOVA_CRED_SESS *sess);
    // The stored session of the credential, or a fresh login when there is none.
    static bool GetAccessToken(long id, KOVA_CRED_SESS *sess);
    static bool GetAccessToken(KOVA_CRED *cred, KOVA_CRED_SESS *sess);
    // Closes a server session; the stored session is left as it is.
    static bool Logout(KOVA_CRED *cred, const std::string &sid);
    // The same logout over `transport`'s settings (see Transport above).
    static bool Logout(KOVA_CRED *cred, const std::string &sid, KOVA::CredRequest *transport);
    static bool Logout(KOVA_CRED *cred, KOVA_CRED_SESS *sess);
    static bool Logout(long id);
};

}  // namespace KOVA

// Derives the AES-256-CBC key and IV from keyData (EVP_BytesToKey, SHA-1, 5 rounds, optional
// 8-byte salt) and initialises whichever of the two contexts is given. 1 on success, 0 on
// failure.
KOVA_EXPORT int InitAES(const unsigned char *keyData, int keyDataLen, const unsigned char *salt,
                        EVP_CIPHER_CTX *encryptCtx, EVP_CIPHER_CTX *decryptCtx);

#endif  // KOVACREDENTIAL_CRED_REQUEST_UTIL_H
