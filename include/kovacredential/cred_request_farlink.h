// KOVA::CredRequestFarlink: resolves a server known only by its server id into a reachable
// address through the relay directory (LAN interface, external address, DDNS name or relay).
#ifndef KOVACREDENTIAL_CRED_REQUEST_FARLINK_H
#define KOVACREDENTIAL_CRED_REQUEST_FARLINK_H

#include <string>

#include <json/value.h>

#include "cred_request.h"

namespace KOVA {

class CredRequestFarlinkPrivate;

class KOVA_EXPORT CredRequestFarlink {
  public:
    CredRequestFarlink();
    ~CredRequestFarlink();
    CredRequestFarlink(const CredRequestFarlink &) = delete;
    CredRequestFarlink &operator=(const CredRequestFarlink &) = delete;

    // Directory requests go to https://<server name>:443 when https, else http://...:80.
    void SetHTTPS(bool https, bool verify);
    void SetServerName(const std::string &name);
    // Response time-out of each directory request; 0 or less leaves the request default.
    void SetTimeout(long seconds);
    void SetServerId(const std::string &serverId);
    // "zon", "zon_portal", "zon_https" or "zon_portal_https".
    void SetServiceId(const std::string &serviceId);
    KOVA::_tag_CRED_REQ_ERR GetError();
    // {"code": <error>, "error": <detail>} ("error" only when there is a detail).
    Json::Value GetErrors();
    void SetError(KOVA::_tag_CRED_REQ_ERR error, const Json::Value &detail = Json::Value());

    // The prepared, unsent "get_server_info" request; the caller owns it.
    KOVA::CredRequest *GetServerInfo();
    bool GetServerInfo(Json::Value &info);
    bool GetSiteList(Json::Value &answer);
    bool GetAvailableServerInfo(Json::Value &info);
    bool RequestTunnel(Json::Value &answer);

    // A candidate {"protocol", "host", "port"} that answers: direct first, then the relay.
    bool GetAvailableConnInfo(const Json::Value &serverInfo, Json::Value &candidate);
    // Whole look-ups for "zon_https" then "zon", and "zon_portal_https" then "zon_portal".
    // errors (may be null) receives GetErrors() on failure.
    static bool GetConnInfo(const std::string &serverId, Json::Value &candidate,
                            Json::Value *errors);
    static bool GetConnInfoPortal(const std::string &serverId, Json::Value &candidate,
                                  Json::Value *errors);

  private:
    friend class CredRequestFarlinkPrivate;
    CredRequestFarlinkPrivate *d;
};

}  // namespace KOVA

#endif  // KOVACREDENTIAL_CRED_REQUEST_FARLINK_H
