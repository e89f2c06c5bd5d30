// Execution of KOVA::CredRequest: the transfer with bounded retries and the mapping of every
// libcurl result and HTTP status to one request error.
#include <stdio.h>
#include <unistd.h>

#include <algorithm>

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

// The pause before a retry after a resolve failure or a time-out, in milliseconds (sleep(1)).
constexpr long kRetryPauseMs = 1000;

// A libcurl time in microseconds, 0 when libcurl cannot tell it.
curl_off_t Micros(CURL *curl, CURLINFO what) {
    curl_off_t us = 0;
    return curl_easy_getinfo(curl, what, &us) == CURLE_OK ? us : 0;
}

double Seconds(curl_off_t us) {
    return static_cast<double>(us) / 1e6;
}

const char *HttpVersionText(long version) {
    switch (version) {
        case CURL_HTTP_VERSION_1_0:
            return "1.0";
        case CURL_HTTP_VERSION_1_1:
            return "1.1";
        case CURL_HTTP_VERSION_2_0:
            return "2";
        case CURL_HTTP_VERSION_3:
            return "3";
        default:
            return "";  // no response
    }
}

}  // namespace

void CredRequestPrivate::StartDeadline() {
    deadline = kova::Deadline::After(totalTimeoutMs);
}

bool CredRequestPrivate::ArmDeadline() {
    // A deadline that has passed still leaves the attempt 1 ms, which libcurl ends with its
    // own time-out.
    const long limit = deadline.IsSet() ? std::max(deadline.LeftMs(), 1L) : 0L;
    if (!SetOption(CURLOPT_TIMEOUT_MS, limit)) {
        return false;
    }
    // libcurl waits for a resolver thread that has not answered when a transfer ends (a
    // getaddrinfo without reply lasts the system resolver's whole time-out); under a deadline
    // it leaves the thread to finish on its own instead. Older libcurl lacks the option and
    // keeps waiting, hence the result is not checked.
    curl_easy_setopt(curl, CURLOPT_QUICK_EXIT, deadline.IsSet() ? 1L : 0L);
    return true;
}

void CredRequestPrivate::NoteTransfer(CURLcode result) {
    curlCode = result;
    curlErrorText = curlErrorBuffer[0] != '\0' ? curlErrorBuffer : curl_easy_strerror(result);
    TransferFacts &f = transferFacts;
    f.noted = true;
    f.completed = result == CURLE_OK;
    f.namelookupUs = Micros(curl, CURLINFO_NAMELOOKUP_TIME_T);
    f.connectUs = Micros(curl, CURLINFO_CONNECT_TIME_T);
    f.tlsUs = Micros(curl, CURLINFO_APPCONNECT_TIME_T);
    f.firstByteUs = Micros(curl, CURLINFO_STARTTRANSFER_TIME_T);
    f.totalUs = Micros(curl, CURLINFO_TOTAL_TIME_T);
    f.connects = 0;
    curl_easy_getinfo(curl, CURLINFO_NUM_CONNECTS, &f.connects);
    f.httpVersion = 0;
    curl_easy_getinfo(curl, CURLINFO_HTTP_VERSION, &f.httpVersion);
    char *ip = nullptr;
    curl_easy_getinfo(curl, CURLINFO_PRIMARY_IP, &ip);
    // Assigned in place: the string keeps its buffer from one attempt to the next.
    f.remoteIp.assign(ip != nullptr ? ip : "");
    f.remotePort = 0;
    curl_easy_getinfo(curl, CURLINFO_PRIMARY_PORT, &f.remotePort);
}

Json::Value CredRequestPrivate::TransferInfo() const {
    const TransferFacts &f = transferFacts;
    if (!f.noted) {
        return Json::Value();
    }
    Json::Value info(Json::objectValue);
    info["namelookup"] = Seconds(f.namelookupUs);
    info["connect"] = Seconds(f.connectUs);
    info["tls"] = Seconds(f.tlsUs);
    info["firstByte"] = Seconds(f.firstByteUs);
    info["total"] = Seconds(f.totalUs);
    info["connects"] = static_cast<Json::Int64>(f.connects);
    // A completed transfer that opened no connection rode one made earlier.
    info["reused"] = f.completed && f.connects == 0;
    info["httpVersion"] = HttpVersionText(f.httpVersion);
    info["remoteIp"] = f.remoteIp;
    info["remotePort"] = static_cast<Json::Int64>(f.remotePort);
    return info;
}

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
        d->StartDeadline();
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
            return d->ArmDeadline();
        }

        const int attempts = retries + 1 > 1 ? retries + 1 : 1;
        CURLcode rc = CURLE_OK;
        for (int attempt = 1; attempt <= attempts; ++attempt) {
            if (!d->ArmDeadline()) {
                return false;
            }
            d->curlErrorBuffer[0] = '\0';
            rc = curl_easy_perform(d->curl);
            d->NoteTransfer(rc);
            if (rc == CURLE_OK || attempt == attempts) {
                break;
            }
            // Retries, and the pause before one, fit within the deadline or are not made.
            const bool pause = PausesBeforeRetry(rc);
            if (d->deadline.LeftMs() <= (pause ? kRetryPauseMs : 0)) {
                rc = CURLE_OPERATION_TIMEDOUT;
                break;
            }
            // The next attempt starts clean: an empty response string, the streams back at
            // their mark. An attempt whose streams cannot be put back is the result.
            d->response.clear();
            if (!d->RewindStreams()) {
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
