// kovacred: command registry and helpers shared by the command groups. Each group lives in a
// cmd_*.cpp file that registers itself with a static Registrar; the helpers (failure lines,
// JSON and table output, hiding secrets) live in output.cpp.
#ifndef KOVACRED_COMMANDS_H
#define KOVACRED_COMMANDS_H

#include <functional>
#include <string>
#include <vector>

#include <CLI/CLI.hpp>
#include <json/value.h>

namespace kovacred {

// Set by a command's callback; main returns it.
extern int gExitCode;

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

// ---- Output.

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
