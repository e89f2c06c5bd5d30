#include "support/child.h"

#include <signal.h>
#include <stdio.h>
#include <string.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>

namespace kova_test {
long ProcStatus(const std::string &field) {
    std::ifstream status("/proc/self/status");
    for (std::string line; std::getline(status, line);) {
        if (line.compare(0, field.size() + 1, field + ":") == 0) {
            return std::stol(line.substr(field.size() + 1));
        }
    }
    return -1;
}

long PeakRssKiB(bool reset) {
    if (reset) {
        std::ofstream("/proc/self/clear_refs") << "5";
    }
    return ProcStatus("VmHWM");
}

std::string RunInChild(unsigned seconds, const std::function<int()> &body) {
#if defined(__SANITIZE_THREAD__) || defined(__SANITIZE_ADDRESS__)
    // The sanitizers' runtimes are not fork-safe while other threads run (ThreadSanitizer
    // cannot follow threads started in the child; AddressSanitizer's allocator lock may be
    // held by a server thread at the fork, and the child then waits for it forever), and these
    // runs look for races and memory errors rather than crashes: with other threads running,
    // the scenario runs in the test's own process, still ended by SIGALRM after `seconds`.
    if (ProcStatus("Threads") != 1) {
        signal(SIGALRM, SIG_DFL);
        alarm(seconds);
        const int result = body();
        alarm(0);
        return "exit " + std::to_string(result);
    }
#endif
    fflush(nullptr);
    const pid_t pid = fork();
    if (pid < 0) {
        return std::string("fork failed: ") + strerror(errno);
    }
    if (pid == 0) {
        // An exception that escapes `body` ends the child with SIGABRT.
        signal(SIGALRM, SIG_DFL);
        alarm(seconds);
        const int status = body();
        fflush(nullptr);
        _exit(status);
    }
    int status = 0;
    while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    if (WIFEXITED(status)) {
        return "exit " + std::to_string(WEXITSTATUS(status));
    }
    return "signal " + std::to_string(WTERMSIG(status)) + " (" + strsignal(WTERMSIG(status)) + ")";
}

}  // namespace kova_test
