// The request settings document: setters and getters, rejected arguments, and the parameter
// and cookie encoders that read the document back.
#include <stdlib.h>

#include <atomic>
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

TEST_F(SettingsTest, HeadersMergeAndReplace) {
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
}

TEST_F(SettingsTest, RejectedArgumentsSetBadParam) {
    CredRequest req;
    EXPECT_FALSE(req.AddGetParam("", "v"));
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_BAD_PARAM);
    req.SetError(KOVA::CRED_REQ_ERR_NONE);
    Json::Value array(Json::arrayValue);
    array.append(1);
    EXPECT_FALSE(req.AddGetParam(array));
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_BAD_PARAM);
    req.SetError(KOVA::CRED_REQ_ERR_NONE);
    EXPECT_FALSE(req.AddPostParam(Json::Value("text")));
    EXPECT_FALSE(req.AddHeader(Json::Value(3)));
    EXPECT_FALSE(req.AddCookie("", "x"));
    EXPECT_FALSE(req.SetReqStream(nullptr));
    EXPECT_FALSE(req.SetRespStream(nullptr));
    EXPECT_FALSE(req.SetUploadFile(nullptr, "/tmp/x"));
    EXPECT_FALSE(req.SetUploadFile("f", nullptr));
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_BAD_PARAM);
    // With both arguments given the result is true, even when the document refuses the name.
    req.SetError(KOVA::CRED_REQ_ERR_NONE);
    EXPECT_TRUE(req.SetUploadFile("", "/tmp/x"));
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_BAD_PARAM);
    req.SetError(KOVA::CRED_REQ_ERR_NONE);
    EXPECT_TRUE(req.SetUploadFile("f", "/tmp/x"));
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_NONE);
    req.SetError(KOVA::CRED_REQ_ERR_BAD_PARAM);
    // The error is never cleared by a later successful setter.
    EXPECT_TRUE(req.AddGetParam(Json::Value(Json::objectValue)));
    EXPECT_TRUE(req.AddHeader("X", ""));
    EXPECT_TRUE(req.AddRawParam(""));
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_BAD_PARAM);
    EXPECT_TRUE(kova_test::LogRecords().empty());
}

TEST_F(SettingsTest, RawDataRejectsEmptyValuesOnly) {
    EXPECT_FALSE(p_.SetRawData("K", Json::Value()));
    EXPECT_FALSE(p_.SetRawData("K", Json::Value(Json::objectValue)));
    EXPECT_FALSE(p_.SetRawData("K", Json::Value(Json::arrayValue)));
    EXPECT_FALSE(p_.SetRawData("", Json::Value(1)));
    EXPECT_EQ(p_.error, KOVA::CRED_REQ_ERR_BAD_PARAM);
    EXPECT_FALSE(p_.HasRawData("K"));
    EXPECT_TRUE(p_.SetRawData("K", Json::Value("")));
    EXPECT_TRUE(p_.SetRawData("B", Json::Value(false)));
    EXPECT_TRUE(p_.SetRawData("N", Json::Value(0)));
    EXPECT_TRUE(p_.HasRawData("K"));
}

TEST_F(SettingsTest, DefaultsTimeoutsAndEncryptionModes) {
    CredRequest req;
    EXPECT_EQ(req.GetURL(), "");
    EXPECT_EQ(req.GetRequestFormat(), "");
    EXPECT_EQ(req.GetResponse(), "");
    EXPECT_TRUE(req.GetResponseHeader().isObject());
    EXPECT_TRUE(req.GetResponseHeader().empty());
    EXPECT_FALSE(req.SetDefaultTimeout(0));
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
    EXPECT_FALSE(req.SetEncryptMode(static_cast<KOVA::CRED_REQ_CRYPTO>(3)));
    // Neither a refused timeout nor a refused mode counts as a bad parameter.
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_NONE);
}

TEST_F(SettingsTest, ParamStringAndObject) {
    Json::Value params;
    params["b"] = "2";
    params["KovaToken"] = "T";
    EXPECT_EQ(p_.GetParamString(params), "b=2&KovaToken=T");
    EXPECT_EQ(p_.GetParamJsonObj(params), params);
    EXPECT_FALSE(p_.jsonFormat);
    EXPECT_EQ(p_.GetParamString(Json::Value()), "");
    // The JSON format writes values as JSON, but never the token.
    ASSERT_TRUE(p_.SetRawData("Format", "JSON"));
    EXPECT_EQ(p_.GetParamString(params), "b=%222%22&KovaToken=T");
    EXPECT_TRUE(p_.jsonFormat);
    // An empty token is left out.
    CredRequestPrivate plain(nullptr);
    params["KovaToken"] = "";
    EXPECT_EQ(plain.GetParamString(params), "b=2");
}

TEST_F(SettingsTest, UnknownModesAreTreatedAsPlain) {
    Json::Value params;
    params["b"] = "2";
    for (const Json::Value &mode : {Json::Value(3), Json::Value("x")}) {
        SCOPED_TRACE(kova::JsonToString(mode));
        ASSERT_TRUE(p_.SetRawData("Crypto", mode));
        EXPECT_EQ(p_.GetParamString(params), "b=2");
        EXPECT_EQ(kova::JsonToString(p_.GetParamJsonObj(params)), "{\"b\":\"2\"}");
    }
}

TEST_F(SettingsTest, ParamStringOfANonObjectFails) {
    EXPECT_EQ(p_.GetParamString(Json::Value("text")), "");
    EXPECT_TRUE(kova_test::LogHas("cred_request:"));
    EXPECT_TRUE(kova_test::LogHas("JsonObjTostrPair Fail"));
}

TEST_F(SettingsTest, Cookies) {
    EXPECT_EQ(p_.GetCookies(), "");
    ASSERT_TRUE(p_.SetData("Cookie", Json::Value(Json::objectValue)));
    EXPECT_EQ(p_.GetCookies(), "");
    ASSERT_TRUE(p_.SetData("Cookie", "a", "1"));
    ASSERT_TRUE(p_.SetData("Cookie", "b", "2"));
    EXPECT_EQ(p_.GetCookies(), "b=2");
    CredRequestPrivate bad(nullptr);
    ASSERT_TRUE(bad.SetRawData("Cookie", "id=1"));
    EXPECT_EQ(bad.GetCookies(), "");
    EXPECT_TRUE(kova_test::LogHas("Invalid Cookie format"));
}

TEST_F(SettingsTest, NonStringUrlFailsSetUp) {
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
