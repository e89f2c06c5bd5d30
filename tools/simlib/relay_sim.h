// A relay-directory simulator for tests, benchmarks and kovasim: "/Serv.php" answering the
// directory commands "get_site_list", "get_server_info" and "request_tunnel" from a configured
// set of servers, with a record of every command received; and the "/webman/pingpong.cgi"
// probe a server's WebAPI side answers with.
//
// Clients always reach a directory on port 80 (or 443) of its host, so several directory
// hosts (the global one, the sites) run as LoopbackServers on port 80 of distinct loopback
// addresses; ProcessLoopbackAddress gives addresses no other process uses.
//
// Configuration (a JSON object; every member optional):
//
//   {
//     "sites": ["127.1.2.3", "127.1.2.4"],
//         // copied verbatim as "sites" into the answer of "get_site_list" (any JSON value, so
//         // that malformed lists can be served); when absent the answer has no "sites"
//     "servers": [
//       {
//         "serverID": "S1",                       // the id clients ask for
//         "sites": ["127.1.2.4"],                 // directory hosts that know the server
//                                                 // (absent: every host the simulator serves)
//         "interface": [{"ip": "127.0.0.1"}],      // LAN addresses, copied as they stand
//         "external": {"ip": "127.0.0.1"},         // external address, copied as it stands
//         "ddns": "localhost",                     // DDNS name, copied as it stands
//         "services": {                            // by service id ("zon", "zon_https", ...)
//           "zon": {
//             "port": 5000, "ext_port": 5000,      // sent by "get_server_info"
//             "relay_ip": "127.0.0.1", "relay_port": 6000, "relay_dn": "localhost",
//             "https_ip": "127.0.0.1", "https_port": 6001  // sent by "request_tunnel"
//           }
//         }
//       }
//     ],
//     "answers": [
//       // fixed answers, tried in order before the servers: the first rule whose "site" (a
//       // directory host; absent matches any) and "command" (absent matches any) fit the
//       // request answers with "raw" (a text sent verbatim) or "json" (a document)
//       {"site": "127.1.2.3", "command": "get_server_info", "raw": "not json"},
//       {"command": "request_tunnel", "json": {"errno": 1}}
//     ]
//   }
//
// Answers of the servers (all with HTTP status 200):
//   get_site_list    {"errno": 0, "sites": <"sites">}
//   get_server_info  {"errno": 0, "server": {"serverID", "interface", "external", "ddns"},
//                     "service": {"id", "port", "ext_port"}} (members present in the entry)
//   request_tunnel   {"errno": 0, "server": {"serverID"},
//                     "service": {"id", "relay_ip", "relay_port", "relay_dn", "https_ip",
//                                 "https_port"}} (members present in the entry)
//   errors           {"errno": N, "errmsg": text}: 2 body not a JSON object or "version" not
//                    1, 3 unknown command, 4 server not known at this host, 5 service not
//                    offered, 6 no relay for the service.
#ifndef KOVASIM_RELAY_SIM_H
#define KOVASIM_RELAY_SIM_H

#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include <json/value.h>

#include "simlib/loopback_server.h"

namespace kovasim {

// Lower-case hexadecimal MD5 of `text` (the "ezid" of a server id).
std::string Md5Hex(const std::string &text);

// Loopback address number `index` (0, 1, ...) of a block 127.A.B.x chosen from the process id,
// so that programs that run side by side bind port 80 on addresses of their own.
std::string ProcessLoopbackAddress(int index);

// Whether `server` failed to start because binding its port needs a privilege the process
// lacks (port 80 or 443 without root or CAP_NET_BIND_SERVICE).
bool BindNotPermitted(const LoopbackServer &server);

// One directory command as it reached the simulator.
struct RelayHit {
    std::string site;     // host of the directory server that received it
    std::string method;   // HTTP method
    std::string command;  // "command" member; "" when the body is not such a document
    std::string body;     // the raw request body
    Json::Value request;  // the body parsed (null when it is not JSON)
    std::string answer;   // the text answered
};

class RelaySim {
  public:
    RelaySim();
    explicit RelaySim(const Json::Value &config);
    RelaySim(const RelaySim &) = delete;
    RelaySim &operator=(const RelaySim &) = delete;

    // Replaces the configuration (also while serving). False, with the reason in `*error`
    // when given, for a configuration that is not an object or whose "servers" or "answers"
    // are not arrays of objects; the old configuration then stays.
    bool Configure(const Json::Value &config, std::string *error = nullptr);
    Json::Value Config() const;

    // Routes "/Serv.php" of `server` (GET and POST; a doubled leading slash is accepted) to
    // this simulator, which must outlive the server's serving. Call before server.Start().
    void Install(LoopbackServer &server);

    // The answer text the directory host `site` gives to the request body `body`.
    std::string Answer(const std::string &site, const std::string &body) const;

    // Every command received, in order of arrival; or those with the given command name.
    std::vector<RelayHit> Hits() const;
    std::vector<RelayHit> Hits(const std::string &command) const;
    size_t HitCount() const;
    void ClearHits();

  private:
    Json::Value ServerAnswer(const std::string &site, const Json::Value &request) const;

    mutable std::mutex mutex_;
    Json::Value config_;
    std::vector<RelayHit> hits_;
};

// One RelaySim served on port 80 (by default) of the loopback addresses
// ProcessLoopbackAddress(first), (first + 1), ...: the directory hosts of a test or benchmark,
// host 0 usually standing for the global directory and the others for its sites.
class RelayDirectory {
  public:
    explicit RelayDirectory(int hosts, int first = 0, int port = 80);
    RelayDirectory(const RelayDirectory &) = delete;
    RelayDirectory &operator=(const RelayDirectory &) = delete;

    // Starts every host. False when one cannot be bound: Error() says why, and NotPermitted()
    // whether for lack of the privilege to bind the port.
    bool Start();
    void Stop();
    bool NotPermitted() const { return notPermitted_; }
    const std::string &Error() const { return error_; }

    int Size() const { return static_cast<int>(servers_.size()); }
    const std::string &Host(int i) const { return servers_.at(i)->Host(); }
    LoopbackServer &Server(int i) { return *servers_.at(i); }
    RelaySim &Sim() { return sim_; }

  private:
    RelaySim sim_;
    std::vector<std::unique_ptr<LoopbackServer>> servers_;
    std::string error_;
    bool notPermitted_ = false;
};

// Routes "/webman/pingpong.cgi" of `server` to the answer a WebAPI server gives:
// {"boot_done": true, "ezid": Md5Hex(serverId), "success": true}. Call before Start.
void InstallPingPong(LoopbackServer &server, const std::string &serverId);

// A TCP port on `host` that refuses connections: bound, never listening, and held for the
// object's lifetime so that no other socket takes it.
class RefusedPort {
  public:
    explicit RefusedPort(const std::string &host = "127.0.0.1");
    ~RefusedPort();
    RefusedPort(const RefusedPort &) = delete;
    RefusedPort &operator=(const RefusedPort &) = delete;
    int Port() const { return port_; }
    const std::string &Host() const { return host_; }

  private:
    std::string host_;
    int fd_ = -1;
    int port_ = 0;
};

}  // namespace kovasim

#endif  // KOVASIM_RELAY_SIM_H
