// KOVA::CredRequestFarlink: resolves a server known only by its server id into a reachable
// address through the relay directory (LAN interface, external address, DDNS name or relay).
//
// Concurrency: separate clients are independent and may run on separate threads at once, and
// so may GetConnInfo and GetConnInfoPortal, which make a client of their own; one client is
// used by one thread at a time.
#ifndef KOVACREDENTIAL_CRED_REQUEST_FARLINK_H
#define KOVACREDENTIAL_CRED_REQUEST_FARLINK_H

#include <string>

#include <json/value.h>

#include "cred_request.h"

namespace KOVA {

class CredRequestFarlinkPrivate;

// A client of the relay directory. Each operation leaves its outcome in the object: true (or a
// non-null request) on success; on failure false (or null) and an error code with a detail
// (GetError, GetErrors) that stay until a later failure overwrites them: a success does not
// clear them. Codes: 1 tunnel asked for without a server id, 22 a directory request could not
// be made or did not complete, 23 the directory's answer is unusable (not JSON, not an object,
// or "errno" not 0), 401 no server id, 402 unusable server information, 403 no directory host,
// 404 empty request document, 405 no usable port for a direct connection.
//
// An object is used by one thread at a time; separate objects are independent. No exception
// leaves it.
class KOVA_EXPORT CredRequestFarlink {
  public:
    // Defaults: the directory host named by kovacredential_farlink_server (else the build's
    // default), plain HTTP without certificate checks, a 5-second response time-out, service id
    // "zon", no server id.
    CredRequestFarlink();
    ~CredRequestFarlink();
    CredRequestFarlink(const CredRequestFarlink &) = delete;
    CredRequestFarlink &operator=(const CredRequestFarlink &) = delete;

    // ---- Settings.
    // Directory requests go to https://<server name>:443 when https, else to http://...:80;
    // verify turns certificate and host-name checks on.
    void SetHTTPS(bool https, bool verify);
    // The directory host asked for server information and tunnels.
    void SetServerName(const std::string &name);
    // Response time-out of each directory request; 0 or less leaves the request's default.
    void SetTimeout(long seconds);
    // A deadline for each whole operation of this client (a command, GetAvailableServerInfo,
    // GetAvailableConnInfo with all its probes and the tunnel), in milliseconds: what is left
    // of it bounds every request the operation makes, and an operation that runs out fails
    // with CRED_REQ_ERR_TIMEOUT and no detail. Each operation has the whole of it again; a
    // request prepared by GetServerInfo() carries what was left when it was made. 0 (the
    // default) or less sets none.
    void SetTotalTimeout(long milliseconds);
    // The server to look up; its MD5 (what the server's probe answer must carry) is kept with
    // it. An empty id sets 401.
    void SetServerId(const std::string &serverId);
    // "zon" and "zon_portal" (reached over "http"), "zon_https" and "zon_portal_https"
    // ("https"). Another id is logged as not supported, kept, and sent as it stands; the
    // protocol stays what it was.
    void SetServiceId(const std::string &serviceId);

    // ---- Errors.
    KOVA::_tag_CRED_REQ_ERR GetError();
    // {"code": <error>, "error": <detail>}; "error" only when there is a detail (a message, the
    // request or answer document, the answer text or the failed request's error code).
    Json::Value GetErrors();
    void SetError(KOVA::_tag_CRED_REQ_ERR error, const Json::Value &detail = Json::Value());

    // ---- Directory commands ("version" 1 JSON documents posted to "/Serv.php").
    // The prepared, unsent "get_server_info" request for the server and service id, to run
    // and check by the caller; the caller owns it. Null with 401 or 22.
    KOVA::CredRequest *GetServerInfo();
    // Sends "get_server_info" to the server name; `info` receives the whole answer object.
    bool GetServerInfo(Json::Value &info);
    // Sends "get_site_list" to the global directory host (kovacredential_farlink_global, else
    // the build's default); the server name is left as it was. `answer` carries "sites".
    bool GetSiteList(Json::Value &answer);
    // Fetches the site list and asks its sites in order until one gives the server information.
    // The server name is left at that site (or the last one tried) so that a following
    // RequestTunnel goes there. A list without a "sites" array fails without a new error.
    bool GetAvailableServerInfo(Json::Value &info);
    // Sends "request_tunnel" to the server name; `answer` describes the relay endpoints.
    bool RequestTunnel(Json::Value &answer);

    // ---- Connection candidates {"protocol", "host", "port"}.
    // Probes "/webman/pingpong.cgi" of each candidate in turn, one after the other, and gives
    // the first whose "ezid" is the server id's MD5: the LAN interfaces, the external address
    // and the DDNS name of `serverInfo` (short time-outs), then, through a tunnel asked of the
    // server name, the relay address, the relay host name and the relay's HTTPS endpoint.
    // Failed probes are not reported; 402 for server information without "server" and
    // "service", 405 (then the tunnel is tried) when it has no positive port.
    bool GetAvailableConnInfo(const Json::Value &serverInfo, Json::Value &candidate);
    // Whole look-ups with a client of their own (so they may run in several threads): the
    // service "zon_https", then "zon"; or "zon_portal_https", then "zon_portal". Each service
    // gets a fresh site list and server information. `errors` (may be null) receives
    // GetErrors() of the last failure when no candidate is found; an empty id gives 401.
    static bool GetConnInfo(const std::string &serverId, Json::Value &candidate,
                            Json::Value *errors);
    static bool GetConnInfoPortal(const std::string &serverId, Json::Value &candidate,
                                  Json::Value *errors);
    // The same look-ups ending within `timeoutMilliseconds` (0 or less: no deadline), both
    // services together; one that runs out fails with {"code": CRED_REQ_ERR_TIMEOUT} in
    // `errors` and tries no further service.
    static bool GetConnInfo(const std::string &serverId, Json::Value &candidate,
                            Json::Value *errors, long timeoutMilliseconds);
    static bool GetConnInfoPortal(const std::string &serverId, Json::Value &candidate,
                                  Json::Value *errors, long timeoutMilliseconds);

  private:
    friend class CredRequestFarlinkPrivate;
    CredRequestFarlinkPrivate *d;
};

}  // namespace KOVA

#endif  // KOVACREDENTIAL_CRED_REQUEST_FARLINK_H
