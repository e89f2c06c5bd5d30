// KOVA::CredRequestMgr: runs many requests at once on the caller's thread over one libcurl
// multi handle. The manager owns the requests it holds until Clear, its destructor or
// RemoveRequest.
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

    void SetError(KOVA::_tag_CRED_REQ_ERR error);
    KOVA::_tag_CRED_REQ_ERR GetError();

    // Takes ownership of `request`; its index, or -1 (null: CRED_REQ_ERR_BAD_PARAM).
    int AddCredRequest(KOVA::CredRequest *request);
    // Builds a WebAPI request with CredRequest::CreateWebAPIRequest and adds it.
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
    int Size();
    bool IsEmpty();
    void Clear();

    // Runs every request concurrently until all have finished or the first failure.
    bool Run();
    std::string GetResponse(int index);
    // One string per slot, in adding order.
    Json::Value GetAllResponse();

    static int SocketCallback(CURL *easy, curl_socket_t socket, int what, void *userp,
                              void *socketp);
    bool curlHandlerProcess(CURLM *multi, long waitSeconds);

  private:
    std::vector<KOVA::CredRequest *> requests;
    KOVA::_tag_CRED_REQ_ERR error;
};

}  // namespace KOVA

#endif  // KOVACREDENTIAL_CRED_REQUEST_MGR_H
