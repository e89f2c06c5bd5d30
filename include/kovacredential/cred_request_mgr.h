// KOVA::CredRequestMgr: runs many requests at once on the caller's thread over one libcurl
// multi handle. The manager owns the requests it holds until Clear, its destructor or
// RemoveRequest.
//
// Concurrency: separate managers may run on separate threads at once; one manager, with the
// requests it holds, is used by one thread at a time; only Cancel may be called while another
// thread runs it.
//
// Connections: the runs of one thread share a multi handle kept between runs, so a later run
// reuses the connections of an earlier one (CredRequest::CloseIdleConnections on that thread
// closes them; they close when the thread ends). Transfers to an HTTPS server that speaks
// HTTP/2 share one connection, up to 100 at a time; HTTP/1.1 servers get all transfers at once.
#ifndef KOVACREDENTIAL_CRED_REQUEST_MGR_H
#define KOVACREDENTIAL_CRED_REQUEST_MGR_H

#include <stdio.h>

#include <string>
#include <vector>

#include <curl/curl.h>
#include <json/value.h>

#include "cred_request.h"
#include "kovacred.h"

namespace KOVA {

class KOVA_EXPORT CredRequestMgr {
  public:
    CredRequestMgr();
    ~CredRequestMgr();
    CredRequestMgr(const CredRequestMgr &) = delete;
    CredRequestMgr &operator=(const CredRequestMgr &) = delete;

    // The manager's last error (CRED_REQ_ERR_BAD_PARAM, _LOGIN_FAIL, _QUERY_FAIL,
    // _NO_REQUEST_FORMAT, _CURL_INTERNAL, _TIMEOUT, _SELECT); 0 until one happens, never reset by
    // the manager. Each request keeps its own error besides.
    void SetError(KOVA::_tag_CRED_REQ_ERR error);
    KOVA::_tag_CRED_REQ_ERR GetError();

    // Takes ownership of `request`; its index, or -1 (null: CRED_REQ_ERR_BAD_PARAM).
    int AddCredRequest(KOVA::CredRequest *request);
    // Build a WebAPI (or relay) request with the factories of CredRequest and add it; -1 (and a
    // log line) when the factory fails.
    int AddWebAPIRequest(long credId, const std::string &api, int version,
                         const std::string &method, const Json::Value &params);
    int AddWebAPIRequest(const KOVA_CRED *cred, const KOVA_CRED_SESS *sess, const std::string &api,
                         int version, const std::string &method, const Json::Value &params);
    int AddRelayRequest(long credId, const std::string &api, int version, const std::string &method,
                        const Json::Value &headers, FILE *in, FILE *out);
    // A WebAPI request for a server without a stored credential; the API description is
    // fetched under a temporary negative id and dropped again.
    int AddCredRequest(const std::string &protocol, const std::string &host, int port,
                       const std::string &sid, const std::string &api, int version,
                       const std::string &method, const Json::Value &params);

    // The request at `index` (still owned by the manager), or null (CRED_REQ_ERR_BAD_PARAM).
    KOVA::CredRequest *GetRequest(int index);
    // Hands the request at `index` to the caller; its slot stays, holding null.
    KOVA::CredRequest *RemoveRequest(int index);
    // Slots, removed ones included.
    int Size();
    bool IsEmpty();
    // Destroys every request the manager holds and empties the slots.
    void Clear();

    // Runs every request concurrently on the calling thread until all have finished; false on
    // the first failure of the loop itself (CRED_REQ_ERR_CURL_INTERNAL, _SELECT, or _TIMEOUT
    // after a whole wait of the largest response time-out, 120 s by default, without progress).
    // Requests whose set-up fails, or whose handle libcurl will not take
    // (CRED_REQ_ERR_CURL_INTERNAL), are left out and keep their own error; with no request left
    // to run the result is true at once. A transfer that fails gives its request the error
    // Process gives for the same libcurl result (a response over the in-memory cap of
    // CredRequest ends with CRED_REQ_ERR_CURL_OTHER); a transfer that completes leaves the
    // request's error as it was, so each request's outcome is read from the request
    // (GetResponse, GetError, its HTTP status).
    bool Run();
    // Run with a deadline for the whole run, in milliseconds from the call (0: none, as Run();
    // negative: CRED_REQ_ERR_BAD_PARAM and false, nothing run). When it passes, every
    // unfinished request is stopped with CRED_REQ_ERR_TIMEOUT, the manager's error becomes
    // CRED_REQ_ERR_TIMEOUT and the result is false; a host name still being resolved is not
    // waited for.
    bool Run(long timeoutMilliseconds);
    // Makes a Run of this manager in progress return false at its next wake-up with
    // CRED_REQ_ERR_SELECT (logged as an interrupted wait), its unfinished requests stopped with
    // CRED_REQ_ERR_SELECT too. Async-signal-safe (errno is kept): may be called from a signal
    // handler or from another thread while Run waits; it wakes the wait itself. Does nothing
    // when no Run of this manager is in progress. It reaches a run that began while fewer than
    // 256 runs were in progress in the process; a run beyond those cannot be cancelled.
    void Cancel();
    // A copy of the response body of the request at `index`; "" and CRED_REQ_ERR_BAD_PARAM for
    // a bad index.
    std::string GetResponse(int index);
    // One string per slot, in adding order ("" for a slot emptied by RemoveRequest).
    Json::Value GetAllResponse();

    // The multi handle's socket callback: on CURL_POLL_REMOVE it marks the request holding
    // `easy` with CRED_REQ_ERR_TIMEOUT (a failed transfer's own error replaces the mark).
    // Always returns 0.
    static int SocketCallback(CURL *easy, curl_socket_t socket, int what, void *userp,
                              void *socketp);
    // The transfer loop of Run: waits on the multi handle's sockets, at most `waitSeconds`
    // without progress, and gives a failed transfer's request its error as Run does. True when
    // every transfer has finished (at once when none runs). Neither Cancel nor a deadline
    // reaches it outside Run.
    bool curlHandlerProcess(CURLM *multi, long waitSeconds);

  private:
    std::vector<KOVA::CredRequest *> requests;
    KOVA::_tag_CRED_REQ_ERR error;
};

}  // namespace KOVA

#endif  // KOVACREDENTIAL_CRED_REQUEST_MGR_H
