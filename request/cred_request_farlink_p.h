// Implementation object of KOVA::CredRequestFarlink: the client's directory settings, the
// server and service it looks for, its error state, and the directory protocol core (making,
// sending and checking one "/Serv.php" request) and candidate probing.
#ifndef KOVA_REQUEST_CRED_REQUEST_FARLINK_P_H
#define KOVA_REQUEST_CRED_REQUEST_FARLINK_P_H

#include <string>
#include <vector>

#include <json/value.h>

#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_farlink.h"
#include "platform/kova_deadline.h"
#include "platform/kova_log.h"

namespace KOVA {

// Unit name of the relay client's exception-guard records (kova::Guarded).
constexpr char kFarlinkGuardUnit[] = "cred_request_farlink";

class CredRequestFarlinkPrivate {
  public:
    explicit CredRequestFarlinkPrivate(CredRequestFarlink *owner);
    ~CredRequestFarlinkPrivate();
    CredRequestFarlinkPrivate(const CredRequestFarlinkPrivate &) = delete;
    CredRequestFarlinkPrivate &operator=(const CredRequestFarlinkPrivate &) = delete;

    // The directory host used after construction and Clear: kovacredential_farlink_server
    // when set (and not empty), else the build's default.
    static std::string DefaultServerName();
    // The host asked for the site list: kovacredential_farlink_global when set (and not
    // empty), else the build's default.
    static std::string GlobalServerName();

    // ---- Settings.
    // Stores `id` whatever it is; "zon"/"zon_portal" select "http", "zon_https"/
    // "zon_portal_https" select "https"; any other id is logged and keeps the old protocol.
    void SetServiceId(const std::string &id);
    const std::string &GetServiceId() const { return serviceId; }
    const std::string &GetServiceProtocol() const { return serviceProtocol; }
    void SetHTTPS(bool https, bool verify);
    void SetServerName(const std::string &name);
    const std::string &GetServerName() const { return serverName; }
    void SetTimeout(long seconds);
    // Stores the id and its MD5; the same id again changes nothing (no new digest).
    void SetServerId(const std::string &id);
    // Stores the lower-case hexadecimal MD5 of `id`; an empty id sets 401 and an empty MD5.
    void SetServerIdMd5(const std::string &id);
    const std::string &GetServerId() const { return serverId; }
    const std::string &GetServerIdMd5() const { return serverIdMd5; }
    // Server name, both HTTPS flags and the time-out back to their defaults.
    void Clear();

    // ---- Deadline of one operation.
    // Milliseconds each whole operation may take; 0 or less: no deadline.
    void SetTotalTimeout(long milliseconds);
    // Starts the deadline of an operation unless an enclosing operation already runs one
    // (GetAvailableConnInfo asking for a tunnel, a look-up running its commands), and ends it
    // with the scope that started it.
    class DeadlineScope {
      public:
        explicit DeadlineScope(CredRequestFarlinkPrivate &client)
            : DeadlineScope(client, client.totalTimeout) {}
        DeadlineScope(CredRequestFarlinkPrivate &client, long milliseconds);
        ~DeadlineScope();
        DeadlineScope(const DeadlineScope &) = delete;
        DeadlineScope &operator=(const DeadlineScope &) = delete;

      private:
        CredRequestFarlinkPrivate &client_;
        bool started_;
    };
    // Whether a running deadline has passed.
    bool DeadlineExpired() const;
    // Gives `request` the time-outs it is meant to have (`responseTimeout` and
    // `defaultTimeout` in seconds; 0 leaves the request's own) and, while a deadline runs,
    // what is left of it as the request's total time-out. False, setting no error, when
    // nothing is left.
    bool BoundRequest(CredRequest &request, long responseTimeout, long defaultTimeout);
    // The whole look-up of GetConnInfo and GetConnInfoPortal: `httpsService`, then
    // `plainService`, within `milliseconds` (0: no deadline).
    static bool Resolve(const std::string &serverId, const char *httpsService,
                        const char *plainService, Json::Value &candidate, Json::Value *errors,
                        long milliseconds);

    // ---- Errors.
    KOVA::_tag_CRED_REQ_ERR GetError() const { return error; }
    // Stores code and detail; inside an operation whose deadline has passed, every failure is
    // CRED_REQ_ERR_TIMEOUT without detail, whatever step noticed it.
    void SetError(KOVA::_tag_CRED_REQ_ERR code, const Json::Value &detail);
    // {"code": error, "error": detail}; "error" only when the detail is not empty.
    Json::Value GetErrors() const;
    // ---- Directory protocol.
    // Whether a directory answer is an object whose "errno" is 0 (a missing one counts as 0).
    static bool IsSuccessAnswer(const Json::Value &answer);
    // True when `text` is a JSON object whose "errno" is 0 (or missing); copies it to `out`
    // when given. Sets no error.
    bool CheckResponse(const std::string &text, Json::Value *out);
    // The prepared, unsent request carrying `body` to "/Serv.php" of the server name; the
    // caller owns it. Null with 403, 404 or 22 set.
    KOVA::CredRequest *CreateFarlinkRequest(const Json::Value &body);
    // Makes, runs and parses one request. False with 22 (not made or not completed) or 23
    // (answer not JSON). Whether the answer's "errno" is 0 is left to the caller.
    bool SendFarlinkRequest(const Json::Value &body, Json::Value &answer);

    // ---- Connection candidates.
    bool GetAvailableDirectConnInfo(const Json::Value &serverInfo, Json::Value &candidate);
    bool GetAvailableRelayConnInfo(const Json::Value &tunnelAnswer, Json::Value &candidate);
    // One address to probe. Protocol and host point into the client and the directory's
    // answer, which outlive the probing; only the address that answers becomes a JSON
    // candidate {"protocol", "host", "port"}.
    struct ProbeTarget {
        const std::string *protocol;
        const Json::Value *host;
        int port;
    };
    // The direct addresses of server information, in the order they are probed; takes the
    // answer's server id. False (405 set when it names no port) when there is none.
    bool DirectCandidates(const Json::Value &serverInfo, std::vector<ProbeTarget> &targets);
    // The relay addresses of a tunnel answer, in the order they are probed; takes the
    // answer's server id. False when there is none.
    bool RelayCandidates(const Json::Value &tunnelAnswer, std::vector<ProbeTarget> &targets);
    // Whether a probe answer is a JSON object whose "ezid" is the server id MD5.
    bool IsProbeAnswer(const std::string &text) const;
    // The directory hosts of a site list answer, in the order they are tried: each entry of
    // "sites" as text ("" for an array or object). False when "sites" is no array.
    static bool SiteHosts(const Json::Value &siteList, std::vector<std::string> &hosts);
    // Probes each target in order with "/webman/pingpong.cgi" and makes the first whose
    // "ezid" is the server id MD5 the `candidate`. Direct probes run with short time-outs;
    // relay probes with the request defaults. Sets no error.
    bool ProbeCandidates(const std::vector<ProbeTarget> &targets, bool direct,
                         Json::Value &candidate);

    // Fields, in this order.
    CredRequestFarlink *owner;
    std::string serverId;
    std::string serverIdMd5;
    std::string serverName;
    bool useHTTPS = false;
    bool verifyHTTPS = false;
    long timeout = 5;
    KOVA::_tag_CRED_REQ_ERR error = CRED_REQ_ERR_NONE;
    Json::Value errorDetail;
    std::string serviceId = "zon";
    std::string serviceProtocol = "http";
    long totalTimeout = 0;
    // The deadline of the operation in progress; none between operations.
    kova::Deadline deadline;
};

}  // namespace KOVA

#endif  // KOVA_REQUEST_CRED_REQUEST_FARLINK_P_H
