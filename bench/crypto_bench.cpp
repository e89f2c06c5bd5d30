// The encryption helpers against direct OpenSSL calls doing the same work, Base64 of the result
// included: AES-256-CBC under an EVP_BytesToKey(SHA-1, 5 rounds) key against raw EVP, and RSA
// PKCS#1 v1.5 under a hexadecimal modulus against two floors, EVP with the key imported on
// every call and the legacy RSA_public_encrypt with the key set on an RSA object. Then a full
// CreateWebAPIRequest + Process cycle against the in-process simulator with a warm description
// cache and a stored session.
//
// Usage: crypto_bench [scale] [rounds]   (scale multiplies the iteration counts; default 1;
// rounds of each comparison, default 21)
#include <stdio.h>
#include <stdlib.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include <openssl/bn.h>
#include <openssl/core_names.h>
#include <openssl/evp.h>
#include <openssl/param_build.h>
#include <openssl/rsa.h>

#include "bench_support.h"
#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_util.h"
#include "kovacredential/kovacred.h"
#include "simlib/loopback_server.h"
#include "simlib/webapi_sim.h"

namespace {

using kova_bench::Median;

using Clock = std::chrono::steady_clock;

std::string Base64(const unsigned char *data, size_t length) {
    std::string out(4 * ((length + 2) / 3) + 1, '\0');
    int n =
        EVP_EncodeBlock(reinterpret_cast<unsigned char *>(&out[0]), data, static_cast<int>(length));
    out.resize(n > 0 ? static_cast<size_t>(n) : 0);
    return out;
}

bool DirectAes(const std::string &passphrase, const std::string &plain, std::string &cipher) {
    unsigned char key[32];
    unsigned char iv[16];
    if (EVP_BytesToKey(EVP_aes_256_cbc(), EVP_sha1(), nullptr,
                       reinterpret_cast<const unsigned char *>(passphrase.data()),
                       static_cast<int>(passphrase.size()), 5, key, iv) != 32) {
        return false;
    }
    std::unique_ptr<EVP_CIPHER_CTX, decltype(&EVP_CIPHER_CTX_free)> ctx(EVP_CIPHER_CTX_new(),
                                                                        EVP_CIPHER_CTX_free);
    std::vector<unsigned char> out(plain.size() + 32);
    int len = 0;
    int finalLen = 0;
    if (!ctx || EVP_EncryptInit_ex(ctx.get(), EVP_aes_256_cbc(), nullptr, key, iv) != 1 ||
        EVP_EncryptUpdate(ctx.get(), out.data(), &len,
                          reinterpret_cast<const unsigned char *>(plain.data()),
                          static_cast<int>(plain.size())) != 1 ||
        EVP_EncryptFinal_ex(ctx.get(), out.data() + len, &finalLen) != 1) {
        return false;
    }
    cipher = Base64(out.data(), static_cast<size_t>(len + finalLen));
    return true;
}

bool DirectRsa(const std::string &modulusHex, const std::string &plain, std::string &cipher) {
    BIGNUM *n = nullptr;
    BIGNUM *e = nullptr;
    BN_hex2bn(&n, modulusHex.c_str());
    BN_hex2bn(&e, "010001");
    std::unique_ptr<BIGNUM, decltype(&BN_free)> nOwner(n, BN_free);
    std::unique_ptr<BIGNUM, decltype(&BN_free)> eOwner(e, BN_free);
    std::unique_ptr<OSSL_PARAM_BLD, decltype(&OSSL_PARAM_BLD_free)> bld(OSSL_PARAM_BLD_new(),
                                                                        OSSL_PARAM_BLD_free);
    if (!n || !e || !bld || !OSSL_PARAM_BLD_push_BN(bld.get(), OSSL_PKEY_PARAM_RSA_N, n) ||
        !OSSL_PARAM_BLD_push_BN(bld.get(), OSSL_PKEY_PARAM_RSA_E, e)) {
        return false;
    }
    std::unique_ptr<OSSL_PARAM, decltype(&OSSL_PARAM_free)> params(
        OSSL_PARAM_BLD_to_param(bld.get()), OSSL_PARAM_free);
    std::unique_ptr<EVP_PKEY_CTX, decltype(&EVP_PKEY_CTX_free)> fromData(
        EVP_PKEY_CTX_new_from_name(nullptr, "RSA", nullptr), EVP_PKEY_CTX_free);
    EVP_PKEY *raw = nullptr;
    if (!params || !fromData || EVP_PKEY_fromdata_init(fromData.get()) <= 0 ||
        EVP_PKEY_fromdata(fromData.get(), &raw, EVP_PKEY_PUBLIC_KEY, params.get()) <= 0) {
        return false;
    }
    std::unique_ptr<EVP_PKEY, decltype(&EVP_PKEY_free)> key(raw, EVP_PKEY_free);
    std::unique_ptr<EVP_PKEY_CTX, decltype(&EVP_PKEY_CTX_free)> ctx(
        EVP_PKEY_CTX_new_from_pkey(nullptr, key.get(), nullptr), EVP_PKEY_CTX_free);
    size_t length = 0;
    const unsigned char *in = reinterpret_cast<const unsigned char *>(plain.data());
    if (!ctx || EVP_PKEY_encrypt_init(ctx.get()) <= 0 ||
        EVP_PKEY_CTX_set_rsa_padding(ctx.get(), RSA_PKCS1_PADDING) <= 0 ||
        EVP_PKEY_encrypt(ctx.get(), nullptr, &length, in, plain.size()) <= 0) {
        return false;
    }
    std::vector<unsigned char> out(length);
    if (EVP_PKEY_encrypt(ctx.get(), out.data(), &length, in, plain.size()) <= 0) {
        return false;
    }
    cipher = Base64(out.data(), length);
    return true;
}

// Legacy floor: the key set directly on an RSA object, as callers did before EVP keys.
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wdeprecated-declarations"
bool LegacyRsa(const std::string &modulusHex, const std::string &plain, std::string &cipher) {
    BIGNUM *n = nullptr;
    BIGNUM *e = nullptr;
    BN_hex2bn(&n, modulusHex.c_str());
    BN_hex2bn(&e, "010001");
    std::unique_ptr<RSA, decltype(&RSA_free)> rsa(RSA_new(), RSA_free);
    if (!n || !e || !rsa || RSA_set0_key(rsa.get(), n, e, nullptr) != 1) {
        BN_free(n);
        BN_free(e);
        return false;
    }
    std::vector<unsigned char> out(static_cast<size_t>(RSA_size(rsa.get())));
    int length = RSA_public_encrypt(static_cast<int>(plain.size()),
                                    reinterpret_cast<const unsigned char *>(plain.data()),
                                    out.data(), rsa.get(), RSA_PKCS1_PADDING);
    if (length < 0) {
        return false;
    }
    cipher = Base64(out.data(), static_cast<size_t>(length));
    return true;
}
#pragma GCC diagnostic pop

// Seconds per call over `iterations` calls; negative when a call fails.
double PerCall(const std::function<bool()> &op, int iterations) {
    Clock::time_point start = Clock::now();
    for (int i = 0; i < iterations; ++i) {
        if (!op()) {
            return -1;
        }
    }
    return std::chrono::duration<double>(Clock::now() - start).count() / iterations;
}

struct Floor {
    const char *name;
    std::function<bool()> op;
};

// The library against each floor in rounds whose order alternates, so that drift of a shared
// machine hits every side alike. Prints median times and the median of the per-round ratios
// floor / library (1.00: no overhead; above 1: faster than the floor).
bool Compare(const char *name, const std::function<bool()> &library,
             const std::vector<Floor> &floors, int iterations, int rounds) {
    std::vector<double> libTimes;
    std::vector<std::vector<double>> floorTimes(floors.size()), ratios(floors.size());
    for (int round = 0; round < rounds; ++round) {
        double lib = 0;
        std::vector<double> raw(floors.size());
        const bool libraryFirst = round % 2 == 0;
        if (libraryFirst) {
            lib = PerCall(library, iterations);
        }
        for (size_t f = 0; f < floors.size(); ++f) {
            const size_t i = libraryFirst ? f : floors.size() - 1 - f;
            raw[i] = PerCall(floors[i].op, iterations);
        }
        if (!libraryFirst) {
            lib = PerCall(library, iterations);
        }
        if (lib < 0 || std::any_of(raw.begin(), raw.end(), [](double t) { return t < 0; })) {
            fprintf(stderr, "%s: an operation failed\n", name);
            return false;
        }
        libTimes.push_back(lib);
        for (size_t f = 0; f < floors.size(); ++f) {
            floorTimes[f].push_back(raw[f]);
            ratios[f].push_back(raw[f] / lib);
        }
    }
    for (size_t f = 0; f < floors.size(); ++f) {
        printf("%-22s %-28s %10.1f %10.1f %7.3f\n", f == 0 ? name : "", floors[f].name,
               1e6 * Median(libTimes), 1e6 * Median(floorTimes[f]), Median(ratios[f]));
    }
    return true;
}

}  // namespace

int main(int argc, char **argv) {
    const int scale = argc > 1 ? std::max(1, atoi(argv[1])) : 1;
    const int rounds = argc > 2 ? std::max(1, atoi(argv[2])) : 21;
    const std::string passphrase = "kova-bench-pass-phrase";
    const std::string small(1024, 'k');
    const std::string large(1024 * 1024, 'K');
    const std::string rsaPlain = "account=admin&passwd=secret&format=sid&__cIpHeRtOkEn=1700000000";

    kovasim::WebApiSim sim;
    const std::string modulus = sim.PublicKeyHex();

    // Both sides must produce the same text, or the comparison is meaningless.
    std::string a;
    std::string b;
    if (!KOVA::CredRequestUtil::GetEncryptAESString(passphrase, small, a) ||
        !DirectAes(passphrase, small, b) || a != b) {
        fprintf(stderr, "AES outputs differ\n");
        return 1;
    }

    // The RSA sides must agree too: each text decrypts to the plain text only under the right
    // key, so equal lengths and successful calls are what can be checked without it.
    if (!KOVA::CredRequestUtil::GetEncString(modulus, rsaPlain, a) ||
        !DirectRsa(modulus, rsaPlain, b) || a.size() != b.size() ||
        !LegacyRsa(modulus, rsaPlain, b) || a.size() != b.size()) {
        fprintf(stderr, "RSA outputs differ\n");
        return 1;
    }

    printf("%d rounds per comparison, order alternating; times are medians\n", rounds);
    printf("%-22s %-28s %10s %10s %7s\n", "operation", "floor", "library us", "floor us", "ratio");
    std::string out;
    bool ok = Compare(
        "AES-256-CBC 1 KB",
        [&] { return KOVA::CredRequestUtil::GetEncryptAESString(passphrase, small, out); },
        {{"raw EVP", [&] { return DirectAes(passphrase, small, out); }}}, 2000 * scale, rounds);
    ok = ok &&
         Compare(
             "AES-256-CBC 1 MB",
             [&] { return KOVA::CredRequestUtil::GetEncryptAESString(passphrase, large, out); },
             {{"raw EVP", [&] { return DirectAes(passphrase, large, out); }}}, 20 * scale, rounds);
    ok = ok &&
         Compare(
             "RSA-2048 PKCS#1 v1.5",
             [&] { return KOVA::CredRequestUtil::GetEncString(modulus, rsaPlain, out); },
             {{"EVP, key imported per call", [&] { return DirectRsa(modulus, rsaPlain, out); }},
              {"RSA_public_encrypt, key set", [&] { return LegacyRsa(modulus, rsaPlain, out); }}},
             200 * scale, rounds);
    printf("(ratio = median over rounds of floor time / library time; 1.00 means no overhead)\n\n");
    if (!ok) {
        return 1;
    }

    // A full WebAPI call cycle: factory (cached description, stored session) + Process.
    char dirTemplate[] = "/tmp/crypto_bench.XXXXXX";
    if (mkdtemp(dirTemplate) == nullptr) {
        return 1;
    }
    const std::string db = std::string(dirTemplate) + "/credentials.sqlite";
    setenv("kovacredential_db", db.c_str(), 1);
    kovasim::LoopbackServer server;
    sim.Install(server);
    if (!server.Start()) {
        fprintf(stderr, "cannot start the simulator: %s\n", server.Error().c_str());
        return 1;
    }
    KOVA_CRED cred;
    cred.protocol = "http";
    cred.host = "127.0.0.1";
    cred.port = server.Port();
    cred.remote_account = "admin";
    cred.remote_passwd = "secret";
    if (KOVACredAdd(&cred) != 0) {
        fprintf(stderr, "cannot store the credential\n");
        return 1;
    }
    Json::Value params;
    params["greeting"] = "hello";
    auto cycle = [&] {
        std::unique_ptr<KOVA::CredRequest> request(
            KOVA::CredRequest::CreateWebAPIRequest(cred.id, "KOVA.Demo.Echo", 1, "echo", params));
        return request && request->Process(true, 0);
    };
    if (!cycle()) {  // logs in, stores the session and fills the description cache
        fprintf(stderr, "the first call failed\n");
        return 1;
    }
    const int calls = 300 * scale;
    Clock::time_point start = Clock::now();
    for (int i = 0; i < calls; ++i) {
        if (!cycle()) {
            fprintf(stderr, "call %d failed\n", i);
            return 1;
        }
    }
    double seconds = std::chrono::duration<double>(Clock::now() - start).count();
    printf(
        "CreateWebAPIRequest(credId) + Process, warm cache: %d calls in %.2f s = %.0f calls/s "
        "(%u description queries, %zu logins)\n",
        calls, seconds, calls / seconds, static_cast<unsigned>(sim.QueryHits()),
        sim.Logins().size());
    server.Stop();
    unlink(db.c_str());
    rmdir(dirTemplate);
    return 0;
}
