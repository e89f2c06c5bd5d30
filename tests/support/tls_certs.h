// TLS material for tests and servers that check certificates: a private CA and server
// certificates it signs for chosen names, which a LoopbackServer or nginx then presents.
#ifndef KOVA_TESTS_SUPPORT_TLS_CERTS_H
#define KOVA_TESTS_SUPPORT_TLS_CERTS_H

#include <memory>
#include <string>

#include "simlib/loopback_server.h"

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

// What TrustPem, a TLS context callback for CredRequest::SetSSLVerify, gets: a certificate
// (PEM) to add to the trusted ones, and a count of its calls.
struct TrustedPem {
    std::string pem;
    int calls = 0;
};
void TrustPem(void *curl, void *sslCtx, void *trustedPem);

// Options of a LoopbackServer on 127.0.0.1 that serves HTTPS with `identity`.
kovasim::LoopbackServer::Options HttpsWith(const TlsIdentity &identity);

}  // namespace kova_test

#endif  // KOVA_TESTS_SUPPORT_TLS_CERTS_H
