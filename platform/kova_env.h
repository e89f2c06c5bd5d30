// Port layer: the library's environment variables. Every read of them goes through here.
#ifndef KOVA_PLATFORM_KOVA_ENV_H
#define KOVA_PLATFORM_KOVA_ENV_H

namespace kova {

// The variables the library reads.
constexpr const char kEnvDatabase[] = "kovacredential_db";
constexpr const char kEnvDebug[] = "kovacredential_debug";
constexpr const char kEnvFarlinkServer[] = "kovacredential_farlink_server";
constexpr const char kEnvFarlinkGlobal[] = "kovacredential_farlink_global";
constexpr const char kEnvNoReuse[] = "kovacredential_no_reuse";

// The value of the environment variable `name`, read with secure_getenv: null when it is not
// set, and also when the process runs in secure-execution mode (AT_SECURE: it was started
// from a set-user-ID or set-group-ID program, or from a program with file capabilities, or a
// security module asked for it), so that whoever starts a privileged program cannot choose its
// database, trace it or redirect its look-ups. A variable that is set but ignored this way is
// logged once per variable per process ("kova_env:21 <name> is set but ignored ..."), so that
// such a program does not fall back to its defaults unnoticed; the value is never logged.
// The pointer is the environment's own, valid until the variable changes.
// Concurrency: may run on several threads at once, as getenv may.
const char *SecureEnv(const char *name);

}  // namespace kova

#endif  // KOVA_PLATFORM_KOVA_ENV_H
