#include "support/nginx_server.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <set>
#include <sstream>
#include <thread>

#include "support/tls_certs.h"

extern char **environ;

namespace kova_test {

namespace {

constexpr const char *kNginx = "/usr/sbin/nginx";
constexpr const char *kEchoModule = "/usr/lib/nginx/modules/ngx_http_echo_module.so";
constexpr int kPortAttempts = 5;
constexpr int kStartWaitMs = 10000;
constexpr int kStopWaitMs = 5000;
constexpr int kPollMs = 10;

// A port of 127.0.0.1 that was free a moment ago (0 when none could be had).
int FreeLoopbackPort() {
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        return 0;
    }
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t len = sizeof(addr);
    int port = 0;
    if (bind(fd, reinterpret_cast<sockaddr *>(&addr), sizeof(addr)) == 0 &&
        getsockname(fd, reinterpret_cast<sockaddr *>(&addr), &len) == 0) {
        port = ntohs(addr.sin_port);
    }
    close(fd);
    return port;
}

bool Accepts(int port) {
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        return false;
    }
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    addr.sin_port = htons(static_cast<uint16_t>(port));
    const bool ok = connect(fd, reinterpret_cast<sockaddr *>(&addr), sizeof(addr)) == 0;
    close(fd);
    return ok;
}

void Sleep(int ms) {
    std::this_thread::sleep_for(std::chrono::milliseconds(ms));
}

}  // namespace

NginxServer::NginxServer() : NginxServer(Options{}) {}

NginxServer::NginxServer(const Options &options) : options_(options) {}

NginxServer::~NginxServer() {
    Stop();
}

std::string NginxServer::BaseUrl() const {
    return std::string(options_.tls ? "https" : "http") + "://127.0.0.1:" + std::to_string(port_);
}

// A certificate for "localhost" and 127.0.0.1 issued by a CA of its own, whose certificate
// clients may trust.
bool NginxServer::MakeCertificate() {
    const TestCa ca;
    const TlsIdentity identity = ca.Issue("DNS:localhost,IP:127.0.0.1");
    if (identity.certPem.empty() || !WriteFile(dir_.File("ca.pem"), ca.CertPem()) ||
        !WriteFile(dir_.File("cert.pem"), identity.certPem) ||
        !WriteFile(dir_.File("key.pem"), identity.keyPem)) {
        error_ = "cannot make a certificate in " + dir_.path();
        return false;
    }
    return true;
}

bool NginxServer::WriteConfig() {
    const std::string &p = dir_.path();
    const bool echo = access(kEchoModule, R_OK) == 0;
    std::ostringstream c;
    if (echo) {
        c << "load_module " << kEchoModule << ";\n";
    }
    // A master running as root hands requests to workers that would otherwise run as nobody
    // and could not read this private folder.
    if (geteuid() == 0) {
        c << "user root;\n";
    }
    c << "daemon off;\nmaster_process on;\nworker_processes " << options_.workerProcesses
      << ";\nworker_rlimit_nofile 16384;\npid " << p << "/nginx.pid;\nerror_log " << p
      << "/error.log warn;\nevents { worker_connections 8192; }\nhttp {\n"
      << "  log_format kova '$connection $connection_requests $server_protocol "
         "$ssl_session_reused $request_method $status $request_uri';\n"
      << "  access_log " << p << "/access.log kova;\n";
    for (const char *temp : {"client_body", "proxy", "fastcgi", "uwsgi", "scgi"}) {
        c << "  " << temp << "_temp_path " << p << "/tmp_" << temp << ";\n";
    }
    c << "  default_type text/plain;\n"
      << "  keepalive_timeout " << options_.keepaliveTimeoutSeconds << "s;\n"
      << "  keepalive_requests " << options_.keepaliveRequests << ";\n"
      << "  http2_max_concurrent_streams " << options_.http2MaxStreams << ";\n"
      << "  server {\n    listen 127.0.0.1:" << port_;
    if (options_.tls) {
        c << " ssl" << (options_.http2 ? " http2" : "") << ";\n"
          << "    ssl_certificate " << p << "/cert.pem;\n"
          << "    ssl_certificate_key " << p << "/key.pem;\n"
          << "    ssl_session_cache shared:kova:1m;\n";
    } else {
        c << ";\n";
    }
    c << "    location = /small { return 200 \"hello from nginx\\n\"; }\n";
    if (echo) {
        c << "    location = /echo { echo_read_request_body; echo_request_body; }\n"
          << "    location = /delay { echo_sleep 0.2; echo delayed; }\n";
    }
    if (!options_.upstream.empty()) {
        c << "    location /proxy/ { proxy_pass http://" << options_.upstream << "/; }\n";
    } else {
        c << "    location /proxy/ { return 502; }\n";
    }
    c << "    " << options_.extraServer << "\n  }\n}\n";

    if (!WriteFile(dir_.File("nginx.conf"), c.str())) {
        error_ = "cannot write " + dir_.File("nginx.conf");
        return false;
    }
    return true;
}

// Starts nginx on port_ and waits until it accepts connections or has ended.
bool NginxServer::Launch() {
    const std::string prefix = dir_.path() + "/";
    const std::string conf = dir_.File("nginx.conf");
    const std::string errorLog = dir_.File("error.log");
    const std::string output = dir_.File("nginx.out");
    std::vector<std::string> args = {kNginx, "-p", prefix, "-c", conf, "-e", errorLog};
    std::vector<char *> argv;
    for (auto &a : args) {
        argv.push_back(a.data());
    }
    argv.push_back(nullptr);

    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, output.c_str(),
                                     O_WRONLY | O_CREAT | O_APPEND, 0600);
    posix_spawn_file_actions_adddup2(&actions, STDOUT_FILENO, STDERR_FILENO);
    // Its own process group, so that a stuck master and its workers can be ended together.
    posix_spawnattr_t attr;
    posix_spawnattr_init(&attr);
    posix_spawnattr_setflags(
        &attr, POSIX_SPAWN_SETPGROUP | POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
    posix_spawnattr_setpgroup(&attr, 0);
    sigset_t none;
    sigemptyset(&none);
    posix_spawnattr_setsigmask(&attr, &none);
    sigset_t defaults;
    sigfillset(&defaults);
    posix_spawnattr_setsigdefault(&attr, &defaults);
    const int rc = posix_spawn(&pid_, kNginx, &actions, &attr, argv.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    posix_spawnattr_destroy(&attr);
    if (rc != 0) {
        pid_ = 0;
        error_ = std::string("cannot start ") + kNginx + " (scripts/setup installs nginx)";
        return false;
    }
    for (int waited = 0; waited < kStartWaitMs; waited += kPollMs) {
        if (waitpid(pid_, nullptr, WNOHANG) == pid_) {
            pid_ = 0;
            error_ = "nginx ended at start: " + ReadFile(errorLog) + ReadFile(output);
            return false;
        }
        if (Accepts(port_)) {
            return true;
        }
        Sleep(kPollMs);
    }
    error_ = "nginx did not accept connections: " + ReadFile(errorLog);
    Stop();
    return false;
}

bool NginxServer::Start() {
    error_.clear();
    if (access(kNginx, X_OK) != 0) {
        error_ = std::string(kNginx) + " is missing (scripts/setup installs nginx)";
        return false;
    }
    if (options_.tls && !MakeCertificate()) {
        return false;
    }
    for (int attempt = 0; attempt < kPortAttempts; ++attempt) {
        port_ = FreeLoopbackPort();
        if (port_ == 0) {
            error_ = "no free loopback port";
            return false;
        }
        if (!WriteConfig()) {
            return false;
        }
        if (Launch()) {
            return true;
        }
        // Another process took the port between the probe and nginx's bind: try another.
        if (error_.find("Address already in use") == std::string::npos) {
            return false;
        }
    }
    return false;
}

void NginxServer::Stop() {
    if (pid_ <= 0) {
        return;
    }
    // Fast shutdown: the master stops its workers and waits for them before it ends.
    kill(pid_, SIGTERM);
    for (int waited = 0; waited < kStopWaitMs; waited += kPollMs) {
        if (waitpid(pid_, nullptr, WNOHANG) == pid_) {
            pid_ = 0;
            return;
        }
        Sleep(kPollMs);
    }
    kill(-pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
    pid_ = 0;
}

std::vector<NginxServer::LogEntry> NginxServer::AccessLog() const {
    std::vector<LogEntry> entries;
    std::istringstream lines(ReadFile(dir_.File("access.log")));
    for (std::string line; std::getline(lines, line);) {
        std::istringstream fields(line);
        LogEntry e;
        std::string reused;
        if (fields >> e.connection >> e.connectionRequests >> e.protocol >> reused >> e.method >>
            e.status >> e.uri) {
            e.tlsSessionReused = reused == "r";
            entries.push_back(e);
        }
    }
    return entries;
}

bool NginxServer::WaitForRequests(size_t count, int ms) const {
    for (int waited = 0;; waited += kPollMs) {
        if (AccessLog().size() >= count) {
            return true;
        }
        if (waited >= ms) {
            return false;
        }
        Sleep(kPollMs);
    }
}

size_t NginxServer::ConnectionCount() const {
    std::set<long> connections;
    for (const auto &e : AccessLog()) {
        connections.insert(e.connection);
    }
    return connections.size();
}

void NginxServer::ClearLog() const {
    truncate(dir_.File("access.log").c_str(), 0);
}

}  // namespace kova_test
