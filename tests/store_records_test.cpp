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

const std::string kSetter = "../include/kovacredential/kovacredsetter.h";
const std::string kGetter = "../include/kovacredential/kovacredgetter.h";
const std::string kSessSetter = "../include/kovacredential/kovacredsesssetter.h";
const std::string kSessGetter = "../include/kovacredential/kovacredsessgetter.h";

class RecordsTest : public ::testing::Test {
  protected:
    void SetUp() override {
        kova_test::ClearLog();
        ResetErrorSlot();
    }
};

struct IntAccessor {
    const char *name;
    int line;
    int (*set)(KOVA_CRED *, int32_t);
    int (*get)(int32_t *, const KOVA_CRED *);
    int32_t KOVA_CRED::*member;
};

struct StringAccessor {
    const char *name;
    int line;
    int (*set)(KOVA_CRED *, const char *);
    int (*get)(char *, size_t, const KOVA_CRED *);
    std::string KOVA_CRED::*member;
};

const IntAccessor kCredInts[] = {
    {"ID", 1, KOVACredItemSetID, KOVACredItemGetID, &KOVA_CRED::id},
    {"CreateTime", 2, KOVACredItemSetCreateTime, KOVACredItemGetCreateTime, &KOVA_CRED::ctime},
    {"ModifyTime", 3, KOVACredItemSetModifyTime, KOVACredItemGetModifyTime, &KOVA_CRED::mtime},
    {"Owner", 4, KOVACredItemSetOwner, KOVACredItemGetOwner, &KOVA_CRED::owner},
    {"Port", 5, KOVACredItemSetPort, KOVACredItemGetPort, &KOVA_CRED::port},
};

const StringAccessor kCredStrings[] = {
    {"Host", 6, KOVACredItemSetHost, KOVACredItemGetHost, &KOVA_CRED::host},
    {"Application", 7, KOVACredItemSetApplication, KOVACredItemGetApplication,
     &KOVA_CRED::application},
    {"RemoteAccount", 8, KOVACredItemSetRemoteAccount, KOVACredItemGetRemoteAccount,
     &KOVA_CRED::remote_account},
    {"RemotePasswd", 9, KOVACredItemSetRemotePasswd, KOVACredItemGetRemotePasswd,
     &KOVA_CRED::remote_passwd},
    {"Protocol", 10, KOVACredItemSetProtocol, KOVACredItemGetProtocol, &KOVA_CRED::protocol},
    {"ExtraInfo", 11, KOVACredItemSetExtraInfo, KOVACredItemGetExtraInfo, &KOVA_CRED::extra_info},
};

TEST_F(RecordsTest, AllocatedCredentialHasTheDefaults) {
    CredPtr cred = NewCred();
    ASSERT_NE(cred, nullptr);
    EXPECT_EQ(cred->next, nullptr);
    EXPECT_EQ(cred->filled, 0);
    EXPECT_EQ(cred->id, -1);
    EXPECT_EQ(cred->ctime, 0);
    EXPECT_EQ(cred->mtime, 0);
    EXPECT_EQ(cred->owner, -1);
    EXPECT_EQ(cred->port, 0);
    EXPECT_TRUE(cred->host.empty() && cred->remote_account.empty() && cred->remote_passwd.empty() &&
                cred->protocol.empty() && cred->application.empty() && cred->extra_info.empty());
    SessPtr sess = NewSess();
    ASSERT_NE(sess, nullptr);
    EXPECT_EQ(sess->next, nullptr);
    EXPECT_EQ(sess->filled, 0);
    EXPECT_EQ(sess->id, -1);
    EXPECT_TRUE(sess->access_token.empty() && sess->csrf_token.empty() && sess->extra_info.empty());
}

TEST_F(RecordsTest, IntegerAccessorsStoreAndReturnTheirMember) {
    for (const auto &acc : kCredInts) {
        SCOPED_TRACE(acc.name);
        CredPtr cred = NewCred();
        EXPECT_EQ(acc.set(cred.get(), -123456), 0);
        EXPECT_EQ(cred.get()->*acc.member, -123456);
        int32_t out = 0;
        EXPECT_EQ(acc.get(&out, cred.get()), 0);
        EXPECT_EQ(out, -123456);
    }
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

TEST_F(RecordsTest, IntegerAccessorsReportNullArgumentsWithTheirLine) {
    for (const auto &acc : kCredInts) {
        SCOPED_TRACE(acc.name);
        kova_test::ClearLog();
        EXPECT_EQ(acc.set(nullptr, 1), -1);
        EXPECT_TRUE(ArgErrorReported(kSetter, acc.line, "__null != pCred"));

        kova_test::ClearLog();
        CredPtr cred = NewCred();
        EXPECT_EQ(acc.get(nullptr, cred.get()), -1);
        EXPECT_TRUE(ArgErrorReported(kGetter, acc.line, "__null != pVal"));

        kova_test::ClearLog();
        int32_t out = 77;
        EXPECT_EQ(acc.get(&out, nullptr), -1);
        EXPECT_TRUE(ArgErrorReported(kGetter, acc.line, "NULL != pCred"));
        EXPECT_EQ(out, 77);

        // Both null: the value pointer is checked first.
        kova_test::ClearLog();
        EXPECT_EQ(acc.get(nullptr, nullptr), -1);
        EXPECT_TRUE(ArgErrorReported(kGetter, acc.line, "__null != pVal"));
    }
}

TEST_F(RecordsTest, StringAccessorsCopyWholeValues) {
    for (const auto &acc : kCredStrings) {
        SCOPED_TRACE(acc.name);
        CredPtr cred = NewCred();
        EXPECT_EQ(acc.set(cred.get(), "value with 'quotes' and \xc3\xa9"), 0);
        EXPECT_EQ(cred.get()->*acc.member, "value with 'quotes' and \xc3\xa9");
        char buf[64];
        EXPECT_EQ(acc.get(buf, sizeof(buf), cred.get()), 0);
        EXPECT_STREQ(buf, "value with 'quotes' and \xc3\xa9");
        // "" empties the member; it is not an error.
        EXPECT_EQ(acc.set(cred.get(), ""), 0);
        EXPECT_TRUE((cred.get()->*acc.member).empty());
    }
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

TEST_F(RecordsTest, StringGettersTruncateSilently) {
    for (const auto &acc : kCredStrings) {
        SCOPED_TRACE(acc.name);
        CredPtr cred = NewCred();
        ASSERT_EQ(acc.set(cred.get(), "abcdefghij"), 0);
        char buf[8];
        memset(buf, 'x', sizeof(buf));
        EXPECT_EQ(acc.get(buf, 5, cred.get()), 0);
        EXPECT_STREQ(buf, "abcd");
        EXPECT_EQ(buf[5], 'x');  // nothing written past cbBuf

        memset(buf, 'x', sizeof(buf));
        EXPECT_EQ(acc.get(buf, 1, cred.get()), 0);
        EXPECT_EQ(buf[0], '\0');
        EXPECT_EQ(buf[1], 'x');
    }
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

TEST_F(RecordsTest, StringAccessorsReportBadArgumentsInOrder) {
    for (const auto &acc : kCredStrings) {
        SCOPED_TRACE(acc.name);
        CredPtr cred = NewCred();
        cred.get()->*acc.member = "kept";

        kova_test::ClearLog();
        EXPECT_EQ(acc.set(nullptr, nullptr), -1);  // the text is checked first
        EXPECT_TRUE(ArgErrorReported(kSetter, acc.line, "__null != szVal"));

        kova_test::ClearLog();
        EXPECT_EQ(acc.set(cred.get(), nullptr), -1);
        EXPECT_TRUE(ArgErrorReported(kSetter, acc.line, "__null != szVal"));
        EXPECT_EQ(cred.get()->*acc.member, "kept");

        kova_test::ClearLog();
        EXPECT_EQ(acc.set(nullptr, "v"), -1);
        EXPECT_TRUE(ArgErrorReported(kSetter, acc.line, "NULL != pCred"));

        char buf[16] = "untouched";
        kova_test::ClearLog();
        EXPECT_EQ(acc.get(nullptr, 0, nullptr), -1);
        EXPECT_TRUE(ArgErrorReported(kGetter, acc.line, "__null != szBuf"));

        kova_test::ClearLog();
        EXPECT_EQ(acc.get(buf, 0, cred.get()), -1);
        EXPECT_TRUE(ArgErrorReported(kGetter, acc.line, "0 < cbBuf"));
        EXPECT_STREQ(buf, "untouched");

        kova_test::ClearLog();
        EXPECT_EQ(acc.get(buf, sizeof(buf), nullptr), -1);
        EXPECT_TRUE(ArgErrorReported(kGetter, acc.line, "NULL != pCred"));
    }
}

TEST_F(RecordsTest, SessionAccessors) {
    SessPtr sess = NewSess();
    EXPECT_EQ(KOVACredSessItemSetID(sess.get(), 42), 0);
    EXPECT_EQ(KOVACredSessItemSetAccessToken(sess.get(), "sid-1"), 0);
    EXPECT_EQ(KOVACredSessItemSetCsrfToken(sess.get(), "tok-1"), 0);
    EXPECT_EQ(KOVACredSessItemSetExtraInfo(sess.get(), "x"), 0);
    int32_t id = 0;
    char buf[16];
    EXPECT_EQ(KOVACredSessItemGetID(&id, sess.get()), 0);
    EXPECT_EQ(id, 42);
    EXPECT_EQ(KOVACredSessItemGetAccessToken(buf, sizeof(buf), sess.get()), 0);
    EXPECT_STREQ(buf, "sid-1");
    EXPECT_EQ(KOVACredSessItemGetCsrfToken(buf, 4, sess.get()), 0);
    EXPECT_STREQ(buf, "tok");
    EXPECT_EQ(KOVACredSessItemGetExtraInfo(buf, sizeof(buf), sess.get()), 0);
    EXPECT_STREQ(buf, "x");

    struct Case {
        std::function<int()> call;
        std::string file;
        int line;
        std::string check;
    };
    const std::vector<Case> cases = {
        {[] { return KOVACredSessItemSetID(nullptr, 1); }, kSessSetter, 1, "__null != pSess"},
        {[] { return KOVACredSessItemSetAccessToken(nullptr, "a"); }, kSessSetter, 2,
         "NULL != pSess"},
        {[&] { return KOVACredSessItemSetCsrfToken(sess.get(), nullptr); }, kSessSetter, 3,
         "__null != szVal"},
        {[] { return KOVACredSessItemSetExtraInfo(nullptr, nullptr); }, kSessSetter, 4,
         "__null != szVal"},
        {[] { return KOVACredSessItemGetID(nullptr, nullptr); }, kSessGetter, 1, "__null != pVal"},
        {[&] { return KOVACredSessItemGetID(&id, nullptr); }, kSessGetter, 1, "NULL != pSess"},
        {[&] { return KOVACredSessItemGetAccessToken(nullptr, 4, sess.get()); }, kSessGetter, 2,
         "__null != szBuf"},
        {[&] { return KOVACredSessItemGetCsrfToken(buf, 0, sess.get()); }, kSessGetter, 3,
         "0 < cbBuf"},
        {[&] { return KOVACredSessItemGetExtraInfo(buf, 4, nullptr); }, kSessGetter, 4,
         "NULL != pSess"},
    };
    for (const auto &c : cases) {
        SCOPED_TRACE(c.check + " line " + std::to_string(c.line));
        kova_test::ClearLog();
        EXPECT_EQ(c.call(), -1);
        EXPECT_TRUE(ArgErrorReported(c.file, c.line, c.check));
    }
}

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

TEST_F(RecordsTest, CredRowFirstCopiesColumnsByName) {
    CredPtr cred = NewCred();
    FakeRow row = CredRow("7", nullptr);
    EXPECT_EQ(row.Feed(CredRowFirst, cred.get()), 0);
    EXPECT_EQ(cred->filled, 1);
    EXPECT_EQ(cred->id, 7);
    EXPECT_EQ(cred->ctime, 100);
    EXPECT_EQ(cred->mtime, 200);
    EXPECT_EQ(cred->host, "");  // a NULL column becomes ""
    EXPECT_EQ(cred->owner, 1026);
    EXPECT_EQ(cred->remote_account, "acct");
    EXPECT_EQ(cred->remote_passwd, "pw");
    EXPECT_EQ(cred->port, 5001);  // strtol: blanks and sign allowed, stops at 'x'
    EXPECT_EQ(cred->protocol, "https");
    EXPECT_EQ(cred->application, "app");
    EXPECT_EQ(cred->extra_info, "extra");

    // A filled record keeps its first row.
    FakeRow second = CredRow("8", "other");
    EXPECT_EQ(second.Feed(CredRowFirst, cred.get()), 0);
    EXPECT_EQ(cred->id, 7);
    EXPECT_EQ(cred->host, "");
}

TEST_F(RecordsTest, IntegerColumnsOutOfRangeSaturate) {
    CredPtr cred = NewCred();
    FakeRow row({"id", "owner", "port", "ctime", "mtime"},
                {"2147483647", "-99999999999", "99999999999", "4294967297", "-2147483648"});
    row.Feed(CredRowFirst, cred.get());
    EXPECT_EQ(cred->id, INT32_MAX);
    EXPECT_EQ(cred->owner, INT32_MIN);
    EXPECT_EQ(cred->port, INT32_MAX);
    EXPECT_EQ(cred->ctime, INT32_MAX);  // not wrapped to 1
    EXPECT_EQ(cred->mtime, INT32_MIN);
}

TEST_F(RecordsTest, CredRowFirstMatchesNamesExactly) {
    CredPtr cred = NewCred();
    FakeRow row({"ID", "Host", "hostname", "host"}, {"5", "upper", "longer", "exact"});
    row.Feed(CredRowFirst, cred.get());
    EXPECT_EQ(cred->id, -1);
    EXPECT_EQ(cred->host, "exact");

    CredPtr empty = NewCred();
    FakeRow none({}, {});
    none.Feed(CredRowFirst, empty.get());
    EXPECT_EQ(empty->filled, 1);
    EXPECT_EQ(empty->id, -1);
}

TEST_F(RecordsTest, CredRowAppendLinksRowsInFront) {
    KOVA_CRED *head = nullptr;
    for (const char *id : {"1", "2", "3"}) {
        FakeRow row = CredRow(id, "h");
        EXPECT_EQ(row.Feed(CredRowAppend, &head), 0);
    }
    std::vector<int> ids;
    for (KOVA_CRED *p = head; p != nullptr; p = KOVACredNext(p)) {
        ids.push_back(p->id);
        EXPECT_EQ(p->filled, 1);
        EXPECT_EQ(p->host, "h");
    }
    EXPECT_EQ(ids, (std::vector<int>{3, 2, 1}));
    KOVACredListFree(&head);
    EXPECT_EQ(head, nullptr);
}

TEST_F(RecordsTest, SessionRowCallbacksSkipMtime) {
    KOVA_CRED_SESS *head = nullptr;
    FakeRow a({"id", "mtime", "access_token", "csrf_token", "extra_info"},
              {"4", "123", "sid", nullptr, "e"});
    FakeRow b({"id", "mtime", "access_token", "csrf_token", "extra_info"},
              {"6", "124", "sid6", "tok6", "e6"});
    a.Feed(CredSessRowAppend, &head);
    b.Feed(CredSessRowAppend, &head);
    ASSERT_NE(head, nullptr);
    EXPECT_EQ(head->id, 6);
    EXPECT_EQ(head->csrf_token, "tok6");
    ASSERT_NE(KOVACredSessNext(head), nullptr);
    EXPECT_EQ(head->next->id, 4);
    EXPECT_EQ(head->next->csrf_token, "");
    EXPECT_EQ(head->next->next, nullptr);
    KOVACredSessListFree(&head);

    SessPtr sess = NewSess();
    a.Feed(CredSessRowFirst, sess.get());
    b.Feed(CredSessRowFirst, sess.get());
    EXPECT_EQ(sess->filled, 1);
    EXPECT_EQ(sess->id, 4);
    EXPECT_EQ(sess->access_token, "sid");
    EXPECT_EQ(sess->extra_info, "e");
}

TEST_F(RecordsTest, ClearFreesTheChainAndResets) {
    KOVA_CRED *head = nullptr;
    for (const char *id : {"1", "2", "3"}) {
        FakeRow row = CredRow(id, "h");
        row.Feed(CredRowAppend, &head);
    }
    EXPECT_EQ(KOVACredClear(head), 0);  // ASan reports a leak if the chain is not freed
    EXPECT_EQ(head->next, nullptr);
    EXPECT_EQ(head->filled, 0);
    EXPECT_EQ(head->id, -1);
    EXPECT_EQ(head->owner, -1);
    EXPECT_EQ(head->port, 0);
    EXPECT_EQ(head->ctime, 0);
    EXPECT_TRUE(head->host.empty() && head->extra_info.empty() && head->remote_passwd.empty());
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

    EXPECT_TRUE(kova_test::LogRecords().empty());
    EXPECT_EQ(KOVACredClear(nullptr), -1);
    EXPECT_EQ(KOVACredSessClear(nullptr), -1);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
    EXPECT_EQ(VLIBCErrGet(), 0);
}

TEST_F(RecordsTest, FailedAllocationsAreReported) {
    KOVA_CRED *cred;
    KOVA_CRED_SESS *sess;
    {
        FailNothrowNewScope noMemory;
        cred = KOVACredAlloc();
        sess = KOVACredSessAlloc();
    }
    EXPECT_EQ(cred, nullptr);
    EXPECT_EQ(sess, nullptr);
    EXPECT_TRUE(ErrorIs(KOVA_ERR_OUT_OF_MEMORY, "cred_sess_alloc", 10));
    EXPECT_EQ(
        kova_test::LogRecords(),
        (std::vector<std::string>{
            std::string("cred_alloc:9 Allocate KOVA_CRED failed. ") + strerror(ENOMEM),
            std::string("cred_sess_alloc:9 Allocate KOVA_CRED_SESS failed. ") + strerror(ENOMEM)}));
}

TEST_F(RecordsTest, RowAppendDropsARowItCannotAllocate) {
    KOVA_CRED *head = nullptr;
    FakeRow first = CredRow("1", "a");
    FakeRow second = CredRow("2", "b");
    FakeRow third = CredRow("3", "c");
    first.Feed(CredRowAppend, &head);
    {
        FailNothrowNewScope noMemory;
        EXPECT_EQ(second.Feed(CredRowAppend, &head), 0);  // the query goes on
    }
    third.Feed(CredRowAppend, &head);
    ASSERT_NE(head, nullptr);
    EXPECT_EQ(head->id, 3);
    ASSERT_NE(head->next, nullptr);
    EXPECT_EQ(head->next->id, 1);
    EXPECT_EQ(head->next->next, nullptr);
    KOVACredListFree(&head);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

TEST_F(RecordsTest, FreeAndNextOfNullRecords) {
    EXPECT_EQ(KOVACredFree(nullptr), -1);
    EXPECT_TRUE(ArgErrorReported("cred_alloc", 19, "__null != pCred"));
    kova_test::ClearLog();
    EXPECT_EQ(KOVACredSessFree(nullptr), -1);
    EXPECT_TRUE(ArgErrorReported("cred_sess_alloc", 19, "__null != pSess"));
    EXPECT_EQ(KOVACredNext(nullptr), nullptr);
    EXPECT_EQ(KOVACredSessNext(nullptr), nullptr);
    CredPtr last = NewCred();
    EXPECT_EQ(KOVACredNext(last.get()), nullptr);
}

}  // namespace
