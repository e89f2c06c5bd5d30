// Sharing the database: the retry of locked statements and several processes writing at once.
#include <signal.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <chrono>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "credential/cred_internal.h"
#include "store_fixture.h"

namespace {

using namespace store_test;

// Counts the executions of statements that begin with a prefix on one connection, and can
// release another connection's lock once a given number of executions is reached.
struct StatementCounter {
    std::string prefix;
    int count = 0;
    int releaseAt = 0;  // 0: never
    sqlite3 *holder = nullptr;

    static int Trace(unsigned, void *ctx, void *stmt, void *) {
        auto *self = static_cast<StatementCounter *>(ctx);
        const char *sql = sqlite3_sql(static_cast<sqlite3_stmt *>(stmt));
        if (sql != nullptr && std::string(sql).rfind(self->prefix, 0) == 0) {
            ++self->count;
            if (self->count == self->releaseAt && self->holder != nullptr) {
                sqlite3_exec(self->holder, "COMMIT;", nullptr, nullptr, nullptr);
            }
        }
        return 0;
    }
    void Attach(sqlite3 *db) { sqlite3_trace_v2(db, SQLITE_TRACE_STMT, Trace, this); }
};

class LockTest : public StoreTest {
  protected:
    void SetUp() override {
        StoreTest::SetUp();
        conn_.reset(KOVACredDBInit());
        ASSERT_NE(conn_, nullptr);
        ASSERT_EQ(sqlite3_open(DbPath().c_str(), &raw_), SQLITE_OK);
        holder_.reset(raw_);
        ASSERT_EQ(sqlite3_exec(holder_.get(), "BEGIN EXCLUSIVE;", nullptr, nullptr, nullptr),
                  SQLITE_OK);
        kova_test::ClearLog();
    }

    static void ExpectSleepsInRange(size_t count) {
        auto sleeps = kova_test::UsleepCalls();
        EXPECT_EQ(sleeps.size(), count);
        for (unsigned us : sleeps) {
            EXPECT_LE(us, 999999u);
        }
    }

    sqlite3 *raw_ = nullptr;
    DbPtr conn_;
    DbPtr holder_;
};

TEST(LockBackoff, FollowsTheSignedArithmetic) {
    using kova::cred::LockBackoffMicros;
    EXPECT_EQ(LockBackoffMicros(0), 100000u);
    EXPECT_EQ(LockBackoffMicros(1), 100032u);
    EXPECT_EQ(LockBackoffMicros(31250), 100000u);       // 1000000 % 1000000 == 0
    EXPECT_EQ(LockBackoffMicros(31249), 999999u);       // 999968 + 100000 is capped
    EXPECT_EQ(LockBackoffMicros(0x04000000), 999999u);  // wraps to INT32_MIN: negative sum
    EXPECT_EQ(LockBackoffMicros(0x7fffffff), 99968u);   // wraps to -32: small sum kept
    EXPECT_EQ(LockBackoffMicros(2080386776), 96u);      // wraps to -2147099904: sum 96
    for (int r = 0; r < 200000; r += 7) {
        ASSERT_LE(LockBackoffMicros(r), 999999u);
    }
}

TEST_F(LockTest, LockedWriteIsTried101TimesThenLoggedOnce) {
    StatementCounter inserts{"INSERT INTO credentials"};
    inserts.Attach(conn_.get());
    kova_test::FakeSleepScope fakeSleep;
    CredPtr cred = MakeCred("locked");
    int id = -1;
    EXPECT_EQ(KOVACredDBRecordAdd(conn_.get(), cred.get(), &id), -1);
    EXPECT_EQ(id, -1);
    EXPECT_EQ(inserts.count, 101);
    ExpectSleepsInRange(100);
    const auto records = kova_test::LogRecords();
    ASSERT_EQ(records.size(), 1u) << kova_test::LogDump();
    EXPECT_EQ(records[0].rfind("cred_db:214 Exec sql:[INSERT INTO credentials \t\t(ctime", 0), 0u);
    EXPECT_NE(records[0].find("] error: database is locked\n"), std::string::npos);

    // Once the other connection lets go, the same write goes through at once.
    ASSERT_EQ(sqlite3_exec(holder_.get(), "COMMIT;", nullptr, nullptr, nullptr), SQLITE_OK);
    kova_test::ClearSleeps();
    EXPECT_EQ(KOVACredDBRecordAdd(conn_.get(), cred.get(), &id), 0);
    EXPECT_EQ(id, 1);
    EXPECT_TRUE(kova_test::UsleepCalls().empty());
}

TEST_F(LockTest, LockReleasedDuringTheRetriesLetsTheWriteThrough) {
    StatementCounter updates{"REPLACE INTO credential_sessions"};
    updates.releaseAt = 4;
    updates.holder = holder_.get();
    updates.Attach(conn_.get());
    // The credential must exist for the foreign key: insert it through the holder's lock.
    ASSERT_EQ(sqlite3_exec(holder_.get(), "INSERT INTO credentials (id, host) VALUES (1, 'h');",
                           nullptr, nullptr, nullptr),
              SQLITE_OK);
    kova_test::FakeSleepScope fakeSleep;
    EXPECT_EQ(KOVACredSessDBRecordUpdate(conn_.get(), 1, MakeSess(1, "s", "t").get()), 0)
        << kova_test::LogDump();
    EXPECT_EQ(updates.count, 4);
    ExpectSleepsInRange(3);
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
    EXPECT_EQ(Query("SELECT access_token FROM credential_sessions;"), (std::vector<Row>{{"s"}}));
}

TEST_F(LockTest, LockedReadsAndTheOpenRetryToo) {
    StatementCounter selects{"SELECT * FROM credentials"};
    selects.Attach(conn_.get());
    kova_test::FakeSleepScope fakeSleep;
    CredPtr cred = NewCred();
    EXPECT_EQ(KOVACredDBRecordGet(conn_.get(), 1, cred.get()), -1);
    EXPECT_EQ(selects.count, 101);
    EXPECT_EQ(kova_test::LogCount("cred_db:242 Exec sql:[SELECT * FROM credentials WHERE id=1;] "
                                  "error: database is locked\n"),
              1u);

    // Through the interface the open's schema statement meets the lock first.
    kova_test::ClearLog();
    kova_test::ClearSleeps();
    CredPtr added = MakeCred("x");
    EXPECT_EQ(KOVACredAdd(added.get()), -1);
    ExpectSleepsInRange(100);
    const auto records = kova_test::LogRecords();
    ASSERT_EQ(records.size(), 2u) << kova_test::LogDump();
    EXPECT_EQ(records[0].rfind("cred_db:175 Exec sql:[CREATE TABLE if not exists credentials", 0),
              0u);
    EXPECT_NE(records[0].find("error: database is locked"), std::string::npos);
    EXPECT_EQ(records[1].rfind("cred_add:16 Init sqlite failed. [0x", 0), 0u);
    EXPECT_EQ(added->id, -1);
}

// ---- Several processes

constexpr int kChildren = 4;
constexpr int kAddsPerChild = 25;

// Each child adds its credentials and exits with the number of failed adds.
[[noreturn]] void RunWriter(int child) {
    // Children of one parent inherit its seed; different seeds keep their pauses apart.
    srand(static_cast<unsigned>(getpid()));
    int failures = 0;
    for (int i = 0; i < kAddsPerChild; ++i) {
        CredPtr cred = MakeCred("child" + std::to_string(child) + "-" + std::to_string(i));
        if (KOVACredAdd(cred.get()) != 0 || cred->id < 1) {
            ++failures;
        }
    }
    _exit(failures);
}

TEST_F(StoreTest, ConcurrentProcessesLoseNothing) {
    {
        // The file and tables exist before the writers start.
        DbPtr db(KOVACredDBInit());
        ASSERT_NE(db, nullptr);
    }
    std::vector<pid_t> pids;
    for (int c = 0; c < kChildren; ++c) {
        pid_t pid = fork();
        ASSERT_GE(pid, 0);
        if (pid == 0) {
            RunWriter(c);
        }
        pids.push_back(pid);
    }
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(120);
    std::vector<int> results(kChildren, -1);
    size_t done = 0;
    while (done < pids.size() && std::chrono::steady_clock::now() < deadline) {
        for (size_t i = 0; i < pids.size(); ++i) {
            int status = 0;
            if (results[i] == -1 && waitpid(pids[i], &status, WNOHANG) == pids[i]) {
                results[i] = WIFEXITED(status) ? WEXITSTATUS(status) : 1000;
                ++done;
            }
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    for (size_t i = 0; i < pids.size(); ++i) {
        if (results[i] == -1) {
            kill(pids[i], SIGKILL);
            waitpid(pids[i], nullptr, 0);
        }
    }
    ASSERT_EQ(done, pids.size()) << "writers did not finish within the time limit";
    for (int r : results) {
        EXPECT_EQ(r, 0) << "a child had failed adds";
    }

    auto rows = Query("SELECT id, host, pid FROM credentials ORDER BY id;");
    ASSERT_EQ(rows.size(), static_cast<size_t>(kChildren * kAddsPerChild));
    std::set<std::string> ids, hosts, writers;
    for (const auto &row : rows) {
        ids.insert(row[0]);
        hosts.insert(row[1]);
        writers.insert(row[2]);
    }
    EXPECT_EQ(ids.size(), rows.size());
    EXPECT_EQ(writers.size(), static_cast<size_t>(kChildren));
    for (int c = 0; c < kChildren; ++c) {
        for (int i = 0; i < kAddsPerChild; ++i) {
            EXPECT_EQ(hosts.count("child" + std::to_string(c) + "-" + std::to_string(i)), 1u);
        }
    }
}

}  // namespace
