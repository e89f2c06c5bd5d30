// A program that reads the library's environment variables and reports what it found, for the
// environment test, which runs it as a set-group-ID copy (secure-execution mode) and as a
// plain one. It prints "secure <AT_SECURE of the process>", "path <database path>" and then
// every log record as "log <record>". Where the database path is not the default one it also
// opens that database, so that a path taken from the environment shows as a file made; the
// default database of the machine is never touched.
#include <stdio.h>
#include <sys/auxv.h>

#include <string>

#include "credential/cred_internal.h"
#include "platform/kova_env.h"
#include "support/interpose.h"

int main() {
    // Each variable is read twice; an ignored one is logged once.
    const std::string path = kova::cred::DatabasePath();
    kova::cred::DatabasePath();
    for (const char *name : {kova::kEnvDebug, kova::kEnvFarlinkServer, kova::kEnvFarlinkGlobal}) {
        kova::SecureEnv(name);
        kova::SecureEnv(name);
    }
    printf("secure %lu\npath %s\n", getauxval(AT_SECURE), path.c_str());
    if (path != kova::cred::kDefaultDatabasePath) {
        sqlite3_close(KOVACredDBInit());
    }
    for (std::string record : kova_test::LogRecords()) {
        if (!record.empty() && record.back() == '\n') {
            record.pop_back();
        }
        printf("log %s\n", record.c_str());
    }
    return 0;
}
