// kovacred: command registry and helpers shared by the command groups. Each group lives in a
// cmd_*.cpp file that registers itself with a static Registrar; the helpers (failure lines,
// JSON and table output, hiding secrets) live in output.cpp.
#ifndef KOVACRED_COMMANDS_H
#define KOVACRED_COMMANDS_H

#include <chrono>
#include <functional>
#include <string>
#include <vector>

#include <CLI/CLI.hpp>
#include <json/value.h>

#include <kovacredential/kovacred.h>

namespace KOVA {
class CredRequest;
}

namespace kovacred {

// Set by a command's callback; main returns it.
extern int gExitCode;

// Exit statuses of their own; every other failure exits with the library's error code when it
// fits 1..255, else 1 (the table is in kovacred(1)).
constexpr int kExitUsage = 2;          // the command line could not be used
constexpr int kExitWrite = 23;         // standard output or an output file could not be written
constexpr int kExitInterrupted = 130;  // stopped by SIGINT

using RegisterFn = std::function<void(CLI::App &app)>;

// Adds a command group at static-initialisation time.
struct Registrar {
    explicit Registrar(RegisterFn fn);
};

// Every registered group, in registration order.
std::vector<RegisterFn> &Registry();

// ---- Failures: one line on standard error, and the exit status.

// "error 14 CRED_REQ_ERR_HTTP_CLIENT: HTTP status 400 to 499" for a code of the library's error
// table, "error <code>" for any other.
std::string ErrorText(long code);
// The table's name of `code`, "" when it has none.
std::string ErrorName(long code);

// Prints "kovacred: <what> failed (<ErrorText(code)>)", sets the exit status (the code when
// it fits 1..255, else 1) and returns it.
int Fail(const std::string &what, long code);

// For codes a WebAPI server answered with, which are not the library's: prints
// "kovacred: <what> failed (server error <code>[: <text>])" and sets the exit status as Fail;
// without a code (0), "kovacred: <what> failed (<text>)" and exit status 1.
int FailServer(const std::string &what, long code, const std::string &text);

// Prints "kovacred: <message>" to standard error and sets exit status 1.
int FailText(const std::string &message);

// A usage error: prints "kovacred: <message>" and sets exit status kExitUsage.
int FailUsage(const std::string &message);

// ---- The credential database.

// The database the store functions open: kovacredential_db, else the system's.
std::string DatabasePath();

// Checks, before the library opens it, that the database is one a command may use, reading it
// read-only so that nothing in it changes: a command that only reads (kExisting) needs a
// credential database at the path; kCreate (add, session set) accepts a missing or empty file,
// which the library then sets up. False after printing why not.
enum class DatabaseUse { kExisting, kCreate };
bool CheckDatabase(DatabaseUse use);

// Reports a failed store call with the code it left in the error slot, naming the database.
int FailStore(const std::string &what);

// ---- Transfers.

// How the tool's requests reach a server: certificate checks, a public key pinned on first
// use, and a time limit. The library's defaults (no checks, no limit) stay unless a command
// line asks.
struct Transport {
    bool verify = false;
    std::string caFile;  // --cacert
    bool pin = false;
    double maxTime = 0;  // seconds; 0: none
    // Set by PrepareTransport when pinning: "host:port" and the key it must show.
    std::string server;
    std::string pinned;
    std::chrono::steady_clock::time_point start = std::chrono::steady_clock::now();

    // What is left of --max-time, in milliseconds (at least 1); 0 without a limit.
    long MaxTimeMs() const;
};

// Adds --verify, --cacert, --pin and --max-time to a command that makes requests.
void AddTransportOptions(CLI::App *cmd, Transport *transport);

// Readies `transport` for the server at scheme://host:port before the first request: checks
// the CA file and, with --pin, finds the key the server must show in the known-servers file
// next to the database, or (first use) records the key it shows now. False after the failure
// line.
bool PrepareTransport(const std::string &what, Transport &transport, const std::string &scheme,
                      const std::string &host, int port);

// Applies `transport` to a request before it runs.
void ApplyTransport(const Transport &transport, KOVA::CredRequest &request);

// libcurl's code and text behind a failed transfer ("curl 7: Failed to connect ..."), "" when
// libcurl reported nothing.
std::string TransferCause(KOVA::CredRequest &request);

// "(<ErrorText of the library's code>)[: <cause>]" of a failed transfer.
std::string TransferFailure(KOVA::CredRequest &request, const Transport *transport = nullptr);

// The failure line of a transfer that did not end with status 200: "<what> failed (<the
// library's code>): <the cause>", where a key that does not match its pin is shown with both
// fingerprints and how to accept the new one. Sets the exit status as Fail and returns it.
int FailTransfer(const std::string &what, KOVA::CredRequest &request,
                 const Transport *transport = nullptr);

// "kovacred: timing: name lookup 0.000 s, connect ..., reused no" on standard error, from
// the request's transfer facts.
void PrintTiming(KOVA::CredRequest &request);

// ---- WebAPI.

// The credential's API description, queried by the library over the transport options, which
// also keeps it in its description cache, where its login and request factories find it
// instead of asking again. False with the failure's text ("(<ErrorText>)[: <cause>]", as
// TransferFailure gives it) and the code.
bool FetchDescription(const KOVA_CRED &cred, const Transport &transport, Json::Value &desc,
                      std::string &failure, long &code);

// Logs in with credential `cred` (the library's login over the transport options, with the
// one-time code `otp` when not empty) and stores the session; false with the failure's text
// ("(server error 400: wrong account or password)", TransferFailure's text of the request that
// failed, or "(<ErrorText of the library's code>)") and exit status in `code`.
bool LogIn(KOVA_CRED &cred, const std::string &otp, const Transport &transport,
           std::string &failure, long &code);

// ---- Output.

// Whether `url` is one the library can fetch: scheme http or https (none means http) and a
// port from 1 to 65535; false after printing "<command> failed: <cause>".
bool CheckURL(const std::string &command, const std::string &url);

// Adds the required positional "id" of a command that works on one credential.
CLI::Option *AddIdArgument(CLI::App *cmd, int *id);

// Adds the --json flag of a command that prints data.
void AddJsonFlag(CLI::App *cmd, bool *json);

// A value as JSON text: indented by two spaces, or compact; UTF-8 kept as it is.
std::string JsonText(const Json::Value &value, bool pretty);
// Parses a whole text; false when it is not JSON.
bool ParseJson(const std::string &text, Json::Value &value);
// Prints the indented JSON text of `value` and a newline.
void PrintJson(const Json::Value &value);

// Control characters would break a table's lines; they are shown as \xNN.
std::string Printable(const std::string &text);
// Prints rows with columns aligned by two spaces, trailing blanks trimmed.
void PrintTable(const std::vector<std::vector<std::string>> &rows);

// Texts that must never reach the output: passwords, session ids and tokens of the stored
// credentials a command works with. Output that may carry them (a server's answer echoing its
// parameters) goes through Hide.
class Secrets {
  public:
    // Adds the password of credential `id` and the session id and token stored for it.
    void AddCredential(long id);
    void Add(const std::string &secret);
    // `value` with every string that equals a secret, or (for secrets of at least
    // kMinSubstring bytes) contains one, masked as "(hidden)"; member names included.
    Json::Value Hide(const Json::Value &value) const;
    std::string Hide(const std::string &text) const;

    static constexpr size_t kMinSubstring = 6;

  private:
    std::vector<std::string> secrets_;
};

}  // namespace kovacred

#endif  // KOVACRED_COMMANDS_H
