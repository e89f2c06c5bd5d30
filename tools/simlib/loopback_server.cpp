#include "simlib/loopback_server.h"

#include <errno.h>
#include <string.h>
#include <strings.h>
#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <limits>
#include <set>

#include <openssl/bn.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509.h>

namespace kovasim {

namespace {

// Set by a route's wrapper while it handles the current request, so that the error handler
// can tell an unmatched request (to record and pass to the fallback) from a route's own error.
thread_local bool tlsRouted = false;

bool SameName(const std::string &a, const std::string &b) {
    return a.size() == b.size() && strcasecmp(a.c_str(), b.c_str()) == 0;
}

// cpp-httplib listens with a backlog of 5, which drops connection attempts when many clients
// connect at once (each drop costs the client a one-second SYN retry). The listening socket is
// found by its port and given a larger backlog; calling listen again only changes the backlog.
void WidenBacklog(int port) {
    for (int fd = 3; fd < 4096; ++fd) {
        int listening = 0;
        socklen_t len = sizeof(listening);
        if (getsockopt(fd, SOL_SOCKET, SO_ACCEPTCONN, &listening, &len) != 0 || !listening) {
            continue;
        }
        struct sockaddr_storage addr;
        socklen_t alen = sizeof(addr);
        if (getsockname(fd, reinterpret_cast<struct sockaddr *>(&addr), &alen) != 0) {
            continue;
        }
        int bound = addr.ss_family == AF_INET
                        ? ntohs(reinterpret_cast<struct sockaddr_in *>(&addr)->sin_port)
                        : ntohs(reinterpret_cast<struct sockaddr_in6 *>(&addr)->sin6_port);
        if (bound == port) {
            listen(fd, 1024);
        }
    }
}

// Ends the connections a server on `port` of `host` has accepted (found by their local
// address among the process's descriptors), so that its workers stop waiting for another
// request on them.
void ShutdownAccepted(const std::string &host, int port) {
    for (int fd = 3; fd < 4096; ++fd) {
        int listening = 0;
        socklen_t len = sizeof(listening);
        if (getsockopt(fd, SOL_SOCKET, SO_ACCEPTCONN, &listening, &len) != 0 || listening) {
            continue;
        }
        struct sockaddr_storage addr;
        socklen_t alen = sizeof(addr);
        if (getsockname(fd, reinterpret_cast<struct sockaddr *>(&addr), &alen) != 0) {
            continue;
        }
        char text[INET6_ADDRSTRLEN] = "";
        int bound = 0;
        if (addr.ss_family == AF_INET) {
            const auto *in = reinterpret_cast<struct sockaddr_in *>(&addr);
            inet_ntop(AF_INET, &in->sin_addr, text, sizeof(text));
            bound = ntohs(in->sin_port);
        } else if (addr.ss_family == AF_INET6) {
            const auto *in6 = reinterpret_cast<struct sockaddr_in6 *>(&addr);
            inet_ntop(AF_INET6, &in6->sin6_addr, text, sizeof(text));
            bound = ntohs(in6->sin6_port);
        }
        if (bound == port && host == text) {
            shutdown(fd, SHUT_RDWR);
        }
    }
}

}  // namespace

std::string RecordedRequest::Header(const std::string &name) const {
    for (const auto &h : headers) {
        if (SameName(h.first, name)) {
            return h.second;
        }
    }
    return "";
}

bool RecordedRequest::HasHeader(const std::string &name) const {
    for (const auto &h : headers) {
        if (SameName(h.first, name)) {
            return true;
        }
    }
    return false;
}

std::string RecordedRequest::Param(const std::string &name) const {
    auto it = params.find(name);
    return it == params.end() ? "" : it->second;
}

bool RecordedRequest::HasParam(const std::string &name) const {
    return params.find(name) != params.end();
}

struct LoopbackServer::KeyMaterial {
    EVP_PKEY *key = nullptr;
    X509 *cert = nullptr;
    ~KeyMaterial() {
        X509_free(cert);
        EVP_PKEY_free(key);
    }
};

LoopbackServer::LoopbackServer() : LoopbackServer(Options()) {}

LoopbackServer::LoopbackServer(const Options &options) : options_(options) {
    if (options_.https) {
        const bool given = !options_.certPem.empty() || !options_.keyPem.empty();
        if (given ? ReadIdentity() : MakeCertificate()) {
            server_ = std::make_unique<httplib::SSLServer>(keys_->cert, keys_->key);
        } else {
            error_ = given ? "cannot read the given certificate and key"
                           : "cannot make a self-signed certificate";
        }
    } else {
        server_ = std::make_unique<httplib::Server>();
    }
    if (!server_) {
        return;
    }
    int threads = options_.threads > 0 ? options_.threads : 1;
    server_->new_task_queue = [this, threads] {
        auto *pool = new httplib::ThreadPool(threads);
        workersStarted_ = true;
        return pool;
    };
    // Without TCP_NODELAY a TLS response waits on delayed ACKs (about 40 ms per request).
    server_->set_tcp_nodelay(true);
    server_->set_keep_alive_max_count(options_.keepAlive ? 1000 : 1);
    // No limit on request bodies, whatever the width of size_t.
    server_->set_payload_max_length(std::numeric_limits<size_t>::max());
    // The body is read after pre-routing, so requests are recorded by the route wrappers and,
    // for unmatched requests, by the error handler.
    server_->set_pre_routing_handler([](const httplib::Request &, httplib::Response &) {
        tlsRouted = false;
        return httplib::Server::HandlerResponse::Unhandled;
    });
    server_->set_error_handler([this](const httplib::Request &req, httplib::Response &res) {
        if (tlsRouted) {
            return;
        }
        Record(req);
        if (fallback_) {
            res.status = 200;
            fallback_(req, res);
        }
    });
}

LoopbackServer::~LoopbackServer() {
    Stop();
}

bool LoopbackServer::MakeCertificate() {
    keys_ = std::make_unique<KeyMaterial>();
    keys_->key = EVP_RSA_gen(2048);
    if (keys_->key == nullptr) {
        return false;
    }
    X509 *cert = X509_new();
    keys_->cert = cert;
    ASN1_INTEGER_set(X509_get_serialNumber(cert), 1);
    X509_gmtime_adj(X509_getm_notBefore(cert), -3600);
    X509_gmtime_adj(X509_getm_notAfter(cert), 7 * 24 * 3600);
    X509_set_pubkey(cert, keys_->key);
    X509_NAME *name = X509_get_subject_name(cert);
    X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_ASC,
                               reinterpret_cast<const unsigned char *>("localhost"), -1, -1, 0);
    X509_set_issuer_name(cert, name);
    if (X509_sign(cert, keys_->key, EVP_sha256()) == 0) {
        return false;
    }
    BIO *bio = BIO_new(BIO_s_mem());
    PEM_write_bio_X509(bio, cert);
    char *data = nullptr;
    long len = BIO_get_mem_data(bio, &data);
    certPem_.assign(data, static_cast<size_t>(len));
    BIO_free(bio);
    return true;
}

bool LoopbackServer::ReadIdentity() {
    keys_ = std::make_unique<KeyMaterial>();
    BIO *bio = BIO_new_mem_buf(options_.certPem.data(), static_cast<int>(options_.certPem.size()));
    keys_->cert = PEM_read_bio_X509(bio, nullptr, nullptr, nullptr);
    BIO_free(bio);
    bio = BIO_new_mem_buf(options_.keyPem.data(), static_cast<int>(options_.keyPem.size()));
    keys_->key = PEM_read_bio_PrivateKey(bio, nullptr, nullptr, nullptr);
    BIO_free(bio);
    if (keys_->cert == nullptr || keys_->key == nullptr ||
        X509_check_private_key(keys_->cert, keys_->key) != 1) {
        return false;
    }
    certPem_ = options_.certPem;
    return true;
}

void LoopbackServer::Route(const std::string &method, const std::string &pattern, Handler handler) {
    if (!server_) {
        return;
    }
    handler = [this, inner = std::move(handler)](const httplib::Request &req,
                                                 httplib::Response &res) {
        tlsRouted = true;
        Record(req);
        inner(req, res);
    };
    if (method == "GET" || method == "*") {
        server_->Get(pattern, handler);
    }
    if (method == "POST" || method == "*") {
        server_->Post(pattern, handler);
    }
    if (method == "PUT") {
        server_->Put(pattern, handler);
    }
    if (method == "DELETE") {
        server_->Delete(pattern, handler);
    }
}

void LoopbackServer::Fallback(Handler handler) {
    fallback_ = std::move(handler);
}

bool LoopbackServer::Start() {
    if (!server_) {
        return false;
    }
    if (running_) {
        return true;
    }
    if (options_.port == 0) {
        port_ = server_->bind_to_any_port(options_.host);
        if (port_ <= 0) {
            error_ = "cannot bind " + options_.host;
            return false;
        }
    } else {
        if (!server_->bind_to_port(options_.host, options_.port)) {
            error_ = "cannot bind " + options_.host + ":" + std::to_string(options_.port) + " (" +
                     strerror(errno) + ")";
            return false;
        }
        port_ = options_.port;
    }
    WidenBacklog(port_);
    running_ = true;
    workersStarted_ = false;
    // The socket is bound and listening already, so clients may connect at once; the accept
    // loop picks their connections up from the backlog.
    thread_ = std::thread([this] { server_->listen_after_bind(); });
    // A stop issued before the accept loop runs would be lost (and Stop would wait forever), so
    // Start returns only once the loop is up, and only once every worker thread exists: a test
    // that forks while threads are still being created can leave its child without a working
    // pthread_create under qemu-user.
    for (int i = 0; i < 6000 && !(server_->is_running() && workersStarted_); ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return true;
}

void LoopbackServer::Stop() {
    if (running_) {
        server_->stop();
        ShutdownAccepted(options_.host, port_);
        if (thread_.joinable()) {
            thread_.join();
        }
        running_ = false;
    }
}

std::string LoopbackServer::BaseUrl() const {
    std::string host =
        options_.host.find(':') != std::string::npos ? "[" + options_.host + "]" : options_.host;
    return std::string(options_.https ? "https" : "http") + "://" + host + ":" +
           std::to_string(port_);
}

void LoopbackServer::Record(const httplib::Request &req) {
    RecordedRequest r;
    r.method = req.method;
    r.path = req.path;
    r.target = req.target;
    size_t q = req.target.find('?');
    if (q != std::string::npos) {
        r.query = req.target.substr(q + 1);
    }
    for (const auto &h : req.headers) {
        r.headers.emplace(h.first, h.second);
    }
    for (const auto &p : req.params) {
        r.params.emplace(p.first, p.second);
    }
    if (req.is_multipart_form_data()) {
        for (const auto &f : req.files) {
            r.parts.push_back(
                {f.second.name, f.second.filename, f.second.content_type, f.second.content});
            if (f.second.filename.empty()) {
                r.params.emplace(f.second.name, f.second.content);
            }
        }
    } else {
        r.body = req.body;
        if (req.get_header_value("Content-Type").find("application/x-www-form-urlencoded") == 0) {
            httplib::Params form;
            httplib::detail::parse_query_text(req.body, form);
            for (const auto &p : form) {
                r.params.emplace(p.first, p.second);
            }
        }
    }
    r.remoteAddr = req.remote_addr;
    r.remotePort = req.remote_port;
    std::lock_guard<std::mutex> lock(mutex_);
    records_.push_back(std::move(r));
}

std::vector<RecordedRequest> LoopbackServer::Requests() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return records_;
}

size_t LoopbackServer::RequestCount() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return records_.size();
}

size_t LoopbackServer::CountPath(const std::string &path) const {
    std::lock_guard<std::mutex> lock(mutex_);
    size_t n = 0;
    for (const auto &r : records_) {
        n += r.path == path ? 1 : 0;
    }
    return n;
}

size_t LoopbackServer::ConnectionCount() const {
    std::lock_guard<std::mutex> lock(mutex_);
    std::set<int> ports;
    for (const auto &r : records_) {
        ports.insert(r.remotePort);
    }
    return ports.size();
}

RecordedRequest LoopbackServer::Last() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return records_.empty() ? RecordedRequest() : records_.back();
}

void LoopbackServer::ClearRecords() {
    std::lock_guard<std::mutex> lock(mutex_);
    records_.clear();
}

RawServer::RawServer(Handler handler, const std::string &host, bool readHead, int port)
    : handler_(std::move(handler)), host_(host), readHead_(readHead), port_(port) {}

RawServer::~RawServer() {
    Stop();
}

bool RawServer::Start() {
    if (listenFd_ >= 0) {
        return true;
    }
    int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        return false;
    }
    int one = 1;
    setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof(one));
    struct sockaddr_in addr = {};
    addr.sin_family = AF_INET;
    addr.sin_port = htons(static_cast<uint16_t>(port_));
    if (inet_pton(AF_INET, host_.c_str(), &addr.sin_addr) != 1 ||
        bind(fd, reinterpret_cast<struct sockaddr *>(&addr), sizeof(addr)) != 0 ||
        listen(fd, 16) != 0) {
        close(fd);
        return false;
    }
    socklen_t len = sizeof(addr);
    getsockname(fd, reinterpret_cast<struct sockaddr *>(&addr), &len);
    port_ = ntohs(addr.sin_port);
    listenFd_ = fd;
    stopping_ = false;
    thread_ = std::thread([this] { Serve(); });
    return true;
}

void RawServer::Stop() {
    if (listenFd_ < 0) {
        return;
    }
    stopping_ = true;
    if (thread_.joinable()) {
        thread_.join();
    }
    close(listenFd_);
    listenFd_ = -1;
}

std::string RawServer::BaseUrl() const {
    return "http://" + host_ + ":" + std::to_string(port_);
}

void RawServer::Serve() {
    while (!stopping_) {
        struct pollfd pfd = {listenFd_, POLLIN, 0};
        if (poll(&pfd, 1, 50) <= 0) {
            continue;
        }
        int fd = accept4(listenFd_, nullptr, nullptr, SOCK_CLOEXEC);
        if (fd < 0) {
            continue;
        }
        Connection conn(fd, accepted_++, &stopping_);
        // Reads the head for at most two seconds; the body, if any, is left unread.
        const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(2);
        char buf[4096];
        while (readHead_ && conn.head_.find("\r\n\r\n") == std::string::npos && !stopping_ &&
               std::chrono::steady_clock::now() < deadline) {
            struct pollfd cfd = {fd, POLLIN, 0};
            if (poll(&cfd, 1, 50) <= 0) {
                continue;
            }
            ssize_t n = recv(fd, buf, sizeof(buf), 0);
            if (n <= 0) {
                break;
            }
            conn.head_.append(buf, static_cast<size_t>(n));
        }
        size_t end = conn.head_.find("\r\n\r\n");
        if (end != std::string::npos) {
            conn.pending_ = conn.head_.substr(end + 4);
            conn.head_.resize(end + 4);
        }
        if (handler_) {
            handler_(conn);
        }
        if (conn.fd_ >= 0) {
            shutdown(fd, SHUT_RDWR);
            close(fd);
        }
    }
}

void RawServer::Connection::Reset() {
    if (fd_ < 0) {
        return;
    }
    // A zero linger time makes close send RST and drop what is unsent.
    struct linger abort = {1, 0};
    setsockopt(fd_, SOL_SOCKET, SO_LINGER, &abort, sizeof(abort));
    close(fd_);
    fd_ = -1;
}

bool RawServer::Connection::Send(const char *data, size_t size) {
    if (fd_ < 0) {
        return false;
    }
    size_t sent = 0;
    while (sent < size) {
        ssize_t n = send(fd_, data + sent, size - sent, MSG_NOSIGNAL);
        if (n <= 0) {
            return false;
        }
        sent += static_cast<size_t>(n);
    }
    return true;
}

bool RawServer::Connection::WaitForClose(int ms) {
    if (fd_ < 0) {
        return true;
    }
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(ms);
    char buf[4096];
    while (!*stopping_ && std::chrono::steady_clock::now() < deadline) {
        struct pollfd pfd = {fd_, POLLIN, 0};
        if (poll(&pfd, 1, 10) <= 0) {
            continue;
        }
        if (recv(fd_, buf, sizeof(buf), 0) <= 0) {
            return true;
        }
    }
    return false;
}

std::string RawServer::Connection::ReadBody(size_t bytes, int ms, const std::string &until) {
    std::string body;
    body.swap(pending_);
    const auto done = [&] {
        return body.size() >= bytes ||
               (!until.empty() && body.size() >= until.size() &&
                body.compare(body.size() - until.size(), until.size(), until) == 0);
    };
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(ms);
    char buf[65536];
    while (!done() && !*stopping_ && std::chrono::steady_clock::now() < deadline) {
        struct pollfd pfd = {fd_, POLLIN, 0};
        if (poll(&pfd, 1, 10) <= 0) {
            continue;
        }
        const size_t want = std::min(sizeof(buf), bytes - body.size());
        ssize_t n = recv(fd_, buf, want, 0);
        if (n <= 0) {
            break;
        }
        body.append(buf, static_cast<size_t>(n));
    }
    return body;
}

void RawServer::Connection::Pause(int ms) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(ms);
    while (!*stopping_ && std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
}

}  // namespace kovasim
