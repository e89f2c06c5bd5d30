// Runs a scenario that could crash or hang in a forked child, so that a failure fails one test
// instead of the whole program; and what the process's status says of its threads and memory.
#ifndef KOVA_TESTS_SUPPORT_CHILD_H
#define KOVA_TESTS_SUPPORT_CHILD_H

#include <functional>
#include <string>

namespace kova_test {

// Forks; the child runs `body`, whose result becomes its exit status, and is ended by SIGALRM
// after `seconds`. Returns how the child ended: "exit 0" for success, "exit N", or
// "signal N (name)". The child's standard error stays the test's, for diagnostics. Under
// ThreadSanitizer and AddressSanitizer, while other threads run, the body runs in the calling
// process instead, under the same alarm (see child.cpp).
std::string RunInChild(unsigned seconds, const std::function<int()> &body);

// The number a line of /proc/self/status gives `field` ("Threads", "VmHWM" in KiB, ...), -1
// when there is none.
long ProcStatus(const std::string &field);
// The peak resident set in KiB; with `reset` the peak first starts afresh from the current set.
long PeakRssKiB(bool reset = false);

}  // namespace kova_test

#endif  // KOVA_TESTS_SUPPORT_CHILD_H
