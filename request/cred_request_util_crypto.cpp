// Encryption helpers of KOVA::CredRequestUtil: the server's encryption information, RSA
// encryption under its public key, and pass-phrase AES-256-CBC in both directions.
#include <stdlib.h>

#include <algorithm>
#include <memory>
#include <mutex>
#include <sstream>
#include <vector>

#include <openssl/bn.h>
#include <openssl/core_names.h>
#include <openssl/param_build.h>
#include <openssl/rsa.h>

#include "kovacredential/cred_request_util.h"
#include "platform/json_text.h"
#include "platform/kova_log.h"
#include "platform/vlibc.h"
#include "request/cred_request_transport.h"
#include "request/cred_request_util_p.h"

namespace {

constexpr const char kUnit[] = "cred_request_util";

// Longest text the RSA helper accepts; longer texts are meant to travel under AES.
constexpr size_t kRsaMaxPlain = 512;
constexpr const char kRsaExponentHex[] = "010001";
constexpr int kAesKeyBytes = 32;
constexpr int kAesBlockSize = 16;
constexpr int kAesKdfRounds = 5;
// Size of the pieces fed to the cipher; a multiple of the block size.
constexpr size_t kAesPiece = 32768;

struct FreeDeleter {
    void operator()(void *p) const { free(p); }
};
template <typename T>
using CBuffer = std::unique_ptr<T, FreeDeleter>;

struct BignumDeleter {
    void operator()(BIGNUM *bn) const { BN_free(bn); }
};
struct ParamBldDeleter {
    void operator()(OSSL_PARAM_BLD *bld) const { OSSL_PARAM_BLD_free(bld); }
};
struct ParamDeleter {
    void operator()(OSSL_PARAM *params) const { OSSL_PARAM_free(params); }
};
struct PkeyCtxDeleter {
    void operator()(EVP_PKEY_CTX *ctx) const { EVP_PKEY_CTX_free(ctx); }
};
struct PkeyDeleter {
    void operator()(EVP_PKEY *key) const { EVP_PKEY_free(key); }
};
struct CipherCtxDeleter {
    void operator()(EVP_CIPHER_CTX *ctx) const { EVP_CIPHER_CTX_free(ctx); }
};
using CipherCtx = std::unique_ptr<EVP_CIPHER_CTX, CipherCtxDeleter>;

// Base64 buffer size for n bytes, as the servers' counterpart sizes it.
size_t Base64BufferSize(size_t n) {
    return (4 * n) / 3 + 5;
}

// An RSA public key from a hexadecimal modulus and exponent.
std::unique_ptr<EVP_PKEY, PkeyDeleter> MakeRsaPublicKey(const std::string &modulusHex,
                                                        const char *exponentHex) {
    std::unique_ptr<BIGNUM, BignumDeleter> n(BN_new());
    std::unique_ptr<BIGNUM, BignumDeleter> e(BN_new());
    if (!n || !e) {
        return nullptr;
    }
    BIGNUM *raw = n.get();
    BN_hex2bn(&raw, modulusHex.c_str());
    raw = e.get();
    BN_hex2bn(&raw, exponentHex);

    std::unique_ptr<OSSL_PARAM_BLD, ParamBldDeleter> bld(OSSL_PARAM_BLD_new());
    if (!bld || !OSSL_PARAM_BLD_push_BN(bld.get(), OSSL_PKEY_PARAM_RSA_N, n.get()) ||
        !OSSL_PARAM_BLD_push_BN(bld.get(), OSSL_PKEY_PARAM_RSA_E, e.get())) {
        return nullptr;
    }
    std::unique_ptr<OSSL_PARAM, ParamDeleter> params(OSSL_PARAM_BLD_to_param(bld.get()));
    std::unique_ptr<EVP_PKEY_CTX, PkeyCtxDeleter> ctx(
        EVP_PKEY_CTX_new_from_name(nullptr, "RSA", nullptr));
    if (!params || !ctx || EVP_PKEY_fromdata_init(ctx.get()) <= 0) {
        return nullptr;
    }
    EVP_PKEY *key = nullptr;
    if (EVP_PKEY_fromdata(ctx.get(), &key, EVP_PKEY_PUBLIC_KEY, params.get()) <= 0) {
        return nullptr;
    }
    return std::unique_ptr<EVP_PKEY, PkeyDeleter>(key);
}

// An encryption context set up for PKCS#1 v1.5 under the key; calls duplicate it rather than
// set one up, which would look the algorithms up in the providers again.
std::unique_ptr<EVP_PKEY_CTX, PkeyCtxDeleter> MakeRsaEncryptor(const std::string &modulusHex,
                                                               const char *exponentHex) {
    auto key = MakeRsaPublicKey(modulusHex, exponentHex);
    if (!key) {
        return nullptr;
    }
    std::unique_ptr<EVP_PKEY_CTX, PkeyCtxDeleter> ctx(
        EVP_PKEY_CTX_new_from_pkey(nullptr, key.get(), nullptr));
    if (!ctx || EVP_PKEY_encrypt_init(ctx.get()) <= 0 ||
        EVP_PKEY_CTX_set_rsa_padding(ctx.get(), RSA_PKCS1_PADDING) <= 0) {
        return nullptr;
    }
    return ctx;
}

using SharedEncryptor = std::shared_ptr<const EVP_PKEY_CTX>;

// Encryption contexts for the public keys of the last few servers, most recently used first.
// A login encrypts under the same server key again and again, and importing a key and setting
// up a context for it cost more than encrypting with it. Keys that cannot be set up are not
// kept, so every call for them fails as before. A kept context is only ever duplicated, which
// reads it, so calls on several threads share it safely.
class RsaEncryptorCache {
  public:
    SharedEncryptor Get(const std::string &modulusHex, const char *exponentHex) {
        {
            std::lock_guard<std::mutex> lock(mutex_);
            if (SharedEncryptor found = FindLocked(modulusHex, exponentHex)) {
                return found;
            }
        }
        // Set up without the lock; a thread that set up the same key meanwhile wins.
        SharedEncryptor built(
            MakeRsaEncryptor(modulusHex, exponentHex).release(),
            [](const EVP_PKEY_CTX *ctx) { EVP_PKEY_CTX_free(const_cast<EVP_PKEY_CTX *>(ctx)); });
        if (!built) {
            return nullptr;
        }
        std::lock_guard<std::mutex> lock(mutex_);
        if (SharedEncryptor found = FindLocked(modulusHex, exponentHex)) {
            return found;
        }
        if (entries_.size() == kCapacity) {
            entries_.pop_back();
        }
        entries_.insert(entries_.begin(), Entry{modulusHex, exponentHex, built});
        return built;
    }

  private:
    static constexpr size_t kCapacity = 8;
    struct Entry {
        std::string modulus;
        std::string exponent;
        SharedEncryptor encryptor;
    };

    // The entry's context, moved to the front; null when absent.
    SharedEncryptor FindLocked(const std::string &modulusHex, const char *exponentHex) {
        auto it = std::find_if(entries_.begin(), entries_.end(), [&](const Entry &e) {
            return e.modulus == modulusHex && e.exponent == exponentHex;
        });
        if (it == entries_.end()) {
            return nullptr;
        }
        std::rotate(entries_.begin(), it, it + 1);
        return entries_.front().encryptor;
    }

    std::mutex mutex_;
    std::vector<Entry> entries_;
};

// Process-wide and never destroyed: OpenSSL cleans itself up at exit, after which freeing a
// context would reach into freed provider state.
RsaEncryptorCache &gRsaEncryptors = *new RsaEncryptorCache;

// AES-256-CBC and SHA-1, fetched from the providers once per process (and, like the RSA
// contexts, never freed). EVP_aes_256_cbc() and EVP_sha1() look the algorithm up again on every
// initialisation, six times per key derivation, which costs more than encrypting a kilobyte.
// When a fetch fails those lookups are used as before.
std::once_flag gAesAlgorithmsOnce;
const EVP_CIPHER *gAes256Cbc = nullptr;
const EVP_MD *gSha1 = nullptr;

void FetchAesAlgorithms() {
    std::call_once(gAesAlgorithmsOnce, [] {
        const EVP_CIPHER *cipher = EVP_CIPHER_fetch(nullptr, "AES-256-CBC", nullptr);
        const EVP_MD *digest = EVP_MD_fetch(nullptr, "SHA1", nullptr);
        gAes256Cbc = cipher != nullptr ? cipher : EVP_aes_256_cbc();
        gSha1 = digest != nullptr ? digest : EVP_sha1();
    });
}

// PKCS#1 v1.5 encryption of the whole text on a duplicate of `encryptor`.
bool RsaEncrypt(const EVP_PKEY_CTX *encryptor, const std::string &plain, std::string &out) {
    std::unique_ptr<EVP_PKEY_CTX, PkeyCtxDeleter> ctx(EVP_PKEY_CTX_dup(encryptor));
    if (!ctx) {
        return false;
    }
    const auto *in = reinterpret_cast<const unsigned char *>(plain.data());
    size_t length = 0;
    if (EVP_PKEY_encrypt(ctx.get(), nullptr, &length, in, plain.size()) <= 0) {
        return false;
    }
    out.assign(length, '\0');
    if (EVP_PKEY_encrypt(ctx.get(), reinterpret_cast<unsigned char *>(&out[0]), &length, in,
                         plain.size()) <= 0) {
        return false;
    }
    out.resize(length);
    return true;
}

}  // namespace

constexpr int kLineInitAesKeySize = 118;

int InitAES(const unsigned char *keyData, int keyDataLen, const unsigned char *salt,
            EVP_CIPHER_CTX *encryptCtx, EVP_CIPHER_CTX *decryptCtx) {
    FetchAesAlgorithms();
    unsigned char key[kAesKeyBytes];
    unsigned char iv[EVP_MAX_IV_LENGTH];
    const int size =
        EVP_BytesToKey(gAes256Cbc, gSha1, salt, keyData, keyDataLen, kAesKdfRounds, key, iv);
    if (size != kAesKeyBytes) {
        kova::Log("%s:%d Key size is %d bits - should be 256 bits", kUnit, kLineInitAesKeySize,
                  size);
        return 0;
    }
    if (encryptCtx != nullptr) {
        EVP_CIPHER_CTX_reset(encryptCtx);
        EVP_EncryptInit_ex(encryptCtx, gAes256Cbc, nullptr, key, iv);
    }
    if (decryptCtx != nullptr) {
        EVP_CIPHER_CTX_reset(decryptCtx);
        EVP_DecryptInit_ex(decryptCtx, gAes256Cbc, nullptr, key, iv);
    }
    OPENSSL_cleanse(key, sizeof(key));
    return 1;
}

namespace KOVA {

constexpr int kLineEncInfoBadParam = 144;
constexpr int kLineEncInfoSendFail = 157;
constexpr int kLineEncInfoInvalid = 163;

bool ReadEncInfoAnswer(const std::string &body, Json::Value &info) {
    // jsoncpp's lenient reader: comments and text behind the answer are tolerated.
    Json::Value root;
    if (!kova::JsonFromLenientText(body, root, false) || !root.isObject() ||
        !root.isMember("data")) {
        kova::Log("%s:%d encryption response is invalid", kUnit, kLineEncInfoInvalid);
        return false;
    }
    info = root["data"];
    return true;
}

bool CredRequestUtil::GetEncInfo(const std::string &url, Json::Value &info) {
    if (url.empty()) {
        kova::Log("%s:%d Bad parameters", kUnit, kLineEncInfoBadParam);
        return false;
    }
    try {
        CredRequest request;
        request.SetURL(url);
        Json::Value params(Json::objectValue);
        params["api"] = "KOVA.API.Encryption";
        params["version"] = 1;
        params["method"] = "getinfo";
        params["format"] = "module";
        request.AddPostParam(params);
        if (!ProcessWithTransport(request)) {
            kova::Log("%s:%d Send encryption request fail.[%d]", kUnit, kLineEncInfoSendFail,
                      static_cast<int>(request.GetError()));
            return false;
        }
        return ReadEncInfoAnswer(request.GetResponse(), info);
    } catch (...) {
        return false;
    }
}

constexpr int kLineEncInfoCredBadParam = 183;

bool CredRequestUtil::GetEncInfo(const KOVA_CRED *cred, Json::Value &info) {
    if (cred == nullptr || cred->filled == 0) {
        kova::Log("%s:%d Bad parameters", kUnit, kLineEncInfoCredBadParam);
        return false;
    }
    try {
        // Built by hand rather than with GetURL: no IPv6 brackets and no "fld" mapping here.
        std::ostringstream url;
        url << cred->protocol << "://" << cred->host << ":" << cred->port << "/"
            << "webapi/encryption.cgi";
        return GetEncInfo(url.str(), info);
    } catch (...) {
        return false;
    }
}

constexpr int kLineEncInfoNoId = 203;

bool CredRequestUtil::GetEncInfo(long id, Json::Value &info) {
    try {
        KOVA_CRED cred;
        if (KOVACredGetByID(id, &cred) < 0 || cred.filled == 0) {
            kova::Log("%s:%d Cannot find id[%ld] in database", kUnit, kLineEncInfoNoId, id);
            return false;
        }
        return GetEncInfo(&cred, info);
    } catch (...) {
        return false;
    }
}

constexpr int kLineRsaTooLong = 222;
constexpr int kLineRsaEncryptFail = 234;
constexpr int kLineRsaBase64Fail = 243;

bool CredRequestUtil::GetEncString(const std::string &publicKey, const std::string &plain,
                                   std::string &cipher) {
    if (publicKey.empty() || plain.empty()) {
        return false;
    }
    if (plain.size() > kRsaMaxPlain) {
        kova::Log("%s:%d RSA encrypt fail, text exceed 512 bytes assume using AES", kUnit,
                  kLineRsaTooLong);
        return false;
    }
    try {
        SharedEncryptor encryptor = gRsaEncryptors.Get(publicKey, kRsaExponentHex);
        std::string encrypted;
        if (!encryptor || !RsaEncrypt(encryptor.get(), plain, encrypted)) {
            kova::Log("%s:%d RSA encrypt fail", kUnit, kLineRsaEncryptFail);
            return false;
        }
        const size_t size = Base64BufferSize(encrypted.size());
        CBuffer<char> text(static_cast<char *>(calloc(size, 1)));
        if (!text ||
            VLIBCBase64SzEncodeFull(reinterpret_cast<const unsigned char *>(encrypted.data()),
                                    encrypted.size(), text.get(), size, 0) == 0) {
            kova::Log("%s:%d VLIBCBase64SzEncodeFull fail", kUnit, kLineRsaBase64Fail);
            return false;
        }
        cipher = text.get();
        return true;
    } catch (...) {
        return false;
    }
}

constexpr int kLineAesEncInitFail = 260;
constexpr int kLineAesEncCallocFail = 266;
constexpr int kLineAesEncReinitFail = 270;
constexpr int kLineAesEncUpdateFail = 284;
constexpr int kLineAesEncFinalFail = 298;
constexpr int kLineAesEncB64CallocFail = 306;
constexpr int kLineAesEncB64Fail = 311;

bool CredRequestUtil::GetEncryptAESString(const std::string &passphrase, const std::string &plain,
                                          std::string &cipher) {
    CipherCtx ctx(EVP_CIPHER_CTX_new());
    if (!ctx || InitAES(reinterpret_cast<const unsigned char *>(passphrase.data()),
                        static_cast<int>(passphrase.size()), nullptr, ctx.get(), nullptr) == 0) {
        kova::Log("%s:%d InitAES fail", kUnit, kLineAesEncInitFail);
        return false;
    }
    // Only the bytes the cipher writes are read back, so the buffer is not cleared first.
    CBuffer<unsigned char> out(
        static_cast<unsigned char *>(malloc(2 * kAesBlockSize + plain.size())));
    if (!out) {
        kova::Log("%s:%d calloc ciphertext fail", kUnit, kLineAesEncCallocFail);
        return false;
    }
    if (EVP_EncryptInit_ex(ctx.get(), nullptr, nullptr, nullptr, nullptr) != 1) {
        kova::Log("%s:%d AES Encrypt init fail", kUnit, kLineAesEncReinitFail);
        return false;
    }
    size_t total = 0;
    const auto *in = reinterpret_cast<const unsigned char *>(plain.data());
    size_t remaining = plain.size();
    while (remaining > 0) {
        const bool lastPiece = remaining <= kAesPiece;
        const int piece = static_cast<int>(lastPiece ? remaining : kAesPiece);
        int written = 0;
        if (EVP_EncryptUpdate(ctx.get(), out.get() + total, &written, in, piece) != 1) {
            kova::Log("%s:%d AES Encrypt fail", kUnit, kLineAesEncUpdateFail);
            return false;
        }
        total += static_cast<size_t>(written);
        if (written == 0 || lastPiece) {
            break;
        }
        remaining -= static_cast<size_t>(written);
        in += written;
    }
    int finalLength = 0;
    if (EVP_EncryptFinal_ex(ctx.get(), out.get() + total, &finalLength) != 1) {
        kova::Log("%s:%d AES Encrypt Final fail", kUnit, kLineAesEncFinalFail);
        return false;
    }
    total += static_cast<size_t>(finalLength);

    // The Base64 text is written straight into its final string (a megabyte of cipher text is
    // not copied again); the string's terminator slot takes the encoder's NUL.
    const size_t length = (total + 2) / 3 * 4;
    std::string text;
    try {
        text.resize(length);
    } catch (...) {
        kova::Log("%s:%d calloc Base64 fail", kUnit, kLineAesEncB64CallocFail);
        return false;
    }
    if (VLIBCBase64SzEncodeFull(out.get(), total, &text[0], length + 1, 0) == 0) {
        kova::Log("%s:%d Base64 Encode fail", kUnit, kLineAesEncB64Fail);
        return false;
    }
    cipher.swap(text);
    return true;
}

constexpr int kLineAesDecInitFail = 331;
constexpr int kLineAesDecB64CallocFail = 337;
constexpr int kLineAesDecB64Fail = 343;
constexpr int kLineAesDecCallocFail = 349;
constexpr int kLineAesDecFail = 362;

bool CredRequestUtil::GetDecryptAESString(const std::string &passphrase, const std::string &cipher,
                                          std::string &plain) {
    CipherCtx ctx(EVP_CIPHER_CTX_new());
    if (!ctx || InitAES(reinterpret_cast<const unsigned char *>(passphrase.data()),
                        static_cast<int>(passphrase.size()), nullptr, nullptr, ctx.get()) == 0) {
        kova::Log("%s:%d InitAES fail", kUnit, kLineAesDecInitFail);
        return false;
    }
    CBuffer<unsigned char> decoded(
        static_cast<unsigned char *>(calloc(cipher.size() > 0 ? cipher.size() : 1, 1)));
    if (!decoded) {
        kova::Log("%s:%d calloc Base64 fail", kUnit, kLineAesDecB64CallocFail);
        return false;
    }
    size_t length = cipher.size();
    if (VLIBCBase64Decode(cipher.data(), cipher.size(), decoded.get(), &length) == 0) {
        kova::Log("%s:%d Base64 Decode fail", kUnit, kLineAesDecB64Fail);
        return false;
    }
    CBuffer<unsigned char> out(
        static_cast<unsigned char *>(calloc(2 * kAesBlockSize + length + 1, 1)));
    if (!out) {
        kova::Log("%s:%d calloc plaintext fail", kUnit, kLineAesDecCallocFail);
        return false;
    }
    int written = 0;
    int finalLength = 0;
    if (EVP_DecryptInit_ex(ctx.get(), nullptr, nullptr, nullptr, nullptr) != 1 ||
        EVP_DecryptUpdate(ctx.get(), out.get(), &written, decoded.get(),
                          static_cast<int>(length)) != 1 ||
        EVP_DecryptFinal_ex(ctx.get(), out.get() + written, &finalLength) != 1) {
        kova::Log("%s:%d AES Decrypt fail", kUnit, kLineAesDecFail);
        return false;
    }
    out.get()[written + finalLength] = '\0';
    try {
        // A text with an embedded NUL comes back cut there.
        plain = reinterpret_cast<const char *>(out.get());
    } catch (...) {
        return false;
    }
    return true;
}

}  // namespace KOVA
