// TLS material for tests that check certificates: a private CA, server certificates it signs
// for chosen names, and an HTTPS server on loopback that presents one of them.
#ifndef KOVA_TESTS_SUPPORT_TLS_CERTS_H
#define KOVA_TESTS_SUPPORT_TLS_CERTS_H

#include <atomic>
#include <memory>
#include <string>
#include <thread>

namespace httplib {
class SSLServer;
}

namespace kova_test {

// A server certificate with its key, in PEM, and its public key in libcurl's pinned form
// ("sha256//<Base64 of the SHA-256 of the DER public key>").
struct TlsIdentity {
    std::string certPem;
    std::string keyPem;
    std::string pin;
};

// A CA made afresh (EC P-256 keys, valid from an hour ago for a week).
class TestCa {
  public:
    TestCa();
    ~TestCa();
    TestCa(const TestCa &) = delete;
    TestCa &operator=(const TestCa &) = delete;
    // Empty when the CA could not be made.
    const std::string &CertPem() const { return certPem_; }
    // A server certificate signed by this CA whose only names are `subjectAltNames`, in
    // OpenSSL's form ("DNS:other.test", "IP:127.0.0.1", joined with ','). Its subject carries
    // no common name, so only these names count. Empty members when it could not be made.
    TlsIdentity Issue(const std::string &subjectAltNames) const;

  private:
    struct Keys;
    std::unique_ptr<Keys> keys_;
    std::string certPem_;
};

// An HTTPS server on 127.0.0.1 (a free port) presenting `identity`; GET /ok answers "secure".
class TlsServer {
  public:
    explicit TlsServer(const TlsIdentity &identity);
    ~TlsServer();
    TlsServer(const TlsServer &) = delete;
    TlsServer &operator=(const TlsServer &) = delete;
    bool Start();
    // "https://127.0.0.1:PORT/ok".
    std::string Url() const;
    // Requests that reached /ok.
    int Requests() const { return requests_; }

  private:
    std::unique_ptr<httplib::SSLServer> server_;
    std::thread thread_;
    int port_ = 0;
    std::atomic<int> requests_{0};
};

}  // namespace kova_test

#endif  // KOVA_TESTS_SUPPORT_TLS_CERTS_H
