// Response header lines in both header modes, and the redirect probe's reading of them: every
// line of the input is one header line as libcurl hands it over; the JSON mode must keep only
// string values, the standard-output mode must write or skip each line whole, and a 302's
// "Location" moves the credential only to an http or https address.
#include <stddef.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>

#include <string>
#include <vector>

#include "request/cred_request_p.h"
#include "request/cred_request_util_p.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    // The standard-output mode writes to stdout; the fuzz program's own output is on stderr.
    static FILE *const sink = freopen("/dev/null", "w", stdout);
    (void)sink;

    const Json::Value message("== headers ==");
    Json::Value headers(Json::objectValue);
    size_t start = 0;
    while (start < size) {
        size_t end = start;
        while (end < size && data[end] != '\n') {
            ++end;
        }
        end = end < size ? end + 1 : end;
        std::vector<char> line(data + start, data + end);
        if (KOVA::CredRequestPrivate::WriteHeaderToJsonValue(line.data(), 1, line.size(),
                                                             &headers) != line.size()) {
            abort();
        }
        const size_t written =
            KOVA::CredRequestPrivate::WriteHeaderToStdout(line.data(), 1, line.size(), &message);
        if (written != line.size()) {
            abort();
        }
        start = end;
    }
    for (const auto &name : headers.getMemberNames()) {
        if (!headers[name].isString()) {
            abort();
        }
    }

    KOVA_CRED cred;
    cred.protocol = "http";
    cred.host = "127.0.0.1";
    cred.port = 5000;
    if (KOVA::ApplyRedirectLocation(&cred, headers) && cred.protocol != "http" &&
        cred.protocol != "https") {
        abort();
    }
    return 0;
}
