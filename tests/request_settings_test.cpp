// The request settings document: setters and getters, rejected arguments, and the parameter
// and cookie encoders that read the document back.
#include <stdlib.h>

#include <atomic>
#include <functional>
#include <new>
#include <string>

#include <gtest/gtest.h>

#include "kovacredential/cred_request.h"
#include "kovacredential/cred_request_farlink.h"
#include "platform/json_text.h"
#include "request/cred_request_p.h"
#include "support/interpose.h"

namespace {
// The next this many allocations through operator new fail, as they would without memory.
std::atomic<int> gFailingAllocations{0};
}  // namespace

void *operator new(size_t size) {
    if (gFailingAllocations > 0 && gFailingAllocations-- > 0) {
        throw std::bad_alloc();
    }
    void *p = malloc(size == 0 ? 1 : size);
    if (p == nullptr) {
        throw std::bad_alloc();
    }
    return p;
}
// The library's records come from the nothrow form; it takes its memory where the other does.
void *operator new(size_t size, const std::nothrow_t &) noexcept {
    try {
        return ::operator new(size);
    } catch (const std::bad_alloc &) {
        return nullptr;
    }
}
// The replaced operator new takes its memory from malloc, so delete gives it back with free.
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wmismatched-new-delete"
void operator delete(void *p) noexcept {
    free(p);
}
void operator delete(void *p, size_t) noexcept {
    free(p);
}
#pragma GCC diagnostic pop

namespace {

using KOVA::CredRequest;
using KOVA::CredRequestPrivate;

class SettingsTest : public ::testing::Test {
  protected:
    void SetUp() override { kova_test::ClearLog(); }
    CredRequestPrivate p_{nullptr};
    const Json::Value null_;
};

TEST_F(SettingsTest, HeadersMergeAndRawDataRefusesEmptyValues) {
    ASSERT_TRUE(p_.SetData("Header", "X-A", "1"));
    Json::Value more;
    more["X-A"] = "2";
    more["X-B"] = "3";
    ASSERT_TRUE(p_.SetData("Header", more));
    EXPECT_EQ(kova::JsonToString(p_.GetData("Header", "", null_)), "{\"X-A\":\"2\",\"X-B\":\"3\"}");
    EXPECT_TRUE(p_.HasData("Header", "X-B"));
    EXPECT_FALSE(p_.HasData("Header", "X-C"));
    EXPECT_EQ(p_.GetData("Header", "X-A", null_).asString(), "2");
    EXPECT_TRUE(p_.GetData("Header", "X-C", null_).isNull());
    EXPECT_TRUE(p_.GetData("", "", null_).isMember("Header"));

    // Raw data refuses empty values only.
    for (const Json::Value &empty :
         {Json::Value(), Json::Value(Json::objectValue), Json::Value(Json::arrayValue)}) {
        EXPECT_FALSE(p_.SetRawData("K", empty));
    }
    EXPECT_FALSE(p_.SetRawData("", Json::Value(1)));
    EXPECT_EQ(p_.error, KOVA::CRED_REQ_ERR_BAD_PARAM);
    EXPECT_FALSE(p_.HasRawData("K"));
    for (const Json::Value &value : {Json::Value(""), Json::Value(false), Json::Value(0)}) {
        EXPECT_TRUE(p_.SetRawData("K", value));
    }
    EXPECT_TRUE(p_.HasRawData("K"));
}

// Each setter's result and error code: a refused argument sets bad-parameter (a refused
// timeout or mode does not), and no setter clears an earlier error.
TEST_F(SettingsTest, RejectedArgumentsSetBadParam) {
    Json::Value array(Json::arrayValue);
    array.append(1);
    const struct {
        std::function<bool(CredRequest &)> call;
        bool result, setsBadParam;
    } cases[] = {
        {[](CredRequest &r) { return r.AddGetParam("", "v"); }, false, true},
        {[&](CredRequest &r) { return r.AddGetParam(array); }, false, true},
        {[](CredRequest &r) { return r.AddPostParam(Json::Value("text")); }, false, true},
        {[](CredRequest &r) { return r.AddHeader(Json::Value(3)); }, false, true},
        {[](CredRequest &r) { return r.AddCookie("", "x"); }, false, true},
        {[](CredRequest &r) { return r.SetReqStream(nullptr); }, false, true},
        {[](CredRequest &r) { return r.SetRespStream(nullptr); }, false, true},
        {[](CredRequest &r) { return r.SetUploadFile(nullptr, "/tmp/x"); }, false, true},
        {[](CredRequest &r) { return r.SetUploadFile("f", nullptr); }, false, true},
        // With both arguments given the result is true, even when the document refuses the name.
        {[](CredRequest &r) { return r.SetUploadFile("", "/tmp/x"); }, true, true},
        {[](CredRequest &r) { return r.SetUploadFile("f", "/tmp/x"); }, true, false},
        {[](CredRequest &r) { return r.AddGetParam(Json::Value(Json::objectValue)); }, true, false},
        {[](CredRequest &r) { return r.AddHeader("X", ""); }, true, false},
        {[](CredRequest &r) { return r.AddRawParam(""); }, true, false},
        {[](CredRequest &r) { return r.SetDefaultTimeout(0); }, false, false},
        {[](CredRequest &r) { return r.SetEncryptMode(KOVA::CRED_REQ_CRYPTO(3)); }, false, false},
        {[](CredRequest &r) { return r.SetTotalTimeout(-1); }, false, true},
        {[](CredRequest &r) { return r.SetTotalTimeout(0); }, true, false},
        {[](CredRequest &r) { return r.SetCAFile(""); }, false, true},
        {[](CredRequest &r) { return r.SetCAFile("/etc/ssl/certs/ca-certificates.crt"); }, true,
         false},
        {[](CredRequest &r) { return r.SetPinnedPublicKey(""); }, false, true},
    };
    for (KOVA::CRED_REQ_ERR before : {KOVA::CRED_REQ_ERR_NONE, KOVA::CRED_REQ_ERR_BAD_PARAM}) {
        for (size_t i = 0; i < sizeof(cases) / sizeof(cases[0]); ++i) {
            SCOPED_TRACE(std::to_string(i) + " after error " + std::to_string(before));
            CredRequest req;
            req.SetError(before);
            EXPECT_EQ(cases[i].call(req), cases[i].result);
            EXPECT_EQ(req.GetError(),
                      cases[i].setsBadParam ? KOVA::CRED_REQ_ERR_BAD_PARAM : before);
        }
    }
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

TEST_F(SettingsTest, DefaultsTimeoutsAndEncryptionModes) {
    CredRequest req;
    EXPECT_EQ(req.GetURL() + req.GetRequestFormat() + req.GetResponse(), "");
    EXPECT_TRUE(req.GetResponseHeader().isObject() && req.GetResponseHeader().empty());
    EXPECT_FALSE(req.SetDefaultTimeout(-3));
    EXPECT_EQ(req.GetDefaultTimeout(), 120);
    EXPECT_TRUE(req.SetDefaultTimeout(30));
    EXPECT_EQ(req.GetDefaultTimeout(), 30);
    EXPECT_EQ(req.GetResponseTimeout(), 120);
    // Any response timeout is taken, zero and negative ones included.
    EXPECT_TRUE(req.SetResponseTimeout(0));
    EXPECT_EQ(req.GetResponseTimeout(), 0);
    EXPECT_TRUE(req.SetResponseTimeout(-7));
    EXPECT_EQ(req.GetResponseTimeout(), -7);
    EXPECT_TRUE(req.SetEncryptMode(KOVA::CRED_REQ_CRYPTO_AES));
    // No deadline, the 64 MiB cap, and no transfer yet.
    EXPECT_EQ(req.GetTotalTimeout(), 0);
    EXPECT_FALSE(req.SetTotalTimeout(-5));
    EXPECT_TRUE(req.SetTotalTimeout(2500));
    EXPECT_EQ(req.GetTotalTimeout(), 2500);
    EXPECT_EQ(req.GetMaxResponseSize(), size_t{64} << 20);
    req.SetMaxResponseSize(0);
    EXPECT_EQ(req.GetMaxResponseSize(), 0u);
    EXPECT_EQ(req.GetCurlCode(), 0);
    EXPECT_EQ(req.GetCurlErrorText(), "");
    EXPECT_TRUE(req.GetTransferInfo().isNull());
}

// The encoders that read the document back: parameters (plain, JSON-formatted, under an unknown
// encryption mode, not an object), cookies (only the last in name order) and the URL.
TEST_F(SettingsTest, EncodersReadTheDocument) {
    Json::Value params;
    params["b"] = "2";
    params["KovaToken"] = "T";
    EXPECT_EQ(p_.GetParamString(params), "b=2&KovaToken=T");
    EXPECT_EQ(p_.GetParamJsonObj(params), params);
    EXPECT_FALSE(p_.jsonFormat);
    EXPECT_EQ(p_.GetParamString(Json::Value()), "");
    // The JSON format writes values as JSON, but never the token.
    CredRequestPrivate json(nullptr);
    ASSERT_TRUE(json.SetRawData("Format", "JSON"));
    EXPECT_EQ(json.GetParamString(params), "b=%222%22&KovaToken=T");
    EXPECT_TRUE(json.jsonFormat);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
    EXPECT_EQ(p_.GetParamString(Json::Value("text")), "");
    EXPECT_EQ(kova_test::LogCount("cred_request:"), 1u);
    EXPECT_TRUE(kova_test::LogHas("JsonObjTostrPair Fail"));
    // Unknown encryption modes are plain, and an empty token is left out.
    params["KovaToken"] = "";
    EXPECT_EQ(p_.GetParamString(params), "b=2");
    params.removeMember("KovaToken");
    for (const Json::Value &mode : {Json::Value(3), Json::Value("x")}) {
        SCOPED_TRACE(kova::JsonToString(mode));
        ASSERT_TRUE(p_.SetRawData("Crypto", mode));
        EXPECT_EQ(p_.GetParamString(params), "b=2");
        EXPECT_EQ(kova::JsonToString(p_.GetParamJsonObj(params)), "{\"b\":\"2\"}");
    }

    EXPECT_EQ(p_.GetCookies(), "");
    ASSERT_TRUE(p_.SetData("Cookie", Json::Value(Json::objectValue)));
    EXPECT_EQ(p_.GetCookies(), "");
    ASSERT_TRUE(p_.SetData("Cookie", "a", "1"));
    ASSERT_TRUE(p_.SetData("Cookie", "b", "2"));
    EXPECT_EQ(p_.GetCookies(), "b=2");
    ASSERT_TRUE(json.SetRawData("Cookie", "id=1"));
    EXPECT_EQ(json.GetCookies(), "");
    EXPECT_TRUE(kova_test::LogHas("Invalid Cookie format"));

    ASSERT_TRUE(p_.SetRawData("URL", 5));
    EXPECT_FALSE(p_.InitCurlHandler());
    EXPECT_EQ(p_.error, KOVA::CRED_REQ_ERR_NO_URL);
}

// The first allocation of a constructor fails: the object is still usable, reports the generic
// failure, fails every operation, and the exception is logged instead of leaving the library.
TEST_F(SettingsTest, ConstructionWithoutMemoryFailsEveryOperation) {
    gFailingAllocations = 1;
    CredRequest req;
    gFailingAllocations = 1;
    KOVA::CredRequestFarlink client;
    gFailingAllocations = 0;
    EXPECT_EQ(kova_test::LogCount("cred_request:25 Exception: std::bad_alloc"), 1u)
        << kova_test::LogDump();
    EXPECT_EQ(kova_test::LogCount("cred_request_farlink:220 Exception: std::bad_alloc"), 1u);

    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_UNKNOWN);
    EXPECT_FALSE(req.SetURL("http://127.0.0.1:1/"));
    EXPECT_FALSE(req.AddPostParam("a", "b"));
    EXPECT_FALSE(req.Process(true, 0));
    EXPECT_FALSE(req.Login("admin", "secret", "http://127.0.0.1:1/"));
    EXPECT_EQ(req.GetURL(), "");
    EXPECT_EQ(req.GetResponse(), "");
    EXPECT_EQ(req.GetCurlHandler(), nullptr);
    EXPECT_TRUE(req.GetResponseHeader().empty());
    req.SetError(KOVA::CRED_REQ_ERR_NONE);
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_UNKNOWN);

    client.SetServerId("S1");
    Json::Value info;
    EXPECT_FALSE(client.GetServerInfo(info));
    EXPECT_EQ(client.GetError(), KOVA::CRED_REQ_ERR_UNKNOWN);
    EXPECT_TRUE(client.GetErrors().isNull());
}

}  // namespace
