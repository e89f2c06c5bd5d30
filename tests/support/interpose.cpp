#include "support/interpose.h"

#include <errno.h>
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <mutex>

namespace {

std::mutex gMutex;
std::vector<std::string> gRecords;
std::vector<unsigned> gUsleeps;
std::vector<unsigned> gSleeps;
std::atomic<bool> gFakeSleep{false};
std::atomic<unsigned> gSleepDivisor{1};

void Capture(const char *fmt, va_list ap) {
    int saved = errno;
    char buf[8192];
    errno = saved;  // keeps %m meaningful
    vsnprintf(buf, sizeof(buf), fmt, ap);
    std::lock_guard<std::mutex> lock(gMutex);
    gRecords.emplace_back(buf);
    if (getenv("KOVA_TEST_ECHO_LOG") != nullptr) {
        fprintf(stderr, "[syslog] %s\n", buf);
    }
    errno = saved;
}

void RealSleep(unsigned long micros) {
    micros /= gSleepDivisor;
    struct timespec ts;
    ts.tv_sec = static_cast<time_t>(micros / 1000000);
    ts.tv_nsec = static_cast<long>((micros % 1000000) * 1000);
    while (nanosleep(&ts, &ts) != 0 && errno == EINTR) {
    }
}

}  // namespace

extern "C" {

void vsyslog(int, const char *fmt, va_list ap) {
    Capture(fmt, ap);
}

void syslog(int, const char *fmt, ...) {
    va_list ap;
    va_start(ap, fmt);
    Capture(fmt, ap);
    va_end(ap);
}

void __vsyslog_chk(int, int, const char *fmt, va_list ap) {
    Capture(fmt, ap);
}

void __syslog_chk(int, int, const char *fmt, ...) {
    va_list ap;
    va_start(ap, fmt);
    Capture(fmt, ap);
    va_end(ap);
}

int usleep(useconds_t usec) {
    {
        std::lock_guard<std::mutex> lock(gMutex);
        gUsleeps.push_back(usec);
    }
    if (!gFakeSleep) {
        RealSleep(usec);
    }
    return 0;
}

unsigned int sleep(unsigned int seconds) {
    {
        std::lock_guard<std::mutex> lock(gMutex);
        gSleeps.push_back(seconds);
    }
    if (!gFakeSleep) {
        RealSleep(static_cast<unsigned long>(seconds) * 1000000UL);
    }
    return 0;
}

}  // extern "C"

namespace kova_test {

std::vector<std::string> LogRecords() {
    std::lock_guard<std::mutex> lock(gMutex);
    return gRecords;
}

void ClearLog() {
    std::lock_guard<std::mutex> lock(gMutex);
    gRecords.clear();
}

size_t LogCount(const std::string &needle) {
    std::lock_guard<std::mutex> lock(gMutex);
    size_t n = 0;
    for (const auto &r : gRecords) {
        if (r.find(needle) != std::string::npos) {
            ++n;
        }
    }
    return n;
}

std::string LogDump() {
    std::lock_guard<std::mutex> lock(gMutex);
    std::string out;
    for (const auto &r : gRecords) {
        out += r;
        out += '\n';
    }
    return out;
}

void SetFakeSleep(bool on) {
    gFakeSleep = on;
}

void SetSleepDivisor(unsigned divisor) {
    gSleepDivisor = divisor == 0 ? 1 : divisor;
}

std::vector<unsigned> UsleepCalls() {
    std::lock_guard<std::mutex> lock(gMutex);
    return gUsleeps;
}

std::vector<unsigned> SleepCalls() {
    std::lock_guard<std::mutex> lock(gMutex);
    return gSleeps;
}

void ClearSleeps() {
    std::lock_guard<std::mutex> lock(gMutex);
    gUsleeps.clear();
    gSleeps.clear();
}

}  // namespace kova_test
