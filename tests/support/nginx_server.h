// Debian's nginx as a child process, for tests and benchmarks that need a real production
// server: TLS with HTTP/2, keep-alive under its own settings, and an access log from which a
// test reads how many connections the clients opened.
//
// Every instance has its own prefix folder (mkdtemp) holding the configuration, a certificate
// for "localhost" and 127.0.0.1 issued by a fresh TestCa (and that CA's), the logs and nginx's
// temporary folders, and listens on a free port of 127.0.0.1. Locations served:
//   /small     a short static body ("hello from nginx\n")
//   /echo      the request body back (needs Debian's echo module; GET answers an empty body)
//   /delay     "delayed\n" after 200 ms (echo module)
//   /proxy/    passed to Options::upstream as plain HTTP (with the /proxy prefix removed)
// Construction and destruction may run on any thread; the object itself is not shared.
#ifndef KOVA_TESTS_SUPPORT_NGINX_SERVER_H
#define KOVA_TESTS_SUPPORT_NGINX_SERVER_H

#include <sys/types.h>

#include <memory>
#include <string>
#include <vector>

#include "support/temp_dir.h"

namespace kova_test {

class NginxServer {
  public:
    struct Options {
        bool tls = true;
        bool http2 = true;                 // with TLS only (ALPN "h2")
        int keepaliveTimeoutSeconds = 75;  // 0 turns keep-alive off
        int keepaliveRequests = 1000;      // requests served per connection
        int http2MaxStreams = 128;         // concurrent streams per HTTP/2 connection
        int workerProcesses = 1;
        std::string upstream;     // "HOST:PORT" behind /proxy/; empty answers 502 there
        std::string extraServer;  // further directives placed inside the server block
    };

    // One line of the access log.
    struct LogEntry {
        long connection = 0;          // nginx's connection serial number
        long connectionRequests = 0;  // 1 for the first request on that connection
        std::string protocol;         // "HTTP/1.1", "HTTP/2.0"
        bool tlsSessionReused = false;
        std::string method;
        int status = 0;
        std::string uri;  // path and query as sent
    };

    explicit NginxServer(const Options &options);
    NginxServer();
    // Stops nginx: SIGTERM, then SIGKILL to its process group after five seconds.
    ~NginxServer();
    NginxServer(const NginxServer &) = delete;
    NginxServer &operator=(const NginxServer &) = delete;

    // Writes the prefix folder and starts nginx, waiting (at most ten seconds) until it
    // accepts connections. A port taken by someone else in between is replaced by another
    // (a few attempts). False with Error() set when nginx is missing or nginx did not come
    // up; Error() then carries nginx's own error log.
    bool Start();
    void Stop();
    const std::string &Error() const { return error_; }

    int Port() const { return port_; }
    // "https://127.0.0.1:PORT" or "http://..." (no trailing slash).
    std::string BaseUrl() const;
    // The PEM certificate file clients may trust to verify the server (CA file).
    std::string CertificateFile() const { return dir_.File("ca.pem"); }
    const std::string &Prefix() const { return dir_.path(); }

    // The access log so far, in order of completion. nginx writes a line once it has
    // finished a request, which can be just after the client got the answer: WaitForRequests
    // first when counting.
    std::vector<LogEntry> AccessLog() const;
    // Waits (at most `ms` milliseconds) until the access log holds at least `count` lines;
    // true if it does.
    bool WaitForRequests(size_t count, int ms = 5000) const;
    // Distinct connections that carried a logged request.
    size_t ConnectionCount() const;
    // Empties the access log (nginx keeps appending to the same file).
    void ClearLog() const;

  private:
    bool WriteConfig();
    bool MakeCertificate();
    bool Launch();

    Options options_;
    TempDir dir_;
    pid_t pid_ = 0;
    int port_ = 0;
    std::string error_;
};

}  // namespace kova_test

#endif  // KOVA_TESTS_SUPPORT_NGINX_SERVER_H
