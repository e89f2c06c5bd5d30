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
