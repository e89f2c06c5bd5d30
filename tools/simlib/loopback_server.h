// A loopback HTTP/HTTPS server for tests, benchmarks and kovasim: per-route handlers over
// cpp-httplib, a self-signed certificate made at start (or an identity the caller gives), and a
// record of every request.
#ifndef KOVASIM_LOOPBACK_SERVER_H
#define KOVASIM_LOOPBACK_SERVER_H

#include <atomic>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include <httplib.h>

namespace kovasim {

// One part of a multipart/form-data body.
struct RecordedPart {
    std::string name;
    std::string filename;
    std::string contentType;
    std::string content;
};

// What reached the server for one request.
struct RecordedRequest {
    std::string method;
    std::string path;                                 // without the query string
    std::string target;                               // path and query exactly as sent
    std::string query;                                // raw query string (after "?"), "" when none
    std::multimap<std::string, std::string> headers;  // names as sent
    std::multimap<std::string, std::string> params;   // decoded query and form fields
    std::string body;                                 // raw body (empty for multipart)
    std::vector<RecordedPart> parts;
    std::string remoteAddr;
    int remotePort = 0;  // the client's port: requests with the same one shared a connection

    // First header with that name, compared without regard to case; "" when absent.
    std::string Header(const std::string &name) const;
    bool HasHeader(const std::string &name) const;
    // First decoded parameter with that name; "" when absent.
    std::string Param(const std::string &name) const;
    bool HasParam(const std::string &name) const;
};

class LoopbackServer {
  public:
    struct Options {
        std::string host = "127.0.0.1";
        int port = 0;        // 0 picks a free port
        bool https = false;  // serve TLS with a self-signed certificate for "localhost"
        // With https: the certificate and its private key (PEM) to present instead of the
        // self-signed one, for example one issued by a test CA. Both or neither.
        std::string certPem;
        std::string keyPem;
        int threads = 16;  // worker threads (concurrent connections served)
        bool keepAlive = true;
    };
    using Handler = std::function<void(const httplib::Request &, httplib::Response &)>;

    LoopbackServer();
    explicit LoopbackServer(const Options &options);
    ~LoopbackServer();
    LoopbackServer(const LoopbackServer &) = delete;
    LoopbackServer &operator=(const LoopbackServer &) = delete;

    // Routes: `method` is "GET", "POST", "PUT", "DELETE" or "*" (GET and POST); `pattern` is a
    // cpp-httplib regular expression over the path. Register routes before Start.
    void Route(const std::string &method, const std::string &pattern, Handler handler);
    // Handler for everything no route matches (default: 404 with an empty body).
    void Fallback(Handler handler);

    // Binds and starts serving on a thread of its own. False when the address cannot be bound
    // (for example port 80 without the right to bind it); Error() says why.
    bool Start();
    // Stops serving. Connections a client keeps alive are ended first, so that stopping does
    // not wait out their keep-alive time.
    void Stop();
    bool Running() const { return running_; }
    const std::string &Error() const { return error_; }

    int Port() const { return port_; }
    const std::string &Host() const { return options_.host; }
    bool Https() const { return options_.https; }
    // "http://127.0.0.1:PORT" (no trailing slash); brackets around an IPv6 host.
    std::string BaseUrl() const;
    // The certificate presented, in PEM form (HTTPS servers only), for clients that want to
    // verify it.
    const std::string &CertificatePem() const { return certPem_; }

    // Every request received so far, in order of arrival.
    std::vector<RecordedRequest> Requests() const;
    size_t RequestCount() const;
    // Requests whose path equals `path`.
    size_t CountPath(const std::string &path) const;
    // Distinct client ports the requests so far came from: the connections they used.
    size_t ConnectionCount() const;
    RecordedRequest Last() const;
    void ClearRecords();

  private:
    void Record(const httplib::Request &req);
    bool MakeCertificate();
    bool ReadIdentity();

    Options options_;
    std::unique_ptr<httplib::Server> server_;
    std::thread thread_;
    std::atomic<bool> running_{false};
    std::atomic<bool> workersStarted_{false};
    int port_ = 0;
    std::string error_;
    std::string certPem_;
    struct KeyMaterial;
    std::unique_ptr<KeyMaterial> keys_;
    mutable std::mutex mutex_;
    std::vector<RecordedRequest> records_;
    Handler fallback_;
};

// A plain TCP server on a loopback address for answers an HTTP library would not give: bodies
// cut off, stalls, malformed header lines. Connections are served one after another; for each,
// the request head (through the blank line) is read and the handler writes what it likes.
class RawServer {
  public:
    class Connection {
      public:
        // Writes all bytes; false once the peer has gone.
        bool Send(const std::string &bytes) { return Send(bytes.data(), bytes.size()); }
        bool Send(const char *data, size_t size);
        // Waits up to `ms` milliseconds; returns early when the server stops.
        void Pause(int ms);
        // Waits up to `ms` milliseconds for the peer to close the connection; true if it did.
        bool WaitForClose(int ms);
        // Ends the connection with a TCP reset instead of an orderly close; later sends fail.
        void Reset();
        // The request head as received (request line and headers).
        const std::string &Head() const { return head_; }
        // Reads the body that follows the head until `bytes` bytes have come, the received
        // bytes end with `until` (when not empty), the peer closes or `ms` milliseconds pass;
        // returns what came. Later calls go on where the last one stopped.
        std::string ReadBody(size_t bytes, int ms, const std::string &until = "");
        // 0 for the first connection the server accepted, 1 for the next, ...
        int Index() const { return index_; }

      private:
        friend class RawServer;
        Connection(int fd, int index, const std::atomic<bool> *stopping)
            : fd_(fd), index_(index), stopping_(stopping) {}
        int fd_;
        int index_;
        const std::atomic<bool> *stopping_;
        std::string head_;
        std::string pending_;  // body bytes that arrived with the head
    };
    using Handler = std::function<void(Connection &)>;

    // With `readHead` false the handler runs as soon as a connection is accepted, before the
    // client has sent anything (Head() stays empty).
    // `port` 0 picks a free one.
    explicit RawServer(Handler handler, const std::string &host = "127.0.0.1", bool readHead = true,
                       int port = 0);
    ~RawServer();
    RawServer(const RawServer &) = delete;
    RawServer &operator=(const RawServer &) = delete;

    bool Start();
    void Stop();
    int Port() const { return port_; }
    std::string BaseUrl() const;
    // Connections accepted so far.
    int ConnectionCount() const { return accepted_; }

  private:
    void Serve();

    Handler handler_;
    std::string host_;
    bool readHead_;
    int listenFd_ = -1;
    int port_;
    std::thread thread_;
    std::atomic<bool> stopping_{false};
    std::atomic<int> accepted_{0};
};

}  // namespace kovasim

#endif  // KOVASIM_LOOPBACK_SERVER_H
