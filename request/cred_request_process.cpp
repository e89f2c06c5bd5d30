// Execution of KOVA::CredRequest: the transfer with bounded retries and the mapping of every
// libcurl result and HTTP status to one request error.
#include <stdio.h>
#include <unistd.h>

#include "kovacredential/cred_request_util.h"
#include "platform/kova_log.h"
#include "request/cred_request_p.h"
#include "request/cred_request_pool.h"

namespace KOVA {

namespace {

constexpr const char kUnit[] = "cred_request";

// Resolve failures and time-outs are worth a pause before the next attempt; other failures
// are retried at once.
bool PausesBeforeRetry(CURLcode rc) {
    return rc == CURLE_COULDNT_RESOLVE_PROXY || rc == CURLE_COULDNT_RESOLVE_HOST ||
           rc == CURLE_OPERATION_TIMEDOUT;
}

}  // namespace

constexpr int kLineInitFailed = 47;
constexpr int kLineCurlError = 98;
constexpr int kLineResponseCode = 110;
constexpr int kLineHttpError = 117;
constexpr int kLineProcessException = 133;

bool CredRequest::Process(bool perform, int retries) {
    if (d == nullptr) {
        return false;
    }
    try {
        // In a child after fork, a handle the request holds from the parent is swapped for a
        // copy of its options: the parent's connections stay untouched.
        if (d->curl != nullptr) {
            d->curl = CredRequestPool::FreshIfInherited(d->curl, &d->poolKey, &d->poolGeneration);
            if (d->curl == nullptr) {
                d->error = CRED_REQ_ERR_CURL_INTERNAL;
                return false;
            }
        }
        if (!d->InitCurlHandler()) {
            kova::Log("%s:%d (pid=%d)InitCurlHandler failed", kUnit, kLineInitFailed,
                      static_cast<int>(getpid()));
            return false;
        }
        d->response.clear();
        // Every attempt, and every re-send libcurl makes for a redirect, starts from where the
        // streams stand now (the manager drives the transfer itself after a set-up only).
        d->MarkStreams();
        if (!perform) {
            return true;
        }

        const int attempts = retries + 1 > 1 ? retries + 1 : 1;
        CURLcode rc = CURLE_OK;
        for (int attempt = 1; attempt <= attempts; ++attempt) {
            rc = curl_easy_perform(d->curl);
            if (rc == CURLE_OK || attempt == attempts) {
                break;
            }
            // The next attempt starts clean: an empty response string, the streams back at
            // their mark. An attempt whose streams cannot be put back is the result.
            const bool pause = PausesBeforeRetry(rc);
            d->response.clear();
            if (!d->RewindStreams(pause)) {
                break;
            }
            if (pause) {
                sleep(1);
            }
        }
        if (rc != CURLE_OK) {
            d->error = ErrorOf(rc, 0);
            // Resolve failures and time-outs are not logged.
            if (d->error != CRED_REQ_ERR_RESOLVE && d->error != CRED_REQ_ERR_TIMEOUT) {
                kova::Log("%s:%d (pid=%d)CURL Error(%d): %s", kUnit, kLineCurlError,
                          static_cast<int>(getpid()), static_cast<int>(rc), curl_easy_strerror(rc));
            }
            return false;
        }

        long status = 0;
        CURLcode info = curl_easy_getinfo(d->curl, CURLINFO_RESPONSE_CODE, &status);
        if (info != CURLE_OK) {
            d->error = CRED_REQ_ERR_CURL_INTERNAL;
            kova::Log("%s:%d CURL Error(%d): %s", kUnit, kLineResponseCode, static_cast<int>(info),
                      curl_easy_strerror(info));
            return false;
        }
        if (status >= 400 && status <= 599) {
            kova::Log("%s:%d (pid=%d)HTTP Error(%ld)", kUnit, kLineHttpError,
                      static_cast<int>(getpid()), status);
        }
        // Success leaves an earlier error in place.
        const KOVA::_tag_CRED_REQ_ERR error = ErrorOf(CURLE_OK, status);
        if (error == CRED_REQ_ERR_NONE) {
            return true;
        }
        d->error = error;
        return false;
    } catch (...) {
        kova::LogCaughtException(kUnit, kLineProcessException);
        d->error = CRED_REQ_ERR_UNKNOWN;
        return false;
    }
}

KOVA::_tag_CRED_REQ_ERR CredRequest::ErrorOf(CURLcode result, long status) {
    switch (result) {
        case CURLE_OK:
            break;
        case CURLE_COULDNT_RESOLVE_PROXY:
        case CURLE_COULDNT_RESOLVE_HOST:
            return CRED_REQ_ERR_RESOLVE;
        case CURLE_OPERATION_TIMEDOUT:
            return CRED_REQ_ERR_TIMEOUT;
        case CURLE_COULDNT_CONNECT:
        case CURLE_RECV_ERROR:
            return CRED_REQ_ERR_CONNECT;
        case CURLE_SSL_CONNECT_ERROR:
            return CRED_REQ_ERR_SSL_CONNECT;
        case CURLE_SEND_ERROR:
        case CURLE_AGAIN:
            return CRED_REQ_ERR_SEND;
        default:  // every other result, and results newer than this library knows
            return CRED_REQ_ERR_CURL_OTHER;
    }
    if (status >= 400 && status <= 499) {
        return CRED_REQ_ERR_HTTP_CLIENT;
    }
    if (status >= 500 && status <= 599) {
        return CRED_REQ_ERR_HTTP_SERVER;
    }
    switch (status) {
        case 200:
            return CRED_REQ_ERR_NONE;
        case 304:
            return CRED_REQ_ERR_NOT_MODIFIED;
        case 302:
            return CRED_REQ_ERR_REDIRECT;
        default:
            return CRED_REQ_ERR_HTTP_UNEXPECTED;
    }
}

bool CredRequest::isURLValid(const std::string &url) {
    return CredRequestUtil::TestURL(url);
}

}  // namespace KOVA
