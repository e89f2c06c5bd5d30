// Response header lines in both header modes, and the redirect probe's reading of them: every
// line of the input is one header line as libcurl hands it over; the JSON mode must keep only
// string values, the standard-output mode must write or skip each line whole, and a 302's
// "Location" moves the credential only to an http or https address.
#include <stdio.h>

#include <vector>

#include "fuzz_target.h"
#include "request/cred_request_p.h"
#include "request/cred_request_util_p.h"

KOVA_FUZZ_TARGET(text) {
    // The standard-output mode writes to stdout; the fuzz program's own output is on stderr.
    static FILE *const sink = freopen("/dev/null", "w", stdout);
    (void)sink;

    const Json::Value message("== headers ==");
    Json::Value headers(Json::objectValue);
    for (size_t start = 0; start < text.size();) {
        const size_t newline = text.find('\n', start);
        const size_t end = newline == std::string::npos ? text.size() : newline + 1;
        std::vector<char> line(text.begin() + start, text.begin() + end);
        Require(KOVA::CredRequestPrivate::WriteHeaderToJsonValue(line.data(), 1, line.size(),
                                                                 &headers) == line.size());
        Require(KOVA::CredRequestPrivate::WriteHeaderToStdout(line.data(), 1, line.size(),
                                                              &message) == line.size());
        start = end;
    }
    for (const auto &name : headers.getMemberNames()) {
        Require(headers[name].isString());
    }

    KOVA_CRED cred;
    cred.protocol = "http";
    cred.host = "127.0.0.1";
    cred.port = 5000;
    Require(!KOVA::ApplyRedirectLocation(&cred, headers) || cred.protocol == "http" ||
            cred.protocol == "https");
}
