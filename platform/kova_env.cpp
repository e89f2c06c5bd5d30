#include "platform/kova_env.h"

#include <stdlib.h>
#include <string.h>
#include <sys/auxv.h>

#include <atomic>

#include "platform/kova_log.h"

namespace kova {
namespace {

constexpr const char kUnit[] = "kova_env";
constexpr int kLineIgnored = 21;

// Whether the ignored variable of the same index has been logged in this process; the last
// entry stands for any other name.
constexpr const char *kNames[] = {kEnvDatabase, kEnvDebug, kEnvFarlinkServer, kEnvFarlinkGlobal,
                                  kEnvNoReuse};
constexpr size_t kNameCount = sizeof(kNames) / sizeof(kNames[0]);
std::atomic<bool> gLogged[kNameCount + 1];

size_t IndexOf(const char *name) {
    size_t i = 0;
    while (i < kNameCount && strcmp(kNames[i], name) != 0) {
        ++i;
    }
    return i;
}

}  // namespace

const char *SecureEnv(const char *name) {
    // Only a secure process can have a variable that secure_getenv does not give; the kernel
    // sets that for the process's life, so the second search is made only there.
    static const bool secureExecution = getauxval(AT_SECURE) != 0;
    const char *value = secure_getenv(name);
    if (value == nullptr && secureExecution && getenv(name) != nullptr &&
        !gLogged[IndexOf(name)].exchange(true, std::memory_order_relaxed)) {
        Log("%s:%d %s is set but ignored: the process runs in secure-execution mode (set-user-ID, "
            "set-group-ID or file capabilities)\n",
            kUnit, kLineIgnored, name);
    }
    return value;
}

}  // namespace kova
