#include "support/tls_certs.h"

#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/sha.h>
#include <openssl/ssl.h>
#include <openssl/x509.h>
#include <openssl/x509v3.h>

#include <atomic>

namespace kova_test {

namespace {

struct KeyFree {
    void operator()(EVP_PKEY *key) const { EVP_PKEY_free(key); }
};
struct CertFree {
    void operator()(X509 *cert) const { X509_free(cert); }
};
using KeyPtr = std::unique_ptr<EVP_PKEY, KeyFree>;
using CertPtr = std::unique_ptr<X509, CertFree>;

KeyPtr NewKey() {
    return KeyPtr(EVP_EC_gen("P-256"));
}

// A certificate for `key` with the validity every test certificate has, not yet signed.
CertPtr NewCertificate(EVP_PKEY *key, long serial) {
    CertPtr cert(X509_new());
    if (!cert) {
        return cert;
    }
    X509_set_version(cert.get(), 2);
    ASN1_INTEGER_set(X509_get_serialNumber(cert.get()), serial);
    X509_gmtime_adj(X509_getm_notBefore(cert.get()), -3600);
    X509_gmtime_adj(X509_getm_notAfter(cert.get()), 7 * 24 * 3600);
    X509_set_pubkey(cert.get(), key);
    return cert;
}

bool AddExtension(X509 *cert, X509 *issuer, int nid, const char *value) {
    X509V3_CTX ctx;
    X509V3_set_ctx_nodb(&ctx);
    X509V3_set_ctx(&ctx, issuer, cert, nullptr, nullptr, 0);
    X509_EXTENSION *ext = X509V3_EXT_conf_nid(nullptr, &ctx, nid, value);
    if (ext == nullptr) {
        return false;
    }
    const bool added = X509_add_ext(cert, ext, -1) == 1;
    X509_EXTENSION_free(ext);
    return added;
}

template <typename Write>
std::string Pem(Write write) {
    BIO *bio = BIO_new(BIO_s_mem());
    std::string text;
    if (bio != nullptr && write(bio)) {
        char *data = nullptr;
        const long length = BIO_get_mem_data(bio, &data);
        text.assign(data, static_cast<size_t>(length));
    }
    BIO_free(bio);
    return text;
}

std::string Pin(EVP_PKEY *key) {
    unsigned char *der = nullptr;
    const int length = i2d_PUBKEY(key, &der);
    if (length <= 0) {
        return std::string();
    }
    unsigned char digest[SHA256_DIGEST_LENGTH];
    SHA256(der, static_cast<size_t>(length), digest);
    OPENSSL_free(der);
    unsigned char base64[4 * ((SHA256_DIGEST_LENGTH + 2) / 3) + 1];
    EVP_EncodeBlock(base64, digest, SHA256_DIGEST_LENGTH);
    return "sha256//" + std::string(reinterpret_cast<char *>(base64));
}

}  // namespace

struct TestCa::Keys {
    KeyPtr key;
    CertPtr cert;
};

TestCa::TestCa() : keys_(std::make_unique<Keys>()) {
    keys_->key = NewKey();
    if (!keys_->key) {
        return;
    }
    keys_->cert = NewCertificate(keys_->key.get(), 1);
    X509 *cert = keys_->cert.get();
    if (cert == nullptr) {
        return;
    }
    X509_NAME *name = X509_get_subject_name(cert);
    X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_ASC,
                               reinterpret_cast<const unsigned char *>("kova test CA"), -1, -1, 0);
    X509_set_issuer_name(cert, name);
    if (!AddExtension(cert, cert, NID_basic_constraints, "critical,CA:TRUE") ||
        !AddExtension(cert, cert, NID_key_usage, "critical,keyCertSign,cRLSign") ||
        !AddExtension(cert, cert, NID_subject_key_identifier, "hash") ||
        X509_sign(cert, keys_->key.get(), EVP_sha256()) == 0) {
        return;
    }
    certPem_ = Pem([cert](BIO *bio) { return PEM_write_bio_X509(bio, cert) == 1; });
}

TestCa::~TestCa() = default;

TlsIdentity TestCa::Issue(const std::string &subjectAltNames) const {
    TlsIdentity identity;
    static std::atomic<long> serial{2};
    KeyPtr key = NewKey();
    if (!key || certPem_.empty()) {
        return identity;
    }
    CertPtr cert = NewCertificate(key.get(), serial++);
    if (!cert) {
        return identity;
    }
    X509 *issuer = keys_->cert.get();
    X509_set_issuer_name(cert.get(), X509_get_subject_name(issuer));
    if (!AddExtension(cert.get(), issuer, NID_basic_constraints, "critical,CA:FALSE") ||
        !AddExtension(cert.get(), issuer, NID_ext_key_usage, "serverAuth") ||
        !AddExtension(cert.get(), issuer, NID_authority_key_identifier, "keyid:always") ||
        !AddExtension(cert.get(), issuer, NID_subject_alt_name, subjectAltNames.c_str()) ||
        X509_sign(cert.get(), keys_->key.get(), EVP_sha256()) == 0) {
        return identity;
    }
    identity.certPem = Pem([&](BIO *bio) { return PEM_write_bio_X509(bio, cert.get()) == 1; });
    identity.keyPem = Pem([&](BIO *bio) {
        return PEM_write_bio_PrivateKey(bio, key.get(), nullptr, nullptr, 0, nullptr, nullptr) == 1;
    });
    identity.pin = Pin(key.get());
    return identity;
}

void TrustPem(void *, void *sslCtx, void *trustedPem) {
    auto *trusted = static_cast<TrustedPem *>(trustedPem);
    ++trusted->calls;
    BIO *bio = BIO_new_mem_buf(trusted->pem.data(), static_cast<int>(trusted->pem.size()));
    CertPtr cert(PEM_read_bio_X509(bio, nullptr, nullptr, nullptr));
    BIO_free(bio);
    X509_STORE_add_cert(SSL_CTX_get_cert_store(static_cast<SSL_CTX *>(sslCtx)), cert.get());
}

kovasim::LoopbackServer::Options HttpsWith(const TlsIdentity &identity) {
    kovasim::LoopbackServer::Options options;
    options.https = true;
    options.certPem = identity.certPem;
    options.keyPem = identity.keyPem;
    return options;
}

}  // namespace kova_test
