// Implementation object of KOVA::CredRequest: the request settings document, the libcurl
// handle built from it, and the callbacks of the transfer.
#ifndef KOVA_REQUEST_CRED_REQUEST_P_H
#define KOVA_REQUEST_CRED_REQUEST_P_H

#include <stdint.h>
#include <stdio.h>
#include <sys/types.h>

#include <atomic>

#include <string>

#include <curl/curl.h>
#include <json/value.h>

#include "kovacredential/cred_request.h"
#include "kovacredential/kovacred.h"
#include "platform/kova_deadline.h"

namespace KOVA {

class CredRequestPrivate {
  public:
    explicit CredRequestPrivate(CredRequest *owner);
    ~CredRequestPrivate();
    CredRequestPrivate(const CredRequestPrivate &) = delete;
    CredRequestPrivate &operator=(const CredRequestPrivate &) = delete;

    // ---- Settings document. Bad keys, names or values set CRED_REQ_ERR_BAD_PARAM.
    // settings[key][name] = value (a string).
    bool SetData(const std::string &key, const std::string &name, const std::string &value);
    // Merges the members of an object into settings[key].
    bool SetData(const std::string &key, const Json::Value &members);
    // settings[key] as an object (made when missing); null, with CRED_REQ_ERR_BAD_PARAM, when
    // the key holds another type.
    Json::Value *ObjectSlot(const std::string &key);
    // settings[key] = value; null, empty arrays and empty objects are rejected.
    bool SetRawData(const std::string &key, const Json::Value &value);
    // The whole document for an empty key; settings[key] for an empty name; the member;
    // otherwise `fallback`.
    const Json::Value &GetData(const std::string &key, const std::string &name,
                               const Json::Value &fallback) const;
    // The member `key` of the settings document, or a null value when it has none.
    const Json::Value &Setting(const char *key) const;
    bool HasData(const char *key) const;
    bool HasRawData(const std::string &key) const;
    bool HasData(const std::string &key, const std::string &name) const;
    const Json::Value &GetResponseHeader() const { return respHeader; }

    // ---- Parameter encoding.
    std::string GetParamString(const Json::Value &params);
    Json::Value GetParamJsonObj(const Json::Value &params);
    bool GetRSAEncParam(const Json::Value &params, std::string &name, std::string &value);
    // The envelope of `params` under the server's encryption information (an object), once
    // fetched.
    bool GetRSAEncParam(Json::Value params, const Json::Value &info, std::string &name,
                        std::string &value);
    bool GetAESEncParam(const Json::Value &params, std::string &textName, std::string &text,
                        std::string &tokenName, std::string &token);
    std::string GetCookies();

    // ---- Transfer set-up and callbacks.
    // The default of the most a response held in memory (the response string) may grow to
    // (maxResponseBytes). No WebAPI or directory answer comes near it; a server that sends more
    // gets its transfer ended with a write error, so that it cannot grow the caller without
    // bound. Response streams and the caller's own writer are not limited.
    static constexpr size_t kMaxResponseBytes = size_t{64} << 20;
    bool InitCurlHandler();
    // Appends the bytes to `out`; 0 (a write error for libcurl) when memory runs out.
    static size_t WriteToStrBuf(char *data, size_t size, size_t nmemb, std::string *out);
    // libcurl's write callback for the response string (data: this object): WriteToStrBuf
    // within maxResponseBytes, a write error past it.
    static size_t WriteResponse(char *data, size_t size, size_t nmemb, void *self);
    static size_t WriteToStream(char *data, size_t size, size_t nmemb, FILE *stream);
    static size_t ReadFromStream(char *buffer, size_t size, size_t nmemb, FILE *stream);
    static size_t WriteHeaderToJsonValue(char *data, size_t size, size_t nmemb,
                                         Json::Value *headers);
    static size_t WriteHeaderToStdout(char *data, size_t size, size_t nmemb,
                                      const Json::Value *message);
    static int DebugCallback(void *handle, curl_infotype type, char *data, size_t size, void *user);

    // ---- Streams across attempts. Every attempt of Process, and every re-send libcurl makes
    // (a redirect that keeps the POST), starts from where the streams stood when Process began.
    // Notes where the request and response streams stand and the shared stream limit.
    void MarkStreams();
    // Puts the streams back to the mark, cutting off the response stream at the mark when the
    // last attempt wrote to it (an attempt that wrote nothing leaves the file as it is). False
    // when that cannot be done: a request stream that is not seekable (a pipe) and was partly
    // sent, a response stream that cannot be cut back.
    bool RewindStreams();
    // libcurl's read, seek and write callbacks for the streams (data: this object). They call
    // ReadFromStream and WriteToStream (or the caller's writer) and count what passed.
    static size_t ReadBody(char *buffer, size_t size, size_t nmemb, void *self);
    static int SeekBody(void *self, curl_off_t offset, int origin);
    static size_t WriteBody(char *data, size_t size, size_t nmemb, void *self);

    // ---- Deadline and transfer facts.
    // Starts the deadline of a Process from now (with a total time-out).
    void StartDeadline();
    // Limits the next attempt on the handle to what is left of the deadline (no limit without
    // a total time-out). False when the option cannot be set (CRED_REQ_ERR_CURL_INTERNAL).
    bool ArmDeadline();
    // Records the outcome of one transfer attempt on the handle: libcurl's result, its text
    // and the raw facts GetTransferInfo reports (see TransferFacts).
    void NoteTransfer(CURLcode result);
    // The facts of the last transfer attempt as GetTransferInfo reports them; null before any.
    Json::Value TransferInfo() const;
    // The private object of `request` (null when its construction failed), for the library's
    // own units that drive requests: the manager and the transport of inner requests.
    static CredRequestPrivate *Of(CredRequest *request) { return request->d; }

    // ---- libcurl's process-wide set-up.
    // Whether this process gained privileges at exec (setuid, setgid, file capabilities:
    // getauxval(AT_SECURE)); libcurl must then not take settings from the invoker's
    // environment.
    static bool SecureProcess();
    // In a `secure` process, removes the variables libcurl reads at its global initialisation
    // from the environment (SSLKEYLOGFILE, which would write the TLS session keys to a file the
    // invoker names). Runs before that initialisation, once.
    static void ScrubCurlEnvironment(bool secure);
    // Initialises libcurl once per process, thread-safely, before the first handle:
    // ScrubCurlEnvironment(secure), then curl_global_init.
    static void InitCurlGlobal(bool secure);

    // ---- A caller's transport lent to inner requests (cred_request_transport.cpp).
    // Gives this (inner, not yet set up) request the transport settings of `transport`:
    // certificate checks ("VerifySSL"), TLS context callback, CA file, pinned key, connect
    // time-out (defaultTimeout), the response time-out when one was set ("RespTime"), and as
    // its total time-out what is left of the transport's deadline (at least 1 ms), or the
    // transport's total time-out when no deadline runs.
    void TakeTransport(const CredRequestPrivate &transport);

    // Fills protocol, host and port of the request's own credential from `url`.
    bool buildCredByURL(const std::string &url);

    // Sets one libcurl option; a failure sets CRED_REQ_ERR_CURL_INTERNAL and logs it.
    template <typename T>
    bool SetOption(CURLoption option, T value);

    // The request-stream limit, shared by every request of the process: SetReqStreamSize sets
    // it, constructing a request clears `reqStreamLimited`, and ReadFromStream consumes it.
    // Atomic, so that requests on several threads share it without a data race.
    static std::atomic<bool> reqStreamLimited;
    static std::atomic<uint32_t> reqStreamRemaining;
    // Set the first time a response header reaches standard output; never cleared, so the
    // standard-output mode's message line is written once per process.
    static std::atomic<bool> headerMessageShown;

    // Fields, in this order.
    // The credential and session a login or WebAPI call of this request fills, made at their
    // first use (a plain request needs neither); null when memory ran out.
    KOVA_CRED *Cred();
    KOVA_CRED_SESS *Sess();
    KOVA_CRED *cred = nullptr;
    KOVA_CRED_SESS *sess = nullptr;
    CredRequest *owner;
    CURL *curl = nullptr;
    // Where `curl` goes back to (request/cred_request_pool.h): its pool key (empty: not
    // pooled) and the pool generation it was taken in.
    std::string poolKey;
    unsigned poolGeneration = 0;
    // The server of the URL `curl` was set up with (CredRequestPool::ServerOf; empty when
    // there is none or libcurl cannot parse it), read once for the pool key and the manager.
    std::string server;
    // Set once the caller took the handle (CredRequest::GetCurlHandler): it may then sit in a
    // multi handle of the caller's or hold state that curl_easy_reset keeps (cookies, a share),
    // so it is cleaned up instead of going back to the pool.
    bool handleLent = false;
    struct curl_slist *headers = nullptr;
    FILE *reqStream = nullptr;
    FILE *respStream = nullptr;
    size_t (*respWriteFn)(char *, size_t, size_t, void *) = nullptr;
    KOVA::_tag_CRED_REQ_ERR error = CRED_REQ_ERR_NONE;
    bool jsonFormat = false;
    Json::Value settings{Json::objectValue};
    std::string response;
    Json::Value respHeader{Json::objectValue};
    struct curl_httppost *form = nullptr;
    void (*sslCtxFn)(void *, void *, void *) = nullptr;
    void *sslCtxData = nullptr;
    long defaultTimeout = 120;
    bool followLocation = true;
    bool encoding = false;

    // Settings kept beside the document.
    long totalTimeoutMs = 0;                      // deadline of Process as a whole; 0: none
    size_t maxResponseBytes = kMaxResponseBytes;  // cap of the response string; 0: none
    std::string caFile;                           // CURLOPT_CAINFO when not empty
    std::string pinnedPublicKey;                  // CURLOPT_PINNEDPUBLICKEY when not empty
    // Whether the invoker's proxy variables are overridden (see SecureProcess); a test may
    // force it before the handle is set up.
    bool secureProcess = SecureProcess();

    // The deadline of the current Process, with a total time-out.
    kova::Deadline deadline;
    // What libcurl tells of the last transfer attempt, read from the handle right after it (the
    // handle may serve another request later) and turned into JSON only when asked for.
    struct TransferFacts {
        bool noted = false;  // false before any transfer
        bool completed = false;
        curl_off_t namelookupUs = 0, connectUs = 0, tlsUs = 0, firstByteUs = 0, totalUs = 0;
        long connects = 0;
        long httpVersion = 0;
        long remotePort = 0;
        std::string remoteIp;
    };
    // Outcome of the last transfer attempt.
    CURLcode curlCode = CURLE_OK;
    std::string curlErrorText;
    TransferFacts transferFacts;
    char curlErrorBuffer[CURL_ERROR_SIZE] = {};

    // Stream positions of the current Process (see MarkStreams): -1 when a stream is not set
    // or not seekable.
    off_t reqStreamStart = -1;
    off_t respStreamStart = -1;
    bool markLimited = false;
    uint32_t markRemaining = 0;
    // Bytes that passed through the stream callbacks since the mark or the last rewind.
    uint64_t reqStreamRead = 0;
    uint64_t respStreamWritten = 0;
};

}  // namespace KOVA

#endif  // KOVA_REQUEST_CRED_REQUEST_P_H
