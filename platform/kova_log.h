// Port layer: the system log and the argument-check reporting every unit of the library uses.
#ifndef KOVA_PLATFORM_KOVA_LOG_H
#define KOVA_PLATFORM_KOVA_LOG_H

#include <exception>

namespace kova {

// Writes one record to the system log at priority error (syslog LOG_ERR). Formats in the
// library begin with "%s:%d " followed by the unit name and line; "%m" is errno's text.
void Log(const char *fmt, ...) __attribute__((format(printf, 1, 2)));

// Reports a rejected argument: logs "<file>:<line> Invaild Argument (<check>)=[0]" and records
// error 3328 with the same file and line in the error slot. Returns -1 for the caller to
// return.
int ArgInvalid(const char *file, int line, const char *check);

// Logs "<file>:<line> <text formatted from fmt>[0x%04X %s:%d]" with the code, file and line of
// the last recorded error, for a failure whose cause an inner step already recorded.
void LogInnerFailure(const char *file, int line, const char *fmt, ...)
    __attribute__((format(printf, 3, 4)));

// Runs `body` and returns its result. An exception escaping it (std::bad_alloc from a string or
// a JSON value) is logged as "<unit>:<line> Exception: <what>" and turns into `failure`, so
// that none leaves the library through a public entry point.
template <typename Result, typename Body>
Result Guarded(const char *unit, int line, Result failure, Body &&body) {
    try {
        return body();
    } catch (const std::exception &e) {
        Log("%s:%d Exception: %s", unit, line, e.what());
    } catch (...) {
        Log("%s:%d Exception", unit, line);
    }
    return failure;
}

}  // namespace kova

#endif  // KOVA_PLATFORM_KOVA_LOG_H
