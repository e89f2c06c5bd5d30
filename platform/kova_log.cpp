#include "platform/kova_log.h"

#include <stdarg.h>
#include <stdio.h>
#include <syslog.h>

#include <exception>
#include <string>

#include "kovacredential/kovaplatform.h"

namespace kova {

void Log(const char *fmt, ...) {
    va_list ap;
    va_start(ap, fmt);
    vsyslog(LOG_ERR, fmt, ap);
    va_end(ap);
}

std::string UrlForLog(const std::string &url) {
    const size_t scheme = url.find("://");
    const size_t begin = scheme == std::string::npos ? 0 : scheme + 3;
    const size_t end = url.find_first_of("/?#", begin);
    const size_t at = url.rfind('@', end == std::string::npos ? url.size() - 1 : end);
    const size_t colon = url.find(':', begin);
    if (at == std::string::npos || at < begin || colon == std::string::npos || colon > at) {
        return url;
    }
    return url.substr(0, colon + 1) + "***" + url.substr(at);
}

int ArgInvalid(const char *file, int line, const char *check) {
    Log("%s:%d Invaild Argument (%s)=[%d]\n", file, line, check, 0);
    VLIBCErrSetEx(KOVA_ERR_INVALID_ARGUMENT, file, line);
    return -1;
}

void LogInnerFailure(const char *file, int line, const char *fmt, ...) {
    char text[1024];
    va_list ap;
    va_start(ap, fmt);
    vsnprintf(text, sizeof(text), fmt, ap);
    va_end(ap);
    Log("%s:%d %s[0x%04X %s:%d]", file, line, text, VLIBCErrGet(), VLIBCErrorGetFile(),
        VLIBCErrorGetLine());
}

void LogCaughtException(const char *unit, int line) {
    try {
        throw;
    } catch (const std::exception &e) {
        Log("%s:%d Exception: %s", unit, line, e.what());
    } catch (...) {
        Log("%s:%d Exception", unit, line);
    }
}

}  // namespace kova
