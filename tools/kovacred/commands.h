// kovacred: command registry and helpers shared by the command groups. Each group lives in a
// cmd_*.cpp file that registers itself with a static Registrar.
#ifndef KOVACRED_COMMANDS_H
#define KOVACRED_COMMANDS_H

#include <functional>
#include <string>
#include <vector>

#include <CLI/CLI.hpp>

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

// Prints "kovacred: <what> failed (error <code>)" to standard error, sets the exit code (the
// library's code when it fits 1..255, else 1) and returns it.
int Fail(const std::string &what, long code);

// Prints "kovacred: <message>" to standard error and sets exit code 1.
int FailText(const std::string &message);

}  // namespace kovacred

#endif  // KOVACRED_COMMANDS_H
