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
    FailNothrowNewScope() { gFailNothrowNew = true; }
    ~FailNothrowNewScope() { gFailNothrowNew = false; }
};

// The accessors of one record type: their headers, the checks reported for a null record and
// every accessor with its line and member.
template <typename Record>
struct IntAccessor {
    const char *name;
    int line;
    int (*set)(Record *, int32_t);
    int (*get)(int32_t *, const Record *);
    int32_t Record::*member;
};

template <typename Record>
struct StringAccessor {
    const char *name;
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
    static std::vector<IntAccessor<Record>> Ints() {
        return {
            {"ID", 1, KOVACredItemSetID, KOVACredItemGetID, &Record::id},
            {"CreateTime", 2, KOVACredItemSetCreateTime, KOVACredItemGetCreateTime, &Record::ctime},
            {"ModifyTime", 3, KOVACredItemSetModifyTime, KOVACredItemGetModifyTime, &Record::mtime},
            {"Owner", 4, KOVACredItemSetOwner, KOVACredItemGetOwner, &Record::owner},
            {"Port", 5, KOVACredItemSetPort, KOVACredItemGetPort, &Record::port},
        };
    }
    static std::vector<StringAccessor<Record>> Strings() {
        return {
            {"Host", 6, KOVACredItemSetHost, KOVACredItemGetHost, &Record::host},
            {"Application", 7, KOVACredItemSetApplication, KOVACredItemGetApplication,
             &Record::application},
            {"RemoteAccount", 8, KOVACredItemSetRemoteAccount, KOVACredItemGetRemoteAccount,
             &Record::remote_account},
            {"RemotePasswd", 9, KOVACredItemSetRemotePasswd, KOVACredItemGetRemotePasswd,
             &Record::remote_passwd},
            {"Protocol", 10, KOVACredItemSetProtocol, KOVACredItemGetProtocol, &Record::protocol},
            {"ExtraInfo", 11, KOVACredItemSetExtraInfo, KOVACredItemGetExtraInfo,
             &Record::extra_info},
        };
    }
};

struct SessAccessors {
    using Record = KOVA_CRED_SESS;
    static SessPtr New() { return NewSess(); }
    static constexpr const char *kSetter = "../include/kovacredential/kovacredsesssetter.h";
    static constexpr const char *kGetter = "../include/kovacredential/kovacredsessgetter.h";
    static constexpr const char *kIntSetterCheck = "__null != pSess";
    static constexpr const char *kRecordCheck = "NULL != pSess";
    static std::vector<IntAccessor<Record>> Ints() {
        return {{"ID", 1, KOVACredSessItemSetID, KOVACredSessItemGetID, &Record::id}};
    }
    static std::vector<StringAccessor<Record>> Strings() {
        return {
            {"AccessToken", 2, KOVACredSessItemSetAccessToken, KOVACredSessItemGetAccessToken,
             &Record::access_token},
            {"CsrfToken", 3, KOVACredSessItemSetCsrfToken, KOVACredSessItemGetCsrfToken,
             &Record::csrf_token},
            {"ExtraInfo", 4, KOVACredSessItemSetExtraInfo, KOVACredSessItemGetExtraInfo,
             &Record::extra_info},
        };
    }
};

template <typename Accessors>
class AccessorTest : public LogTest {};
using AccessorKinds = ::testing::Types<CredAccessors, SessAccessors>;
TYPED_TEST_SUITE(AccessorTest, AccessorKinds);

TYPED_TEST(AccessorTest, AccessorsStoreReturnAndTruncate) {
    for (const auto &acc : TypeParam::Ints()) {
        SCOPED_TRACE(acc.name);
        auto rec = TypeParam::New();
        EXPECT_EQ(acc.set(rec.get(), -123456), 0);
        EXPECT_EQ(rec.get()->*acc.member, -123456);
        int32_t out = 0;
        EXPECT_EQ(acc.get(&out, rec.get()), 0);
        EXPECT_EQ(out, -123456);
    }
    const char *value = "value with 'quotes' and \xc3\xa9";
    for (const auto &acc : TypeParam::Strings()) {
        SCOPED_TRACE(acc.name);
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
    for (const auto &acc : TypeParam::Ints()) {
        SCOPED_TRACE(acc.name);
        auto rec = TypeParam::New();
        int32_t out = 77;
        ExpectArgErrors({
            {[&] { return acc.set(nullptr, 1); }, TypeParam::kSetter, acc.line,
             TypeParam::kIntSetterCheck},
            {[&] { return acc.get(nullptr, rec.get()); }, TypeParam::kGetter, acc.line,
             "__null != pVal"},
            {[&] { return acc.get(&out, nullptr); }, TypeParam::kGetter, acc.line,
             TypeParam::kRecordCheck},
            // Both null: the value pointer is checked first.
            {[&] { return acc.get(nullptr, nullptr); }, TypeParam::kGetter, acc.line,
             "__null != pVal"},
        });
        EXPECT_EQ(out, 77);
    }
    for (const auto &acc : TypeParam::Strings()) {
        SCOPED_TRACE(acc.name);
        auto rec = TypeParam::New();
        rec.get()->*acc.member = "kept";
        char buf[16] = "untouched";
        ExpectArgErrors({
            // The text is checked before the record.
            {[&] { return acc.set(nullptr, nullptr); }, TypeParam::kSetter, acc.line,
             "__null != szVal"},
            {[&] { return acc.set(rec.get(), nullptr); }, TypeParam::kSetter, acc.line,
             "__null != szVal"},
            {[&] { return acc.set(nullptr, "v"); }, TypeParam::kSetter, acc.line,
             TypeParam::kRecordCheck},
            // The buffer, then its size, then the record.
            {[&] { return acc.get(nullptr, 0, nullptr); }, TypeParam::kGetter, acc.line,
             "__null != szBuf"},
            {[&] { return acc.get(buf, 0, nullptr); }, TypeParam::kGetter, acc.line, "0 < cbBuf"},
            {[&] { return acc.get(buf, sizeof(buf), nullptr); }, TypeParam::kGetter, acc.line,
             TypeParam::kRecordCheck},
        });
        EXPECT_EQ(rec.get()->*acc.member, "kept");
        EXPECT_STREQ(buf, "untouched");
    }
}

using RecordTest = LogTest;

// Column names and texts as sqlite3_exec hands them to a callback.
struct FakeRow {
    std::vector<std::string> names;
    std::vector<const char *> values;
    std::vector<char *> nameArgs;
    std::vector<char *> valueArgs;
    FakeRow(std::vector<std::string> n, std::vector<const char *> v)
        : names(std::move(n)), values(std::move(v)) {
        for (auto &name : names) {
            nameArgs.push_back(name.data());
        }
        for (auto *value : values) {
            valueArgs.push_back(const_cast<char *>(value));
        }
    }
    int Feed(int (*callback)(void *, int, char **, char **), void *arg) {
        return callback(arg, static_cast<int>(names.size()), valueArgs.data(), nameArgs.data());
    }
};

FakeRow CredRow(const char *id, const char *host) {
    return FakeRow(
        {"id", "ctime", "mtime", "host", "owner", "remote_account", "remote_passwd", "port",
         "protocol", "application", "extra_info", "pid"},
        {id, "100", "200", host, "1026", "acct", "pw", " +5001x", "https", "app", "extra", "9999"});
}

TEST_F(RecordTest, CredRowFirstCopiesColumnsByExactNameOnce) {
    CredPtr cred = NewCred();
    FakeRow row = CredRow("7", nullptr);
    EXPECT_EQ(row.Feed(CredRowFirst, cred.get()), 0);
    EXPECT_EQ(cred->filled, 1);
    EXPECT_EQ((std::vector<int32_t>{cred->id, cred->ctime, cred->mtime, cred->owner, cred->port}),
              (std::vector<int32_t>{7, 100, 200, 1026, 5001}));  // strtol: " +5001x" is 5001
    // A NULL column becomes "".
    EXPECT_EQ((std::vector<std::string>{cred->host, cred->remote_account, cred->remote_passwd,
                                        cred->protocol, cred->application, cred->extra_info}),
              (std::vector<std::string>{"", "acct", "pw", "https", "app", "extra"}));

    // A filled record keeps its first row, every member of it.
    FakeRow second({"id", "ctime", "mtime", "host", "owner", "remote_account", "remote_passwd",
                    "port", "protocol", "application", "extra_info"},
                   {"8", "1", "2", "other", "3", "a2", "p2", "4", "http", "app2", "e2"});
    EXPECT_EQ(second.Feed(CredRowFirst, cred.get()), 0);
    EXPECT_EQ((std::vector<int32_t>{cred->id, cred->ctime, cred->owner, cred->port}),
              (std::vector<int32_t>{7, 100, 1026, 5001}));
    EXPECT_EQ((std::vector<std::string>{cred->host, cred->remote_account, cred->extra_info}),
              (std::vector<std::string>{"", "acct", "extra"}));

    // Names match exactly.
    CredPtr other = NewCred();
    FakeRow odd({"ID", "Host", "hostname", "host"}, {"5", "upper", "longer", "exact"});
    odd.Feed(CredRowFirst, other.get());
    EXPECT_EQ(other->host, "exact");
    EXPECT_EQ(other->id, -1);
    // Integers convert as strtol does; out of range they saturate instead of wrapping.
    const std::pair<const char *, int32_t> kIntegers[] = {{"1700000000", 1700000000},
                                                          {"-2147483648", INT32_MIN},
                                                          {"2147483648", INT32_MAX},
                                                          {"-4294967297", INT32_MIN},
                                                          {"99999999999999999999", INT32_MAX},
                                                          {"000000000000000000042", 42},
                                                          {"12abc", 12},
                                                          {" \t+42", 42},
                                                          {"-", 0},
                                                          {"", 0}};
    for (const auto &[text, value] : kIntegers) {
        CredPtr converted = NewCred();
        FakeRow({"port"}, {text}).Feed(CredRowFirst, converted.get());
        EXPECT_EQ(converted->port, value) << text;
    }
    CredPtr empty = NewCred();
    FakeRow none({}, {});
    none.Feed(CredRowFirst, empty.get());
    EXPECT_EQ(empty->filled, 1);
}

TEST_F(RecordTest, CredRowAppendLinksRowsInFrontAndDropsOneItCannotAllocate) {
    KOVA_CRED *head = nullptr;
    for (const char *id : {"1", "2", "3"}) {
        FakeRow row = CredRow(id, "h");
        if (*id == '2') {
            FailNothrowNewScope noMemory;
            EXPECT_EQ(row.Feed(CredRowAppend, &head), 0);  // the query goes on
        } else {
            EXPECT_EQ(row.Feed(CredRowAppend, &head), 0);
        }
    }
    EXPECT_EQ(Ids(head), (std::vector<int>{3, 1}));
    for (KOVA_CRED *p = head; p != nullptr; p = p->next) {
        EXPECT_EQ(p->filled, 1);
        EXPECT_EQ(p->host, "h");
    }
    KOVACredListFree(&head);
    EXPECT_EQ(head, nullptr);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

TEST_F(RecordTest, SessionRowCallbacksSkipMtime) {
    KOVA_CRED_SESS *head = nullptr;
    FakeRow a({"id", "mtime", "access_token", "csrf_token", "extra_info"},
              {"4", "123", "sid", nullptr, "e"});
    FakeRow b({"id", "mtime", "access_token", "csrf_token", "extra_info"},
              {"6", "124", "sid6", "tok6", "e6"});
    a.Feed(CredSessRowAppend, &head);
    b.Feed(CredSessRowAppend, &head);
    ASSERT_EQ(Ids(head), (std::vector<int>{6, 4}));
    EXPECT_EQ(head->csrf_token, "tok6");
    EXPECT_EQ(head->next->csrf_token, "");  // NULL column
    KOVACredSessListFree(&head);

    SessPtr sess = NewSess();
    a.Feed(CredSessRowFirst, sess.get());
    b.Feed(CredSessRowFirst, sess.get());
    EXPECT_EQ(sess->filled, 1);
    EXPECT_EQ(sess->id, 4);
    EXPECT_EQ(sess->access_token, "sid");
    EXPECT_EQ(sess->extra_info, "e");
}

// Every member but `next`, so that two records compare whole.
std::vector<std::string> Members(const KOVA_CRED &c) {
    std::vector<std::string> out{c.host,     c.remote_account, c.remote_passwd,
                                 c.protocol, c.application,    c.extra_info};
    for (int32_t value : {c.filled, c.id, c.ctime, c.mtime, c.owner, c.port}) {
        out.push_back(std::to_string(value));
    }
    return out;
}

TEST_F(RecordTest, AllocationDefaultsAndClearingBackToThem) {
    CredPtr fresh = NewCred();
    ASSERT_NE(fresh, nullptr);
    EXPECT_EQ(KOVACredNext(fresh.get()), nullptr);
    EXPECT_EQ(Members(*fresh),
              (std::vector<std::string>{"", "", "", "", "", "", "0", "-1", "0", "0", "-1", "0"}));
    SessPtr freshSess = NewSess();
    ASSERT_NE(freshSess, nullptr);
    EXPECT_EQ(freshSess->next, nullptr);
    EXPECT_EQ((std::vector<int32_t>{freshSess->filled, freshSess->id}),
              (std::vector<int32_t>{0, -1}));
    EXPECT_TRUE(freshSess->access_token.empty() && freshSess->csrf_token.empty() &&
                freshSess->extra_info.empty());

    KOVA_CRED *head = nullptr;
    for (const char *id : {"1", "2", "3"}) {
        FakeRow row = CredRow(id, "h");
        row.Feed(CredRowAppend, &head);
    }
    EXPECT_EQ(KOVACredClear(head), 0);  // ASan reports a leak if the chain is not freed
    EXPECT_EQ(head->next, nullptr);
    EXPECT_EQ(Members(*head), Members(*fresh));
    EXPECT_EQ(KOVACredFree(head), 0);

    KOVA_CRED_SESS *sessHead = nullptr;
    FakeRow s1({"id", "access_token"}, {"1", "a"});
    FakeRow s2({"id", "access_token"}, {"2", "b"});
    s1.Feed(CredSessRowAppend, &sessHead);
    s2.Feed(CredSessRowAppend, &sessHead);
    EXPECT_EQ(KOVACredSessClear(sessHead), 0);
    EXPECT_EQ(sessHead->next, nullptr);
    EXPECT_EQ(sessHead->id, -1);
    EXPECT_TRUE(sessHead->access_token.empty());
    EXPECT_EQ(KOVACredSessFree(sessHead), 0);

    EXPECT_EQ(KOVACredClear(nullptr), -1);
    EXPECT_EQ(KOVACredSessClear(nullptr), -1);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
    EXPECT_EQ(VLIBCErrGet(), 0);
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
    EXPECT_EQ(
        kova_test::LogRecords(),
        (std::vector<std::string>{
            std::string("cred_alloc:9 Allocate KOVA_CRED failed. ") + strerror(ENOMEM),
            std::string("cred_sess_alloc:9 Allocate KOVA_CRED_SESS failed. ") + strerror(ENOMEM)}));

    kova_test::ClearLog();
    EXPECT_EQ(KOVACredFree(nullptr), -1);
    EXPECT_TRUE(ArgErrorReported("cred_alloc", 19, "__null != pCred"));
    kova_test::ClearLog();
    EXPECT_EQ(KOVACredSessFree(nullptr), -1);
    EXPECT_TRUE(ArgErrorReported("cred_sess_alloc", 19, "__null != pSess"));
    EXPECT_EQ(KOVACredNext(nullptr), nullptr);
    EXPECT_EQ(KOVACredSessNext(nullptr), nullptr);
}

}  // namespace
