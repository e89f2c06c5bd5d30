// What reaches the server for each request setting: query strings, bodies and their
// precedence, headers, cookies, the user agent, uploads and the request-stream limit.
#include <errno.h>
#include <stdio.h>
#include <string.h>

#include <fstream>
#include <map>
#include <memory>
#include <string>

#include <gtest/gtest.h>

#include "kovacredential/cred_request.h"
#include "simlib/loopback_server.h"
#include "support/interpose.h"
#include "support/temp_dir.h"

namespace {

using kova_test::File;
using kova_test::StreamWith;

class WireTest : public ::testing::Test {
  protected:
    void SetUp() override {
        server_.Route("*", "/echo", [](const httplib::Request &req, httplib::Response &res) {
            res.set_content(req.body, "text/plain");
        });
        server_.Route("GET", "/moved", [](const httplib::Request &, httplib::Response &res) {
            res.status = 302;
            res.set_header("Location", "/echo");
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

// A plain GET carries the user agent and neither Expect nor Cookie; a followed redirect names
// the address it came from.
TEST_F(WireTest, PlainGetAndTheRedirectItFollows) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/moved")));
    ASSERT_TRUE(req.Process(true, 0)) << req.GetError();
    const auto requests = server_.Requests();
    ASSERT_EQ(requests.size(), 2u);
    EXPECT_EQ(requests[1].path, "/echo");
    EXPECT_EQ(requests[1].Header("Referer"), Url("/moved"));
    EXPECT_FALSE(requests[0].HasHeader("Referer"));
    for (const auto &r : requests) {
        EXPECT_EQ(r.method, "GET");
        EXPECT_EQ(r.Header("User-Agent"), "Velantix-23739");
        EXPECT_FALSE(r.HasHeader("Expect"));
        EXPECT_FALSE(r.HasHeader("Cookie"));
        EXPECT_EQ(r.query, "");
    }
}

// The query joins the URL's own with "?" or "&"; values are percent-encoded in name order, and
// the token goes last without encoding.
TEST_F(WireTest, QueryJoiningEncodingAndTokenPlacement) {
    const std::string query = "a=x%2Fy&z=a%20b%26c&KovaToken=T/k=1";
    for (const auto &c : {std::make_pair("/echo", "/echo?" + query),
                          std::make_pair("/echo?q=1", "/echo?q=1&" + query)}) {
        SCOPED_TRACE(c.first);
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL(Url(c.first)));
        ASSERT_TRUE(req.AddGetParam("KovaToken", "T/k=1"));
        Json::Value params;
        params["z"] = "a b&c";
        params["a"] = "x/y";
        ASSERT_TRUE(req.AddGetParam(params));
        auto r = Send(req);
        EXPECT_EQ(r.target, c.second);
        EXPECT_EQ(r.Param("z"), "a b&c");
    }
}

// Post parameters become a form body, added headers merge by name, and of the cookies only the
// last in name order is sent; the JSON format writes the values as JSON.
TEST_F(WireTest, PostParamsBecomeFormBodyWithHeadersAndCookie) {
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/echo")));
    ASSERT_TRUE(req.AddHeader("X-A", "1"));
    Json::Value more;
    more["X-A"] = "2";
    more["X-B"] = "3";
    ASSERT_TRUE(req.AddHeader(more));
    ASSERT_TRUE(req.AddPostParam("name", "v 1"));
    ASSERT_TRUE(req.AddPostParam("api", "KOVA.API.Info"));
    ASSERT_TRUE(req.AddCookie("b", "2"));
    ASSERT_TRUE(req.AddCookie("a", "1"));
    ASSERT_TRUE(req.AddCookie("id", "SID"));
    auto r = Send(req);
    EXPECT_EQ(r.method, "POST");
    EXPECT_EQ(r.body, "api=KOVA.API.Info&name=v%201");
    EXPECT_EQ(r.Header("Content-Type"), "application/x-www-form-urlencoded");
    EXPECT_EQ(r.Header("X-A"), "2");
    EXPECT_EQ(r.Header("X-B"), "3");
    EXPECT_EQ(r.Header("Cookie"), "id=SID");

    for (bool json : {true, false}) {
        SCOPED_TRACE(json);
        KOVA::CredRequest formatted;
        ASSERT_TRUE(formatted.SetURL(Url("/echo")));
        if (json)
            formatted.SetRequestFormat("JSON");
        Json::Value params;
        params["s"] = "x";
        params["n"] = 3;
        params["o"]["k"] = true;
        ASSERT_TRUE(formatted.AddPostParam(params));
        r = Send(formatted);
        EXPECT_EQ(r.Param("s"), json ? "\"x\"" : "x");
        EXPECT_EQ(r.Param("n"), "3");
        if (json) {
            EXPECT_EQ(r.Param("o"), "{\"k\":true}");
        }
    }
}

// A streamed body has no length, so libcurl sends it chunked and, by default, waits for an
// interim 100 answer; the empty Expect of a header list suppresses that. A size limit cuts it.
TEST_F(WireTest, StreamedBodyIsChunkedAndCutByTheSharedLimit) {
    for (bool withHeaders : {false, true}) {
        SCOPED_TRACE(withHeaders);
        File stream = StreamWith("stream-body");
        ASSERT_TRUE(stream);
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL(Url("/echo")));
        if (withHeaders) {
            ASSERT_TRUE(req.AddHeader("X-Relay", "1"));
        }
        ASSERT_TRUE(req.SetReqStream(stream.get()));
        auto r = Send(req);
        EXPECT_EQ(r.body, "stream-body");
        EXPECT_EQ(r.Header("Transfer-Encoding"), "chunked");
        EXPECT_EQ(r.HasHeader("Expect"), !withHeaders);
        if (!withHeaders) {
            EXPECT_EQ(r.Header("Expect"), "100-continue");
        }
    }
    // The stream limit is shared by all requests and cleared whenever one is constructed.
    for (bool constructAnother : {false, true}) {
        SCOPED_TRACE(constructAnother);
        File stream = StreamWith("0123456789abcdef");
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL(Url("/echo")));
        ASSERT_TRUE(req.SetReqStream(stream.get()));
        ASSERT_TRUE(req.SetReqStreamSize(4));
        if (constructAnother)
            KOVA::CredRequest other;
        EXPECT_EQ(Send(req).body, constructAnother ? "0123456789abcdef" : "0123");
    }
}

// Body sources in order of precedence: raw parameter, upload file, request stream, post
// parameters. Each case offers every source from its own down. A missing upload file fails.
TEST_F(WireTest, BodySourcePrecedence) {
    std::string path = dir_.File("up.txt");
    std::ofstream(path) << "file-content";
    for (int top = 0; top < 3; ++top) {
        SCOPED_TRACE(top);
        File stream = StreamWith("stream-body");
        KOVA::CredRequest req;
        ASSERT_TRUE(req.SetURL(Url("/echo")));
        if (top == 0) {
            ASSERT_TRUE(req.AddRawParam("first"));
            ASSERT_TRUE(req.AddRawParam("{\"raw\":1}"));
        }
        if (top <= 1) {
            ASSERT_TRUE(req.SetUploadFile("file", path.c_str()));
        }
        ASSERT_TRUE(req.SetReqStream(stream.get()));
        ASSERT_TRUE(req.AddPostParam("_sid", "S"));
        ASSERT_TRUE(req.AddPostParam("x", "1"));
        auto r = Send(req);
        EXPECT_EQ(r.method, "POST");
        std::map<std::string, std::string> parts;
        for (const auto &part : r.parts)
            parts[part.name] = part.filename + ":" + part.content;
        if (top == 0) {
            EXPECT_EQ(r.body, "{\"raw\":1}");
            EXPECT_TRUE(parts.empty());
        } else if (top == 1) {
            // The session id moves from the form to the query.
            EXPECT_EQ(r.query, "_sid=S");
            EXPECT_EQ(parts, (std::map<std::string, std::string>{{"file", "up.txt:file-content"},
                                                                 {"x", ":1"}}));
        } else {
            EXPECT_EQ(r.body, "stream-body");
        }
    }
    // An upload file that cannot be read fails the transfer.
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/echo")));
    ASSERT_TRUE(req.SetUploadFile("file", dir_.File("absent").c_str()));
    EXPECT_FALSE(req.Process(true, 0));
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_CURL_OTHER);
    EXPECT_TRUE(kova_test::LogHas("CURL Error(26)")) << kova_test::LogDump();
}

// A request stream that hands out "part-" and then fails to read.
ssize_t FailingRead(void *cookie, char *buf, size_t size) {
    int &calls = *static_cast<int *>(cookie);
    if (calls++ > 0 || size < 5) {
        errno = EIO;
        return -1;
    }
    memcpy(buf, "part-", 5);
    return 5;
}

// A read error of the request stream aborts the transfer: the server never takes the part
// that was sent for a whole body.
TEST_F(WireTest, RequestStreamReadErrorAbortsTheTransfer) {
    int calls = 0;
    cookie_io_functions_t io = {FailingRead, nullptr, nullptr, nullptr};
    File stream(fopencookie(&calls, "r", io));
    ASSERT_TRUE(stream);
    KOVA::CredRequest req;
    ASSERT_TRUE(req.SetURL(Url("/echo")));
    ASSERT_TRUE(req.SetReqStream(stream.get()));
    EXPECT_FALSE(req.Process(true, 2));
    EXPECT_EQ(req.GetError(), KOVA::CRED_REQ_ERR_CURL_OTHER);
    EXPECT_EQ(req.GetCurlCode(), CURLE_ABORTED_BY_CALLBACK);
    EXPECT_TRUE(kova_test::LogHas("CURL Error(42)")) << kova_test::LogDump();
    for (const auto &r : server_.Requests()) {
        EXPECT_EQ(r.body, "");  // the server saw no body it could take as whole
    }
}

}  // namespace
