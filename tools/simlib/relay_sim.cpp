#include "simlib/relay_sim.h"

#include <errno.h>
#include <stdio.h>
#include <string.h>
#include <unistd.h>
#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <memory>

#include <openssl/evp.h>

#include "simlib/sim_json.h"

namespace kovasim {

namespace {

Json::Value Failure(int code, const char *message) {
    Json::Value answer(Json::objectValue);
    answer["errno"] = code;
    answer["errmsg"] = message;
    return answer;
}

// Copies the members `names` that `from` has into `to`.
void CopyMembers(const Json::Value &from, std::initializer_list<const char *> names,
                 Json::Value &to) {
    for (const char *name : names) {
        if (from.isObject() && from.isMember(name)) {
            to[name] = from[name];
        }
    }
}

bool KnownAt(const Json::Value &server, const std::string &site) {
    if (!server.isMember("sites")) {
        return true;
    }
    for (const Json::Value &host : server["sites"]) {
        if (host.isString() && host.asString() == site) {
            return true;
        }
    }
    return false;
}

bool ArrayOfObjects(const Json::Value &config, const char *name) {
    if (!config.isMember(name)) {
        return true;
    }
    const Json::Value &array = config[name];
    if (!array.isArray()) {
        return false;
    }
    for (const Json::Value &element : array) {
        if (!element.isObject()) {
            return false;
        }
    }
    return true;
}

}  // namespace

std::string Md5Hex(const std::string &text) {
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned int length = 0;
    if (EVP_Digest(text.data(), text.size(), digest, &length, EVP_md5(), nullptr) != 1) {
        return "";
    }
    std::string hex;
    for (unsigned int i = 0; i < length; ++i) {
        char pair[3];
        snprintf(pair, sizeof(pair), "%02x", digest[i]);
        hex += pair;
    }
    return hex;
}

std::string ProcessLoopbackAddress(int index) {
    // pid_max is at most 2^22: 250 * 256 blocks separate every pair of pids less than 64000
    // apart, and the first byte never is 0, which keeps clear of the familiar 127.0.0.x.
    unsigned pid = static_cast<unsigned>(getpid());
    unsigned a = 1 + (pid >> 8) % 250;
    unsigned b = pid & 0xff;
    return "127." + std::to_string(a) + "." + std::to_string(b) + "." +
           std::to_string(2 + index % 250);
}

bool BindNotPermitted(const LoopbackServer &server) {
    return !server.Running() && server.Error().find(strerror(EACCES)) != std::string::npos;
}

// ---- RelaySim.

RelaySim::RelaySim() : config_(Json::objectValue) {}

RelaySim::RelaySim(const Json::Value &config) : RelaySim() {
    Configure(config);
}

bool RelaySim::Configure(const Json::Value &config, std::string *error) {
    const char *problem = nullptr;
    if (!config.isObject()) {
        problem = "the configuration is not a JSON object";
    } else if (!ArrayOfObjects(config, "servers")) {
        problem = "\"servers\" is not an array of objects";
    } else if (!ArrayOfObjects(config, "answers")) {
        problem = "\"answers\" is not an array of objects";
    }
    if (problem != nullptr) {
        if (error != nullptr) {
            *error = problem;
        }
        return false;
    }
    std::lock_guard<std::mutex> lock(mutex_);
    config_ = config;
    return true;
}

Json::Value RelaySim::Config() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return config_;
}

void RelaySim::Install(LoopbackServer &server) {
    const std::string site = server.Host();
    server.Route("*", "/+Serv\\.php",
                 [this, site](const httplib::Request &req, httplib::Response &res) {
                     RelayHit hit;
                     hit.site = site;
                     hit.method = req.method;
                     hit.body = req.body;
                     if (ParseJson(req.body, hit.request) && hit.request.isObject() &&
                         hit.request["command"].isString()) {
                         hit.command = hit.request["command"].asString();
                     }
                     hit.answer = Answer(site, req.body);
                     res.set_content(hit.answer, "application/json");
                     std::lock_guard<std::mutex> lock(mutex_);
                     hits_.push_back(std::move(hit));
                 });
}

std::string RelaySim::Answer(const std::string &site, const std::string &body) const {
    Json::Value request;
    bool parsed = ParseJson(body, request) && request.isObject();
    std::string command =
        parsed && request["command"].isString() ? request["command"].asString() : std::string();
    Json::Value config = Config();
    for (const Json::Value &rule : config["answers"]) {
        if ((rule.isMember("site") && rule["site"].asString() != site) ||
            (rule.isMember("command") && rule["command"].asString() != command)) {
            continue;
        }
        if (rule.isMember("raw")) {
            return rule["raw"].asString();
        }
        return WriteJson(rule["json"]);
    }
    if (!parsed || !request["version"].isInt() || request["version"].asInt() != 1) {
        return WriteJson(Failure(2, "bad request"));
    }
    return WriteJson(ServerAnswer(site, request));
}

Json::Value RelaySim::ServerAnswer(const std::string &site, const Json::Value &request) const {
    Json::Value config = Config();
    const std::string command = request["command"].asString();
    if (command == "get_site_list") {
        Json::Value answer(Json::objectValue);
        answer["errno"] = 0;
        CopyMembers(config, {"sites"}, answer);
        return answer;
    }
    if (command != "get_server_info" && command != "request_tunnel") {
        return Failure(3, "unknown command");
    }
    const std::string serverId =
        request["serverID"].isString() ? request["serverID"].asString() : std::string();
    const std::string serviceId =
        request["id"].isString() ? request["id"].asString() : std::string();
    for (const Json::Value &server : config["servers"]) {
        if (server["serverID"].asString() != serverId || !KnownAt(server, site)) {
            continue;
        }
        const Json::Value &services = server["services"];
        if (!services.isObject() || !services.isMember(serviceId)) {
            return Failure(5, "service not offered");
        }
        const Json::Value &entry = services[serviceId];
        Json::Value answer(Json::objectValue);
        answer["errno"] = 0;
        answer["server"]["serverID"] = serverId;
        answer["service"]["id"] = serviceId;
        if (command == "get_server_info") {
            CopyMembers(server, {"interface", "external", "ddns"}, answer["server"]);
            CopyMembers(entry, {"port", "ext_port"}, answer["service"]);
            return answer;
        }
        CopyMembers(entry, {"relay_ip", "relay_port", "relay_dn", "https_ip", "https_port"},
                    answer["service"]);
        if (answer["service"].size() == 1) {
            return Failure(6, "no relay for the service");
        }
        return answer;
    }
    return Failure(4, "server not found");
}

std::vector<RelayHit> RelaySim::Hits() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return hits_;
}

std::vector<RelayHit> RelaySim::Hits(const std::string &command) const {
    std::lock_guard<std::mutex> lock(mutex_);
    std::vector<RelayHit> selected;
    for (const RelayHit &hit : hits_) {
        if (hit.command == command) {
            selected.push_back(hit);
        }
    }
    return selected;
}

size_t RelaySim::HitCount() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return hits_.size();
}

void RelaySim::ClearHits() {
    std::lock_guard<std::mutex> lock(mutex_);
    hits_.clear();
}

// ---- RelayDirectory.

RelayDirectory::RelayDirectory(int hosts, int first, int port) {
    for (int i = 0; i < hosts; ++i) {
        LoopbackServer::Options options;
        options.host = ProcessLoopbackAddress(first + i);
        options.port = port;
        servers_.push_back(std::make_unique<LoopbackServer>(options));
        sim_.Install(*servers_.back());
    }
}

bool RelayDirectory::Start() {
    for (auto &server : servers_) {
        if (!server->Start()) {
            error_ = server->Error();
            notPermitted_ = BindNotPermitted(*server);
            Stop();
            return false;
        }
    }
    return true;
}

void RelayDirectory::Stop() {
    for (auto &server : servers_) {
        server->Stop();
    }
}

// ---- WebAPI side.

void InstallPingPong(LoopbackServer &server, const std::string &serverId) {
    Json::Value answer(Json::objectValue);
    answer["boot_done"] = true;
    answer["ezid"] = Md5Hex(serverId);
    answer["success"] = true;
    const std::string text = WriteJson(answer);
    server.Route("*", "/+webman/pingpong\\.cgi",
                 [text](const httplib::Request &, httplib::Response &res) {
                     res.set_content(text, "application/json");
                 });
}

RefusedPort::RefusedPort(const std::string &host) : host_(host) {
    fd_ = socket(AF_INET, SOCK_STREAM, 0);
    if (fd_ < 0) {
        return;
    }
    struct sockaddr_in addr;
    memset(&addr, 0, sizeof(addr));
    addr.sin_family = AF_INET;
    addr.sin_port = 0;
    socklen_t len = sizeof(addr);
    if (inet_pton(AF_INET, host.c_str(), &addr.sin_addr) != 1 ||
        bind(fd_, reinterpret_cast<struct sockaddr *>(&addr), sizeof(addr)) != 0 ||
        getsockname(fd_, reinterpret_cast<struct sockaddr *>(&addr), &len) != 0) {
        close(fd_);
        fd_ = -1;
        return;
    }
    port_ = ntohs(addr.sin_port);
}

RefusedPort::~RefusedPort() {
    if (fd_ >= 0) {
        close(fd_);
    }
}

}  // namespace kovasim
