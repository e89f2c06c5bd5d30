// kovacred: command-line access to the credential store and the WebAPI request layer.
#include <errno.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <syslog.h>

#include <string>
#include <vector>

#include "commands.h"
#include "common/tool_version.h"

namespace kovacred {

int gExitCode = 0;

std::vector<RegisterFn> &Registry() {
    static std::vector<RegisterFn> registry;
    return registry;
}

Registrar::Registrar(RegisterFn fn) {
    Registry().push_back(std::move(fn));
}

namespace {

// The parser's message on one line: it may span several.
std::string OneLine(std::string text) {
    while (!text.empty() && text.back() == '\n') {
        text.pop_back();
    }
    for (char &c : text) {
        if (c == '\n') {
            c = ' ';
        }
    }
    return text;
}

// Takes the global options --db and -v out of the command line wherever they stand (before a
// "--"), so that they may follow the command too. False after a usage message.
bool TakeGlobalOptions(int argc, char **argv, std::vector<char *> &rest, bool &verbose) {
    rest.push_back(argv[0]);
    bool literal = false;
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (literal) {
            rest.push_back(argv[i]);
            continue;
        }
        std::string db;
        if (arg == "--db") {
            if (i + 1 >= argc) {
                FailUsage("--db needs a database path");
                return false;
            }
            db = argv[++i];
        } else if (arg.rfind("--db=", 0) == 0) {
            db = arg.substr(5);
        } else {
            if (arg == "-v" || arg == "--verbose") {
                verbose = true;
            } else {
                literal = arg == "--";
                rest.push_back(argv[i]);
            }
            continue;
        }
        if (db.empty()) {
            FailUsage("--db needs a database path, not an empty one");
            return false;
        }
        setenv("kovacredential_db", db.c_str(), 1);
    }
    return true;
}

// The first word that names no command where one is expected ("bogus" in "kovacred bogus",
// "session bogus"); "" when every command word is known.
std::string UnknownCommand(CLI::App &app, const std::vector<char *> &args) {
    CLI::App *current = &app;
    for (size_t i = 1; i < args.size(); ++i) {
        const std::string word = args[i];
        if (word.empty() || word[0] == '-') {
            continue;
        }
        if (current->get_subcommands({}).empty()) {
            return "";
        }
        try {
            current = current->get_subcommand(word);
        } catch (const CLI::OptionNotFound &) {
            return word;
        }
    }
    return "";
}

}  // namespace

}  // namespace kovacred

int main(int argc, char **argv) {
    using kovacred::gExitCode;
    std::vector<char *> args;
    bool verbose = false;
    if (!kovacred::TakeGlobalOptions(argc, argv, args, verbose)) {
        return gExitCode;
    }
    if (verbose) {
        // The library's log records reach standard error as well as the system log.
        openlog("kovacred", LOG_PERROR | LOG_PID, LOG_USER);
    }
    CLI::App app{"kovacred: keep credentials for remote servers and call their WebAPI"};
    app.require_subcommand(1);
    app.set_version_flag(
        "--version", [] { return kova_tools::VersionText("kovacred"); },
        "print the versions of kovacred and the libraries it runs with");
    // Both are taken out of the command line above; declared here for --help.
    std::string db;
    bool verboseFlag = false;
    app.add_option("--db", db,
                   "credential database to use (sets kovacredential_db; anywhere on the line)");
    app.add_flag("-v,--verbose", verboseFlag, "copy the library's log records to standard error");
    for (auto &registerGroup : kovacred::Registry()) {
        registerGroup(app);
    }
    try {
        app.parse(static_cast<int>(args.size()), args.data());
    } catch (const CLI::ParseError &e) {
        if (e.get_exit_code() == 0) {
            app.exit(e);  // --help, --version
        } else {
            const std::string unknown = kovacred::UnknownCommand(app, args);
            kovacred::FailUsage(unknown.empty() ? kovacred::OneLine(e.what())
                                                : "unknown command \"" + unknown +
                                                      "\" (kovacred --help lists the commands)");
        }
    }
    // Output that did not reach its file or pipe is a failure, whatever the command did.
    const int flushError = fflush(stdout) != 0 ? errno : 0;
    if (flushError != 0 || ferror(stdout) != 0) {
        fprintf(stderr, "kovacred: writing standard output failed%s%s\n",
                flushError != 0 ? ": " : "", flushError != 0 ? strerror(flushError) : "");
        return kovacred::kExitWrite;
    }
    return gExitCode;
}
