#include "support/interpose.h"

#include <errno.h>
#include <stdarg.h>
#include <stdlib.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <mutex>

namespace {

std::mutex gMutex;
std::vector<std::string> gRecords;
std::vector<unsigned> gUsleeps;
std::vector<unsigned> gSleeps;
std::atomic<bool> gFakeSleep{false};
std::atomic<unsigned> gSleepDivisor{1};
std::atomic<bool> gInterruptible{false};

void Capture(const char *fmt, va_list ap) {
    const int saved = errno;  // the caller's errno survives, and %m reads it
    char buf[8192];
    vsnprintf(buf, sizeof(buf), fmt, ap);
    std::lock_guard<std::mutex> lock(gMutex);
    gRecords.emplace_back(buf);
    if (getenv("KOVA_TEST_ECHO_LOG") != nullptr) {
        fprintf(stderr, "[syslog] %s\n", buf);
    }
    errno = saved;
}

// 0, or -1 with errno EINTR when a signal ended the pause while interruptible sleeps are on.
int Pause(std::vector<unsigned> &calls, unsigned asked, unsigned long micros) {
    {
        std::lock_guard<std::mutex> lock(gMutex);
        calls.push_back(asked);
    }
    if (gFakeSleep) {
        return 0;
    }
    micros /= gSleepDivisor;
    struct timespec ts = {static_cast<time_t>(micros / 1000000),
                          static_cast<long>((micros % 1000000) * 1000)};
    while (nanosleep(&ts, &ts) != 0 && errno == EINTR) {
        if (gInterruptible) {
            return -1;
        }
    }
    return 0;
}

template <typename T>
T Locked(const T &value) {
    std::lock_guard<std::mutex> lock(gMutex);
    return value;
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
    return Pause(gUsleeps, usec, usec);
}

unsigned int sleep(unsigned int seconds) {
    Pause(gSleeps, seconds, seconds * 1000000UL);
    return 0;
}

}  // extern "C"

namespace kova_test {

std::vector<std::string> LogRecords() {
    return Locked(gRecords);
}

void ClearLog() {
    std::lock_guard<std::mutex> lock(gMutex);
    gRecords.clear();
}

size_t LogCount(const std::string &needle) {
    const auto records = LogRecords();
    return static_cast<size_t>(std::count_if(records.begin(), records.end(), [&](const auto &r) {
        return r.find(needle) != std::string::npos;
    }));
}

std::string LogDump() {
    std::string out;
    for (const auto &r : LogRecords()) {
        out += r + '\n';
    }
    return out;
}

void SetFakeSleep(bool on) {
    gFakeSleep = on;
}

void SetSleepInterruptible(bool on) {
    gInterruptible = on;
}

void SetSleepDivisor(unsigned divisor) {
    gSleepDivisor = divisor == 0 ? 1 : divisor;
}

std::vector<unsigned> UsleepCalls() {
    return Locked(gUsleeps);
}

std::vector<unsigned> SleepCalls() {
    return Locked(gSleeps);
}

void ClearSleeps() {
    std::lock_guard<std::mutex> lock(gMutex);
    gUsleeps.clear();
    gSleeps.clear();
}

std::string Pattern(size_t size) {
    std::string text(size, '\0');
    for (size_t i = 0; i < size; ++i) {
        text[i] = static_cast<char>('a' + (i * 7 + i / 251) % 26);
    }
    return text;
}

File StreamWith(const std::string &text, bool atEnd) {
    File f(tmpfile());
    if (f) {
        fwrite(text.data(), 1, text.size(), f.get());
        fseek(f.get(), 0, atEnd ? SEEK_END : SEEK_SET);
    }
    return f;
}

std::string ReadAll(FILE *f) {
    fflush(f);
    rewind(f);
    std::string out;
    char buf[65536];
    for (size_t n; (n = fread(buf, 1, sizeof(buf), f)) > 0;) {
        out.append(buf, n);
    }
    return out;
}

std::string Dechunk(const std::string &chunked) {
    std::string body;
    for (size_t pos = 0, eol; (eol = chunked.find("\r\n", pos)) != std::string::npos;) {
        const size_t size = std::stoul(chunked.substr(pos, eol - pos), nullptr, 16);
        if (size == 0 || eol + 4 + size > chunked.size()) {
            return size == 0 ? body : "";
        }
        body.append(chunked, eol + 2, size);
        pos = eol + 4 + size;
    }
    return "";
}

}  // namespace kova_test
