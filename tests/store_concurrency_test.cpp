// Sharing the database: the retry of locked statements, the seed of its pauses, writers killed
// at random moments and several processes working at once.
#include <errno.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <functional>
#include <map>
#include <numeric>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "credential/cred_internal.h"
#include "store_fixture.h"

namespace {

using namespace store_test;
using LockTest = StoreTest;

// Counts the executions of statements that begin with a prefix on one connection.
struct StatementCounter {
    std::string prefix;
    int count = 0;

    static int Trace(unsigned, void *ctx, void *stmt, void *) {
        auto *self = static_cast<StatementCounter *>(ctx);
        const char *sql = sqlite3_sql(static_cast<sqlite3_stmt *>(stmt));
        self->count += sql != nullptr && std::string(sql).rfind(self->prefix, 0) == 0;
        return 0;
    }
};

void ExpectSleepsInRange(size_t count) {
    auto sleeps = kova_test::UsleepCalls();
    EXPECT_EQ(sleeps.size(), count);
    for (unsigned us : sleeps) {
        EXPECT_LE(us, 999999u);
    }
}

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
    DbPtr conn(KOVACredDBInit());
    ASSERT_NE(conn, nullptr);
    sqlite3 *raw = nullptr;
    ASSERT_EQ(sqlite3_open(DbPath().c_str(), &raw), SQLITE_OK);
    const DbPtr holder(raw);
    ASSERT_EQ(sqlite3_exec(raw, "BEGIN EXCLUSIVE;", nullptr, nullptr, nullptr), SQLITE_OK);
    StatementCounter counter{"INSERT INTO credentials"};
    sqlite3_trace_v2(conn.get(), SQLITE_TRACE_STMT, StatementCounter::Trace, &counter);
    kova_test::FakeSleepScope fakeSleep;
    CredPtr cred = MakeCred("locked");
    int id = -1;
    EXPECT_EQ(KOVACredDBRecordAdd(conn.get(), cred.get(), &id), -1);
    EXPECT_EQ(id, -1);
    EXPECT_EQ(counter.count, 101);
    ExpectSleepsInRange(100);
    // One record, the password hidden.
    EXPECT_EQ(kova_test::LogRecords().size(), 1u) << kova_test::LogDump();
    EXPECT_EQ(LogCountPrefix("cred_db:214 Exec sql:[INSERT INTO credentials \t\t(ctime"), 1u);
    EXPECT_EQ(kova_test::LogCount("'admin', '***', '5001', 'https', 'app', '{\"k\":1}', " +
                                  std::to_string(getpid()) + ");] error: database is locked\n"),
              1u);

    // Reads retry the same way.
    counter = {"SELECT * FROM credentials"};
    kova_test::ClearLog();
    EXPECT_EQ(KOVACredDBRecordGet(conn.get(), 1, NewCred().get()), -1);
    EXPECT_EQ(counter.count, 101);
    EXPECT_EQ(kova_test::LogRecords(), (Texts{"cred_db:242 Exec sql:[SELECT * FROM credentials "
                                              "WHERE id=1;] error: database is locked\n"}));
    counter = {"SELECT * FROM credentials"};
    kova_test::ClearLog();
    EXPECT_EQ(KOVACredDBRecordGetList(conn.get(), nullptr, nullptr, 0), nullptr);
    EXPECT_EQ(counter.count, 101);
    EXPECT_EQ(kova_test::LogRecords(), (Texts{"cred_db:297 Exec sql:[SELECT * FROM credentials;] "
                                              "error: database is locked\n"}));

    // Through the interface the open's schema statement meets the lock first.
    kova_test::ClearLog();
    kova_test::ClearSleeps();
    CredPtr added = MakeCred("x");
    EXPECT_EQ(KOVACredAdd(added.get()), -1);
    EXPECT_EQ(added->id, -1);
    ExpectSleepsInRange(100);
    EXPECT_EQ(kova_test::LogRecords(), (Texts{"cred_db:175 Exec sql:[" + std::string(kCredSchema) +
                                                  "] error: database is locked\n",
                                              "cred_add:16 Init sqlite failed. [0x0000 :0]"}));

    // Once the other connection lets go, the same write goes through at once.
    ASSERT_EQ(sqlite3_exec(raw, "COMMIT;", nullptr, nullptr, nullptr), SQLITE_OK);
    kova_test::ClearSleeps();
    EXPECT_EQ(KOVACredDBRecordAdd(conn.get(), cred.get(), &id), 0);
    EXPECT_EQ(id, 1);
    EXPECT_TRUE(kova_test::UsleepCalls().empty());
}

TEST_F(LockTest, PausesAreSleptOutWhateverSignalsArrive) {
    ASSERT_NE(DbPtr(KOVACredDBInit()), nullptr);
    int ready[2];
    ASSERT_EQ(pipe(ready), 0);
    // Another process holds the lock for 1.5 s, far less than the retries' pauses add up to.
    const pid_t holder = StartChild(
        [&] {
            sqlite3 *raw = nullptr;
            ASSERT_EQ(sqlite3_open(DbPath().c_str(), &raw), SQLITE_OK);
            const DbPtr db(raw);
            ASSERT_EQ(sqlite3_exec(raw, "BEGIN EXCLUSIVE;", nullptr, nullptr, nullptr), SQLITE_OK);
            ASSERT_EQ(write(ready[1], "x", 1), 1);
            struct timespec hold = {1, 500000000};
            while (nanosleep(&hold, &hold) != 0 && errno == EINTR) {
            }
            EXPECT_EQ(sqlite3_exec(raw, "COMMIT;", nullptr, nullptr, nullptr), SQLITE_OK);
        },
        30);
    char byte = 0;
    ASSERT_EQ(read(ready[0], &byte, 1), 1);
    close(ready[0]);
    close(ready[1]);

    // A signal every millisecond in the caller, each ending a real usleep early as libc's does.
    struct sigaction onAlarm = {}, old = {};
    onAlarm.sa_handler = [](int) {};
    ASSERT_EQ(sigaction(SIGALRM, &onAlarm, &old), 0);
    const itimerval every1ms = {{0, 1000}, {0, 1000}}, off = {};
    kova_test::SetSleepInterruptible(true);
    ASSERT_EQ(setitimer(ITIMER_REAL, &every1ms, nullptr), 0);
    CredPtr cred = MakeCred("patient");
    const int added = KOVACredAdd(cred.get());
    setitimer(ITIMER_REAL, &off, nullptr);
    kova_test::SetSleepInterruptible(false);
    sigaction(SIGALRM, &old, nullptr);

    EXPECT_EQ(WaitChild(holder), 0);
    EXPECT_EQ(added, 0) << kova_test::LogDump();
    EXPECT_EQ(Query("SELECT host FROM credentials;"), (std::vector<Row>{{"patient"}}));
    EXPECT_TRUE(kova_test::LogRecords().empty()) << kova_test::LogDump();
}

// ---- Several processes and threads

// rand() in a forked child after store calls on four threads at once, with the child's pid
// and the seconds around the calls: 8 values, then 8 more after another seeding call.
struct Draw {
    long pid = 0;
    long before = 0;
    long after = 0;
    std::array<int, 16> values{};
};

Draw DrawInChild() {
    int fds[2];
    Draw draw;
    EXPECT_EQ(pipe(fds), 0);
    auto body = [&] {
        draw.pid = getpid();
        draw.before = time(nullptr);
        std::vector<std::thread> threads;
        for (int i = 0; i < 4; ++i) {
            threads.emplace_back([] { KOVACredIDGetByApplication("app"); });
        }
        for (auto &t : threads) {
            t.join();
        }
        draw.after = time(nullptr);
        for (int i = 0; i < 16; ++i) {
            if (i == 8) {
                KOVACredRandInit();
            }
            draw.values[i] = rand();
        }
        EXPECT_EQ(write(fds[1], &draw, sizeof(draw)), static_cast<ssize_t>(sizeof(draw)));
    };
    EXPECT_EQ(WaitChild(StartChild(body, 60)), 0);
    EXPECT_EQ(read(fds[0], &draw, sizeof(draw)), static_cast<ssize_t>(sizeof(draw)));
    close(fds[0]);
    close(fds[1]);
    return draw;
}

TEST_F(StoreTest, EveryProcessSeedsOnceWithItsOwnPid) {
    // The parent is seeded and its children inherit the generator. The tables exist, so that
    // the children's reads meet no lock (whose pauses would draw from rand()).
    ASSERT_NE(DbPtr(KOVACredDBInit()), nullptr);
    const Draw first = DrawInChild();
    const Draw second = DrawInChild();
    std::vector<int> parent(8);
    std::generate(parent.begin(), parent.end(), rand);
    EXPECT_NE(std::vector<int>(first.values.begin(), first.values.begin() + 8), parent)
        << "the child went on with the parent's sequence";
    EXPECT_NE(first.values, second.values);
    for (const Draw &d : {first, second}) {
        bool seededOnce = false;
        for (long t = d.before; t <= d.after && !seededOnce; ++t) {
            srand(static_cast<unsigned>(t + d.pid));
            seededOnce =
                std::all_of(d.values.begin(), d.values.end(), [](int v) { return rand() == v; });
        }
        EXPECT_TRUE(seededOnce) << "pid " << d.pid << " did not seed once with time + its pid";
    }
}

// Rows written by the burst and the soak: every column follows from a tag and a version, and
// the extra information spans several database pages, so that a torn write would show.
std::string Extra(const std::string &tag, int version) {
    std::string extra = "v" + std::to_string(version) + ":";
    while (extra.size() < 6000) {
        extra += tag + ";";
    }
    return extra;
}

CredPtr TaggedCred(const std::string &tag, int version) {
    CredPtr cred = MakeCred(tag);
    cred->remote_account = "acct-" + tag;
    cred->remote_passwd = "pw" + std::to_string(version) + "-" + tag;
    cred->extra_info = Extra(tag, version);
    return cred;
}

SessPtr TaggedSess(const std::string &tag, int version) {
    SessPtr sess = MakeSess(-1, "sid" + std::to_string(version) + "-" + tag,
                            "tok" + std::to_string(version) + "-" + tag);
    sess->extra_info = Extra(tag, version);
    return sess;
}

// Every credential with its session (NULL columns when it has none), and the row a credential
// of that id and tag has after writes of these versions (session 0: none written).
constexpr const char kJoinedRows[] =
    "SELECT c.id, c.host, c.remote_account, c.remote_passwd, c.extra_info, s.access_token, "
    "s.csrf_token, s.extra_info FROM credentials c LEFT JOIN credential_sessions s ON s.id = c.id;";
constexpr const char kOrphanSessions[] =
    "SELECT count(*) FROM credential_sessions WHERE id NOT IN (SELECT id FROM credentials);";

Row Written(const std::string &id, const std::string &tag, int version, int session) {
    const CredPtr cred = TaggedCred(tag, version);
    const SessPtr sess = TaggedSess(tag, session);
    Row row{id, tag, cred->remote_account, cred->remote_passwd, cred->extra_info};
    for (const std::string &text : {sess->access_token, sess->csrf_token, sess->extra_info}) {
        row.push_back(session == 0 ? "<NULL>" : text);
    }
    return row;
}

void WriteUntilKilled(const std::string &prefix) {
    for (int i = 0;; ++i) {
        const std::string tag = prefix + "-" + std::to_string(i);
        CredPtr cred = TaggedCred(tag, 1);
        if (KOVACredAdd(cred.get()) == 0) {
            KOVACredSessSetByID(cred->id, TaggedSess(tag, 1).get());
            KOVACredSetByID(cred->id, TaggedCred(tag, 2).get());
        }
    }
}

TEST_F(StoreTest, WritersKilledAtRandomMomentsLeaveWholeRows) {
    ASSERT_NE(DbPtr(KOVACredDBInit()), nullptr);
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("kill moments from seed " + std::to_string(seed));
    std::mt19937 rng(seed);
    int kills = 0;
    int hotJournals = 0;
    for (int round = 0; round < 12; ++round) {
        std::vector<pid_t> writers;
        for (int w = 0; w < 2; ++w) {
            const std::string prefix = "r" + std::to_string(round) + "w" + std::to_string(w);
            writers.push_back(StartChild([&] { WriteUntilKilled(prefix); }, 60));
        }
        for (pid_t pid : writers) {
            std::this_thread::sleep_for(
                std::chrono::milliseconds(std::uniform_int_distribution<int>(20, 300)(rng)));
            kill(pid, SIGKILL);
        }
        for (pid_t pid : writers) {
            const int status = WaitChild(pid);
            EXPECT_EQ(status, 128 + SIGKILL);
            kills += status == 128 + SIGKILL;
        }
        // A writer killed inside a transaction leaves a journal for the next reader to roll back.
        hotJournals += access((DbPath() + "-journal").c_str(), F_OK) == 0;
        ASSERT_EQ(Query("PRAGMA integrity_check;"), (std::vector<Row>{{"ok"}})) << round;
    }
    // Each credential was added, given a session and updated, and was killed at any step.
    const auto rows = Query(kJoinedRows);
    for (const Row &row : rows) {
        auto is = [&](int version, int session) {
            return row == Written(row[0], row[1], version, session);
        };
        EXPECT_TRUE(is(1, 0) || is(1, 1) || is(2, 1)) << "torn row " << row[0];
    }
    EXPECT_GT(rows.size(), 0u) << "the writers wrote nothing before they were killed";
    EXPECT_EQ(Query("SELECT count(DISTINCT host) FROM credentials;"),
              (std::vector<Row>{{std::to_string(rows.size())}}))
        << "a row was written twice";
    EXPECT_EQ(Query(kOrphanSessions), (std::vector<Row>{{"0"}}));
    KOVA_CRED *list = nullptr;
    EXPECT_EQ(KOVACredListGet(&list, nullptr, nullptr), static_cast<int>(rows.size()));
    KOVACredListFree(&list);
    printf("[ figures  ] %d writers killed, %d rounds left a hot journal, %zu whole rows\n", kills,
           hotJournals, rows.size());
}

// ---- The soak: several processes run mixed operations on credentials of their own, then the
// database is audited against what each of them was told.

constexpr int kSoakProcesses = 8;
#if defined(__SANITIZE_ADDRESS__)
// Instrumented, every transaction holds the lock several times longer and the workers mostly
// wait for each other; fewer operations keep that run as short as the normal one.
constexpr int kSoakOperations = 150;
#else
constexpr int kSoakOperations = 500;
#endif

// What a worker tells the test, in memory they share: counts of its operations by kind, of
// failures (those that left a code, and those that did not return -1 or said nothing), of lock
// retries and of lists that missed or misread one of its credentials; and each credential it
// holds as {id, number of the operation that added it, version, session version}.
enum Count {
    kAdd,
    kSet,
    kSessionSet,
    kList,
    kRemove,
    kFailed,
    kWithCode,
    kSilent,
    kRetries,
    kStale,
    kCounts
};
struct SoakReport {
    int count[kCounts];
    int owned;
    std::array<int, 4> own[kSoakOperations];
};

std::string SoakTag(int worker, int n) {
    return "p" + std::to_string(worker) + "-" + std::to_string(n);
}

void RunSoakWorker(int worker, unsigned seed, SoakReport *report) {
    // The pauses between lock retries keep their order but last a tenth, so that the run fits
    // in a test suite; a worker then retries more often, not less.
    kova_test::SetSleepDivisor(10);
    kova_test::ClearSleeps();
    std::mt19937 rng(seed + static_cast<unsigned>(worker));
    std::discrete_distribution<int> mix({30, 20, 20, 15, 15});  // by kind, add to remove
    std::map<int, std::array<int, 3>> owned;  // id: {operation that added it, version, session}
    int *count = report->count;
    for (int n = 0; n < kSoakOperations; ++n) {
        const int op = owned.empty() ? kAdd : mix(rng);
        auto it = owned.begin();
        std::advance(it, owned.empty() ? 0 : rng() % owned.size());
        const std::string tag = SoakTag(worker, op == kAdd ? n : it->second[0]);
        kova_test::ClearLog();
        ResetErrorSlot();
        long result = -1;
        if (op == kAdd) {
            CredPtr cred = TaggedCred(tag, 1);
            if ((result = KOVACredAdd(cred.get())) == 0) {
                owned[cred->id] = {n, 1, 0};
            }
        } else if (op == kSet) {
            result = KOVACredSetByID(it->first, TaggedCred(tag, it->second[1] + 1).get());
            it->second[1] += result == 0;
        } else if (op == kSessionSet) {
            result = KOVACredSessSetByID(it->first, TaggedSess(tag, it->second[2] + 1).get());
            it->second[2] += result == 0;
        } else if (op == kRemove) {
            if ((result = KOVACredRemoveByID(it->first)) == 0) {
                owned.erase(it);
            }
        } else {
            KOVA_CRED *list = nullptr;
            result = KOVACredListGet(&list, nullptr, nullptr);
            std::map<int, std::string> seen;
            for (KOVA_CRED *p = list; p != nullptr; p = p->next) {
                seen[p->id] = p->remote_passwd;
            }
            KOVACredListFree(&list);
            for (const auto &o : owned) {
                count[kStale] +=
                    result >= 0 &&
                    seen[o.first] !=
                        TaggedCred(SoakTag(worker, o.second[0]), o.second[1])->remote_passwd;
            }
        }
        ++count[op];
        if (result < 0) {
            // A failure returns -1 and says why: a code in the error slot or a log record.
            ++count[kFailed];
            count[kWithCode] += VLIBCErrGet() != 0;
            count[kSilent] +=
                result != -1 || (VLIBCErrGet() == 0 && kova_test::LogRecords().empty());
        }
    }
    count[kRetries] = static_cast<int>(kova_test::UsleepCalls().size());
    for (const auto &o : owned) {
        report->own[report->owned++] = {o.first, o.second[0], o.second[1], o.second[2]};
    }
}

TEST_F(StoreTest, SoakOfEightProcessesLosesNothing) {
    // On a disk every write waits for its flushes and the run would measure the disk; in memory
    // (/dev/shm) SQLite locks the file just the same.
    const kova_test::TempDir dir(access("/dev/shm", W_OK) == 0 ? "/dev/shm" : "");
    const std::string path = dir.File("credentials.sqlite");
    setenv("kovacredential_db", path.c_str(), 1);
    ASSERT_NE(DbPtr(KOVACredDBInit()), nullptr);
    const size_t size = sizeof(SoakReport) * kSoakProcesses;
    void *shared = mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
    ASSERT_NE(shared, MAP_FAILED);
    const std::unique_ptr<SoakReport, std::function<void(SoakReport *)>> reports(
        static_cast<SoakReport *>(shared), [size](SoakReport *p) { munmap(p, size); });
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("operations from seed " + std::to_string(seed));
    const auto start = std::chrono::steady_clock::now();
    std::vector<pid_t> workers;
    for (int w = 0; w < kSoakProcesses; ++w) {
        workers.push_back(StartChild([&] { RunSoakWorker(w, seed, &reports.get()[w]); }, 240));
    }
    for (pid_t pid : workers) {
        EXPECT_EQ(WaitChild(pid), 0) << "a worker crashed or did not finish in time";
    }
    ASSERT_FALSE(HasFailure());
    const double seconds =
        std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();

    int total[kCounts] = {};
    std::map<std::string, Row> expected;
    for (int w = 0; w < kSoakProcesses; ++w) {
        const SoakReport &r = reports.get()[w];
        for (int c = 0; c < kCounts; ++c) {
            total[c] += r.count[c];
        }
        for (int i = 0; i < r.owned; ++i) {
            const std::string id = std::to_string(r.own[i][0]);
            EXPECT_TRUE(
                expected.emplace(id, Written(id, SoakTag(w, r.own[i][1]), r.own[i][2], r.own[i][3]))
                    .second)
                << "two workers hold credential " << id;
        }
    }
    EXPECT_EQ(std::accumulate(total, total + kFailed, 0), kSoakProcesses * kSoakOperations);
    EXPECT_EQ(total[kSilent], 0) << "a failed operation returned other than -1 or said nothing";
    EXPECT_EQ(total[kStale], 0) << "a list missed or misread a credential its worker held";

    // Every credential a worker holds is there as last written, with its session as last
    // written, and there is nothing else: no duplicate, no write that failed yet landed.
    std::map<std::string, Row> found;
    for (const Row &row : RawQuery(path, kJoinedRows)) {
        found[row[0]] = row;
    }
    EXPECT_EQ(found.size(), expected.size());
    for (const auto &e : expected) {
        const auto it = found.find(e.first);
        EXPECT_EQ(it == found.end() ? Row{"lost"} : it->second, e.second);
    }
    EXPECT_EQ(RawQuery(path, kOrphanSessions), (std::vector<Row>{{"0"}}));
    const size_t sessions = std::count_if(expected.begin(), expected.end(),
                                          [](const auto &e) { return e.second[5] != "<NULL>"; });
    printf(
        "[ figures  ] %d processes x %d operations in %.1f s: %d add, %d set, %d session-set, "
        "%d list, %d remove; %d lock retries; %d failed (%d with a code); %zu credentials and "
        "%zu sessions as expected\n",
        kSoakProcesses, kSoakOperations, seconds, total[kAdd], total[kSet], total[kSessionSet],
        total[kList], total[kRemove], total[kRetries], total[kFailed], total[kWithCode],
        found.size(), sessions);
}

}  // namespace
