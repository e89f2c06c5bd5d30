// Encryption helpers and the encrypted parameter envelopes, checked by decrypting with OpenSSL
// directly: RSA with the private half of a key made here, AES with a key derived here.
#include <string.h>

#include <atomic>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include <curl/curl.h>
#include <gtest/gtest.h>
#include <openssl/bn.h>
#include <openssl/core_names.h>
#include <openssl/evp.h>
#include <openssl/rsa.h>

#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_util.h"
#include "kovacredential/kovaplatform.h"
#include "platform/json_text.h"
#include "request/cred_request_p.h"
#include "simlib/loopback_server.h"
#include "support/child.h"
#include "support/interpose.h"
#include "support/temp_dir.h"

namespace {

using KOVA::CredRequestUtil;

struct PkeyDeleter {
    void operator()(EVP_PKEY *k) const { EVP_PKEY_free(k); }
};
using Pkey = std::unique_ptr<EVP_PKEY, PkeyDeleter>;

std::string ModulusHex(EVP_PKEY *key) {
    BIGNUM *n = nullptr;
    EVP_PKEY_get_bn_param(key, OSSL_PKEY_PARAM_RSA_N, &n);
    char *hex = BN_bn2hex(n);
    std::string out(hex);
    OPENSSL_free(hex);
    BN_free(n);
    return out;
}

const unsigned char *Bytes(const std::string &s) {
    return reinterpret_cast<const unsigned char *>(s.data());
}

std::string Unbase64(const std::string &text) {
    std::string out(text.size(), '\0');
    const int n = EVP_DecodeBlock(reinterpret_cast<unsigned char *>(&out[0]), Bytes(text),
                                  static_cast<int>(text.size()));
    const size_t pad = text.size() - text.find_last_not_of('=') - 1;
    return n < 0 ? "<bad base64>" : out.substr(0, static_cast<size_t>(n) - pad);
}

std::string RsaDecrypt(EVP_PKEY *key, const std::string &base64) {
    const std::string raw = Unbase64(base64);
    std::unique_ptr<EVP_PKEY_CTX, void (*)(EVP_PKEY_CTX *)> ctx(EVP_PKEY_CTX_new(key, nullptr),
                                                                EVP_PKEY_CTX_free);
    std::string out(1024, '\0');
    size_t len = out.size();
    const bool ok = ctx && EVP_PKEY_decrypt_init(ctx.get()) > 0 &&
                    EVP_PKEY_CTX_set_rsa_padding(ctx.get(), RSA_PKCS1_PADDING) > 0 &&
                    EVP_PKEY_decrypt(ctx.get(), reinterpret_cast<unsigned char *>(&out[0]), &len,
                                     Bytes(raw), raw.size()) > 0;
    return ok ? out.substr(0, len) : "<decrypt failed>";
}

// AES-256-CBC under a key and IV derived from `pass` (SHA-1, five rounds, no salt).
std::string AesDecrypt(const std::string &pass, const std::string &base64) {
    unsigned char key[32];
    unsigned char iv[16];
    EVP_BytesToKey(EVP_aes_256_cbc(), EVP_sha1(), nullptr, Bytes(pass),
                   static_cast<int>(pass.size()), 5, key, iv);
    const std::string raw = Unbase64(base64);
    std::string out(raw.size() + 32, '\0');
    auto *at = reinterpret_cast<unsigned char *>(&out[0]);
    int n1 = 0;
    int n2 = 0;
    std::unique_ptr<EVP_CIPHER_CTX, void (*)(EVP_CIPHER_CTX *)> ctx(EVP_CIPHER_CTX_new(),
                                                                    EVP_CIPHER_CTX_free);
    const bool ok =
        EVP_DecryptInit_ex(ctx.get(), EVP_aes_256_cbc(), nullptr, key, iv) == 1 &&
        EVP_DecryptUpdate(ctx.get(), at, &n1, Bytes(raw), static_cast<int>(raw.size())) == 1 &&
        EVP_DecryptFinal_ex(ctx.get(), at + n1, &n2) == 1;
    return ok ? out.substr(0, static_cast<size_t>(n1 + n2)) : "<decrypt failed>";
}

std::string PercentDecode(const std::string &s) {
    int n = 0;
    char *raw = curl_easy_unescape(nullptr, s.c_str(), static_cast<int>(s.size()), &n);
    std::string out(raw, static_cast<size_t>(n));
    curl_free(raw);
    return out;
}

class CryptoTest : public ::testing::Test {
  protected:
    static void SetUpTestSuite() {
        key2048_ = EVP_RSA_gen(2048);
        key1024_ = EVP_RSA_gen(1024);
    }
    static void TearDownTestSuite() {
        EVP_PKEY_free(key2048_);
        EVP_PKEY_free(key1024_);
    }
    void SetUp() override { kova_test::ClearLog(); }
    static EVP_PKEY *key2048_;
    static EVP_PKEY *key1024_;
};
EVP_PKEY *CryptoTest::key2048_ = nullptr;
EVP_PKEY *CryptoTest::key1024_ = nullptr;

// The RSA text decrypts with the private key, and PKCS#1 v1.5 padding makes each one differ.
// Empty inputs are refused silently. Up to 512 bytes pass the length test and are then limited
// by the key (a 1024-bit key takes at most 128 - 11 bytes); longer texts are meant for AES.
TEST_F(CryptoTest, RsaEncryptionAndItsLimits) {
    struct Case {
        EVP_PKEY *key;  // nullptr: the key text below
        const char *keyText;
        size_t length;
        bool ok;
        const char *log;
    };
    const Case cases[] = {
        {nullptr, "", 1, false, nullptr},
        {key2048_, nullptr, 0, false, nullptr},
        {nullptr, "not-hex", 1, false, " RSA encrypt fail"},
        {key2048_, nullptr, 18, true, nullptr},
        {key2048_, nullptr, 512, false, " RSA encrypt fail"},
        {key2048_, nullptr, 513, false,
         " RSA encrypt fail, text exceed 512 bytes assume using AES"},
        {key1024_, nullptr, 117, true, nullptr},
        {key1024_, nullptr, 120, false, " RSA encrypt fail"},
    };
    // The second pass finds the keys already imported: results and records stay the same.
    for (int pass = 0; pass < 2; ++pass) {
        for (const Case &c : cases) {
            const std::string key = c.key != nullptr ? ModulusHex(c.key) : c.keyText;
            SCOPED_TRACE(std::to_string(pass) + " " + key.substr(0, 8) + " " +
                         std::to_string(c.length));
            kova_test::ClearLog();
            const std::string text(c.length, 'a');
            std::string cipher = "untouched";
            ASSERT_EQ(CredRequestUtil::GetEncString(key, text, cipher), c.ok);
            const std::vector<std::string> log = kova_test::LogRecords();
            ASSERT_EQ(log.size(), c.log != nullptr ? 1u : 0u) << kova_test::LogDump();
            if (!c.ok) {
                // The output is left alone; a record is "cred_request_util:<line>" and the text.
                EXPECT_EQ(cipher, "untouched");
                EXPECT_TRUE(c.log == nullptr || (log[0].rfind("cred_request_util:", 0) == 0 &&
                                                 log[0].substr(log[0].find(' ')) == c.log))
                    << log[0];
                continue;
            }
            // The key size in bytes, Base64-encoded.
            EXPECT_EQ(cipher.size(), static_cast<size_t>(EVP_PKEY_get_size(c.key) + 2) / 3 * 4);
            EXPECT_EQ(RsaDecrypt(c.key, cipher), text);
            std::string again;
            ASSERT_TRUE(CredRequestUtil::GetEncString(key, text, again));
            EXPECT_NE(cipher, again);
        }
    }
}

// More server keys than the cache of imported keys holds, used from several threads at once
// (in a child with an alarm): every text decrypts under the private half of the modulus it
// was encrypted for, and a key that cannot be used fails with its one record on every call.
TEST_F(CryptoTest, RsaKeysBeyondTheCacheFromThreads) {
    constexpr int kKeys = 12;
    constexpr int kThreads = 4;
    constexpr int kCalls = 60;
    std::vector<Pkey> keys;
    std::vector<std::string> moduli;
    for (int k = 0; k < kKeys; ++k) {
        keys.emplace_back(EVP_RSA_gen(512));
        ASSERT_NE(keys.back(), nullptr);
        moduli.push_back(ModulusHex(keys.back().get()));
    }
    auto walk = [&](int t, std::atomic<int> &wrong) {
        for (int i = 0; i < kCalls; ++i) {
            const int k = (i * (t + 1) + t) % kKeys;  // an order of the keys per thread
            const std::string text = std::to_string(t) + "/" + std::to_string(i);
            std::string cipher;
            if (!CredRequestUtil::GetEncString(moduli[k], text, cipher) ||
                RsaDecrypt(keys[k].get(), cipher) != text ||
                (i % 10 == 0 && CredRequestUtil::GetEncString("not-hex", text, cipher))) {
                ++wrong;
            }
        }
    };
    // Exit 1: a wrong result; 2: records other than one per unusable key.
    auto run = [&] {
        kova_test::ClearLog();
        std::atomic<int> wrong{0};
        std::vector<std::thread> threads;
        for (int t = 0; t < kThreads; ++t) {
            threads.emplace_back(walk, t, std::ref(wrong));
        }
        for (std::thread &thread : threads) {
            thread.join();
        }
        const size_t failures = kThreads * kCalls / 10;
        return wrong != 0 ? 1
               : kova_test::LogCount(" RSA encrypt fail") == failures &&
                       kova_test::LogRecords().size() == failures
                   ? 0
                   : 2;
    };
    EXPECT_EQ(kova_test::RunInChild(60, run), "exit 0");
}

// The AES text is deterministic for a passphrase, padded to whole blocks (one block for an
// empty text), decrypts with OpenSSL directly, and comes back cut at a NUL. A wrong pass
// phrase, or a text that is no Base64, fails to decrypt and leaves the output alone.
TEST_F(CryptoTest, AesRoundTripsAndDecryptFailures) {
    std::string longText;
    for (int i = 0; longText.size() < 100000; ++i)
        longText += std::to_string(i) + ",";
    const std::pair<std::string, std::string> cases[] = {
        {"account=admin&passwd=s%C3%A9cret", "account=admin&passwd=s%C3%A9cret"},
        {"", ""},
        {longText, longText},
        {std::string("ab\0cd", 5), "ab"},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.first.substr(0, 40));
        std::string cipher;
        ASSERT_TRUE(CredRequestUtil::GetEncryptAESString("pass phrase", c.first, cipher));
        EXPECT_EQ(Unbase64(cipher).size(), (c.first.size() / 16 + 1) * 16);
        EXPECT_EQ(AesDecrypt("pass phrase", cipher), c.first);
        std::string again;
        ASSERT_TRUE(CredRequestUtil::GetEncryptAESString("pass phrase", c.first, again));
        EXPECT_EQ(cipher, again);
        std::string back;
        ASSERT_TRUE(CredRequestUtil::GetDecryptAESString("pass phrase", cipher, back));
        EXPECT_EQ(back, c.second);
    }

    std::string cipher;
    ASSERT_TRUE(CredRequestUtil::GetEncryptAESString("right", "some secret text", cipher));
    int failures = 0;
    for (const char *wrong : {"wrong", "Right", "right ", "other", "x"}) {
        std::string plain = "untouched";
        if (!CredRequestUtil::GetDecryptAESString(wrong, cipher, plain)) {
            ++failures;
            EXPECT_EQ(plain, "untouched");
        }
    }
    // A wrong key passes the padding check now and then (about 1 in 256).
    EXPECT_GE(failures, 4);
    EXPECT_EQ(kova_test::LogCount("AES Decrypt fail"), static_cast<size_t>(failures));
    std::string plain;
    EXPECT_FALSE(CredRequestUtil::GetDecryptAESString("k", "***", plain));
    EXPECT_TRUE(kova_test::LogHas("Base64 Decode fail"));
    EXPECT_FALSE(CredRequestUtil::GetDecryptAESString("k", "", plain));
    EXPECT_EQ(kova_test::LogCount("AES Decrypt fail"), static_cast<size_t>(failures) + 1);
}

// ---- GetEncInfo and the envelopes, against a loopback server.

class EncInfoTest : public CryptoTest {
  protected:
    void SetUp() override {
        CryptoTest::SetUp();
        server_.Route("POST", "/webapi/encryption.cgi",
                      [this](const httplib::Request &, httplib::Response &res) {
                          res.set_content(answer_, "application/json");
                      });
        server_.Route("*", "/webapi/entry.cgi",
                      [](const httplib::Request &req, httplib::Response &res) {
                          res.set_content(req.body, "text/plain");
                      });
        ASSERT_TRUE(server_.Start());
        answer_ =
            "{\"success\":true,\"data\":{\"cipherkey\":\"__cIpHeRtExT\",\"ciphertoken\":"
            "\"client_time\",\"public_key\":\"" +
            ModulusHex(key2048_) + "\",\"server_time\":1700000000}}";
    }
    std::string EncUrl() const { return server_.BaseUrl() + "/webapi/encryption.cgi"; }

    kovasim::LoopbackServer server_;
    std::string answer_;
};

// The data object counts even beside "success":false, and comments or text around the answer
// are tolerated; an answer without one is invalid. A credential is asked at its encryption
// CGI once it was loaded; a record never loaded or an unknown id sends nothing.
TEST_F(EncInfoTest, AnswersAndFailures) {
    const std::pair<std::string, const char *> cases[] = {
        {answer_, "__cIpHeRtExT"},
        {"{\"success\":false,\"data\":{\"cipherkey\":\"k\"}}", "k"},
        {"/* module */ {\"data\":{\"cipherkey\":\"k\"}}\n<!-- served in 1 ms -->", "k"},
        {"{\"success\":true}", nullptr},
        {"<html>", nullptr},
        {"[1,2]", nullptr},
        {"", nullptr},
        {"{\"data\":{\"cipherkey\":\"k\",\"x\":" + std::string(1000, '[') + std::string(1000, ']') +
             "}}",
         nullptr},
    };
    Json::Value info;
    for (const auto &c : cases) {
        SCOPED_TRACE(c.first);
        answer_ = c.first;
        kova_test::ClearLog();
        EXPECT_EQ(CredRequestUtil::GetEncInfo(EncUrl(), info), c.second != nullptr);
        EXPECT_EQ(kova_test::LogHas("encryption response is invalid"), c.second == nullptr)
            << kova_test::LogDump();
        if (c.second != nullptr) {
            EXPECT_EQ(info["cipherkey"].asString(), c.second);
        }
        auto r = server_.Last();
        EXPECT_EQ(r.Param("api"), "KOVA.API.Encryption");
        EXPECT_EQ(r.Param("version"), "1");
        EXPECT_EQ(r.Param("method"), "getinfo");
        EXPECT_EQ(r.Param("format"), "module");
    }
    EXPECT_FALSE(CredRequestUtil::GetEncInfo(server_.BaseUrl() + "/nothing", info));
    EXPECT_TRUE(kova_test::LogHas("Send encryption request fail.[14]")) << kova_test::LogDump();
    EXPECT_FALSE(CredRequestUtil::GetEncInfo("", info));
    EXPECT_TRUE(kova_test::LogHas("Bad parameters"));

    KOVA_CRED cred;
    cred.protocol = "http";
    cred.host = "127.0.0.1";
    cred.port = server_.Port();
    const size_t sent = server_.RequestCount();
    kova_test::ClearLog();
    EXPECT_FALSE(CredRequestUtil::GetEncInfo(&cred, info));  // never loaded
    EXPECT_EQ(kova_test::LogCount("Bad parameters"), 1u);
    EXPECT_FALSE(CredRequestUtil::GetEncInfo(static_cast<const KOVA_CRED *>(nullptr), info));
    EXPECT_EQ(server_.RequestCount(), sent);
    answer_ = cases[0].first;
    cred.filled = 1;
    ASSERT_TRUE(CredRequestUtil::GetEncInfo(&cred, info));
    EXPECT_EQ(server_.Last().path, "/webapi/encryption.cgi");
    EXPECT_EQ(info["ciphertoken"].asString(), "client_time");

    kova_test::TempDatabase db;
    EXPECT_FALSE(CredRequestUtil::GetEncInfo(987654L, info));
    EXPECT_TRUE(kova_test::LogHas("Cannot find id[987654] in database")) << kova_test::LogDump();
}

int InstalledToken(char *token, size_t tokenSize, char *key, size_t keySize) {
    snprintf(token, tokenSize, "%s", "token-0123456789");
    snprintf(key, keySize, "%s", "aes-key-abcdefghijklmnopqrstuvwx");
    return 0;
}

// The RSA envelope on the wire holds every parameter but the CSRF token, with the client time.
// Either envelope fails to an empty string without what it needs (an encryption URL, a token);
// the AES envelope then encrypts every parameter but the CSRF token under the token's key.
TEST_F(EncInfoTest, RsaAndAesEnvelopesAndTheirFailures) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(server_.BaseUrl() + "/webapi/entry.cgi"));
    ASSERT_TRUE(req.SetEncURL(EncUrl()));
    ASSERT_TRUE(req.SetEncryptParam(false));  // still selects RSA
    ASSERT_TRUE(req.AddPostParam("account", "admin"));
    ASSERT_TRUE(req.AddPostParam("passwd", "p w"));
    ASSERT_TRUE(req.AddPostParam("KovaToken", "TOK"));
    ASSERT_TRUE(req.Process(true, 0)) << kova_test::LogDump();
    const auto r = server_.Last();
    EXPECT_EQ(r.path, "/webapi/entry.cgi");
    ASSERT_TRUE(r.HasParam("__cIpHeRtExT")) << r.body;
    EXPECT_FALSE(r.HasParam("account"));
    EXPECT_EQ(r.Param("KovaToken"), "TOK");
    EXPECT_EQ(r.body.rfind("&KovaToken=TOK"), r.body.size() - 14);
    EXPECT_EQ(RsaDecrypt(key2048_, r.Param("__cIpHeRtExT")),
              "account=admin&client_time=1700000000&passwd=p%20w");

    const std::string aesKey = "aes-key-abcdefghijklmnopqrstuvwx";
    KOVA::CredRequestPrivate p(nullptr);
    Json::Value params;
    params["b"] = "2";
    params["a"] = "x y";
    params["KovaToken"] = "T";
    ASSERT_TRUE(p.SetRawData("Crypto", 1));
    EXPECT_EQ(p.GetParamString(params), "");
    EXPECT_TRUE(kova_test::LogHas("Get encryption url fail"));
    EXPECT_TRUE(kova_test::LogHas("GetRSAEncParamString Fail"));
    EXPECT_TRUE(p.GetParamJsonObj(params).isNull());

    ASSERT_TRUE(p.SetRawData("Crypto", 2));
    KOVACloudServiceHxtokenSetProvider(nullptr);
    EXPECT_EQ(p.GetParamString(params), "");
    EXPECT_TRUE(kova_test::LogHas("Get Token Fail"));
    EXPECT_TRUE(kova_test::LogHas("GetAESEncParam Fail"));

    KOVACloudServiceHxtokenSetProvider(InstalledToken);
    std::string s = p.GetParamString(params);
    Json::Value tokenOnly;
    tokenOnly["KovaToken"] = "T";
    Json::Value fields = p.GetParamJsonObj(tokenOnly);
    KOVACloudServiceHxtokenSetProvider(nullptr);

    const std::string head = "__tXeTrEhPiC=\"";
    ASSERT_EQ(s.rfind(head, 0), 0u) << s;
    size_t close = s.find('"', head.size());
    ASSERT_NE(close, std::string::npos);
    EXPECT_EQ(s.substr(close), "\"&__nEkOtReHpIc=\"token-0123456789\"&KovaToken=T");
    std::string text = PercentDecode(s.substr(head.size(), close - head.size()));
    std::string plain;
    ASSERT_TRUE(CredRequestUtil::GetDecryptAESString(aesKey, text, plain));
    EXPECT_EQ(plain, "a=x%20y&b=2");

    // As form fields, the token is encrypted like any other field.
    ASSERT_TRUE(fields.isObject());
    EXPECT_EQ(fields.size(), 2u);
    EXPECT_EQ(fields["__nEkOtReHpIc"].asString(), "token-0123456789");
    ASSERT_TRUE(
        CredRequestUtil::GetDecryptAESString(aesKey, fields["__tXeTrEhPiC"].asString(), plain));
    EXPECT_EQ(plain, "KovaToken=T");
}

}  // namespace
