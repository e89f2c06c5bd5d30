// kovacred as a user runs it: against a kovasim process and a temporary database, every
// command's text and --json output, the failure lines and exit statuses, the batch summary
// and progress, streamed request bodies, the shell completion and the manual page.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <fstream>
#include <memory>
#include <mutex>
#include <regex>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include <curl/curl.h>
#include <sys/stat.h>
#include <gtest/gtest.h>
#include <json/version.h>
#include <openssl/crypto.h>
#include <sqlite3.h>

#include "kovacredential/kovacredential.h"
#include "platform/json_text.h"
#include "simlib/fault_server.h"
#include "simlib/loopback_server.h"
#include "simlib/webapi_sim.h"
#include "store_fixture.h"
#include "support/sim_process.h"
#include "support/temp_dir.h"
#include "support/tls_certs.h"

namespace kova_test {
namespace {

constexpr char kPassword[] = "Kp-9f2e6c1d-x";  // the simulator's account "keeper"

struct Result {
    int status = -1;
    std::string out;
    std::string err;
};

Json::Value ParseOut(const std::string &text) {
    Json::Value value;
    EXPECT_TRUE(kova::JsonFromString(text.substr(0, text.find_last_not_of('\n') + 1), value))
        << text;
    return value;
}

std::string Quote(const std::string &text) {
    std::string quoted = "'";
    for (char c : text) {
        quoted += c == '\'' ? std::string("'\\''") : std::string(1, c);
    }
    return quoted + "'";
}

// One kovasim for the whole suite (its RSA key takes a while to make), with an account whose
// password is easy to spot in output; each test has a database of its own.
class KovacredTest : public ::testing::Test {
  protected:
    static void SetUpTestSuite() {
        simDir_ = new TempDir();
        std::ofstream(simDir_->File("sim.json"))
            << R"({"webapi": {"accounts": [{"account": "admin", "password": "secret"},
                  {"account": "otpuser", "password": "secret", "otp": "123456"},
                  {"account": "keeper", "password": ")"
            << kPassword << "\"}]}}";
        sim_ = new SimProcess(*simDir_, "--config " + simDir_->File("sim.json"));
    }
    static void TearDownTestSuite() {
        delete sim_;
        delete simDir_;
    }
    void SetUp() override { ASSERT_GT(sim_->HttpPort(), 0) << sim_->ErrorOutput(); }

    // Runs kovacred on the test's database with `input` on standard input.
    Result Run(const std::string &args, const std::string &input = "") {
        const std::string in = db_.dir().File("stdin");
        const std::string err = db_.dir().File("stderr");
        std::ofstream(in, std::ios::binary) << input;
        Result result;
        result.status = RunCommand(kova_test::ToolCommand(KOVACRED_BIN) + " --db " + db_.path() +
                                       " " + args + " <" + in + " 2>" + err,
                                   &result.out);
        result.err = ReadFile(err);
        return result;
    }
    static std::string Url(const std::string &path, bool https = false) {
        return std::string(https ? "https" : "http") +
               "://127.0.0.1:" + std::to_string(https ? sim_->HttpsPort() : sim_->HttpPort()) +
               path;
    }
    // Each credential gets an application tag of its own, so that add stores a new one.
    void Add(const std::string &account, const std::string &password, bool https = false) {
        Result r = Run("add --host 127.0.0.1 --port " +
                           std::to_string(https ? sim_->HttpsPort() : sim_->HttpPort()) +
                           " --protocol " + (https ? "https" : "http") + " --account " + account +
                           " --application app" + std::to_string(++added_),
                       password + "\n");
        ASSERT_EQ(r.status, 0) << r.err;
    }

    TempDatabase db_;
    int added_ = 0;
    static inline TempDir *simDir_ = nullptr;
    static inline SimProcess *sim_ = nullptr;
};

TEST_F(KovacredTest, StoreCommandsPrintTextOrJson) {
    const std::string password = "pa$$'w0rd\"-SECRET";
    Result r =
        Run("add --host nas.example --port 5001 --protocol https --account admin "
            "--application backup --extra '{\"note\":1}' --owner 1026",
            password + "\n");
    ASSERT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(r.out, "added credential 1\n");
    ASSERT_EQ(Run("add --host 10.0.0.7 --port 5000 --protocol http --account ops", "pw\r\n").status,
              0);
    KOVA_CRED stored;
    ASSERT_EQ(KOVACredGetByID(1, &stored), 0);
    EXPECT_EQ(stored.remote_passwd, password);  // one line, without its newline
    KOVA_CRED second;
    ASSERT_EQ(KOVACredGetByID(2, &second), 0);
    EXPECT_EQ(second.remote_passwd, "pw");
    EXPECT_EQ(second.owner, -1);
    // The same server, account and application again: updated, not duplicated.
    r = Run("add --host 10.0.0.7 --port 5000 --protocol http --account ops --owner 7 --json",
            "pw2\n");
    EXPECT_EQ(ParseOut(r.out), ParseOut(R"({"id": 2, "updated": true})")) << r.err;
    EXPECT_EQ(ParseOut(Run("add --host 10.0.0.7 --port 5000 --protocol http --account ops "
                           "--application other --json",
                           "pw\n")
                           .out),
              ParseOut(R"({"id": 3, "updated": false})"));
    ASSERT_EQ(Run("remove 3").status, 0);
    EXPECT_EQ(Run("passwd 2", "pw3\n").out, "changed the password of credential 2\n");
    KOVA_CRED changed;
    ASSERT_EQ(KOVACredGetByID(2, &changed), 0);
    EXPECT_EQ(changed.remote_passwd, "pw3");
    EXPECT_EQ(changed.owner, 7);

    // Rows oldest first, columns aligned.
    r = Run("list");
    EXPECT_EQ(r.out.find("ID  HOST         PORT  PROTOCOL  ACCOUNT  APPLICATION  OWNER"), 0u)
        << r.out;
    EXPECT_LT(r.out.find("\n1   nas.example  5001  https     admin    backup       1026"),
              r.out.find("\n2   10.0.0.7     5000  http      ops                   -1"))
        << r.out;
    Json::Value list = ParseOut(Run("list --json").out);
    ASSERT_EQ(list.size(), 2u);
    EXPECT_EQ(list[0]["host"], "nas.example");
    EXPECT_EQ(list[0]["extra"], "{\"note\":1}");
    EXPECT_EQ(list[1]["protocol"], "http");

    r = Run("show 1");
    EXPECT_NE(r.out.find("password:     (stored, not shown)\n"), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("owner:        1026\n"), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("session:      none\n"), std::string::npos) << r.out;

    // The session id and token come from standard input, one line each.
    ASSERT_EQ(Run("session set 1 --extra e", "SID-1\nTOK-1\n").out,
              "stored session of credential 1\n");
    EXPECT_EQ(Run("session show 1").out, "id:     1\nsid:    SID-1\ntoken:  TOK-1\nextra:  e\n");
    EXPECT_EQ(ParseOut(Run("session show 1 --json").out),
              ParseOut(R"({"id": 1, "sid": "SID-1", "token": "TOK-1", "extra": "e"})"));
    Json::Value shown = ParseOut(Run("show 1 --json").out);
    EXPECT_EQ(shown["session"], true);
    EXPECT_EQ(shown["application"], "backup");
    EXPECT_EQ(shown["owner"], 1026);

    EXPECT_EQ(Run("session remove 1").out, "removed session of credential 1\n");
    ASSERT_EQ(Run("session set 2", "s\n").status, 0);
    EXPECT_EQ(store_test::RawQuery(db_.path(),
                                   "SELECT access_token, csrf_token FROM credential_sessions;"),
              (std::vector<store_test::Row>{{"s", ""}}));
    EXPECT_EQ(Run("remove 2").out, "removed credential 2\n");
    EXPECT_EQ(store_test::RawQuery(db_.path(), "SELECT id FROM credentials;"),
              (std::vector<store_test::Row>{{"1"}}));
    EXPECT_TRUE(store_test::RawQuery(db_.path(), "SELECT * FROM credential_sessions;").empty());
}

TEST_F(KovacredTest, FailuresPrintOneLineWithTheCodesNameAndExitNonZero) {
    Add("admin", "secret");
    ASSERT_EQ(Run("add --host 127.0.0.1 --port 1 --protocol http --account down", "pw\n").status,
              0);
    const struct {
        std::string args;
        int status;
        std::string err;
    } cases[] = {
        {"show 42", 1, "kovacred: show: no credential with id 42\n"},
        {"remove 42", 1, "kovacred: remove: no credential with id 42\n"},
        {"add --host h --port 1 --account a", 1,
         "kovacred: add: no password on standard input (give it as one line)\n"},
        {"session show 1", 1, "kovacred: session show: no session for credential 1\n"},
        {"session remove 1", 1, "kovacred: session remove: no session for credential 1\n"},
        {"session set 9", 1, "kovacred: session set: no credential with id 9\n"},
        {"session set 1", 1,
         "kovacred: session set: no session id on standard input (give it as the first line)\n"},
        {"call 9 KOVA.Demo.Echo 1 echo", 1, "kovacred: call failed: no credential with id 9\n"},
        {"logout 1", 1, "kovacred: logout failed: no stored session for credential 1\n"},
        {"call 1 KOVA.No.Such 1 get", 6,
         "kovacred: call KOVA.No.Such failed (error 6 CRED_REQ_ERR_NO_SUCH_API: the server does "
         "not offer the API)\n"},
        {"request --fail " + Url("/missing"), 14,
         "kovacred: request failed (error 14 CRED_REQ_ERR_HTTP_CLIENT: HTTP status 400 to 499)\n"},
        {"probe " + Url("/missing"), 5,
         "kovacred: probe failed (error 5 CRED_REQ_ERR_QUERY_FAIL: a probe or API-description "
         "query failed)\n"},
        {"request http://127.0.0.1:1/", 20,
         "kovacred: request failed (error 20 CRED_REQ_ERR_CONNECT: connecting or receiving "
         "failed): curl 7: Failed to connect to 127.0.0.1 port 1 "},
        // Causes the tool finds before the library runs.
        {"request ftp://127.0.0.1/", 1,
         "kovacred: request failed: unsupported scheme \"ftp\" (http or https)\n"},
        {"probe http://127.0.0.1:70000/", 1,
         "kovacred: probe failed: bad port \"70000\" (1 to 65535)\n"},
        {"request -F f=/nonexistent/x " + Url("/"), 1,
         "kovacred: request failed: cannot read /nonexistent/x: No such file or directory\n"},
        {"call 1 KOVA.Demo.Upload 1 put --file f=/nonexistent/x", 1,
         "kovacred: call failed: cannot read /nonexistent/x: No such file or directory\n"},
        // A server that is down is named by the description query of login, call and apis.
        {"login 2", 20,
         "kovacred: login failed (error 20 CRED_REQ_ERR_CONNECT: connecting or receiving "
         "failed): curl 7: "},
        {"call 2 KOVA.Demo.Echo 1 echo", 20,
         "kovacred: call KOVA.Demo.Echo failed (error 20 CRED_REQ_ERR_CONNECT: connecting or "
         "receiving failed): curl 7: "},
        {"apis 2", 20,
         "kovacred: apis failed (error 20 CRED_REQ_ERR_CONNECT: connecting or receiving "
         "failed): curl 7: "},
    };
    // One line each, which starts with (or, ending in a newline, is) the expected text.
    for (const auto &c : cases) {
        Result r = Run(c.args);
        EXPECT_EQ(r.status, c.status) << c.args << ": " << r.err;
        EXPECT_EQ(r.err.substr(0, c.err.size()), c.err) << c.args;
        EXPECT_EQ(std::count(r.err.begin(), r.err.end(), '\n'), 1) << r.err;
        EXPECT_EQ(r.out, "") << c.args;
    }
    // -v copies the library's log records to standard error.
    Result r = Run("-v request http://127.0.0.1:1/");
    EXPECT_EQ(r.status, 20);
    EXPECT_TRUE(
        std::regex_search(r.err, std::regex("kovacred\\[[0-9]+\\]: cred_request[a-z_]*:[0-9]+ ")))
        << r.err;
}

TEST_F(KovacredTest, WebApiCommandsLogInCallAndLogOutShowingNoSecrets) {
    Add("admin", "secret");
    Add("admin", "wrong");
    Add("otpuser", "secret");
    Add("admin", "secret", true);

    Result r = Run("login 1");
    EXPECT_EQ(r.out, "logged in to " + Url("") + " as admin; session stored for credential 1\n")
        << r.err;
    r = Run("apis 1");
    EXPECT_TRUE(
        std::regex_search(r.out, std::regex("\nKOVA\\.Demo\\.Json +entry\\.cgi +1-1 +JSON\n")))
        << r.out;
    EXPECT_EQ(ParseOut(Run("apis 1 --json").out)["KOVA.Demo.Upload"]["path"], "upload.cgi");

    // Text: the answer's data, indented; --json: the whole answer, on one line.
    r = Run("call 1 KOVA.Demo.Echo 1 echo greeting=hello 'note=two words'");
    ASSERT_EQ(r.status, 0) << r.err;
    EXPECT_NE(r.out.find("\n  \"method\" : \"echo\""), std::string::npos) << r.out;
    EXPECT_EQ(ParseOut(r.out)["params"]["note"], "two words");
    r = Run("call 1 KOVA.Demo.Json 1 get --params '{\"count\":3}' tag=x --json");
    ASSERT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(std::count(r.out.begin(), r.out.end(), '\n'), 1) << r.out;
    Json::Value answer = ParseOut(r.out);
    EXPECT_EQ(answer["success"], true);
    EXPECT_EQ(answer["data"]["params"]["count"], 3);
    std::ofstream(db_.dir().File("up.txt")) << "up";
    r = Run("call 1 KOVA.Demo.Echo 1 echo --file f=" + db_.dir().File("up.txt") + " x=1");
    EXPECT_EQ(ParseOut(r.out)["params"]["x"], "1") << r.err;
    // Over HTTPS, logging in first since no session is stored.
    EXPECT_EQ(ParseOut(Run("call 4 KOVA.Demo.Session 1 whoami").out)["account"], "admin");

    EXPECT_EQ(Run("logout 1").out, "logged out; session of credential 1 removed\n");

    // The server's own codes are not the library's; a call's login names them as login does.
    EXPECT_EQ(Run("login 2").err,
              "kovacred: login failed (server error 400: wrong account or password)\n");
    r = Run("call 2 KOVA.Demo.Echo 1 echo");
    EXPECT_EQ(r.err,
              "kovacred: call KOVA.Demo.Echo failed: login failed (server error 400: wrong "
              "account or password)\n");
    EXPECT_EQ(r.status, 1);  // 400 does not fit an exit status
    EXPECT_EQ(Run("login 3").err,
              "kovacred: login failed (server error 403: one-time code required)\n");
    EXPECT_EQ(Run("login 3 --otp 000000").err,
              "kovacred: login failed (server error 404: wrong one-time code)\n");
    EXPECT_EQ(Run("login 3 --otp 123456").status, 0);

    // The password, session id and token of a stored credential reach no output but that of
    // "session show", although the echo API sends the session back in every answer.
    Add("keeper", kPassword);
    ASSERT_EQ(Run("login 5").status, 0);
    const std::string batch = R"([{"cred": 5, "api": "KOVA.Demo.Echo", "version": 1,
                                  "method": "echo", "params": {"p": ")" +
                              std::string(kPassword) + "\"}}]";
    std::set<std::string> secrets = {kPassword};
    bool echoed = false;
    for (const std::string command :
         {"list", "list --json", "show 5", "show 5 --json", "apis 5", "apis 5 --json", "batch -",
          "batch - --json", "login 5", "call 5 KOVA.Demo.Echo 1 echo",
          "call 5 KOVA.Demo.Echo 1 echo --json", "logout 5"}) {
        r = Run(command, command.rfind("batch", 0) == 0 ? batch : "");
        EXPECT_TRUE(r.status == 0) << command << ": " << r.err;
        KOVA_CRED_SESS sess;
        if (KOVACredSessGetByID(5, &sess) == 0 && sess.id == 5) {
            secrets.insert(sess.access_token);
            secrets.insert(sess.csrf_token);
        }
        for (const std::string &secret : secrets) {
            EXPECT_EQ((r.out + r.err).find(secret), std::string::npos)
                << command << " printed " << secret << ":\n"
                << r.out << r.err;
        }
        echoed = echoed || r.out.find("(hidden)") != std::string::npos;
    }
    EXPECT_TRUE(echoed) << "the echo answers should have carried the session";

    ASSERT_EQ(Run("login 5").status, 0);
    KOVA_CRED_SESS kept;
    ASSERT_EQ(KOVACredSessGetByID(5, &kept), 0);
    for (const char *command : {"session show 5", "session show 5 --json"}) {
        r = Run(command);
        EXPECT_NE(r.out.find(kept.access_token), std::string::npos) << r.out;
        EXPECT_NE(r.out.find(kept.csrf_token), std::string::npos) << r.out;
    }
}

TEST_F(KovacredTest, BatchSummarisesEveryCallAndFailsWhenOneDoes) {
    Add("admin", "secret");
    const std::string info = Url("/webapi/query.cgi?api=KOVA.API.Info&version=1&method=query");
    const std::string calls =
        R"([{"cred": 1, "api": "KOVA.Demo.Delay", "version": 1, "method": "wait",
             "params": {"ms": "100"}},
            {"url": ")" +
        info + R"("}, {"url": ")" + Url("/missing") + R"("},
            {"cred": 42, "api": "KOVA.Demo.Echo", "version": 1, "method": "echo"}, 7])";
    Result r = Run("batch -", calls);
    EXPECT_EQ(r.status, 1);
    std::vector<std::string> lines;
    std::istringstream rows(r.out);
    for (std::string line; std::getline(rows, line);) {
        lines.push_back(line);
    }
    ASSERT_EQ(lines.size(), 6u) << r.out;
    const std::string time = " +[0-9]+\\.[0-9]{3} s";
    const std::string expected[] = {
        "# +TARGET +RESULT +ERROR +TIME",
        "0 +cred 1 KOVA\\.Demo\\.Delay 1 wait +ok +-" + time,
        "1 +http://127\\.0\\.0\\.1:[0-9]+/webapi/query\\.cgi\\?api=KOVA\\.API\\.Info&version=1&"
        "method=query +ok +-" +
            time,
        "2 +http://127\\.0\\.0\\.1:[0-9]+/missing +failed +14 CRED_REQ_ERR_HTTP_CLIENT" + time,
        "3 +cred 42 KOVA\\.Demo\\.Echo 1 echo +not run +[0-9]+ CRED_REQ_ERR_[A-Z_]+ +-",
        "4 +\\(not an object\\) +not run +1 CRED_REQ_ERR_BAD_PARAM +-",
    };
    for (size_t i = 0; i < lines.size(); ++i) {
        EXPECT_TRUE(std::regex_match(lines[i], std::regex(expected[i]))) << lines[i];
    }
    EXPECT_EQ(r.err,
              "kovacred: batch: call 3: no credential with id 42\n"
              "kovacred: batch: call 4: not an object\n"
              "kovacred: batch: 3 of 5 calls failed\n");

    const std::string file = db_.dir().File("calls.json");
    std::ofstream(file) << calls;
    r = Run("batch --json " + file);
    EXPECT_EQ(r.status, 1);
    Json::Value out = ParseOut(r.out);
    ASSERT_EQ(out.size(), 5u) << r.out;
    EXPECT_EQ(out[0]["result"], "ok");
    EXPECT_EQ(out[0]["answer"]["data"]["delayed_ms"], 100);
    EXPECT_GE(out[0]["ms"].asInt(), 100);
    EXPECT_TRUE(out[1]["answer"]["data"].isMember("KOVA.API.Info")) << r.out;
    EXPECT_EQ(out[2]["code"], 14);
    EXPECT_EQ(out[2]["name"], "CRED_REQ_ERR_HTTP_CLIENT");
    EXPECT_EQ(out[4]["result"], "not run");
    EXPECT_TRUE(out[4]["answer"].isNull());

    r = Run("batch -", "[{\"url\": \"" + info + "\"}]");
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(r.err, "");
    r = Run("batch " + db_.dir().File("absent.json"));
    EXPECT_EQ(r.err, "kovacred: batch: cannot read " + db_.dir().File("absent.json") + "\n");
    r = Run("batch -", "{\"url\": \"x\"}");
    EXPECT_EQ(r.err, "kovacred: batch: standard input must hold a JSON array of calls\n");
    r = Run("batch -", "[{\"url\":\n");
    EXPECT_TRUE(std::regex_match(r.err, std::regex("kovacred: batch: standard input is not JSON: "
                                                   "Line 2, Column 1 [^\n]+\n")))
        << r.err;
}

// Progress goes to standard error only on a terminal, and ends on the final counts. script(1)
// runs the batch on a terminal of its own and copies what reaches it.
TEST_F(KovacredTest, BatchShowsProgressOnATerminal) {
    Add("admin", "secret");
    const std::string file = db_.dir().File("calls.json");
    std::ofstream(file) << R"([{"cred": 1, "api": "KOVA.Demo.Delay", "version": 1,
        "method": "wait", "params": {"ms": "1500"}}, {"url": ")"
                        << Url("/missing") << "\"}]";
    const std::string out = db_.dir().File("stdout");
    std::string terminal;
    EXPECT_EQ(RunCommand("script -qec " +
                             Quote("timeout 60 " + kova_test::ToolCommand(KOVACRED_BIN) + " --db " +
                                   db_.path() + " batch " + file + " >" + out) +
                             " /dev/null </dev/null",
                         &terminal),
              1);
    EXPECT_NE(terminal.find("kovacred: batch: 1/2 done, 1 failed, "), std::string::npos)
        << terminal;
    EXPECT_TRUE(std::regex_search(terminal, std::regex("\rkovacred: batch: 2/2 done, 1 failed, "
                                                       "[0-9]+\\.[0-9] s\r?\n")))
        << terminal;
    EXPECT_NE(ReadFile(out).find("0  cred 1 KOVA.Demo.Delay 1 wait"), std::string::npos);
}

TEST_F(KovacredTest, RequestSendsItsOptionsStreamsAndPrintsTextOrJson) {
    kovasim::LoopbackServer server;
    server.Route("*", "/echo", [](const httplib::Request &req, httplib::Response &res) {
        res.set_header("X-Answer", "42");
        res.set_content(req.method + " " + req.target + " " + req.body + " H=" +
                            req.get_header_value("X-Test") + " C=" + req.get_header_value("Cookie"),
                        "text/plain");
    });
    ASSERT_TRUE(server.Start());
    const std::string url = server.BaseUrl() + "/echo";
    // Options and the URL in any order; the body byte-exact, without a newline added.
    EXPECT_EQ(Run("request " + url + " -q a=1 -d b=x -H 'X-Test: t' -b id=S").out,
              "POST /echo?a=1 b=x H=t C=id=S");
    EXPECT_EQ(Run("request -H 'X-Test: t' " + url + " -d b=x").out, "POST /echo b=x H=t C=");
    ASSERT_EQ(Run("request -d b=x " + url + " -o " + db_.dir().File("out")).status, 0);
    EXPECT_EQ(ReadFile(db_.dir().File("out")), "POST /echo b=x H= C=");
    std::ofstream(db_.dir().File("body")) << "{\"k\":1}";
    Result r = Run("request --headers --body-file " + db_.dir().File("body") + " " + url);
    EXPECT_TRUE(std::regex_match(r.out, std::regex("\\{.*\"X-Answer\":\"42\".*\\}\n"
                                                   "POST /echo \\{\"k\":1\\} H= C=")))
        << r.out;
    Json::Value answer = ParseOut(Run("request " + url + " --json -d b=y").out);
    EXPECT_EQ(answer["url"], url);
    EXPECT_EQ(answer["status"], 200);
    EXPECT_EQ(answer["headers"]["X-Answer"], "42");
    EXPECT_EQ(answer["body"], "POST /echo b=y H= C=");
    answer = ParseOut(Run("request --timing --json " + url).out);
    EXPECT_GT(answer["timing"]["total"].asDouble(), 0) << answer.toStyledString();
    EXPECT_EQ(answer["timing"]["reused"], false);
    EXPECT_TRUE(std::regex_match(
        Run("request --timing " + url).err,
        std::regex("kovacred: timing: name lookup [0-9.]+ s, connect [0-9.]+ s, TLS [0-9.]+ s, "
                   "first byte [0-9.]+ s, total [0-9.]+ s, reused no\n")));

    EXPECT_EQ(Run("probe " + url).out, "reachable\n");
    EXPECT_EQ(ParseOut(Run("probe --json " + url).out),
              ParseOut("{\"url\": \"" + url + "\", \"reachable\": true}"));

    // Twenty megabytes streamed up and down byte-exact, from a file and from standard input.
    const std::string in = db_.dir().File("in.bin");
    ASSERT_EQ(RunCommand("head -c " + std::to_string(20 << 20) + " /dev/urandom >" + in), 0);
    const std::string out = db_.dir().File("out.bin");
    r = Run("request -T " + in + " -o " + out + " " + Url("/raw/echo"));
    ASSERT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(r.out, "");
    EXPECT_TRUE(ReadFile(in) == ReadFile(out)) << "the body came back altered";

    r = Run("request --json --upload-file - --output " + out + " " + Url("/raw/echo", true),
            ReadFile(in));
    ASSERT_EQ(r.status, 0) << r.err;
    answer = ParseOut(r.out);
    EXPECT_EQ(answer["status"], 200);
    EXPECT_EQ(answer["bytes"], 20 << 20);
    EXPECT_EQ(answer["output"], out);
    EXPECT_EQ(answer["headers"]["Content-Type"], "application/octet-stream");
    EXPECT_TRUE(ReadFile(in) == ReadFile(out)) << "the body came back altered";
}

// -o replaces its file only when the request succeeds; like curl, the body of any HTTP answer
// is the output unless --fail; a body past the in-memory cap needs -o; what cannot be written
// exits 23.
TEST_F(KovacredTest, RequestOutputReplacesItsFileOnlyOnSuccess) {
    kovasim::LoopbackServer server;
    server.Route("GET", "/text", [](const httplib::Request &, httplib::Response &res) {
        res.set_content("no newline", "text/plain");
    });
    server.Route("GET", "/gone", [](const httplib::Request &, httplib::Response &res) {
        res.status = 404;
        res.set_content("gone body", "text/plain");
    });
    server.Route("GET", "/big", [](const httplib::Request &, httplib::Response &res) {
        res.set_content(std::string((size_t{64} << 20) + 1, 'x'), "application/octet-stream");
    });
    ASSERT_TRUE(server.Start());
    const std::string dir = db_.dir().File("out");
    ASSERT_EQ(mkdir(dir.c_str(), 0700), 0);
    const std::string file = dir + "/f";
    const std::string notFound =
        "kovacred: request: HTTP status 404 (error 14 CRED_REQ_ERR_HTTP_CLIENT: HTTP status 400 "
        "to 499)\n";
    const struct {
        std::string args;
        int status;
        std::string file;
        std::string err;
    } cases[] = {
        {"http://127.0.0.1:1/", 20, "keep\n",
         "kovacred: request failed (error 20 CRED_REQ_ERR_CONNECT: connecting or receiving "
         "failed): curl 7: Failed to connect to 127.0.0.1 port 1 "},
        {"--fail " + server.BaseUrl() + "/gone", 14, "keep\n",
         "kovacred: request failed (error 14 CRED_REQ_ERR_HTTP_CLIENT: HTTP status 400 to "
         "499)\n"},
        {server.BaseUrl() + "/gone", 0, "gone body", notFound},
        {server.BaseUrl() + "/text", 0, "no newline", ""},
    };
    for (const auto &c : cases) {
        std::ofstream(file) << "keep\n";
        Result r = Run("request -o " + file + " " + c.args);
        EXPECT_EQ(r.status, c.status) << c.args;
        EXPECT_EQ(c.err.empty() ? r.err : r.err.substr(0, c.err.size()), c.err) << c.args;
        EXPECT_EQ(ReadFile(file), c.file) << c.args;
        std::string listing;
        RunCommand("ls -A " + dir, &listing);
        EXPECT_EQ(listing, "f\n") << c.args << ": a temporary file was left";
    }
    Result r = Run("request " + server.BaseUrl() + "/gone");
    EXPECT_EQ(r.status, 0);
    EXPECT_EQ(r.out, "gone body");
    EXPECT_EQ(r.err, notFound);
    r = Run("request " + server.BaseUrl() + "/big");
    EXPECT_EQ(r.status, 12);
    EXPECT_EQ(r.err,
              "kovacred: request failed (error 12 CRED_REQ_ERR_CURL_OTHER: any other libcurl "
              "failure): the answer is larger than the 67108864 bytes held in memory; use -o "
              "FILE\n");
    EXPECT_TRUE(r.out.empty()) << r.out.size() << " bytes on standard output";

    // Standard output that cannot be written.
    Add("admin", "secret");
    for (const std::string &args :
         std::vector<std::string>{"list", "request " + server.BaseUrl() + "/text"}) {
        std::string err;
        EXPECT_EQ(RunCommand(kova_test::ToolCommand(KOVACRED_BIN) + " --db " + db_.path() + " " +
                                 args + " 2>&1 >/dev/full",
                             &err),
                  23)
            << args;
        EXPECT_EQ(err, "kovacred: writing standard output failed: No space left on device\n");
    }
}

// Only add creates a database; no command adds tables to, or changes, a file that is not a
// credential database.
TEST_F(KovacredTest, DatabaseMistakesCreateAndChangeNothing) {
    std::string out;
    EXPECT_EQ(RunCommand(kova_test::ToolCommand(KOVACRED_BIN) + " list --db '' 2>&1", &out), 2);
    EXPECT_EQ(out, "kovacred: --db needs a database path, not an empty one\n");

    const std::string absent = db_.dir().File("sub") + "/absent.sqlite";
    const std::string foreign = db_.dir().File("foreign.sqlite");
    const std::string junk = db_.dir().File("junk");
    {
        sqlite3 *db = nullptr;
        ASSERT_EQ(sqlite3_open(foreign.c_str(), &db), SQLITE_OK);
        ASSERT_EQ(sqlite3_exec(db, "CREATE TABLE notes (text TEXT);", nullptr, nullptr, nullptr),
                  SQLITE_OK);
        sqlite3_close(db);
    }
    ASSERT_EQ(chmod(foreign.c_str(), 0644), 0);
    std::ofstream(junk) << std::string(4096, 'J');
    const std::string foreignBytes = ReadFile(foreign);
    const std::pair<std::string, std::string> databases[] = {
        {absent, "no credential database at " + absent},
        {foreign, foreign + " is not a credential database (it has no credentials table)"},
        {junk, junk + " is not a credential database (file is not a database)"},
    };
    for (const auto &database : databases) {
        for (const std::string command :
             {"list", "show 1", "remove 1", "passwd 1", "session show 1", "session set 1",
              "session remove 1", "login 1", "logout 1", "call 1 A 1 m", "apis 1"}) {
            Result r = Run(command + " --db " + database.first, "x\n");
            EXPECT_EQ(r.status, 1) << command;
            EXPECT_EQ(r.err, "kovacred: " + database.second + "\n") << command;
        }
    }
    const std::string add = "add --host h --port 1 --account a --db ";
    EXPECT_EQ(Run(add + foreign, "pw\n").err, "kovacred: " + databases[1].second + "\n");
    EXPECT_FALSE(std::ifstream(absent).good()) << "a read-only command made a database";
    EXPECT_TRUE(ReadFile(foreign) == foreignBytes) << "the foreign database was changed";
    struct stat st;
    ASSERT_EQ(stat(foreign.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0644u);
    EXPECT_EQ(ReadFile(junk), std::string(4096, 'J'));
    // add makes the database, and then the others use it.
    EXPECT_EQ(Run(add + absent, "pw\n").out, "added credential 1\n");
    EXPECT_EQ(Run("show 1 --json --db " + absent).status, 0);
}

// Usage errors exit 2 with one line that names the word at fault.
TEST_F(KovacredTest, UsageErrorsExitTwoNamingTheWord) {
    const std::pair<std::string, std::string> cases[] = {
        {"bogus", "bogus"},
        {"list --bogus", "--bogus"},
        {"show 0", "a credential id is a whole number from 1 to 2147483647, not \"0\""},
        {"call x A 1 m", "not \"x\""},
        {"add --host h --port 1 --account a --owner abc", "abc"},
        {"add --host h --port 0 --account a", "0 not in range 1 to 65535"},
        {"add --host h --port 1 --account a --protocol ftp", "ftp"},
        {"add --host '' --port 1 --account a", "add: --host must not be empty"},
        {"add --host h --port 1 --account a --password x", "--password"},
        {"session set 1 --sid S", "--sid"},
        {"request", "url is required"},
        {"request -d novalue http://127.0.0.1:1/", "bad --data novalue"},
    };
    for (const auto &c : cases) {
        Result r = Run(c.first, "pw\n");
        EXPECT_EQ(r.status, 2) << c.first << ": " << r.err;
        EXPECT_EQ(r.err.rfind("kovacred: ", 0), 0u) << r.err;
        EXPECT_EQ(std::count(r.err.begin(), r.err.end(), '\n'), 1) << r.err;
        EXPECT_NE(r.err.find(c.second), std::string::npos) << c.first << ": " << r.err;
    }
    EXPECT_FALSE(std::ifstream(db_.path()).good()) << "a rejected command made a database";
}

// The first Ctrl-C during a batch ends it with the summary of what finished.
TEST_F(KovacredTest, BatchInterruptedPrintsWhatFinished) {
    kovasim::LoopbackServer server;
    std::mutex mutex;
    std::condition_variable changed;
    bool entered = false;
    bool release = false;
    server.Route("GET", "/slow", [&](const httplib::Request &, httplib::Response &res) {
        std::unique_lock<std::mutex> lock(mutex);
        entered = true;
        changed.notify_all();
        changed.wait_for(lock, std::chrono::seconds(60), [&] { return release; });
        res.set_content("late", "text/plain");
    });
    ASSERT_TRUE(server.Start());
    const std::string file = db_.dir().File("calls.json");
    std::ofstream(file) << "[{\"url\": \"" << server.BaseUrl() << "/slow\"}]";
    const std::string out = db_.dir().File("stdout");
    const std::string err = db_.dir().File("stderr");
    const pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
        execl("/bin/sh", "sh", "-c",
              (kova_test::ToolCommand(KOVACRED_BIN) + " batch " + file + " >" + out + " 2>" + err)
                  .insert(0, "exec ")
                  .c_str(),
              static_cast<char *>(nullptr));
        _exit(127);
    }
    {
        std::unique_lock<std::mutex> lock(mutex);
        EXPECT_TRUE(changed.wait_for(lock, std::chrono::seconds(60), [&] { return entered; }));
    }
    kill(pid, SIGINT);
    int status = 0;
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    {
        std::lock_guard<std::mutex> lock(mutex);
        release = true;
        changed.notify_all();
    }
    ASSERT_TRUE(WIFEXITED(status)) << "ended by signal " << WTERMSIG(status);
    EXPECT_EQ(WEXITSTATUS(status), 130);
    EXPECT_TRUE(
        std::regex_search(ReadFile(out), std::regex("\n0 +http://[^ ]+/slow +cancelled +- +-\n")))
        << ReadFile(out);
    EXPECT_EQ(ReadFile(err), "kovacred: batch: interrupted: 0 of 1 calls finished, 1 cancelled\n");
}

// --verify, --cacert and --pin check the server of request, login, call, apis and batch (the
// library's default checks nothing); --max-time bounds them; a failure names libcurl's cause.
TEST_F(KovacredTest, TransportOptionsCheckTheServerAndBoundTheTime) {
    kova_test::TestCa ca;
    const kova_test::TlsIdentity identity = ca.Issue("IP:127.0.0.1");
    kovasim::LoopbackServer tls(HttpsWith(identity));
    tls.Route("GET", "/ok", [](const httplib::Request &, httplib::Response &res) {
        res.set_content("secure", "text/plain");
    });
    ASSERT_TRUE(tls.Start()) << tls.Error();
    const std::string url = tls.BaseUrl() + "/ok";
    const std::string caFile = db_.dir().File("ca.pem");
    std::ofstream(caFile) << ca.CertPem();
    const std::string known = db_.dir().File("known_servers");
    const std::string server = "127.0.0.1:" + std::to_string(tls.Port());
    const std::string unverified =
        "failed (error 12 CRED_REQ_ERR_CURL_OTHER: any other libcurl failure): curl 60: ";

    Result r = Run("request " + url);
    EXPECT_EQ(r.out, "secure") << r.err;
    r = Run("request --verify " + url);
    EXPECT_EQ(r.status, 12);
    EXPECT_EQ(r.err.rfind("kovacred: request " + unverified, 0), 0u) << r.err;
    EXPECT_EQ(Run("request --cacert " + caFile + " " + url).out, "secure");

    // Trust on first use: the key is recorded, then required.
    r = Run("request --pin " + url);
    EXPECT_EQ(r.out, "secure");
    EXPECT_EQ(r.err, "kovacred: pinned the public key of " + server + " (" + identity.pin +
                         ") in " + known + "\n");
    EXPECT_EQ(ReadFile(known), server + " " + identity.pin + "\n");
    struct stat st;
    ASSERT_EQ(stat(known.c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 0777, 0600u);
    r = Run("request --pin " + url);
    EXPECT_EQ(r.out, "secure");
    EXPECT_EQ(r.err, "");
    const std::string other = ca.Issue("IP:127.0.0.1").pin;
    std::ofstream(known) << server << " " << other << "\n";
    const size_t served = tls.RequestCount();
    r = Run("request --pin " + url);
    EXPECT_EQ(r.status, 12);
    EXPECT_EQ(r.err,
              "kovacred: request failed (error 12 CRED_REQ_ERR_CURL_OTHER: any other "
              "libcurl failure): the public key of " +
                  server + " has changed: known " + other + ", now " + identity.pin +
                  "; if the change is expected, delete the line of " + server + " from " + known +
                  " and run again\n");
    EXPECT_EQ(tls.RequestCount(), served) << "the request reached a server with another key";

    // The WebAPI commands against the simulator's self-signed certificate.
    Add("admin", "secret", true);
    for (const std::string command : {"login 1", "apis 1", "call 1 KOVA.Demo.Echo 1 echo"}) {
        r = Run(command + " --verify");
        EXPECT_EQ(r.status, 12) << command;
        EXPECT_NE(r.err.find(unverified), std::string::npos) << command << ": " << r.err;
    }
    EXPECT_TRUE(std::regex_search(
        Run("batch - --verify", R"([{"cred": 1, "api": "KOVA.Demo.Echo", "version": 1,
                                    "method": "echo"}])")
            .err,
        std::regex("call 0: the API description \\(error 12 [^\n]*curl 60: ")));
    // The login's own requests are checked: no password reaches a server that fails.
    kovasim::WebApiSim webapi;
    kovasim::LoopbackServer::Options httpsOptions;
    httpsOptions.https = true;
    kovasim::LoopbackServer https(httpsOptions);
    webapi.Install(https);
    ASSERT_TRUE(https.Start()) << https.Error();
    std::ofstream(db_.dir().File("self.pem")) << https.CertificatePem();
    ASSERT_EQ(Run("add --host localhost --port " + std::to_string(https.Port()) +
                      " --protocol https --account admin",
                  "secret\n")
                  .status,
              0);
    r = Run("login 2 --verify");
    EXPECT_EQ(r.status, 12);
    EXPECT_EQ(r.err.rfind("kovacred: login " + unverified, 0), 0u) << r.err;
    EXPECT_EQ(https.CountPath("/webapi/auth.cgi"), 0u) << "the password went to it";
    r = Run("login 2 --cacert " + db_.dir().File("self.pem"));
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(https.CountPath("/webapi/auth.cgi"), 1u);
    r = Run("login 1 --pin");
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_NE(ReadFile(known).find("127.0.0.1:" + std::to_string(sim_->HttpsPort()) + " sha256//"),
              std::string::npos);

    // A server that never answers.
    kovasim::FaultServer silent(kovasim::Fault::kSilent);
    ASSERT_TRUE(silent.Start());
    r = Run("request --max-time 0.5 " + silent.BaseUrl() + "/");
    EXPECT_EQ(r.status, 10);
    EXPECT_NE(r.err.find("(error 10 CRED_REQ_ERR_TIMEOUT: operation timed out): curl 28: "),
              std::string::npos)
        << r.err;
    ASSERT_EQ(Run("add --host 127.0.0.1 --port " + std::to_string(silent.Port()) +
                      " --protocol http --account a",
                  "pw\n")
                  .status,
              0);
    r = Run("login 3 --max-time 0.5");
    EXPECT_EQ(r.status, 10) << r.err;
    EXPECT_EQ(r.err.rfind("kovacred: login failed (error 10 CRED_REQ_ERR_TIMEOUT", 0), 0u) << r.err;
}

// The completion function run in bash, as bash-completion runs it.
TEST_F(KovacredTest, CompletionOffersCommandsOptionsIdsAndFiles) {
    Add("admin", "secret");
    Add("ops", "secret");
    std::ofstream(db_.dir().File("calls.json")) << "[]";
    const std::string db = db_.path();
    const std::string dir = db_.dir().path();
    const std::string script = db_.dir().File("complete.sh");
    // The completion runs the command word itself to list ids: a wrapper, so that it runs the
    // way every test starts the tool (behind an emulator on a cross build).
    const std::string kovacred = db_.dir().File("kovacred");
    std::ofstream(kovacred) << "#!/bin/sh\nexec " << kova_test::ToolCommand(KOVACRED_BIN)
                            << " \"$@\"\n";
    ASSERT_EQ(chmod(kovacred.c_str(), 0755), 0);
    std::ofstream(script) << "source /usr/share/bash-completion/bash_completion\n"
                             "source " KOVA_SOURCE_DIR
                             "/tools/kovacred/kovacred.bash\n"
                             "COMP_LINE=\"$1\"\nCOMP_POINT=${#COMP_LINE}\n"
                             "read -ra COMP_WORDS <<< \"$COMP_LINE\"\n"
                             "[[ $COMP_LINE == *' ' ]] && COMP_WORDS+=('')\n"
                             "COMP_CWORD=$((${#COMP_WORDS[@]} - 1))\n"
                             "_kovacred\necho \"${COMPREPLY[*]}\"\n";
    const std::pair<std::string, std::string> cases[] = {
        // the line after "kovacred ", and the candidates offered
        {"se", "session"},
        {"session ", "show set remove"},
        {"--db " + db + " show ", "1 2"},
        {"--db " + db + " session show ", "1 2"},
        {"--db " + db + " call 2 ", ""},
        {"--db " + dir + "/absent.sqlite show ", ""},
        {"request --upl", "--upload --upload-file"},
        {"list --", "--json --help"},
        {"add --protocol ", "http https"},
        {"batch " + dir + "/ca", dir + "/calls.json"},
        {"request -o " + dir + "/ca", dir + "/calls.json"},
    };
    for (const auto &c : cases) {
        std::string out;
        EXPECT_EQ(
            RunCommand("bash " + script + " " + Quote(kovacred + " " + c.first) + " 2>&1", &out),
            0);
        EXPECT_EQ(out, c.second + "\n") << c.first;
    }
    EXPECT_FALSE(std::ifstream(dir + "/absent.sqlite").good()) << "completion made a database";
}

// --version names the libraries the tools run with; every command and option `kovacred --help`
// lists is in kovacred(1) and (options) offered by the completion.
TEST(KovacredManualTest, VersionPageAndCompletionNameEverything) {
    const std::string libraries = std::string("libcurl ") +
                                  curl_version_info(CURLVERSION_NOW)->version + "\nOpenSSL " +
                                  OpenSSL_version(OPENSSL_VERSION_STRING) + "\nSQLite " +
                                  sqlite3_libversion() + "\njsoncpp " JSONCPP_VERSION_STRING "\n";
    std::string out;
    EXPECT_EQ(RunCommand(kova_test::ToolCommand(KOVACRED_BIN) + " --version", &out), 0);
    EXPECT_EQ(out, "kovacred " KOVA_VERSION "\nlibkovacredential " KOVA_VERSION "\n" + libraries);
    out.clear();
    EXPECT_EQ(RunCommand(kova_test::ToolCommand(KOVASIM_BIN) + " --version", &out), 0);
    EXPECT_EQ(out, "kovasim " KOVA_VERSION "\nlibkovacredential " KOVA_VERSION "\n" + libraries);

    std::string page;
    ASSERT_EQ(
        RunCommand("MANWIDTH=200 LC_ALL=C man -l " KOVA_BINARY_DIR "/doc/kovacred.1.gz", &page), 0);
    const std::string completion = ReadFile(KOVA_SOURCE_DIR "/tools/kovacred/kovacred.bash");
    const std::regex option("^  (?:(-[a-zA-Z]),)?(--[a-z][a-z-]*)");
    const std::regex subcommand("^  ([a-z]+) ");
    std::vector<std::string> commands = {""};
    size_t checked = 0;
    for (size_t i = 0; i < commands.size(); ++i) {
        std::string help;
        ASSERT_EQ(
            RunCommand(kova_test::ToolCommand(KOVACRED_BIN) + " " + commands[i] + " --help", &help),
            0);
        std::istringstream lines(help);
        bool inSubcommands = false;
        for (std::string line; std::getline(lines, line);) {
            std::smatch m;
            if (line.rfind("Subcommands:", 0) == 0 || line.rfind("Options:", 0) == 0 ||
                line.rfind("Positionals:", 0) == 0) {
                inSubcommands = line[0] == 'S';
            } else if (inSubcommands && std::regex_search(line, m, subcommand)) {
                const std::string name = (commands[i].empty() ? "" : commands[i] + " ") + m.str(1);
                commands.push_back(name);
                EXPECT_TRUE(std::regex_search(page, std::regex("\n +" + name + "[ \n]")))
                    << "kovacred(1) has no entry for " << name;
                EXPECT_NE(completion.find(m.str(1)), std::string::npos) << name;
            } else if (std::regex_search(line, m, option)) {
                for (const std::string &name : {m.str(1), m.str(2)}) {
                    if (name.empty() || name == "--help") {
                        continue;
                    }
                    ++checked;
                    EXPECT_TRUE(std::regex_search(
                        page, std::regex("(^|[^a-zA-Z-])" + name + "([^a-zA-Z-]|$)")))
                        << "kovacred(1) does not name " << name << " of '" << commands[i] << "'";
                    if (name.size() > 2) {
                        EXPECT_NE(completion.find(name), std::string::npos)
                            << "the completion does not offer " << name;
                    }
                }
            }
        }
    }
    EXPECT_EQ(commands.size(), 18u);  // "" and 14 commands, session's three
    EXPECT_GT(checked, 40u);
}

}  // namespace
}  // namespace kova_test
