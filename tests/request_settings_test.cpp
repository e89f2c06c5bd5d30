// The request settings document: setters and getters, rejected arguments, and the parameter
// and cookie encoders that read the document back.
#include <stdio.h>

#include <string>

#include <gtest/gtest.h>

#include "kovacredential/cred_request.h"
#include "platform/json_text.h"
#include "request/cred_request_p.h"
#include "support/interpose.h"

namespace {

using KOVA::CredRequest;
using KOVA::CredRequestPrivate;

class SettingsTest : public ::testing::Test {
  protected:
    void SetUp() override { kova_test::ClearLog(); }
    CredRequestPrivate p_{nullptr};
    const Json::Value null_;
};

TEST_F(SettingsTest, FreshRequest) {
    CredRequest req;
    EXPECT_EQ(req.GetURL(), "");
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_NONE);
    EXPECT_EQ(req.GetDefaultTimeout(), 120);
    EXPECT_EQ(req.GetResponseTimeout(), 120);
    EXPECT_EQ(req.GetRequestFormat(), "");
    EXPECT_EQ(req.GetCurlHandler(), nullptr);
    EXPECT_EQ(req.GetResponse(), "");
    EXPECT_TRUE(req.GetResponseHeader().isObject());
    EXPECT_TRUE(req.GetResponseHeader().empty());
}

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

TEST_F(SettingsTest, UrlAndRawBody) {
    CredRequest req;
    EXPECT_TRUE(req.SetURL(""));
    EXPECT_EQ(req.GetURL(), "");
    EXPECT_TRUE(req.SetURL("http://a/b"));
    EXPECT_EQ(req.GetURL(), "http://a/b");
    EXPECT_TRUE(req.AddRawParam("one"));
    EXPECT_TRUE(req.AddRawParam(""));
}

TEST_F(SettingsTest, Timeouts) {
    CredRequest req;
    EXPECT_FALSE(req.SetDefaultTimeout(0));
    EXPECT_FALSE(req.SetDefaultTimeout(-3));
    EXPECT_EQ(req.GetDefaultTimeout(), 120);
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_NONE);
    EXPECT_TRUE(req.SetDefaultTimeout(30));
    EXPECT_EQ(req.GetDefaultTimeout(), 30);
    EXPECT_EQ(req.GetResponseTimeout(), 120);
    EXPECT_TRUE(req.SetResponseTimeout(0));
    EXPECT_EQ(req.GetResponseTimeout(), 0);
    EXPECT_TRUE(req.SetResponseTimeout(-7));
    EXPECT_EQ(req.GetResponseTimeout(), -7);
}

TEST_F(SettingsTest, EncryptionModes) {
    CredRequest req;
    EXPECT_TRUE(req.SetEncryptMode(KOVA::CRED_REQ_CRYPTO_AES));
    EXPECT_FALSE(req.SetEncryptMode(static_cast<KOVA::CRED_REQ_CRYPTO>(3)));
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_NONE);

    ASSERT_TRUE(p_.SetRawData("Crypto", 2));
    EXPECT_EQ(p_.GetData("Crypto", "", null_).asInt(), 2);
}

TEST_F(SettingsTest, HeaderModes) {
    CredRequest req;
    EXPECT_TRUE(req.SetRespHeaderToJsonValue(true));
    EXPECT_TRUE(req.SetRespHeaderToStdout(false));
    EXPECT_TRUE(req.SetRespHeaderToStdout(true, "msg"));
}

TEST_F(SettingsTest, RespStreamKeepsAnEarlierWriter) {
    CredRequest req;
    FILE *f = tmpfile();
    ASSERT_NE(f, nullptr);
    EXPECT_TRUE(req.SetRespStream(f));
    EXPECT_TRUE(req.SetRespStream(f, nullptr));
    fclose(f);
}

TEST_F(SettingsTest, ParamStringPlain) {
    Json::Value params;
    params["b"] = "2";
    params["KovaToken"] = "T";
    EXPECT_EQ(p_.GetParamString(params), "b=2&KovaToken=T");
    params["KovaToken"] = "";
    EXPECT_EQ(p_.GetParamString(params), "b=2");
    EXPECT_EQ(p_.GetParamString(Json::Value()), "");
    EXPECT_FALSE(p_.jsonFormat);
}

TEST_F(SettingsTest, UnknownModesAreTreatedAsPlain) {
    Json::Value params;
    params["b"] = "2";
    ASSERT_TRUE(p_.SetRawData("Crypto", 3));
    EXPECT_EQ(p_.GetParamString(params), "b=2");
    ASSERT_TRUE(p_.SetRawData("Crypto", "x"));
    EXPECT_EQ(p_.GetParamString(params), "b=2");
    EXPECT_EQ(kova::JsonToString(p_.GetParamJsonObj(params)), "{\"b\":\"2\"}");
}

TEST_F(SettingsTest, ParamStringJsonFormat) {
    ASSERT_TRUE(p_.SetRawData("Format", "JSON"));
    Json::Value params;
    params["s"] = "v";
    params["KovaToken"] = "T";
    EXPECT_EQ(p_.GetParamString(params), "s=%22v%22&KovaToken=T");
    EXPECT_TRUE(p_.jsonFormat);
}

TEST_F(SettingsTest, ParamStringOfANonObjectFails) {
    EXPECT_EQ(p_.GetParamString(Json::Value("text")), "");
    EXPECT_TRUE(kova_test::LogHas("cred_request:"));
    EXPECT_TRUE(kova_test::LogHas("JsonObjTostrPair Fail"));
}

TEST_F(SettingsTest, ParamJsonObjKeepsToken) {
    Json::Value params;
    params["x"] = "1";
    params["KovaToken"] = "T";
    EXPECT_EQ(p_.GetParamJsonObj(params), params);
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

TEST_F(SettingsTest, HeaderCallbackStoresNameAndValue) {
    Json::Value headers(Json::objectValue);
    char line[] = "Content-Type: text/html\r\n";
    EXPECT_EQ(CredRequestPrivate::WriteHeaderToJsonValue(line, 1, sizeof(line) - 1, &headers),
              sizeof(line) - 1);
    EXPECT_EQ(headers["Content-Type"].asString(), "text/html");
    char status[] = "HTTP/1.1 200 OK\r\n";
    CredRequestPrivate::WriteHeaderToJsonValue(status, 1, sizeof(status) - 1, &headers);
    EXPECT_EQ(headers.size(), 1u);
    char bare[] = "X:\r\n";
    EXPECT_EQ(CredRequestPrivate::WriteHeaderToJsonValue(bare, 1, 4, &headers), 4u);
    EXPECT_FALSE(headers.isMember("X"));
    EXPECT_TRUE(kova_test::LogHas("HTTP header has no value:"));
}

TEST_F(SettingsTest, ReadFromStreamHonoursTheSharedLimit) {
    FILE *f = tmpfile();
    ASSERT_NE(f, nullptr);
    fputs(std::string(100, 'r').c_str(), f);
    rewind(f);
    CredRequest req;
    req.SetReqStreamSize(10);
    char buffer[16384];
    EXPECT_EQ(CredRequestPrivate::ReadFromStream(buffer, 1, sizeof(buffer), f), 10u);
    EXPECT_EQ(CredRequestPrivate::ReadFromStream(buffer, 1, sizeof(buffer), f), 0u);
    CredRequest other;  // clears the limit
    EXPECT_EQ(CredRequestPrivate::ReadFromStream(buffer, 1, sizeof(buffer), f), 90u);
    fclose(f);
}

TEST_F(SettingsTest, SetUpTwiceKeepsTheHandle) {
    ASSERT_TRUE(p_.SetRawData("URL", "http://127.0.0.1:1/"));
    ASSERT_TRUE(p_.InitCurlHandler());
    CURL *first = p_.curl;
    ASSERT_NE(first, nullptr);
    EXPECT_TRUE(p_.InitCurlHandler());
    EXPECT_EQ(p_.curl, first);
}

TEST_F(SettingsTest, NonStringUrlFailsSetUp) {
    ASSERT_TRUE(p_.SetRawData("URL", 5));
    EXPECT_FALSE(p_.InitCurlHandler());
    EXPECT_EQ(p_.error, KOVA::CRED_REQ_ERR_NO_URL);
}

TEST_F(SettingsTest, UploadMovesSidIntoTheQuery) {
    ASSERT_TRUE(p_.SetRawData("URL", "http://127.0.0.1:1/up"));
    ASSERT_TRUE(p_.SetData("File", "f", "/nonexistent"));
    ASSERT_TRUE(p_.SetData("PostParam", "_sid", "S"));
    ASSERT_TRUE(p_.SetData("PostParam", "x", "1"));
    ASSERT_TRUE(p_.InitCurlHandler());
    EXPECT_FALSE(p_.HasData("PostParam", "_sid"));
    EXPECT_EQ(p_.GetData("GetParam", "_sid", null_).asString(), "S");
    char *url = nullptr;
    curl_easy_getinfo(p_.curl, CURLINFO_EFFECTIVE_URL, &url);
    ASSERT_NE(url, nullptr);
    EXPECT_STREQ(url, "http://127.0.0.1:1/up?_sid=S");
}

}  // namespace
