// kovacred: command-line access to the credential store and the WebAPI request layer.
#include <stdio.h>
#include <stdlib.h>

#include <string>

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

}  // namespace kovacred

int main(int argc, char **argv) {
    CLI::App app{"kovacred: keep credentials for remote servers and call their WebAPI"};
    app.require_subcommand(1);
    app.set_version_flag(
        "--version", [] { return kova_tools::VersionText("kovacred"); },
        "print the versions of kovacred and the libraries it runs with");
    std::string db;
    app.add_option("--db", db, "credential database to use (sets kovacredential_db)");
    // The database must be chosen before any command callback runs, so --db is applied here
    // rather than through the parser's option callbacks.
    for (int i = 1; i < argc; ++i) {
        std::string arg = argv[i];
        if (arg == "--db" && i + 1 < argc) {
            setenv("kovacredential_db", argv[i + 1], 1);
        } else if (arg.rfind("--db=", 0) == 0) {
            setenv("kovacredential_db", arg.substr(5).c_str(), 1);
        }
    }
    for (auto &registerGroup : kovacred::Registry()) {
        registerGroup(app);
    }
    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError &e) {
        return app.exit(e);
    }
    return kovacred::gExitCode;
}
