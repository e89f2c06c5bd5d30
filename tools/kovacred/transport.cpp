// How kovacred's requests reach a server: the options that check the server and bound the
// time, applied the same way by every command that makes requests, the public keys pinned on
// first use, and the failure line that names a transfer's cause.
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <strings.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <fstream>
#include <memory>
#include <sstream>
#include <string>

#include <curl/curl.h>
#include <json/value.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509.h>

#include "commands.h"
#include "kovacredential/cred_request.h"

namespace kovacred {

namespace {

constexpr char kKnownServersFile[] = "known_servers";
constexpr long kKeyFetchTimeoutMs = 30000;

struct EasyCleanup {
    void operator()(CURL *easy) const { curl_easy_cleanup(easy); }
};
struct BioFree {
    void operator()(BIO *bio) const { BIO_free(bio); }
};
struct X509Free {
    void operator()(X509 *cert) const { X509_free(cert); }
};

// libcurl's pinned-key form of a certificate in PEM: "sha256//" and the Base64 of the SHA-256
// of its DER public key; "" when it cannot be read.
std::string PinOfCertificate(const std::string &pem) {
    std::unique_ptr<BIO, BioFree> bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
    std::unique_ptr<X509, X509Free> cert(
        bio ? PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr) : nullptr);
    if (!cert) {
        return "";
    }
    unsigned char *der = nullptr;
    const int length = i2d_PUBKEY(X509_get0_pubkey(cert.get()), &der);
    if (length <= 0) {
        return "";
    }
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned int digestLength = 0;
    const bool hashed =
        EVP_Digest(der, static_cast<size_t>(length), digest, &digestLength, EVP_sha256(), nullptr);
    OPENSSL_free(der);
    if (!hashed) {
        return "";
    }
    unsigned char base64[4 * ((EVP_MAX_MD_SIZE + 2) / 3) + 1];
    EVP_EncodeBlock(base64, digest, static_cast<int>(digestLength));
    return "sha256//" + std::string(reinterpret_cast<char *>(base64));
}

// The pin of the key the server at host:port shows now, from a TLS handshake of its own;
// "" (with libcurl's reason in `reason`) when there is none.
std::string FetchPin(const std::string &host, int port, long timeoutMs, std::string &reason) {
    std::unique_ptr<CURL, EasyCleanup> easy(curl_easy_init());
    if (!easy) {
        reason = "libcurl could not start";
        return "";
    }
    char error[CURL_ERROR_SIZE] = "";
    const std::string url = "https://" + host + ":" + std::to_string(port) + "/";
    curl_easy_setopt(easy.get(), CURLOPT_URL, url.c_str());
    curl_easy_setopt(easy.get(), CURLOPT_CONNECT_ONLY, 1L);
    curl_easy_setopt(easy.get(), CURLOPT_CERTINFO, 1L);
    curl_easy_setopt(easy.get(), CURLOPT_SSL_VERIFYPEER, 0L);
    curl_easy_setopt(easy.get(), CURLOPT_SSL_VERIFYHOST, 0L);
    curl_easy_setopt(easy.get(), CURLOPT_TIMEOUT_MS, timeoutMs);
    curl_easy_setopt(easy.get(), CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(easy.get(), CURLOPT_ERRORBUFFER, error);
    const CURLcode rc = curl_easy_perform(easy.get());
    if (rc != CURLE_OK) {
        reason = *error != '\0' ? error : curl_easy_strerror(rc);
        return "";
    }
    struct curl_certinfo *info = nullptr;
    if (curl_easy_getinfo(easy.get(), CURLINFO_CERTINFO, &info) != CURLE_OK || info == nullptr ||
        info->num_of_certs < 1) {
        reason = "the server showed no certificate";
        return "";
    }
    for (struct curl_slist *field = info->certinfo[0]; field != nullptr; field = field->next) {
        if (strncmp(field->data, "Cert:", 5) == 0) {
            const std::string pin = PinOfCertificate(field->data + 5);
            if (!pin.empty()) {
                return pin;
            }
        }
    }
    reason = "the server's certificate could not be read";
    return "";
}

std::string KnownServersPath() {
    const std::string db = DatabasePath();
    const size_t slash = db.rfind('/');
    return (slash == std::string::npos ? std::string() : db.substr(0, slash + 1)) +
           kKnownServersFile;
}

// The pin recorded for "host:port", "" when none is.
std::string KnownPin(const std::string &server) {
    std::ifstream file(KnownServersPath());
    std::string line;
    while (std::getline(file, line)) {
        std::istringstream words(line);
        std::string name;
        std::string pin;
        if (words >> name >> pin && name == server) {
            return pin;
        }
    }
    return "";
}

// Appends "host:port pin" to the known-servers file, made with mode 0600.
bool RecordPin(const std::string &server, const std::string &pin) {
    const std::string path = KnownServersPath();
    const int fd = open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600);
    if (fd < 0) {
        return false;
    }
    const std::string line = server + " " + pin + "\n";
    const bool written = write(fd, line.data(), line.size()) == static_cast<ssize_t>(line.size());
    return close(fd) == 0 && written;
}

}  // namespace

void AddTransportOptions(CLI::App *cmd, Transport *transport) {
    cmd->add_flag("--verify", transport->verify, "verify the server certificate and host name");
    cmd->add_option("--cacert", transport->caFile,
                    "trust the CA certificates of this PEM file (implies --verify)");
    cmd->add_flag("--pin", transport->pin,
                  "accept only the server public key seen on first use (known_servers next to "
                  "the database)");
    cmd->add_option("--max-time", transport->maxTime, "seconds the whole command may take")
        ->check(CLI::PositiveNumber);
}

long Transport::MaxTimeMs() const {
    if (maxTime <= 0) {
        return 0;
    }
    const double elapsed =
        std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start).count();
    return std::max(1L, std::lround(maxTime * 1000 - elapsed));
}

bool PrepareTransport(const std::string &what, Transport &transport, const std::string &scheme,
                      const std::string &host, int port) {
    if (!transport.caFile.empty() && access(transport.caFile.c_str(), R_OK) != 0) {
        FailText(what + " failed: cannot read " + transport.caFile + ": " + strerror(errno));
        return false;
    }
    if (!transport.pin) {
        return true;
    }
    if (strcasecmp(scheme.c_str(), "https") != 0) {
        FailUsage(what + ": --pin needs an https server");
        return false;
    }
    transport.server = host + ":" + std::to_string(port);
    transport.pinned = KnownPin(transport.server);
    if (!transport.pinned.empty()) {
        return true;
    }
    std::string reason;
    const long timeout = transport.MaxTimeMs() > 0 ? transport.MaxTimeMs() : kKeyFetchTimeoutMs;
    transport.pinned = FetchPin(host, port, timeout, reason);
    if (transport.pinned.empty()) {
        FailText(what + " failed: cannot read the public key of " + transport.server + ": " +
                 reason);
        return false;
    }
    if (!RecordPin(transport.server, transport.pinned)) {
        FailText(what + " failed: cannot write " + KnownServersPath() + ": " + strerror(errno));
        return false;
    }
    fprintf(stderr, "kovacred: pinned the public key of %s (%s) in %s\n", transport.server.c_str(),
            transport.pinned.c_str(), KnownServersPath().c_str());
    return true;
}

void ApplyTransport(const Transport &transport, KOVA::CredRequest &request) {
    if (transport.verify || !transport.caFile.empty()) {
        request.SetHTTPSVerify(true);
    }
    if (!transport.caFile.empty()) {
        request.SetCAFile(transport.caFile);
    }
    if (!transport.pinned.empty()) {
        request.SetPinnedPublicKey(transport.pinned);
    }
    if (transport.MaxTimeMs() > 0) {
        request.SetTotalTimeout(transport.MaxTimeMs());
    }
}

std::string TransferCause(KOVA::CredRequest &request) {
    const int code = request.GetCurlCode();
    if (code == CURLE_OK) {
        return "";
    }
    const std::string text = request.GetCurlErrorText();
    return "curl " + std::to_string(code) + (text.empty() ? "" : ": " + text);
}

std::string TransferFailure(KOVA::CredRequest &request, const Transport *transport) {
    const long error = request.GetError();
    std::string cause = TransferCause(request);
    if (request.GetCurlCode() == CURLE_SSL_PINNEDPUBKEYNOTMATCH && transport != nullptr &&
        !transport->pinned.empty()) {
        std::string reason;
        const size_t colon = transport->server.rfind(':');
        const std::string now =
            FetchPin(transport->server.substr(0, colon),
                     atoi(transport->server.c_str() + colon + 1), kKeyFetchTimeoutMs, reason);
        cause = "the public key of " + transport->server + " has changed: known " +
                transport->pinned + ", now " + (now.empty() ? "unreadable (" + reason + ")" : now) +
                "; if the change is expected, delete the line of " + transport->server + " from " +
                KnownServersPath() + " and run again";
    }
    return "(" + ErrorText(error) + ")" + (cause.empty() ? "" : ": " + cause);
}

int FailTransfer(const std::string &what, KOVA::CredRequest &request, const Transport *transport) {
    fprintf(stderr, "kovacred: %s failed %s\n", what.c_str(),
            TransferFailure(request, transport).c_str());
    const long error = request.GetError();
    gExitCode = error >= 1 && error <= 255 ? static_cast<int>(error) : 1;
    return gExitCode;
}

void PrintTiming(KOVA::CredRequest &request) {
    const Json::Value info = request.GetTransferInfo();
    if (!info.isObject()) {
        return;
    }
    fprintf(stderr,
            "kovacred: timing: name lookup %.3f s, connect %.3f s, TLS %.3f s, first byte %.3f s, "
            "total %.3f s, reused %s\n",
            info["namelookup"].asDouble(), info["connect"].asDouble(), info["tls"].asDouble(),
            info["firstByte"].asDouble(), info["total"].asDouble(),
            info["reused"].asBool() ? "yes" : "no");
}

}  // namespace kovacred
