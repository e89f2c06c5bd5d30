// The port layer: error slot, file touch, Base64, pair and URL encoding, token service and
// address-family query.
#include <errno.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <functional>
#include <string>
#include <thread>

#include <gtest/gtest.h>

#include "platform/json_text.h"
#include "platform/kova_log.h"
#include "platform/vlibc.h"
#include "platform/webapi_util.h"
#include "support/child.h"
#include "support/temp_dir.h"

namespace {

TEST(ErrorSlot, RecordsCodeFileAndLinePerThread) {
    VLIBCErrSetEx(0x0D00, "cred_db", 193);
    EXPECT_EQ(VLIBCErrGet(), 0x0D00);
    EXPECT_STREQ(VLIBCErrorGetFile(), "cred_db");
    EXPECT_EQ(VLIBCErrorGetLine(), 193);

    int otherCode = -1;
    std::thread([&] { otherCode = VLIBCErrGet(); }).join();
    EXPECT_EQ(otherCode, 0) << "a fresh thread starts with an empty slot";

    std::string longName(400, 'f');
    VLIBCErrSetEx(0x0900, longName.c_str(), 169);
    EXPECT_EQ(std::string(VLIBCErrorGetFile()), longName.substr(0, 255));
    VLIBCErrSetEx(0x0200, nullptr, 10);
    EXPECT_STREQ(VLIBCErrorGetFile(), "");
}

TEST(FileTouch, CreatesMissingFoldersPrivately) {
    kova_test::TempDir dir;
    std::string path = dir.File("a/b/c/file.sqlite");
    ASSERT_EQ(VLIBCFileTouch(path.c_str()), 0);
    struct stat st;
    ASSERT_EQ(stat(path.c_str(), &st), 0);
    EXPECT_TRUE(S_ISREG(st.st_mode));
    EXPECT_EQ(st.st_size, 0);
    ASSERT_EQ(stat(dir.File("a/b").c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0700u);

    // An existing file keeps its contents.
    ASSERT_EQ(truncate(path.c_str(), 4), 0);
    ASSERT_EQ(VLIBCFileTouch(path.c_str()), 0);
    ASSERT_EQ(stat(path.c_str(), &st), 0);
    EXPECT_EQ(st.st_size, 4);

    // A link is never followed, not even a dangling one.
    const std::string link = dir.File("link");
    ASSERT_EQ(symlink(dir.File("target").c_str(), link.c_str()), 0);
    EXPECT_EQ(VLIBCFileTouch(link.c_str()), -1);
    EXPECT_EQ(errno, ELOOP);
    EXPECT_NE(access(dir.File("target").c_str(), F_OK), 0);

    // A parent that is a regular file cannot become a folder.
    EXPECT_EQ(VLIBCFileTouch((path + "/below").c_str()), -1);
    EXPECT_EQ(VLIBCFileTouch(""), -1);
    EXPECT_EQ(VLIBCFileTouch(nullptr), -1);
}

// The Base64 text of some bytes, or "<fails>" when a buffer of `room` bytes is too small.
std::string Encode(const std::string &in, size_t room = 512) {
    char buf[512];
    const auto *data = reinterpret_cast<const unsigned char *>(in.data());
    return VLIBCBase64SzEncodeFull(data, in.size(), buf, room, 0) != 0 ? buf : "<fails>";
}

// The bytes of a Base64 text, or "<fails>" when it is no Base64 or does not fit `room` bytes.
std::string Decode(const std::string &in, size_t room = 256) {
    unsigned char buf[256];
    size_t len = room;
    return VLIBCBase64Decode(in.data(), in.size(), buf, &len) != 0
               ? std::string(reinterpret_cast<char *>(buf), len)
               : "<fails>";
}

TEST(Base64, MatchesTheStandardVectorsBothWaysAndRejectsBadInput) {
    const std::pair<std::string, std::string> vectors[] = {
        {"", ""},
        {"f", "Zg=="},
        {"fo", "Zm8="},
        {"foo", "Zm9v"},
        {"foob", "Zm9vYg=="},
        {"fooba", "Zm9vYmE="},
        {"foobar", "Zm9vYmFy"},
        {std::string("\xfb\xff\x00", 3), "+/8A"}};
    for (const auto &v : vectors) {
        EXPECT_EQ(Encode(v.first), v.second);
        EXPECT_EQ(Decode(v.second), v.first);
    }
    // Long input is not broken into lines.
    const std::string encoded = Encode(std::string(300, 'x'));
    EXPECT_EQ(encoded.size(), 400u);
    EXPECT_EQ(encoded.find('\n'), std::string::npos);
    for (const char *bad : {"Zm9v!A==", "Z", "Zm=v"}) {
        EXPECT_EQ(Decode(bad), "<fails>") << bad;
    }
    EXPECT_EQ(Decode("Zm9vYg"), "foob") << "padding may be left out";
    EXPECT_EQ(Encode("abc", 4), "<fails>") << "no room for the terminating NUL";
    EXPECT_EQ(Decode("Zm9v", 2), "<fails>");
}

TEST(PairEncoding, EncodesNamesAndValues) {
    EXPECT_EQ(KOVA::WebAPIUtil::URLEncode("a b&c=d/é~-._"), "a%20b%26c%3Dd%2F%C3%A9~-._");

    Json::Value params;
    params["version"] = 3;
    params["account"] = "ad min";
    params["flag"] = true;
    params["list"] = Json::Value(Json::arrayValue);
    params["list"].append("x");
    std::string out;
    ASSERT_TRUE(KOVA::WebAPIUtil::JsonObjTostrPair(params, out, true, false));
    EXPECT_EQ(out, "account=ad%20min&flag=true&list=%5B%22x%22%5D&version=3");

    ASSERT_TRUE(KOVA::WebAPIUtil::JsonObjTostrPair(params, out, true, true));
    EXPECT_EQ(out, "account=%22ad%20min%22&flag=true&list=%5B%22x%22%5D&version=3")
        << "JSON format writes strings with their quotes";

    ASSERT_TRUE(KOVA::WebAPIUtil::JsonObjTostrPair(params, out, false, false));
    EXPECT_EQ(out, "account=ad min&flag=true&list=[\"x\"]&version=3");

    EXPECT_TRUE(KOVA::WebAPIUtil::JsonObjTostrPair(Json::Value(), out, true, false));
    EXPECT_EQ(out, "");
    out = "stale";
    EXPECT_FALSE(KOVA::WebAPIUtil::JsonObjTostrPair(Json::Value("text"), out, true, false));
    EXPECT_EQ(out, "");
}

TEST(JsonText, ParsesStrictlyAndWritesCompactly) {
    Json::Value v;
    EXPECT_TRUE(kova::JsonFromString("{\"a\": [1, \"\xc3\xa9\"]}", v));
    EXPECT_EQ(kova::JsonToString(v), "{\"a\":[1,\"\xc3\xa9\"]}");
    EXPECT_FALSE(kova::JsonFromString("<html></html>", v));
    EXPECT_TRUE(v.isNull());
    EXPECT_FALSE(kova::JsonFromString("{\"a\":1} trailing", v));
    EXPECT_FALSE(kova::JsonFromString("", v));
    EXPECT_FALSE(kova::JsonFromString("{'a':1}", v));
    // A scalar is a whole JSON document too.
    EXPECT_TRUE(kova::JsonFromString("0", v));
    EXPECT_EQ(v, Json::Value(0));
    EXPECT_TRUE(kova::JsonFromString("\"busy\"", v));
    EXPECT_EQ(v, Json::Value("busy"));
    EXPECT_FALSE(kova::JsonFromString("0 1", v));

    // The lenient reader takes comments and ignores what follows the value.
    EXPECT_TRUE(kova::JsonFromLenientText("/* c */ {\"a\": 1} <!-- -->", v, false));
    EXPECT_EQ(v["a"], 1);
    EXPECT_FALSE(kova::JsonFromLenientText("{\"a\": ", v, false));
    // Nested deeper than the reader allows: a failed parse on both readers, never a throw.
    const std::string deep = std::string(1001, '[') + std::string(1001, ']');
    EXPECT_TRUE(kova::JsonFromString(deep.substr(1, 2000), v));
    EXPECT_FALSE(kova::JsonFromString(deep, v));
    EXPECT_TRUE(v.isNull());
    v = 1;
    EXPECT_FALSE(kova::JsonFromLenientText(deep, v, true));
    EXPECT_TRUE(v.isNull());
}

// Run in a child: makes the text, parses it, and returns 0 when the parse succeeded as
// `parses` says and the high-water mark grew by less than eight times the text plus the
// budget's margin; otherwise says why on standard error and returns 1.
int ParseWithinPeak(const char *shape, const std::function<std::string()> &make, bool lenient,
                    bool parses) {
    const long before = kova_test::PeakRssKiB();
    const std::string text = make();
    Json::Value value;
    const bool parsed =
        lenient ? kova::JsonFromLenientText(text, value, true) : kova::JsonFromString(text, value);
    const long grown = kova_test::PeakRssKiB() - before;
    const long bound = static_cast<long>((8 * text.size() + kova::kJsonCostMargin) / 1024);
#if defined(__SANITIZE_ADDRESS__)
    // AddressSanitizer's red zones and quarantine inflate every allocation, so only the
    // outcome is checked there; the normal build checks the peak.
    const bool withinPeak = true;
#else
    const bool withinPeak = before > 0 && grown <= bound;
#endif
    if (parsed == parses && withinPeak) {
        return 0;
    }
    fprintf(stderr, "%s: %zu bytes, parsed %d, peak grew by %ld KiB of %ld\n", shape, text.size(),
            parsed, grown, bound);
    return 1;
}

// The peak memory of a parse, measured in a child (whose high-water mark starts at what it
// holds when forked): the text and all that either reader allocates stay under eight times
// the text plus the budget's margin. Texts whose values would take more are refused: 16 MB of
// a flat array and of small objects; 16 MB of long strings parses, as does an array whose
// values take nearly all the budget.
TEST(JsonText, ParsePeakStaysWithinTheBudget) {
    // `count` copies of `item` joined by commas inside `open` and `close`.
    const auto repeat = [](const std::string &open, const std::string &item, size_t count,
                           const std::string &close) {
        std::string text;
        text.reserve(open.size() + count * (item.size() + 1) + close.size());
        text += open;
        for (size_t i = 0; i < count; ++i) {
            text += i == 0 ? "" : ",";
            text += item;
        }
        return text + close;
    };
    const struct {
        const char *shape;
        std::function<std::string()> text;
        bool parses;
    } cases[] = {
        {"flat array", [&] { return repeat("{\"success\":true,\"data\":[", "0", 8000000, "]}"); },
         false},
        {"objects", [&] { return repeat("[", R"({"a":{"b":{"c":[1,{}]}}})", 640000, "]"); }, false},
        {"long strings",
         [&] { return repeat("{\"data\":[", "\"" + std::string(1 << 20, 's') + "\"", 16, "]}"); },
         true},
        {"array just within the budget", [&] { return repeat("[", "0", 90000, "]"); }, true},
    };
    for (const auto &c : cases) {
        for (const bool lenient : {false, true}) {
            SCOPED_TRACE(std::string(c.shape) + (lenient ? " lenient" : " strict"));
            EXPECT_EQ(kova_test::RunInChild(
                          120, [&] { return ParseWithinPeak(c.shape, c.text, lenient, c.parses); }),
                      "exit 0");
        }
    }
}

TEST(TokenService, NeedsAProviderAndTerminatesItsBuffers) {
    char token[36];
    char key[33];
    auto get = [&] { return KOVACloudServiceHxtokenGetToken(token, sizeof(token), key, 33); };
    KOVACloudServiceHxtokenSetProvider(nullptr);
    EXPECT_EQ(get(), -1);
    // A provider that fills both buffers to their ends: the service terminates them.
    KOVACloudServiceHxtokenSetProvider([](char *t, size_t tSize, char *k, size_t kSize) {
        memset(t, 'T', tSize);
        memset(k, 'K', kSize);
        return 0;
    });
    EXPECT_EQ(get(), 0);
    EXPECT_EQ(std::string(token) + std::string(key), std::string(35, 'T') + std::string(32, 'K'));
    EXPECT_EQ(KOVACloudServiceHxtokenGetToken(nullptr, 0, key, sizeof(key)), -1);
    KOVACloudServiceHxtokenSetProvider([](char *, size_t, char *, size_t) { return -7; });
    EXPECT_EQ(get(), -7);
    KOVACloudServiceHxtokenSetProvider(nullptr);
}

TEST(AddressType, ClassifiesNumericHostsOnly) {
    EXPECT_EQ(KOVANetGetAddrType("192.168.1.10"), 2);
    EXPECT_EQ(KOVANetGetAddrType("::1"), 10);
    EXPECT_EQ(KOVANetGetAddrType("fe80::1%eth0"), 10);
    EXPECT_EQ(KOVANetGetAddrType("[::1]"), -1);
    EXPECT_EQ(KOVANetGetAddrType("nas.local"), -1);
    EXPECT_EQ(KOVANetGetAddrType("1.2.3"), -1);
    EXPECT_EQ(KOVANetGetAddrType(""), -1);
    EXPECT_EQ(KOVANetGetAddrType(nullptr), -1);
}

}  // namespace
