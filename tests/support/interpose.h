// Test-side replacements of libc's syslog, usleep and sleep. Every test program links
// interpose.cpp and exports its symbols, so the library's calls land here: log records are
// captured for assertions, and sleeps are counted (and skipped while fake sleeping is on).
// Also the temporary streams the request tests hand to the library.
#ifndef KOVA_TESTS_SUPPORT_INTERPOSE_H
#define KOVA_TESTS_SUPPORT_INTERPOSE_H

#include <stdio.h>

#include <string>
#include <vector>

#include "support/temp_dir.h"

namespace kova_test {

// Every record written since the last ClearLog, fully formatted, in order.
std::vector<std::string> LogRecords();
void ClearLog();
// Number of records containing `needle`.
size_t LogCount(const std::string &needle);
inline bool LogHas(const std::string &needle) {
    return LogCount(needle) > 0;
}
// All records joined by newlines, for failure messages.
std::string LogDump();

// While on, usleep and sleep return at once (they are still recorded).
void SetFakeSleep(bool on);
// Real sleeps last 1/divisor of what was asked (1, the default, is the full time); a long run
// keeps its pauses and their order in less time.
void SetSleepDivisor(unsigned divisor);
// While on, a signal ends a real usleep early with -1 and errno EINTR, as libc's does
// (otherwise the pause is resumed, so that tests need not care about signals).
void SetSleepInterruptible(bool on);
std::vector<unsigned> UsleepCalls();  // microseconds of each usleep call
std::vector<unsigned> SleepCalls();   // seconds of each sleep call
void ClearSleeps();

// RAII: fake sleeping for the lifetime of the object, with the records cleared at start.
class FakeSleepScope {
  public:
    FakeSleepScope() {
        ClearSleeps();
        SetFakeSleep(true);
    }
    ~FakeSleepScope() { SetFakeSleep(false); }
};

// A temporary stream holding `text`, positioned at its start (or its end).
File StreamWith(const std::string &text, bool atEnd = false);
// Everything `f` holds (after flushing it), from its start.
std::string ReadAll(FILE *f);
// `size` letters in a pattern that does not repeat within a few kilobytes, so that a body cut,
// doubled or shifted anywhere shows.
std::string Pattern(size_t size);
// The data of a chunked body through its last chunk; "" when it is malformed or incomplete.
std::string Dechunk(const std::string &chunked);

}  // namespace kova_test

#endif  // KOVA_TESTS_SUPPORT_INTERPOSE_H
