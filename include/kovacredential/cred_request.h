// KOVA::CredRequest: one HTTP(S) request over libcurl, with retries, optional RSA or AES
// encryption of its parameters, automatic login with a stored credential, and factories that
// build a WebAPI request from a credential.
//
// Operations return true (or a non-null pointer, or a non-empty text) on success and leave a
// KOVA::_tag_CRED_REQ_ERR code readable with GetError on failure. No exception leaves them.
//
// Concurrency: separate requests may be used on separate threads at once; one request is used
// by one thread at a time. The request-stream limit (SetReqStreamSize) is shared by the whole
// process.
//
// Connections: a request takes its libcurl handle from a process-wide pool of idle handles for
// the same scheme, host, port and TLS settings, keeps it for its lifetime and gives it back
// when destroyed, so a later request to the same server, on any thread, reuses its kept-alive
// connection and TLS session. A handle serves one request at a time; options, headers and
// cookies never carry over. Requests with a TLS context callback (SetSSLVerify) always make
// their own connection. A child process after fork starts with an empty pool. Setting the
// environment variable kovacredential_no_reuse turns reuse off.
#ifndef KOVACREDENTIAL_CRED_REQUEST_H
#define KOVACREDENTIAL_CRED_REQUEST_H

#include <stdio.h>

#include <string>

#include <json/value.h>

#include "kovacred.h"
#include "kovacred_export.h"

#include <curl/curl.h>

namespace KOVA {

// The one error enumeration of requests, the request manager, the relay client and the
// WebAPI utilities. Values 3, 16 and 25 to 400 are unused.
typedef enum _tag_CRED_REQ_ERR {
    CRED_REQ_ERR_NONE = 0,
    CRED_REQ_ERR_BAD_PARAM = 1,          // an argument was rejected
    CRED_REQ_ERR_NO_URL = 2,             // no "URL" string at transfer set-up
    CRED_REQ_ERR_LOGIN_FAIL = 4,         // the login ProcessWithLogin makes first failed
    CRED_REQ_ERR_QUERY_FAIL = 5,         // a probe or API-description query failed
    CRED_REQ_ERR_NO_SUCH_API = 6,        // the server does not offer the API
    CRED_REQ_ERR_NO_REQUEST_FORMAT = 7,  // the API's request format is unknown
    CRED_REQ_ERR_CURL_INTERNAL = 8,      // a libcurl call itself failed
    CRED_REQ_ERR_RESOLVE = 9,            // host or proxy name not resolved
    CRED_REQ_ERR_TIMEOUT = 10,           // operation timed out
    CRED_REQ_ERR_SSL_CONNECT = 11,       // TLS handshake failed
    CRED_REQ_ERR_CURL_OTHER = 12,        // any other libcurl failure
    CRED_REQ_ERR_HTTP_SERVER = 13,       // HTTP status 500 to 599
    CRED_REQ_ERR_HTTP_CLIENT = 14,       // HTTP status 400 to 499
    CRED_REQ_ERR_HTTP_UNEXPECTED = 15,   // any status but 200, 302, 304, 4xx, 5xx
    CRED_REQ_ERR_SELECT = 17,            // waiting for the multi handle's sockets failed
    CRED_REQ_ERR_INVALID_RESPONSE = 18,  // a login or logout answer could not be used
    CRED_REQ_ERR_SEND = 19,              // sending failed
    CRED_REQ_ERR_CONNECT = 20,           // connecting or receiving failed
    CRED_REQ_ERR_NOT_MODIFIED = 21,      // HTTP status 304
    CRED_REQ_ERR_UNKNOWN = 22,           // generic failure
    CRED_REQ_ERR_SERVER_ERRNO = 23,      // the relay directory answered with an error
    CRED_REQ_ERR_REDIRECT = 24,          // HTTP status 302 (redirects not followed)
    CRED_REQ_ERR_NO_SERVER_ID = 401,     // relay client: no server id
    CRED_REQ_ERR_NO_CONN_INFO = 402,     // relay client: no usable connection information
    CRED_REQ_ERR_NO_SERVICE_ID = 403,    // relay client: no service id (or directory host)
    CRED_REQ_ERR_EMPTY_REQUEST = 404,    // relay client: empty request document
    CRED_REQ_ERR_NO_PORT = 405,          // relay client: no usable port for a direct connection
    CRED_REQ_ERR_LOGIN_PARAM = 406,      // Login: the credential could not be prepared
    CRED_REQ_ERR_LOGIN_SESSION = 407,    // Login: no session could be obtained or attached
} CRED_REQ_ERR;

// How a request's parameters travel: in plain, in an RSA envelope, or in an AES envelope.
typedef enum _tag_CRED_REQ_CRYPTO {
    CRED_REQ_CRYPTO_NONE = 0,
    CRED_REQ_CRYPTO_RSA = 1,
    CRED_REQ_CRYPTO_AES = 2,
} CRED_REQ_CRYPTO;

class CredRequestPrivate;

class KOVA_EXPORT CredRequest {
  public:
    CredRequest();
    ~CredRequest();
    CredRequest(const CredRequest &) = delete;
    CredRequest &operator=(const CredRequest &) = delete;

    // ---- Settings. Invalid arguments (empty keys or names, wrong JSON types, null streams)
    // set CRED_REQ_ERR_BAD_PARAM and return false. Settings are read once, when the transfer
    // is first set up; later changes do not reach that transfer.

    bool SetURL(const std::string &url);
    // The URL CredRequestUtil::GetURL(scheme, host, port, path) builds.
    bool SetURL(const std::string &scheme, const std::string &host, int port,
                const std::string &path);
    // Where the server's encryption information is fetched for encrypted parameters.
    bool SetEncURL(const std::string &url);
    std::string GetURL();
    // Headers merge into the request's headers; a name given again replaces the value.
    bool AddHeader(const Json::Value &headers);
    bool AddHeader(const std::string &name, const std::string &value);
    // Only the cookie whose name sorts last is sent.
    bool AddCookie(const std::string &name, const std::string &value);
    bool AddGetParam(const Json::Value &params);
    bool AddGetParam(const std::string &name, const std::string &value);
    bool AddPostParam(const Json::Value &params);
    bool AddPostParam(const std::string &name, const std::string &value);
    // A ready-made body, sent as it stands; takes precedence over files, streams and POST
    // parameters.
    bool AddRawParam(const std::string &body);
    // The request body is read from `stream` (borrowed, never closed).
    bool SetReqStream(FILE *stream);
    // Limits how many bytes the next request that reads a request stream takes from it. The
    // limit is shared by all requests of the process and cleared when a request is created.
    bool SetReqStreamSize(unsigned int size);
    // Sends the file at `path` as multipart form field `field`.
    bool SetUploadFile(const char *field, const char *path);
    // A TLS context callback handed to libcurl; it turns certificate and host checks on.
    void SetSSLVerify(void (*fn)(void *, void *, void *), void *data);
    // Certificate and host-name checks; off unless asked for.
    void SetHTTPSVerify(bool verify);
    // Collects response headers as a JSON object (GetResponseHeader).
    bool SetRespHeaderToJsonValue(bool on);
    // Writes response headers to standard output, preceded once per process by `message`.
    bool SetRespHeaderToStdout(bool on, const std::string &message = "");
    // The response body goes to `stream` (borrowed), through `fn` when it is not null.
    bool SetRespStream(FILE *stream, size_t (*fn)(char *, size_t, size_t, void *) = nullptr);
    // "JSON" makes parameter values travel in their JSON form.
    void SetRequestFormat(const std::string &format);
    std::string GetRequestFormat();
    // Connect time-out, keep-alive timing and default low-speed time, in seconds (default 120).
    bool SetDefaultTimeout(long seconds);
    long GetDefaultTimeout() const;
    // Seconds a transfer may stay below 1 byte per second before it is aborted.
    bool SetResponseTimeout(long seconds);
    // The response time-out, 120 when none was set.
    long GetResponseTimeout();
    // Selects the RSA envelope, whatever the argument; SetEncryptMode(0) switches back.
    bool SetEncryptParam(bool encrypt);
    bool SetEncryptMode(KOVA::_tag_CRED_REQ_CRYPTO mode);
    void SetFollowLocation(bool follow);
    // Asks for any content encoding libcurl supports.
    void SetEncoding(bool encoding);
    // A deadline for Process as a whole, in milliseconds, counted from the start of each
    // Process: every attempt, the pauses between retries and name resolution included (libcurl
    // is told not to wait for a resolver that has not answered, which finishes on its own
    // thread). Each attempt gets what is left as its time limit; a retry, or its 1-second
    // pause, that no longer fits is not made. Process then ends with CRED_REQ_ERR_TIMEOUT.
    // Under the request manager it limits the transfer from Process(false) on. 0 (the default)
    // sets none: the connect and response time-outs alone bound a transfer. Negative values
    // set CRED_REQ_ERR_BAD_PARAM and change nothing. Read at every Process.
    bool SetTotalTimeout(long milliseconds);
    long GetTotalTimeout() const;
    // The most a response held in memory (GetResponse) may grow to, in bytes: 64 MiB
    // (67108864) unless set; 0 lifts the cap. An answer of exactly the cap comes back whole; a
    // larger one ends the transfer with libcurl's write error, CRED_REQ_ERR_CURL_OTHER
    // (GetCurlCode() 23). Decoded bytes count when SetEncoding is on. Response streams and
    // writers are never capped. Read at every transfer.
    void SetMaxResponseSize(size_t bytes);
    size_t GetMaxResponseSize() const;
    // A file of trusted CA certificates (PEM) used instead of the system's bundle when
    // certificates are checked (SetHTTPSVerify(true) or SetSSLVerify); the certificate must
    // still name the host. A file that cannot be read fails the transfer. False with
    // CRED_REQ_ERR_BAD_PARAM for an empty path. Read when the transfer is first set up.
    bool SetCAFile(const std::string &path);
    // Accepts the server only when its public key matches `pin`, in libcurl's pinned-key form
    // ("sha256//<Base64 of the SHA-256 of the DER public key>", several joined with ';'),
    // whether or not certificates are checked. A mismatch fails the transfer
    // (CRED_REQ_ERR_CURL_OTHER, GetCurlCode() 90). False with CRED_REQ_ERR_BAD_PARAM for an
    // empty pin. Read when the transfer is first set up.
    bool SetPinnedPublicKey(const std::string &pin);

    // ---- Results.
    KOVA::_tag_CRED_REQ_ERR GetError();
    void SetError(KOVA::_tag_CRED_REQ_ERR error);
    // The libcurl easy handle; null before the first transfer set-up. Owned by the request.
    // A handle the caller took here never goes back to the process's pool of idle handles (see
    // below): the caller may have put it in a multi handle or given it state, so it is cleaned
    // up with the request as it always was, which also takes it out of a multi handle.
    CURL *GetCurlHandler();
    // Closes every connection kept alive in the process's pool of idle handles. Requests in
    // use keep theirs. Safe on any thread at any time.
    static void CloseIdleConnections();
    // The response body held in memory when no response stream is set: at most
    // GetMaxResponseSize() bytes (64 MiB unless set), the transfer failing with
    // CRED_REQ_ERR_CURL_OTHER past that.
    std::string GetResponse();
    const Json::Value &GetResponseHeader();
    // The libcurl result of this request's last transfer attempt (CURLE_OK before any) and
    // libcurl's own text for it (the detailed message when libcurl gave one, else
    // curl_easy_strerror), so that a caller can name the cause behind a code such as
    // CRED_REQ_ERR_CURL_OTHER. Per request, like GetError. Set by each attempt of Process; the
    // text is "" before any.
    int GetCurlCode();
    std::string GetCurlErrorText();
    // Timing and connection facts of the last transfer, in seconds from its start:
    // {"namelookup", "connect", "tls", "firstByte", "total" (numbers), "reused" (true when it
    // rode a connection made earlier), "httpVersion" ("1.1", "2", ...), "remoteIp",
    // "remotePort", "connects" (new connections it opened)}, taken after each attempt of
    // Process; zeros and "" for what the attempt did not reach. Null before any transfer.
    Json::Value GetTransferInfo();

    // ---- Execution.
    // Sets the transfer up and, when `perform`, runs it with up to `retries` further attempts
    // (within the total time-out, if one is set). True only for HTTP status 200 (or a
    // successful set-up when not performing). A body held in memory is capped (see
    // SetMaxResponseSize): a larger answer fails with CRED_REQ_ERR_CURL_OTHER. A response
    // stream is cut back, before a retry, to where it stood when Process began only when the
    // failed attempt wrote to it. In a process that gained privileges at exec (setuid, setgid,
    // file capabilities) the invoker's proxy variables are ignored and, when this library
    // initialises libcurl, SSLKEYLOGFILE is removed from the environment first.
    bool Process(bool perform = true, int retries = 0);
    // The error Process leaves for a transfer that ended with libcurl's `result` and, when that
    // is CURLE_OK, the HTTP `status`: CRED_REQ_ERR_NONE only for status 200. For callers that
    // drive the handle themselves (GetCurlHandler after Process(false)).
    static KOVA::_tag_CRED_REQ_ERR ErrorOf(CURLcode result, long status);
    // Logs in with stored credential credId, attaches the session, then Process.
    bool ProcessWithLogin(long credId, bool perform = true, int retries = 0);
    // Logs in to the server of `url` (or of this request's URL when empty) with the given
    // account and attaches the session ("_sid", "KovaToken", cookie "id").
    bool Login(const std::string &account, const std::string &password,
               const std::string &url = "");
    // Closes the server session of this request's own Login.
    bool Logout();
    // Whether the server at this request's URL offers `api`.
    bool isAPIValid(const std::string &api);
    // Whether a plain GET of `url` completes with status 200.
    bool isURLValid(const std::string &url);

    // ---- WebAPI factories. The caller owns a returned request.
    // Points this request at `method` of `api` on the server of its own credential.
    bool SetWebAPIRequest(const std::string &api, int version, const std::string &method,
                          const Json::Value &params);
    // Fills `request` for the records' server and session.
    static bool CreateWebAPIRequest(KOVA::CredRequest *request, const KOVA_CRED *cred,
                                    const KOVA_CRED_SESS *sess, const std::string &api, int version,
                                    const std::string &method, const Json::Value &params);
    static KOVA::CredRequest *CreateWebAPIRequest(const KOVA_CRED *cred, const KOVA_CRED_SESS *sess,
                                                  const std::string &api, int version,
                                                  const std::string &method,
                                                  const Json::Value &params);
    // Loads credential credId, obtains a session (stored, or a fresh login), then builds.
    static KOVA::CredRequest *CreateWebAPIRequest(long credId, const std::string &api, int version,
                                                  const std::string &method,
                                                  const Json::Value &params);
    static KOVA::CredRequest *CreateRelayRequest(long credId, const std::string &api, int version,
                                                 const std::string &method,
                                                 const Json::Value &headers, FILE *in, FILE *out);

  private:
    friend class CredRequestPrivate;
    CredRequestPrivate *d;
};

}  // namespace KOVA

#endif  // KOVACREDENTIAL_CRED_REQUEST_H
