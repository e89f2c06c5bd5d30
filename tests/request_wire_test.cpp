// What reaches the server for each request setting: query strings, bodies and their
// precedence, headers, cookies, the user agent, uploads and the request-stream limit.
#include <stdio.h>

#include <fstream>
#include <memory>
#include <string>

#include <gtest/gtest.h>

#include "kovacredential/cred_request.h"
#include "simlib/loopback_server.h"
#include "support/interpose.h"
#include "support/temp_dir.h"

namespace {

struct FileCloser {
    void operator()(FILE *f) const {
        if (f != nullptr)
            fclose(f);
    }
};
using File = std::unique_ptr<FILE, FileCloser>;

// A temporary stream holding `text`, positioned at its start.
File StreamWith(const std::string &text) {
    File f(tmpfile());
    if (f) {
        fwrite(text.data(), 1, text.size(), f.get());
        rewind(f.get());
    }
    return f;
}

class WireTest : public ::testing::Test {
  protected:
    void SetUp() override {
        server_.Route("*", "/echo", [](const httplib::Request &req, httplib::Response &res) {
            res.set_content(req.body, "text/plain");
        });
        ASSERT_TRUE(server_.Start()) << server_.Error();
        kova_test::ClearLog();
    }
    std::string Url(const std::string &path) const { return server_.BaseUrl() + path; }
    // Runs the request and returns what the server recorded for it.
    kovasim::RecordedRequest Send(KOVA::CredRequest &req) {
        server_.ClearRecords();
        EXPECT_TRUE(req.Process(true, 0)) << "error " << req.GetError() << "\n"
                                          << kova_test::LogDump();
        EXPECT_EQ(server_.RequestCount(), 1u);
        return server_.Last();
    }

    kovasim::LoopbackServer server_;
    kova_test::TempDir dir_;
};

TEST_F(WireTest, PlainGetCarriesUserAgentAndNoExpect) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/echo")));
    auto r = Send(req);
    EXPECT_EQ(r.method, "GET");
    EXPECT_EQ(r.Header("User-Agent"), "Velantix-23739");
    EXPECT_FALSE(r.HasHeader("Expect"));
    EXPECT_FALSE(r.HasHeader("Cookie"));
    EXPECT_EQ(r.query, "");
}

TEST_F(WireTest, QueryStartsWithQuestionMarkOrAmpersand) {
    KOVA::CredRequest plain;
    ASSERT_TRUE(plain.SetURL(Url("/echo")));
    ASSERT_TRUE(plain.AddGetParam("b", "2"));
    EXPECT_EQ(Send(plain).target, "/echo?b=2");

    KOVA::CredRequest withQuery;
    ASSERT_TRUE(withQuery.SetURL(Url("/echo?a=1")));
    ASSERT_TRUE(withQuery.AddGetParam("b", "2"));
    EXPECT_EQ(Send(withQuery).target, "/echo?a=1&b=2");
}

TEST_F(WireTest, QueryValuesArePercentEncodedInNameOrder) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/echo")));
    Json::Value params;
    params["z"] = "a b&c";
    params["a"] = "x/y";
    ASSERT_TRUE(req.AddGetParam(params));
    auto r = Send(req);
    EXPECT_EQ(r.query, "a=x%2Fy&z=a%20b%26c");
    EXPECT_EQ(r.Param("z"), "a b&c");
}

TEST_F(WireTest, KovaTokenIsAppendedLastAndNotEncoded) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/echo")));
    ASSERT_TRUE(req.AddGetParam("KovaToken", "T/k=1"));
    ASSERT_TRUE(req.AddGetParam("b", "2"));
    ASSERT_TRUE(req.AddGetParam("z", "9"));
    EXPECT_EQ(Send(req).query, "b=2&z=9&KovaToken=T/k=1");
}

TEST_F(WireTest, PostParamsBecomeFormBody) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/echo")));
    ASSERT_TRUE(req.AddPostParam("name", "v 1"));
    ASSERT_TRUE(req.AddPostParam("api", "KOVA.API.Info"));
    auto r = Send(req);
    EXPECT_EQ(r.method, "POST");
    EXPECT_EQ(r.body, "api=KOVA.API.Info&name=v%201");
    EXPECT_EQ(r.Header("Content-Type"), "application/x-www-form-urlencoded");
    EXPECT_FALSE(r.HasHeader("Expect"));
}

TEST_F(WireTest, JsonFormatWritesValuesAsJson) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/echo")));
    req.SetRequestFormat("JSON");
    Json::Value params;
    params["s"] = "x";
    params["n"] = 3;
    params["o"]["k"] = true;
    ASSERT_TRUE(req.AddPostParam(params));
    auto r = Send(req);
    EXPECT_EQ(r.Param("s"), "\"x\"");
    EXPECT_EQ(r.Param("n"), "3");
    EXPECT_EQ(r.Param("o"), "{\"k\":true}");
}

TEST_F(WireTest, NonStringValuesWithoutJsonFormat) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/echo")));
    Json::Value params;
    params["s"] = "x";
    params["n"] = 3;
    ASSERT_TRUE(req.AddPostParam(params));
    auto r = Send(req);
    EXPECT_EQ(r.Param("s"), "x");
    EXPECT_EQ(r.Param("n"), "3");
}

TEST_F(WireTest, OnlyTheLastSortingCookieIsSent) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/echo")));
    ASSERT_TRUE(req.AddCookie("b", "2"));
    ASSERT_TRUE(req.AddCookie("a", "1"));
    ASSERT_TRUE(req.AddCookie("id", "SID"));
    EXPECT_EQ(Send(req).Header("Cookie"), "id=SID");
}

TEST_F(WireTest, HeadersAreSentWithEmptyExpect) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/echo")));
    ASSERT_TRUE(req.AddHeader("X-A", "1"));
    Json::Value more;
    more["X-A"] = "2";
    more["X-B"] = "3";
    ASSERT_TRUE(req.AddHeader(more));
    ASSERT_TRUE(req.AddPostParam("k", "v"));
    auto r = Send(req);
    EXPECT_EQ(r.Header("X-A"), "2");
    EXPECT_EQ(r.Header("X-B"), "3");
    // "Expect:" with no value tells libcurl to leave the header out altogether.
    EXPECT_FALSE(r.HasHeader("Expect"));
    EXPECT_EQ(r.body, "k=v");
}

// A streamed body has no length, so libcurl sends it chunked and, by default, waits for an
// interim 100 answer; the empty Expect of a header list suppresses that.
TEST_F(WireTest, StreamedBodyExpectsContinueOnlyWithoutHeaderList) {
    File bare = StreamWith("stream-body");
    ASSERT_TRUE(bare);
    KOVA::CredRequest withoutHeaders;
    ASSERT_TRUE(withoutHeaders.SetURL(Url("/echo")));
    ASSERT_TRUE(withoutHeaders.SetReqStream(bare.get()));
    auto r1 = Send(withoutHeaders);
    EXPECT_EQ(r1.body, "stream-body");
    EXPECT_EQ(r1.Header("Expect"), "100-continue");
    EXPECT_EQ(r1.Header("Transfer-Encoding"), "chunked");

    File withList = StreamWith("stream-body");
    ASSERT_TRUE(withList);
    KOVA::CredRequest withHeaders;
    ASSERT_TRUE(withHeaders.SetURL(Url("/echo")));
    ASSERT_TRUE(withHeaders.AddHeader("X-Relay", "1"));
    ASSERT_TRUE(withHeaders.SetReqStream(withList.get()));
    auto r2 = Send(withHeaders);
    EXPECT_EQ(r2.body, "stream-body");
    EXPECT_FALSE(r2.HasHeader("Expect"));
}

TEST_F(WireTest, RawParamWinsOverEverything) {
    std::string path = dir_.File("up.txt");
    std::ofstream(path) << "file-content";
    File stream = StreamWith("stream-body");
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/echo")));
    ASSERT_TRUE(req.AddRawParam("first"));
    ASSERT_TRUE(req.AddRawParam("{\"raw\":1}"));
    ASSERT_TRUE(req.SetUploadFile("file", path.c_str()));
    ASSERT_TRUE(req.SetReqStream(stream.get()));
    ASSERT_TRUE(req.AddPostParam("p", "1"));
    auto r = Send(req);
    EXPECT_EQ(r.method, "POST");
    EXPECT_EQ(r.body, "{\"raw\":1}");
    EXPECT_TRUE(r.parts.empty());
}

TEST_F(WireTest, FileWinsOverStreamAndPostParamsAndMovesSidToQuery) {
    std::string path = dir_.File("up.txt");
    std::ofstream(path) << "file-content";
    File stream = StreamWith("stream-body");
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/echo")));
    ASSERT_TRUE(req.SetUploadFile("file", path.c_str()));
    ASSERT_TRUE(req.SetReqStream(stream.get()));
    ASSERT_TRUE(req.AddPostParam("_sid", "S"));
    ASSERT_TRUE(req.AddPostParam("x", "1"));
    auto r = Send(req);
    EXPECT_EQ(r.query, "_sid=S");
    ASSERT_EQ(r.parts.size(), 2u);
    bool sawFile = false;
    bool sawX = false;
    for (const auto &part : r.parts) {
        EXPECT_NE(part.name, "_sid");
        if (part.name == "file") {
            sawFile = true;
            EXPECT_EQ(part.filename, "up.txt");
            EXPECT_EQ(part.content, "file-content");
        } else if (part.name == "x") {
            sawX = true;
            EXPECT_EQ(part.content, "1");
        }
    }
    EXPECT_TRUE(sawFile);
    EXPECT_TRUE(sawX);
}

TEST_F(WireTest, StreamWinsOverPostParams) {
    File stream = StreamWith("from-stream");
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/echo")));
    ASSERT_TRUE(req.SetReqStream(stream.get()));
    ASSERT_TRUE(req.AddPostParam("p", "1"));
    EXPECT_EQ(Send(req).body, "from-stream");
}

TEST_F(WireTest, RequestStreamLimitCutsTheBody) {
    File stream = StreamWith(std::string(100, 'x') + "tail");
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/echo")));
    ASSERT_TRUE(req.SetReqStream(stream.get()));
    ASSERT_TRUE(req.SetReqStreamSize(10));
    EXPECT_EQ(Send(req).body, std::string(10, 'x'));
}

TEST_F(WireTest, ConstructingARequestClearsTheSharedLimit) {
    File stream = StreamWith("0123456789abcdef");
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/echo")));
    ASSERT_TRUE(req.SetReqStream(stream.get()));
    ASSERT_TRUE(req.SetReqStreamSize(4));
    KOVA::CredRequest other;  // clears the limit for every request
    EXPECT_EQ(Send(req).body, "0123456789abcdef");
}

TEST_F(WireTest, MissingUploadFileFailsTheTransfer) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/echo")));
    ASSERT_TRUE(req.SetUploadFile("file", dir_.File("absent").c_str()));
    server_.ClearRecords();
    EXPECT_FALSE(req.Process(true, 0));
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_CURL_OTHER);
    EXPECT_TRUE(kova_test::LogHas("CURL Error(26)")) << kova_test::LogDump();
}

TEST_F(WireTest, SettingsAfterTheFirstSetUpDoNotReachTheTransfer) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/echo")));
    ASSERT_TRUE(req.AddGetParam("a", "1"));
    EXPECT_EQ(Send(req).query, "a=1");
    CURL *handle = req.GetCurlHandler();
    ASSERT_NE(handle, nullptr);
    ASSERT_TRUE(req.AddGetParam("b", "2"));
    EXPECT_EQ(Send(req).query, "a=1");
    EXPECT_EQ(req.GetCurlHandler(), handle);
}

}  // namespace
