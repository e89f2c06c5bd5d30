// KOVA::CredRequestMgr: many requests driven together over one libcurl multi handle with a
// select loop on the caller's thread.
#include "kovacredential/cred_request_mgr.h"

#include <errno.h>
#include <limits.h>
#include <string.h>

#include <algorithm>
#include <chrono>
#include <memory>
#include <new>

#include "kovacredential/cred_request_util.h"
#include "platform/kova_log.h"
#include "request/cred_request_util_p.h"

namespace KOVA {

namespace {

constexpr char kUnit[] = "cred_request_mgr";
constexpr char kLoopName[] = "curlHandlerProcess";

// Default wait per select when no request asks for a response time-out above 0.
constexpr long kDefaultWaitSeconds = 120;
// Quiet waits with a connection still in progress that one run tolerates.
constexpr int kMaxSelectRetries = 30;
// Line of the manager's exception-guard records.
constexpr int kLineMgrException = 100;

struct MultiDeleter {
    void operator()(CURLM *multi) const { curl_multi_cleanup(multi); }
};
using MultiPtr = std::unique_ptr<CURLM, MultiDeleter>;

struct RequestDeleter {
    void operator()(CredRequest *request) const { delete request; }
};
using RequestPtr = std::unique_ptr<CredRequest, RequestDeleter>;

void LogMultiError(int line, CURLMcode code) {
    kova::Log("%s:%d CURL Error(%d): %s", kUnit, line, static_cast<int>(code),
              curl_multi_strerror(code));
}

}  // namespace

CredRequestMgr::CredRequestMgr() : error(CRED_REQ_ERR_NONE) {}

CredRequestMgr::~CredRequestMgr() {
    Clear();
}

void CredRequestMgr::SetError(KOVA::_tag_CRED_REQ_ERR err) {
    error = err;
}

KOVA::_tag_CRED_REQ_ERR CredRequestMgr::GetError() {
    return error;
}

int CredRequestMgr::AddCredRequest(KOVA::CredRequest *request) {
    if (request == nullptr) {
        SetError(CRED_REQ_ERR_BAD_PARAM);
        return -1;
    }
    // The caller keeps the request when it could not be taken.
    return kova::Guarded(kUnit, kLineMgrException, -1, [&] {
        requests.push_back(request);
        return static_cast<int>(requests.size()) - 1;
    });
}

namespace {
constexpr int kLineCreateWebAPIFail = 39;

// Adds a request a factory built, destroying it when the manager cannot take it. A null request
// (the factory failed) is logged as "<factory> fail" with `line`.
int Adopt(CredRequestMgr &mgr, CredRequest *built, const char *factory, int line) {
    RequestPtr request(built);
    if (!request) {
        kova::Log("%s:%d %s fail", kUnit, line, factory);
        return -1;
    }
    int index = mgr.AddCredRequest(request.get());
    if (index >= 0) {
        request.release();
    }
    return index;
}

}  // namespace

int CredRequestMgr::AddWebAPIRequest(long credId, const std::string &api, int version,
                                     const std::string &method, const Json::Value &params) {
    return Adopt(*this, CredRequest::CreateWebAPIRequest(credId, api, version, method, params),
                 "CreateWebAPIRequest", kLineCreateWebAPIFail);
}

namespace {
constexpr int kLineCreateWebAPIRecordsFail = 58;
}  // namespace

int CredRequestMgr::AddWebAPIRequest(const KOVA_CRED *cred, const KOVA_CRED_SESS *sess,
                                     const std::string &api, int version, const std::string &method,
                                     const Json::Value &params) {
    return Adopt(*this, CredRequest::CreateWebAPIRequest(cred, sess, api, version, method, params),
                 "CreateWebAPIRequest", kLineCreateWebAPIRecordsFail);
}

namespace {
constexpr int kLineCreateRelayFail = 77;
}  // namespace

int CredRequestMgr::AddRelayRequest(long credId, const std::string &api, int version,
                                    const std::string &method, const Json::Value &headers, FILE *in,
                                    FILE *out) {
    return Adopt(*this,
                 CredRequest::CreateRelayRequest(credId, api, version, method, headers, in, out),
                 "CreateRelayRequest", kLineCreateRelayFail);
}

int CredRequestMgr::AddCredRequest(const std::string &protocol, const std::string &host, int port,
                                   const std::string &sid, const std::string &api, int version,
                                   const std::string &method, const Json::Value &params) {
    if (protocol.empty() || host.empty() || api.empty() || method.empty() || port < 0 ||
        version < 1) {
        SetError(CRED_REQ_ERR_BAD_PARAM);
        return -1;
    }
    return kova::Guarded(kUnit, kLineMgrException, -1, [&] {
        // The scratch record gets the first negative id without a cached description, so
        // that it collides neither with a stored credential nor with another server's entry;
        // the id is reserved at once, so that a manager on another thread picks another.
        KOVA_CRED cred;
        cred.id = static_cast<int32_t>(ReserveUncachedCredId());
        // Whatever happens from here on, the description fetched under the pseudo-id goes
        // again so that the id can be handed out next time.
        struct DropDescription {
            const KOVA_CRED *cred;
            ~DropDescription() { CredRequestUtil::RemoveWebAPIDesc(cred); }
        } dropDescription{&cred};
        cred.host = host;
        cred.protocol = protocol;
        cred.port = port;

        RequestPtr request(new (std::nothrow) CredRequest());
        if (!request) {
            return -1;
        }
        if (!CredRequestUtil::SetWebAPIURL(&cred, api, version, method, request.get())) {
            SetError(CRED_REQ_ERR_QUERY_FAIL);
            return -1;
        }
        if (!params.empty() && !request->AddPostParam(params)) {
            SetError(CRED_REQ_ERR_BAD_PARAM);
            return -1;
        }
        std::string format;
        if (!CredRequestUtil::GetWebAPIRequestFormat(&cred, api, format)) {
            SetError(CRED_REQ_ERR_NO_REQUEST_FORMAT);
            return -1;
        }
        request->SetRequestFormat(format);
        if (!sid.empty() && !request->AddPostParam("_sid", sid)) {
            SetError(CRED_REQ_ERR_LOGIN_FAIL);
            return -1;
        }
        int index = AddCredRequest(request.get());
        if (index >= 0) {
            request.release();
        }
        return index;
    });
}

KOVA::CredRequest *CredRequestMgr::GetRequest(int index) {
    if (index < 0 || index >= Size()) {
        SetError(CRED_REQ_ERR_BAD_PARAM);
        return nullptr;
    }
    return requests[static_cast<size_t>(index)];
}

KOVA::CredRequest *CredRequestMgr::RemoveRequest(int index) {
    if (index < 0 || index >= Size()) {
        SetError(CRED_REQ_ERR_BAD_PARAM);
        return nullptr;
    }
    CredRequest *request = requests[static_cast<size_t>(index)];
    requests[static_cast<size_t>(index)] = nullptr;
    return request;
}

int CredRequestMgr::Size() {
    return static_cast<int>(requests.size());
}

bool CredRequestMgr::IsEmpty() {
    return requests.empty();
}

void CredRequestMgr::Clear() {
    for (CredRequest *&request : requests) {
        delete request;
        request = nullptr;
    }
    requests.clear();
}

namespace {
constexpr int kLineSocketFunctionFail = 230;
constexpr int kLineSocketDataFail = 231;
constexpr int kLineAddHandleFail = 262;
}  // namespace

bool CredRequestMgr::Run() {
    MultiPtr multi(curl_multi_init());
    if (!multi) {
        SetError(CRED_REQ_ERR_CURL_INTERNAL);
        return false;
    }
    CURLMcode code =
        curl_multi_setopt(multi.get(), CURLMOPT_SOCKETFUNCTION, &CredRequestMgr::SocketCallback);
    if (code != CURLM_OK) {
        SetError(CRED_REQ_ERR_CURL_INTERNAL);
        LogMultiError(kLineSocketFunctionFail, code);
        return false;
    }
    code = curl_multi_setopt(multi.get(), CURLMOPT_SOCKETDATA, this);
    if (code != CURLM_OK) {
        SetError(CRED_REQ_ERR_CURL_INTERNAL);
        LogMultiError(kLineSocketDataFail, code);
        return false;
    }
    if (requests.empty()) {
        return true;
    }

    long longestTimeout = 0;
    for (CredRequest *request : requests) {
        if (request == nullptr) {
            continue;
        }
        long timeout = request->GetResponseTimeout();
        if (timeout > longestTimeout) {
            longestTimeout = timeout;
        }
        // The select loop below is the only time limit of a managed transfer.
        request->SetResponseTimeout(0);
        if (request->Process(false, 0)) {
            code = curl_multi_add_handle(multi.get(), request->GetCurlHandler());
            if (code != CURLM_OK) {
                // The request is left out, like one whose set-up failed.
                request->SetError(CRED_REQ_ERR_CURL_INTERNAL);
                LogMultiError(kLineAddHandleFail, code);
            }
        }
    }
    return curlHandlerProcess(multi.get(),
                              longestTimeout > 0 ? longestTimeout : kDefaultWaitSeconds);
}

std::string CredRequestMgr::GetResponse(int index) {
    CredRequest *request = GetRequest(index);
    if (request == nullptr) {
        return std::string();
    }
    return request->GetResponse();
}

Json::Value CredRequestMgr::GetAllResponse() {
    Json::Value all(Json::arrayValue);
    kova::Guarded(kUnit, kLineMgrException, [&] {
        for (CredRequest *request : requests) {
            // A slot emptied by RemoveRequest keeps its place with an empty text.
            all.append(request != nullptr ? request->GetResponse() : std::string());
        }
    });
    return all;
}

int CredRequestMgr::SocketCallback(CURL *easy, curl_socket_t, int what, void *userp, void *) {
    if (what != CURL_POLL_REMOVE || userp == nullptr) {
        return 0;
    }
    auto *mgr = static_cast<CredRequestMgr *>(userp);
    for (CredRequest *request : mgr->requests) {
        if (request != nullptr && request->GetCurlHandler() == easy) {
            request->SetError(CRED_REQ_ERR_TIMEOUT);
            break;
        }
    }
    return 0;
}

namespace {
constexpr int kLineFirstPerformFail = 291;
constexpr int kLineFdsetFail = 313;
constexpr int kLineSelectError = 320;
constexpr int kLineIdlePerformFail = 327;
constexpr int kLineMaxRetries = 332;
constexpr int kLineRetryPerformFail = 335;
constexpr int kLineSelectTimeout = 339;
constexpr int kLineReadyPerformFail = 343;
}  // namespace

namespace {

using Clock = std::chrono::steady_clock;
using Millis = std::chrono::milliseconds;

// Waits up to `ms` for activity on the multi handle's sockets. curl_multi_poll also sleeps
// when libcurl has no socket yet; the older curl_multi_wait returns at once then.
CURLMcode WaitForSockets(CURLM *multi, int ms, int *ready) {
#if LIBCURL_VERSION_NUM >= 0x074200
    return curl_multi_poll(multi, nullptr, 0, ms, ready);
#else
    return curl_multi_wait(multi, nullptr, 0, ms, ready);
#endif
}

// Whether libcurl's wait failed in poll itself (errno tells why) rather than in its own state.
bool IsPollFailure(CURLMcode code) {
#if LIBCURL_VERSION_NUM >= 0x075400
    return code == CURLM_UNRECOVERABLE_POLL;
#else
    (void)code;  // older libcurl does not report a failed poll
    return false;
#endif
}

}  // namespace

bool CredRequestMgr::curlHandlerProcess(CURLM *multi, long waitSeconds) {
    int running = 0;
    CURLMcode code = curl_multi_perform(multi, &running);
    if (code != CURLM_OK) {
        SetError(CRED_REQ_ERR_CURL_INTERNAL);
        LogMultiError(kLineFirstPerformFail, code);
        return false;
    }
    // The run ends with a time-out once no socket has been ready for a whole wait. The wait is
    // polled (descriptors of any number), never past libcurl's own next timer, and resumed
    // after a signal; each wake-up lets libcurl advance.
    const Millis wholeWait =
        std::chrono::duration_cast<Millis>(std::chrono::seconds(std::max(waitSeconds, 0L)));
    Clock::time_point quietSince = Clock::now();
    int retries = 0;
    for (;;) {
        errno = 0;
        long curlTimeout = -1;
        curl_multi_timeout(multi, &curlTimeout);
        const Millis quiet = std::chrono::duration_cast<Millis>(Clock::now() - quietSince);
        Millis wait = std::max(wholeWait - quiet, Millis(0));
        if (curlTimeout >= 0) {
            wait = std::min(wait, Millis(curlTimeout));
        }
        int ready = 0;
        code = WaitForSockets(multi, static_cast<int>(std::min<Millis::rep>(wait.count(), INT_MAX)),
                              &ready);
        if (code != CURLM_OK) {
            const int err = errno;
            if (!IsPollFailure(code)) {
                SetError(CRED_REQ_ERR_CURL_INTERNAL);
                LogMultiError(kLineFdsetFail, code);
                return false;
            }
            if (err == EINTR) {
                continue;  // a signal cut the wait short; the quiet time goes on counting
            }
            kova::Log("%s:%d %s select error: %s[%d]", kUnit, kLineSelectError, kLoopName,
                      strerror(err), err);
            SetError(CRED_REQ_ERR_SELECT);
            return false;
        }
        if (ready > 0) {
            quietSince = Clock::now();
            code = curl_multi_perform(multi, &running);
            if (code != CURLM_OK) {
                SetError(CRED_REQ_ERR_CURL_INTERNAL);
                LogMultiError(kLineReadyPerformFail, code);
                return false;
            }
        } else if (Clock::now() - quietSince < wholeWait) {
            // libcurl's timer is due (or a signal woke the wait): let it advance.
            code = curl_multi_perform(multi, &running);
            if (code != CURLM_OK) {
                SetError(CRED_REQ_ERR_CURL_INTERNAL);
                LogMultiError(kLineIdlePerformFail, code);
                return false;
            }
        } else {
            const int err = errno;
            if (retries > kMaxSelectRetries) {
                kova::Log("%s:%d Exceed max retries times!", kUnit, kLineMaxRetries);
                kova::Log("%s:%d %s select timeout(%ld): %s[%d]", kUnit, kLineSelectTimeout,
                          kLoopName, waitSeconds, strerror(err), err);
                SetError(CRED_REQ_ERR_TIMEOUT);
                return false;
            }
            if (err != EINPROGRESS && err != EAGAIN) {
                kova::Log("%s:%d %s select timeout(%ld): %s[%d]", kUnit, kLineSelectTimeout,
                          kLoopName, waitSeconds, strerror(err), err);
                SetError(CRED_REQ_ERR_TIMEOUT);
                return false;
            }
            // A connection still in progress earns another whole wait, a limited number of times.
            code = curl_multi_perform(multi, &running);
            ++retries;
            quietSince = Clock::now();
            if (code != CURLM_OK) {
                SetError(CRED_REQ_ERR_CURL_INTERNAL);
                LogMultiError(kLineRetryPerformFail, code);
                return false;
            }
        }
        if (running == 0) {
            return true;
        }
    }
}

}  // namespace KOVA
