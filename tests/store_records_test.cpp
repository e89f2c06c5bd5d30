// Credential and session records: accessors, their argument errors, the row callbacks and the
// allocation, clearing and list functions.
#include <errno.h>
#include <string.h>

#include <functional>
#include <new>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "store_fixture.h"

// While set, the non-throwing operator new fails as an exhausted heap would.
bool gFailNothrowNew = false;

void *operator new(std::size_t size, const std::nothrow_t &) noexcept {
    if (gFailNothrowNew) {
        errno = ENOMEM;
        return nullptr;
    }
    try {
        return ::operator new(size);
    } catch (...) {
        return nullptr;
    }
}

namespace {

using namespace store_test;

struct FailNothrowNewScope {
    explicit FailNothrowNewScope(bool fail = true) { gFailNothrowNew = fail; }
    ~FailNothrowNewScope() { gFailNothrowNew = false; }
};

// The accessors of one record type: the headers their argument errors name, the checks of a
// null record, and every accessor with its line and member.
template <typename Record>
struct IntAccessor {
    int line;
    int (*set)(Record *, int32_t);
    int (*get)(int32_t *, const Record *);
    int32_t Record::*member;
};

template <typename Record>
struct StringAccessor {
    int line;
    int (*set)(Record *, const char *);
    int (*get)(char *, size_t, const Record *);
    std::string Record::*member;
};

struct CredAccessors {
    using Record = KOVA_CRED;
    static CredPtr New() { return NewCred(); }
    static constexpr const char *kSetter = "../include/kovacredential/kovacredsetter.h";
    static constexpr const char *kGetter = "../include/kovacredential/kovacredgetter.h";
    static constexpr const char *kIntSetterCheck = "__null != pCred";
    static constexpr const char *kRecordCheck = "NULL != pCred";
    static constexpr IntAccessor<Record> kInts[] = {
        {1, KOVACredItemSetID, KOVACredItemGetID, &Record::id},
        {2, KOVACredItemSetCreateTime, KOVACredItemGetCreateTime, &Record::ctime},
        {3, KOVACredItemSetModifyTime, KOVACredItemGetModifyTime, &Record::mtime},
        {4, KOVACredItemSetOwner, KOVACredItemGetOwner, &Record::owner},
        {5, KOVACredItemSetPort, KOVACredItemGetPort, &Record::port},
    };
    static constexpr StringAccessor<Record> kStrings[] = {
        {6, KOVACredItemSetHost, KOVACredItemGetHost, &Record::host},
        {7, KOVACredItemSetApplication, KOVACredItemGetApplication, &Record::application},
        {8, KOVACredItemSetRemoteAccount, KOVACredItemGetRemoteAccount, &Record::remote_account},
        {9, KOVACredItemSetRemotePasswd, KOVACredItemGetRemotePasswd, &Record::remote_passwd},
        {10, KOVACredItemSetProtocol, KOVACredItemGetProtocol, &Record::protocol},
        {11, KOVACredItemSetExtraInfo, KOVACredItemGetExtraInfo, &Record::extra_info},
    };
};

struct SessAccessors {
    using Record = KOVA_CRED_SESS;
    static SessPtr New() { return NewSess(); }
    static constexpr const char *kSetter = "../include/kovacredential/kovacredsesssetter.h";
    static constexpr const char *kGetter = "../include/kovacredential/kovacredsessgetter.h";
    static constexpr const char *kIntSetterCheck = "__null != pSess";
    static constexpr const char *kRecordCheck = "NULL != pSess";
    static constexpr IntAccessor<Record> kInts[] = {
        {1, KOVACredSessItemSetID, KOVACredSessItemGetID, &Record::id}};
    static constexpr StringAccessor<Record> kStrings[] = {
        {2, KOVACredSessItemSetAccessToken, KOVACredSessItemGetAccessToken, &Record::access_token},
        {3, KOVACredSessItemSetCsrfToken, KOVACredSessItemGetCsrfToken, &Record::csrf_token},
        {4, KOVACredSessItemSetExtraInfo, KOVACredSessItemGetExtraInfo, &Record::extra_info},
    };
};

template <typename Accessors>
class AccessorTest : public LogTest {};
using AccessorKinds = ::testing::Types<CredAccessors, SessAccessors>;
TYPED_TEST_SUITE(AccessorTest, AccessorKinds);

TYPED_TEST(AccessorTest, AccessorsStoreReturnAndTruncate) {
    for (const auto &acc : TypeParam::kInts) {
        SCOPED_TRACE(acc.line);
        auto rec = TypeParam::New();
        int32_t out = 0;
        EXPECT_EQ(acc.set(rec.get(), -123456), 0);
        EXPECT_EQ(acc.get(&out, rec.get()), 0);
        EXPECT_EQ((Ints{rec.get()->*acc.member, out}), (Ints{-123456, -123456}));
    }
    const char *value = "value with 'quotes' and \xc3\xa9";
    for (const auto &acc : TypeParam::kStrings) {
        SCOPED_TRACE(acc.line);
        auto rec = TypeParam::New();
        EXPECT_EQ(acc.set(rec.get(), value), 0);
        EXPECT_EQ(rec.get()->*acc.member, value);
        char buf[64];
        memset(buf, 'x', sizeof(buf));
        EXPECT_EQ(acc.get(buf, sizeof(buf), rec.get()), 0);
        EXPECT_STREQ(buf, value);
        // Getters truncate silently and write nothing past cbBuf.
        memset(buf, 'x', sizeof(buf));
        EXPECT_EQ(acc.get(buf, 5, rec.get()), 0);
        EXPECT_STREQ(buf, "valu");
        EXPECT_EQ(buf[5], 'x');
        EXPECT_EQ(acc.get(buf, 1, rec.get()), 0);
        EXPECT_EQ(buf[0], '\0');
        // "" empties the member; it is not an error.
        EXPECT_EQ(acc.set(rec.get(), ""), 0);
        EXPECT_TRUE((rec.get()->*acc.member).empty());
    }
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

TYPED_TEST(AccessorTest, AccessorsReportBadArgumentsInOrder) {
    auto setter = [](int line, const char *check, std::function<long()> call) {
        return ArgCase{std::move(call), TypeParam::kSetter, line, check};
    };
    auto getter = [](int line, const char *check, std::function<long()> call) {
        return ArgCase{std::move(call), TypeParam::kGetter, line, check};
    };
    for (const auto &acc : TypeParam::kInts) {
        SCOPED_TRACE(acc.line);
        auto rec = TypeParam::New();
        int32_t out = 77;
        ExpectArgErrors({
            setter(acc.line, TypeParam::kIntSetterCheck, [&] { return acc.set(nullptr, 1); }),
            getter(acc.line, "__null != pVal", [&] { return acc.get(nullptr, rec.get()); }),
            getter(acc.line, TypeParam::kRecordCheck, [&] { return acc.get(&out, nullptr); }),
            // Both null: the value pointer is checked first.
            getter(acc.line, "__null != pVal", [&] { return acc.get(nullptr, nullptr); }),
        });
        EXPECT_EQ(out, 77);
    }
    for (const auto &acc : TypeParam::kStrings) {
        SCOPED_TRACE(acc.line);
        auto rec = TypeParam::New();
        rec.get()->*acc.member = "kept";
        char buf[16] = "untouched";
        ExpectArgErrors({
            // The text is checked before the record.
            setter(acc.line, "__null != szVal", [&] { return acc.set(nullptr, nullptr); }),
            setter(acc.line, "__null != szVal", [&] { return acc.set(rec.get(), nullptr); }),
            setter(acc.line, TypeParam::kRecordCheck, [&] { return acc.set(nullptr, "v"); }),
            // The buffer, then its size, then the record.
            getter(acc.line, "__null != szBuf", [&] { return acc.get(nullptr, 0, nullptr); }),
            getter(acc.line, "0 < cbBuf", [&] { return acc.get(buf, 0, nullptr); }),
            getter(acc.line, TypeParam::kRecordCheck, [&] { return acc.get(buf, 16, nullptr); }),
        });
        EXPECT_EQ(rec.get()->*acc.member, "kept");
        EXPECT_STREQ(buf, "untouched");
    }
}

using RecordTest = LogTest;

// Feeds one row to a callback as sqlite3_exec does.
int Feed(int (*callback)(void *, int, char **, char **), void *arg, std::vector<const char *> names,
         std::vector<const char *> values) {
    return callback(arg, static_cast<int>(names.size()), const_cast<char **>(values.data()),
                    const_cast<char **>(names.data()));
}

const std::vector<const char *> kCredColumns = {
    "id",   "ctime",    "mtime",       "host",       "owner", "remote_account", "remote_passwd",
    "port", "protocol", "application", "extra_info", "pid"};

std::vector<const char *> CredValues(const char *id, const char *host) {
    return {id,   "100",     "200",   host,  "1026",  "acct",
            "pw", " +5001x", "https", "app", "extra", "9999"};
}

// Every member but `next`, so that two records compare whole.
Texts Members(const KOVA_CRED &c) {
    Texts out{c.host, c.remote_account, c.remote_passwd, c.protocol, c.application, c.extra_info};
    for (int32_t value : {c.filled, c.id, c.ctime, c.mtime, c.owner, c.port}) {
        out.push_back(std::to_string(value));
    }
    return out;
}

Texts Members(const KOVA_CRED_SESS &s) {
    return {s.access_token, s.csrf_token, s.extra_info, std::to_string(s.filled),
            std::to_string(s.id)};
}

TEST_F(RecordTest, CredRowFirstCopiesColumnsByExactNameOnce) {
    CredPtr cred = NewCred();
    EXPECT_EQ(Feed(CredRowFirst, cred.get(), kCredColumns, CredValues("7", nullptr)), 0);
    // A NULL column becomes "", and strtol reads " +5001x" as 5001.
    const Texts first{"",  "acct", "pw",  "https", "app",  "extra",
                      "1", "7",    "100", "200",   "1026", "5001"};
    EXPECT_EQ(Members(*cred), first);
    // A filled record keeps its first row, every member of it.
    EXPECT_EQ(Feed(CredRowFirst, cred.get(), kCredColumns,
                   {"8", "1", "2", "other", "3", "a2", "p2", "4", "http", "app2", "e2", "1"}),
              0);
    EXPECT_EQ(Members(*cred), first);

    // Names match exactly.
    CredPtr other = NewCred();
    Feed(CredRowFirst, other.get(), {"ID", "Host", "hostname", "host"},
         {"5", "upper", "longer", "exact"});
    EXPECT_EQ(other->host, "exact");
    EXPECT_EQ(other->id, -1);
    // Integers convert as strtol does; out of range they saturate instead of wrapping.
    const char *texts[] = {"1700000000",
                           "-2147483648",
                           "2147483648",
                           "-4294967297",
                           "99999999999999999999",
                           "000000000000000000042",
                           "12abc",
                           " \t+42",
                           "-",
                           ""};
    const int32_t values[] = {1700000000, INT32_MIN, INT32_MAX, INT32_MIN, INT32_MAX,
                              42,         12,        42,        0,         0};
    for (size_t i = 0; i < std::size(texts); ++i) {
        CredPtr converted = NewCred();
        Feed(CredRowFirst, converted.get(), {"port"}, {texts[i]});
        EXPECT_EQ(converted->port, values[i]) << texts[i];
    }
    CredPtr empty = NewCred();
    Feed(CredRowFirst, empty.get(), {}, {});
    EXPECT_EQ(empty->filled, 1);
}

TEST_F(RecordTest, SessionRowCallbacksSkipMtimeAndClearingFreesTheChain) {
    const std::vector<const char *> columns = {"id", "mtime", "access_token", "csrf_token",
                                               "extra_info"};
    const std::vector<const char *> a = {"4", "123", "sid", nullptr, "e"};
    const std::vector<const char *> b = {"6", "124", "sid6", "tok6", "e6"};
    SessPtr sess = NewSess();
    const Texts fresh = Members(*sess);
    EXPECT_EQ(fresh, (Texts{"", "", "", "0", "-1"}));
    EXPECT_EQ(sess->next, nullptr);
    Feed(CredSessRowFirst, sess.get(), columns, a);
    Feed(CredSessRowFirst, sess.get(), columns, b);
    EXPECT_EQ(Members(*sess), (Texts{"sid", "", "e", "1", "4"}));  // a NULL column becomes ""

    KOVA_CRED_SESS *head = nullptr;
    Feed(CredSessRowAppend, &head, columns, a);
    Feed(CredSessRowAppend, &head, columns, b);
    ASSERT_EQ(Ids(head), (std::vector<int>{6, 4}));
    EXPECT_EQ(Members(*head), (Texts{"sid6", "tok6", "e6", "1", "6"}));
    EXPECT_EQ(Members(*head->next), (Texts{"sid", "", "e", "1", "4"}));
    EXPECT_EQ(KOVACredSessClear(head), 0);  // ASan reports a leak if the chain is not freed
    EXPECT_EQ(head->next, nullptr);
    EXPECT_EQ(Members(*head), fresh);
    EXPECT_EQ(KOVACredSessFree(head), 0);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

TEST_F(RecordTest, CredAllocationAppendAndClearing) {
    CredPtr fresh = NewCred();
    ASSERT_NE(fresh, nullptr);
    EXPECT_EQ(KOVACredNext(fresh.get()), nullptr);
    EXPECT_EQ(Members(*fresh), (Texts{"", "", "", "", "", "", "0", "-1", "0", "0", "-1", "0"}));
    // Rows link in front; one that cannot be allocated is dropped and the query goes on.
    KOVA_CRED *head = nullptr;
    for (const char *id : {"1", "2", "3"}) {
        FailNothrowNewScope noMemory(*id == '2');
        EXPECT_EQ(Feed(CredRowAppend, &head, kCredColumns, CredValues(id, "h")), 0);
    }
    EXPECT_EQ(Ids(head), (std::vector<int>{3, 1}));
    for (KOVA_CRED *p = head; p != nullptr; p = p->next) {
        EXPECT_EQ(Members(*p), (Texts{"h", "acct", "pw", "https", "app", "extra", "1",
                                      std::to_string(p->id), "100", "200", "1026", "5001"}));
    }
    EXPECT_EQ(KOVACredClear(head), 0);  // ASan reports a leak if the chain is not freed
    EXPECT_EQ(head->next, nullptr);
    EXPECT_EQ(Members(*head), Members(*fresh));
    EXPECT_EQ(KOVACredFree(head), 0);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

TEST_F(RecordTest, FailedAllocationsAndNullRecords) {
    KOVA_CRED *cred;
    KOVA_CRED_SESS *sess;
    {
        FailNothrowNewScope noMemory;
        cred = KOVACredAlloc();
        EXPECT_TRUE(ErrorIs(KOVA_ERR_OUT_OF_MEMORY, "cred_alloc", 10));
        sess = KOVACredSessAlloc();
        EXPECT_TRUE(ErrorIs(KOVA_ERR_OUT_OF_MEMORY, "cred_sess_alloc", 10));
    }
    EXPECT_EQ(cred, nullptr);
    EXPECT_EQ(sess, nullptr);
    EXPECT_EQ(kova_test::LogRecords(),
              (Texts{std::string("cred_alloc:9 Allocate KOVA_CRED failed. ") + strerror(ENOMEM),
                     std::string("cred_sess_alloc:9 Allocate KOVA_CRED_SESS failed. ") +
                         strerror(ENOMEM)}));

    kova_test::ClearLog();
    EXPECT_EQ(KOVACredFree(nullptr), -1);
    EXPECT_TRUE(ArgErrorReported("cred_alloc", 19, "__null != pCred"));
    kova_test::ClearLog();
    EXPECT_EQ(KOVACredSessFree(nullptr), -1);
    EXPECT_TRUE(ArgErrorReported("cred_sess_alloc", 19, "__null != pSess"));
    // Clearing nothing fails without a record or a code; the next of nothing is nothing.
    kova_test::ClearLog();
    ResetErrorSlot();
    EXPECT_EQ(KOVACredClear(nullptr), -1);
    EXPECT_EQ(KOVACredSessClear(nullptr), -1);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
    EXPECT_EQ(VLIBCErrGet(), 0);
    EXPECT_EQ(KOVACredNext(nullptr), nullptr);
    EXPECT_EQ(KOVACredSessNext(nullptr), nullptr);
}

}  // namespace
