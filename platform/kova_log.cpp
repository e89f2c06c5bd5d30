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

namespace {

// Parameters whose values are secrets: the session id, anti-forgery token, password and
// one-time code the library sends, and the common names of session tokens. Compared in lower
// case after percent-decoding, as a server reads them.
constexpr const char *kSecretParameters[] = {"_sid",   "sid",          "kovatoken",
                                             "passwd", "password",     "otp_code",
                                             "token",  "access_token", "csrf_token"};

int HexValue(char c) {
    if (c >= '0' && c <= '9') {
        return c - '0';
    }
    if (c >= 'a' && c <= 'f') {
        return c - 'a' + 10;
    }
    if (c >= 'A' && c <= 'F') {
        return c - 'A' + 10;
    }
    return -1;
}

bool IsSecretParameter(const std::string &url, size_t begin, size_t end) {
    std::string name;
    for (size_t i = begin; i < end; ++i) {
        char c = url[i];
        if (c == '%' && i + 2 < end && HexValue(url[i + 1]) >= 0 && HexValue(url[i + 2]) >= 0) {
            c = static_cast<char>(HexValue(url[i + 1]) * 16 + HexValue(url[i + 2]));
            i += 2;
        }
        name += (c >= 'A' && c <= 'Z') ? static_cast<char>(c - 'A' + 'a') : c;
    }
    for (const char *secret : kSecretParameters) {
        if (name == secret) {
            return true;
        }
    }
    return false;
}

}  // namespace

std::string UrlForLog(const std::string &url) {
    // A "scheme://" that follows a path, query or user information is part of them.
    size_t begin = url.find("://");
    begin = (begin == std::string::npos || url.find_first_of("/?#@") < begin) ? 0 : begin + 3;

    // The user information ends at the last '@': a password may hold unencoded '/', '?' or
    // '#', and reading too much as user information only hides more.
    std::string out;
    size_t rest = begin;
    const size_t at = url.rfind('@');
    if (at != std::string::npos && at >= begin) {
        const size_t colon = url.find(':', begin);
        if (colon != std::string::npos && colon < at) {
            out = url.substr(0, colon + 1) + "***";
            rest = at;
        }
    }
    if (out.empty()) {
        out = url.substr(0, rest);
    }

    // Query and fragment parameters: the value of each secret one becomes "***".
    const size_t query = url.find_first_of("?#", rest);
    out.append(url, rest, (query == std::string::npos ? url.size() : query) - rest);
    if (query == std::string::npos) {
        return out;
    }
    size_t piece = query;
    while (piece < url.size()) {
        // Each piece begins with its separator; ';', '?' and '#' separate parameters too.
        const size_t end = url.find_first_of("&;?#", piece + 1);
        const size_t stop = end == std::string::npos ? url.size() : end;
        const size_t equals = url.find('=', piece + 1);
        if (equals != std::string::npos && equals + 1 < stop &&
            IsSecretParameter(url, piece + 1, equals)) {
            out.append(url, piece, equals + 1 - piece);
            out += "***";
        } else {
            out.append(url, piece, stop - piece);
        }
        piece = stop;
    }
    return out;
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
