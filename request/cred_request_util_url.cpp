// URL helpers of KOVA::CredRequestUtil: split a server address, build one, and probe one.
#include <sstream>

#include "kovacredential/cred_request_util.h"
#include "kovacredential/kovaplatform.h"
#include "platform/kova_log.h"
#include "request/cred_request_util_p.h"

namespace KOVA {

namespace {

constexpr const char kUnit[] = "cred_request_util";
constexpr int kAddrFamilyIPv6 = 10;
// Connect time-out of a reachability probe, in seconds.
constexpr long kProbeTimeout = 10;

bool StartsWith(const std::string &text, const char *prefix, size_t length) {
    return text.compare(0, length, prefix) == 0;
}

}  // namespace

bool CredRequestUtil::ParseURL(const std::string &url, std::string &scheme, std::string &host,
                               std::string &port) {
    if (url.empty()) {
        return false;
    }
    try {
        scheme.clear();
        host.clear();
        port.clear();
        std::string rest;
        // Only the two lower-case prefixes are schemes; anything else is plain HTTP.
        if (StartsWith(url, "http://", 7)) {
            scheme = "http";
            port = "80";
            rest = url.substr(7);
        } else if (StartsWith(url, "https://", 8)) {
            scheme = "https";
            port = "443";
            rest = url.substr(8);
        } else {
            scheme = "http";
            port = "80";
            rest = url;
        }
        const size_t slash = rest.find('/');
        if (slash != std::string::npos) {
            rest.resize(slash);
        }
        if (!rest.empty() && rest[0] == '[') {
            const size_t close = rest.rfind(']');
            if (close == std::string::npos) {
                return false;
            }
            host = rest.substr(0, close + 1);
            const size_t colon = rest.find(':', close + 1);
            if (colon != std::string::npos) {
                port = rest.substr(colon + 1);
            }
            return true;
        }
        const size_t colon = rest.rfind(':');
        if (colon == std::string::npos) {
            host = rest;
        } else {
            host = rest.substr(0, colon);
            port = rest.substr(colon + 1);
        }
        return true;
    } catch (...) {
        return false;
    }
}

std::string CredRequestUtil::GetURL(const std::string &scheme, const std::string &host, int port,
                                    const std::string &path) {
    try {
        // "fld" is a direct connection found through the relay directory: HTTPS under "direct/".
        const bool direct = scheme == "fld";
        std::ostringstream out;
        out << (direct ? std::string("https") : scheme) << "://";
        if (KOVANetGetAddrType(host.c_str()) == kAddrFamilyIPv6) {
            out << "[" << host << "]";
        } else {
            out << host;
        }
        out << ":" << port << "/" << (direct ? "direct/" + path : path);
        return out.str();
    } catch (...) {
        return std::string();
    }
}

constexpr int kLineTestSetUrl = 97;
constexpr int kLineTestFailed = 103;

bool CredRequestUtil::TestURL(const std::string &url) {
    try {
        CredRequest request;
        if (!request.SetURL(url)) {
            kova::Log("%s:%d SetURL failed. %s", kUnit, kLineTestSetUrl,
                      kova::UrlForLog(url).c_str());
            return false;
        }
        request.SetDefaultTimeout(kProbeTimeout);
        if (request.Process(true, 0)) {
            return true;
        }
        kova::Log("%s:%d Cred Error:[%s][%d]", kUnit, kLineTestFailed,
                  kova::UrlForLog(request.GetURL()).c_str(), static_cast<int>(request.GetError()));
        SetUtilError(CRED_REQ_ERR_QUERY_FAIL);
        return false;
    } catch (...) {
        SetUtilError(CRED_REQ_ERR_QUERY_FAIL);
        return false;
    }
}

}  // namespace KOVA
