// KOVA::CredRequestMgr: many requests driven together over one libcurl multi handle with a
// select loop on the caller's thread.
#include "kovacredential/cred_request_mgr.h"

#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <sched.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <deque>
#include <map>
#include <memory>
#include <new>
#include <string>
#include <unordered_map>
#include <vector>

#include <openssl/ssl.h>

#include "kovacredential/cred_request_util.h"
#include "platform/kova_deadline.h"
#include "platform/kova_log.h"
#include "request/cred_request_p.h"
#include "request/cred_request_pool.h"
#include "request/cred_request_util_p.h"

namespace KOVA {

namespace {

// The easy handle of a request the manager drives. Read through the private object, so that
// the manager's own use does not count as the caller taking the handle (which keeps it out of
// the pool).
CURL *HandleOf(CredRequest *request) {
    CredRequestPrivate *p = CredRequestPrivate::Of(request);
    return p != nullptr ? p->curl : nullptr;
}

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

// A multi-handle call that failed ends the run: logged at `line`, the manager's error
// CRED_REQ_ERR_CURL_INTERNAL, and false for the run to return.
bool MultiFailed(CredRequestMgr &mgr, int line, CURLMcode code) {
    mgr.SetError(CRED_REQ_ERR_CURL_INTERNAL);
    LogMultiError(line, code);
    return false;
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

using Clock = std::chrono::steady_clock;
using Millis = std::chrono::milliseconds;

// Runs in progress that Cancel can reach. Cancel may run in a signal handler, so the registry
// is a fixed array of lock-free atomics: a run claims a slot, opens a wake pipe and publishes
// its manager; Cancel raises the slot's flag and writes a byte to the pipe, which the run's
// wait watches. `callers` counts Cancel calls looking at a slot, so that a finishing run closes
// its pipe only once no Cancel can still write to it.
struct RunSlot {
    std::atomic<bool> claimed{false};
    std::atomic<const CredRequestMgr *> manager{nullptr};
    std::atomic<bool> cancelled{false};
    std::atomic<int> wakeFd{-1};
    std::atomic<int> callers{0};
};
static_assert(std::atomic<bool>::is_always_lock_free && std::atomic<int>::is_always_lock_free &&
                  std::atomic<const CredRequestMgr *>::is_always_lock_free,
              "Cancel must not take a lock");

// Runs that may be in progress at once in a process and still be cancelled; a run beyond that
// number runs to its end.
constexpr size_t kRunSlots = 256;
RunSlot gRunSlots[kRunSlots];

// A run's place in the registry for its lifetime (see RunSlot).
class RunRegistration {
  public:
    explicit RunRegistration(const CredRequestMgr *mgr) {
        for (RunSlot &slot : gRunSlots) {
            bool expected = false;
            if (slot.claimed.compare_exchange_strong(expected, true)) {
                slot_ = &slot;
                break;
            }
        }
        if (slot_ == nullptr) {
            return;
        }
        // Without a pipe a Cancel still raises the flag; a signal, or the next wake-up of
        // libcurl's own, then ends the wait.
        if (pipe2(pipe_, O_NONBLOCK | O_CLOEXEC) != 0) {
            pipe_[0] = pipe_[1] = -1;
        }
        slot_->cancelled.store(false);
        slot_->wakeFd.store(pipe_[1]);
        slot_->manager.store(mgr);
    }
    ~RunRegistration() {
        if (slot_ != nullptr) {
            slot_->manager.store(nullptr);
            while (slot_->callers.load() != 0) {
                sched_yield();  // a Cancel on another thread is between its check and its write
            }
            slot_->wakeFd.store(-1);
            slot_->claimed.store(false);
        }
        for (int fd : pipe_) {
            if (fd >= 0) {
                close(fd);
            }
        }
    }
    RunRegistration(const RunRegistration &) = delete;
    RunRegistration &operator=(const RunRegistration &) = delete;

    bool Cancelled() const { return slot_ != nullptr && slot_->cancelled.load(); }
    // The read end of the wake pipe, or -1.
    int WakeFd() const { return pipe_[0]; }

  private:
    RunSlot *slot_ = nullptr;
    int pipe_[2] = {-1, -1};
};

// Transfers to one HTTPS server. A server that speaks HTTP/2 carries many transfers over one
// connection, but libcurl learns that only once a connection's TLS handshake is done: until
// then each transfer added opens a connection of its own, and even with CURLOPT_PIPEWAIT the
// transfers beyond one connection's streams open one each. So the first transfer goes alone
// (the probe); once it has sent its request (or ended) the protocol is known: over HTTP/2 at
// most kStreamsPerServer transfers run at once, so that all fit into the probe's connection;
// over HTTP/1.1 all the rest start at once, as many connections as transfers.
struct ServerAdmission {
    enum State { kProbing, kMultiplexed, kParallel };
    State state = kProbing;
    CURL *probe = nullptr;
    std::deque<CredRequest *> waiting;  // set up, not yet added to the multi handle
    int running = 0;                    // added and unfinished
};

// libcurl's default of concurrent streams on one HTTP/2 connection.
constexpr int kStreamsPerServer = 100;

// What Run adds to the transfer loop: the transfers it started, its deadline and its
// registration for Cancel.
struct RunControl {
    std::vector<CredRequest *> active;  // requests whose transfers are unfinished
    std::vector<CURL *> added;          // handles added to the multi handle
    std::map<std::string, ServerAdmission> servers;
    std::map<CURL *, ServerAdmission *> serverOf;
    // The held request of each handle, the first in the manager's order (as RequestOf finds
    // it), made once the run's requests are set up: a finished transfer finds its request
    // without a walk through all of them.
    std::unordered_map<CURL *, CredRequest *> requestOf;
    kova::Deadline deadline;
    const RunRegistration *registration = nullptr;
};

bool DriveTransfers(CredRequestMgr &mgr, CURLM *multi, long waitSeconds, RunControl *control);

// Adds a set-up request's transfer to the multi handle; a handle libcurl will not take leaves
// its request out, like one whose set-up failed.
bool AddTransfer(CURLM *multi, CredRequest *request, RunControl &control) {
    CURL *easy = HandleOf(request);
    const CURLMcode code = curl_multi_add_handle(multi, easy);
    if (code != CURLM_OK) {
        request->SetError(CRED_REQ_ERR_CURL_INTERNAL);
        LogMultiError(kLineAddHandleFail, code);
        auto &active = control.active;
        active.erase(std::remove(active.begin(), active.end(), request), active.end());
        return false;
    }
    control.added.push_back(easy);
    return true;
}

// Whether the connection of `easy` carries HTTP/2: from its answer when one came, else from
// the protocol its TLS handshake agreed on.
bool Multiplexes(CURL *easy) {
    long version = 0;
    if (curl_easy_getinfo(easy, CURLINFO_HTTP_VERSION, &version) == CURLE_OK && version != 0) {
        return version >= CURL_HTTP_VERSION_2_0;
    }
    struct curl_tlssessioninfo *tls = nullptr;
    if (curl_easy_getinfo(easy, CURLINFO_TLS_SSL_PTR, &tls) != CURLE_OK || tls == nullptr ||
        tls->backend != CURLSSLBACKEND_OPENSSL || tls->internals == nullptr) {
        return false;
    }
    const unsigned char *alpn = nullptr;
    unsigned int length = 0;
    SSL_get0_alpn_selected(static_cast<SSL *>(tls->internals), &alpn, &length);
    return length == 2 && memcmp(alpn, "h2", 2) == 0;
}

// Starts the waiting transfers their servers admit now; returns how many it started.
int Admit(CURLM *multi, RunControl &control) {
    int started = 0;
    for (auto &entry : control.servers) {
        ServerAdmission &server = entry.second;
        if (server.state == ServerAdmission::kProbing) {
            curl_off_t sent = 0;
            const bool probeDone = control.serverOf.count(server.probe) == 0;
            if (!probeDone &&
                (curl_easy_getinfo(server.probe, CURLINFO_PRETRANSFER_TIME_T, &sent) != CURLE_OK ||
                 sent == 0)) {
                continue;
            }
            server.state = Multiplexes(server.probe) ? ServerAdmission::kMultiplexed
                                                     : ServerAdmission::kParallel;
        }
        while (!server.waiting.empty() &&
               (server.state == ServerAdmission::kParallel || server.running < kStreamsPerServer)) {
            CredRequest *request = server.waiting.front();
            server.waiting.pop_front();
            if (AddTransfer(multi, request, control)) {
                control.serverOf[HandleOf(request)] = &server;
                ++server.running;
                ++started;
            }
        }
    }
    return started;
}

// The server a set-up request's transfer goes to: the one its set-up read from the URL, unless
// the caller took the handle and may have pointed it elsewhere. Empty while reuse is off.
const std::string &ServerOfTransfer(CredRequest *request, std::string &lentServer) {
    const CredRequestPrivate *p = CredRequestPrivate::Of(request);
    if (!CredRequestPool::ReuseEnabled()) {
        return lentServer;
    }
    if (!p->handleLent) {
        return p->server;
    }
    const char *url = nullptr;
    if (curl_easy_getinfo(p->curl, CURLINFO_EFFECTIVE_URL, &url) == CURLE_OK && url != nullptr) {
        lentServer = CredRequestPool::ServerOf(url);
    }
    return lentServer;
}

// Starts a set-up request's transfer, or queues it behind its server's probe (see
// ServerAdmission). Plain HTTP, and every transfer while reuse is off, starts at once.
void StartOrQueue(CURLM *multi, CredRequest *request, RunControl &control) {
    control.active.push_back(request);
    CURL *easy = HandleOf(request);
    std::string lentServer;
    const std::string &server = ServerOfTransfer(request, lentServer);
    if (server.compare(0, 8, "https://") != 0) {
        AddTransfer(multi, request, control);
        return;
    }
    curl_easy_setopt(easy, CURLOPT_PIPEWAIT, 1L);
    ServerAdmission &admission = control.servers[server];
    if (admission.probe == nullptr) {
        if (AddTransfer(multi, request, control)) {
            admission.probe = easy;
            control.serverOf[easy] = &admission;
            admission.running = 1;
        }
        return;
    }
    admission.waiting.push_back(request);
}

}  // namespace

bool CredRequestMgr::Run() {
    return Run(0);
}

bool CredRequestMgr::Run(long timeoutMilliseconds) {
    if (timeoutMilliseconds < 0) {
        SetError(CRED_REQ_ERR_BAD_PARAM);
        return false;
    }
    // The deadline counts from the call, the set-up of the multi handle and the requests included.
    const kova::Deadline deadline = kova::Deadline::After(timeoutMilliseconds);
    // The thread's multi handle keeps the connections of earlier runs (see
    // CredRequestPool::ThreadMulti).
    bool ownedMulti = false;
    CURLM *const multi = CredRequestPool::ThreadMulti(&ownedMulti);
    const MultiPtr owner(ownedMulti ? multi : nullptr);
    if (multi == nullptr) {
        SetError(CRED_REQ_ERR_CURL_INTERNAL);
        return false;
    }
    // Whatever the run's end, the multi handle afterwards holds none of its transfers and
    // calls back no manager.
    RunControl control;
    struct Detach {
        CURLM *multi;
        const RunControl &control;
        ~Detach() {
            curl_multi_setopt(multi, CURLMOPT_SOCKETDATA, nullptr);
            for (CURL *easy : control.added) {
                curl_multi_remove_handle(multi, easy);
            }
        }
    } detach{multi, control};
    CURLMcode code =
        curl_multi_setopt(multi, CURLMOPT_SOCKETFUNCTION, &CredRequestMgr::SocketCallback);
    if (code != CURLM_OK) {
        return MultiFailed(*this, kLineSocketFunctionFail, code);
    }
    code = curl_multi_setopt(multi, CURLMOPT_SOCKETDATA, this);
    if (code != CURLM_OK) {
        return MultiFailed(*this, kLineSocketDataFail, code);
    }
    if (requests.empty()) {
        return true;
    }

    return kova::Guarded(kUnit, kLineMgrException, false, [&] {
        const RunRegistration registration(this);
        control.registration = &registration;
        control.deadline = deadline;
        control.active.reserve(requests.size());
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
                // A run that stops early (its deadline, Cancel) leaves a resolver thread that
                // has not answered to finish on its own instead of waiting for it.
                curl_easy_setopt(HandleOf(request), CURLOPT_QUICK_EXIT, 1L);
                StartOrQueue(multi, request, control);
            }
        }
        control.requestOf.reserve(requests.size());
        for (CredRequest *request : requests) {
            CURL *easy = request != nullptr ? HandleOf(request) : nullptr;
            if (easy != nullptr) {
                control.requestOf.emplace(easy, request);
            }
        }
        return DriveTransfers(*this, multi,
                              longestTimeout > 0 ? longestTimeout : kDefaultWaitSeconds, &control);
    });
}

void CredRequestMgr::Cancel() {
    const int savedErrno = errno;  // a signal handler must leave errno as it found it
    for (RunSlot &slot : gRunSlots) {
        slot.callers.fetch_add(1);
        if (slot.manager.load() == this) {
            slot.cancelled.store(true);
            const int fd = slot.wakeFd.load();
            if (fd >= 0) {
                const char byte = 1;
                // A full pipe wakes the run already, so a failed write needs no retry.
                const ssize_t written = write(fd, &byte, 1);
                (void)written;
            }
        }
        slot.callers.fetch_sub(1);
    }
    errno = savedErrno;
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
        if (request != nullptr && HandleOf(request) == easy) {
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

// Waits up to `ms` for activity on the multi handle's sockets or on `wakeFd` (-1: none).
// libcurl shortens the wait to its own next timer, and a signal that interrupts it ends it
// quietly, as a wait without activity.
CURLMcode WaitForSockets(CURLM *multi, int wakeFd, int ms, int *ready) {
    struct curl_waitfd wake = {};
    wake.fd = wakeFd;
    wake.events = CURL_WAIT_POLLIN;
    const unsigned int extra = wakeFd >= 0 ? 1 : 0;
#if LIBCURL_VERSION_NUM >= 0x074200
    // curl_multi_poll also sleeps when libcurl has no socket yet; the older curl_multi_wait
    // returns at once then.
    return curl_multi_poll(multi, extra > 0 ? &wake : nullptr, extra, ms, ready);
#else
    return curl_multi_wait(multi, extra > 0 ? &wake : nullptr, extra, ms, ready);
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

// The held request whose transfer is `easy` (the first in the manager's order), or null: from
// the run's map when there is one, else by a walk through the slots.
CredRequest *RequestOf(CredRequestMgr &mgr, CURL *easy, const RunControl *control) {
    if (control != nullptr) {
        auto known = control->requestOf.find(easy);
        if (known != control->requestOf.end()) {
            return known->second;
        }
    }
    for (int i = 0; i < mgr.Size(); ++i) {
        CredRequest *request = mgr.GetRequest(i);
        if (request != nullptr && HandleOf(request) == easy) {
            return request;
        }
    }
    return nullptr;
}

// Reads the results of the transfers libcurl has finished. A failed transfer gives its request
// the error Process gives for the same result (a response over the in-memory cap, for one,
// ends with libcurl's write error); the socket callback's mark stays on the others.
void CollectFinished(CredRequestMgr &mgr, CURLM *multi, RunControl *control) {
    int queued = 0;
    while (CURLMsg *message = curl_multi_info_read(multi, &queued)) {
        if (message->msg != CURLMSG_DONE) {
            continue;
        }
        CURL *easy = message->easy_handle;
        CredRequest *request = RequestOf(mgr, easy, control);
        if (request != nullptr) {
            // libcurl's code, text and timing, as Process records them.
            CredRequestPrivate::Of(request)->NoteTransfer(message->data.result);
            if (message->data.result != CURLE_OK) {
                request->SetError(CredRequest::ErrorOf(message->data.result, 0));
            }
        }
        if (control != nullptr) {
            auto server = control->serverOf.find(easy);
            if (server != control->serverOf.end()) {
                --server->second->running;
                control->serverOf.erase(server);
            }
            auto &active = control->active;
            active.erase(std::remove(active.begin(), active.end(), request), active.end());
        }
    }
}

// After libcurl advanced: reads the finished transfers, then starts those their servers now
// admit (a run's transfers to an HTTPS server, see ServerAdmission) and lets libcurl take them
// up, until no more start.
CURLMcode Advance(CURLM *multi, int *running, CredRequestMgr &mgr, RunControl *control) {
    // Transfers started here may finish at once, leaving none running: their servers may then
    // admit more, so the run is over only once nothing more starts.
    for (;;) {
        CollectFinished(mgr, multi, control);
        if (control == nullptr || Admit(multi, *control) == 0) {
            return CURLM_OK;
        }
        const CURLMcode code = curl_multi_perform(multi, running);
        if (code != CURLM_OK) {
            return code;
        }
    }
}

// Ends a run before its transfers finished: every unfinished transfer is taken off the multi
// handle and its request gets `error`, as does the manager.
bool StopRun(CredRequestMgr &mgr, CURLM *multi, RunControl &control,
             KOVA::_tag_CRED_REQ_ERR error) {
    for (CredRequest *request : control.active) {
        curl_multi_remove_handle(multi, HandleOf(request));
        // After the removal, so that the socket callback's mark of a closed socket gives way.
        request->SetError(error);
    }
    control.active.clear();
    mgr.SetError(error);
    return false;
}

bool DriveTransfers(CredRequestMgr &mgr, CURLM *multi, long waitSeconds, RunControl *control) {
    int running = 0;
    CURLMcode code = curl_multi_perform(multi, &running);
    if (code != CURLM_OK) {
        return MultiFailed(mgr, kLineFirstPerformFail, code);
    }
    code = Advance(multi, &running, mgr, control);
    if (code != CURLM_OK) {
        return MultiFailed(mgr, kLineFirstPerformFail, code);
    }
    // The run ends with a time-out once no socket has been ready for a whole wait. The wait is
    // polled (descriptors of any number); libcurl cuts it short for its own timer, and so does
    // a signal. Each wake-up lets libcurl advance, and the quiet time is counted by the clock,
    // so that a wake-up without activity does not end the run early.
    const Millis wholeWait =
        std::chrono::duration_cast<Millis>(std::chrono::seconds(std::max(waitSeconds, 0L)));
    const RunRegistration *registration = control != nullptr ? control->registration : nullptr;
    const int wakeFd = registration != nullptr ? registration->WakeFd() : -1;
    Clock::time_point quietSince = Clock::now();
    int retries = 0;
    while (running != 0) {
        errno = 0;
        const Clock::time_point now = Clock::now();
        Millis wait =
            std::max(wholeWait - std::chrono::duration_cast<Millis>(now - quietSince), Millis(0));
        if (control != nullptr && control->deadline.IsSet()) {
            wait = std::min(wait, Millis(std::max(control->deadline.LeftMs(), 0L)));
        }
        int ready = 0;
        code = WaitForSockets(
            multi, wakeFd, static_cast<int>(std::min<Millis::rep>(wait.count(), INT_MAX)), &ready);
        const int err = errno;
        if (registration != nullptr && registration->Cancelled()) {
            // Cancel ends the run as an interrupted wait ends it.
            kova::Log("%s:%d %s select error: %s[%d]", kUnit, kLineSelectError, kLoopName,
                      strerror(EINTR), EINTR);
            return StopRun(mgr, multi, *control, CRED_REQ_ERR_SELECT);
        }
        if (control != nullptr && control->deadline.Expired()) {
            return StopRun(mgr, multi, *control, CRED_REQ_ERR_TIMEOUT);
        }
        if (code != CURLM_OK) {
            if (!IsPollFailure(code)) {
                return MultiFailed(mgr, kLineFdsetFail, code);
            }
            kova::Log("%s:%d %s select error: %s[%d]", kUnit, kLineSelectError, kLoopName,
                      strerror(err), err);
            mgr.SetError(CRED_REQ_ERR_SELECT);
            return false;
        }
        if (ready > 0) {
            quietSince = Clock::now();
            code = curl_multi_perform(multi, &running);
            if (code != CURLM_OK) {
                return MultiFailed(mgr, kLineReadyPerformFail, code);
            }
        } else if (Clock::now() - quietSince < wholeWait) {
            // libcurl's timer is due (or a signal woke the wait): let it advance.
            code = curl_multi_perform(multi, &running);
            if (code != CURLM_OK) {
                return MultiFailed(mgr, kLineIdlePerformFail, code);
            }
        } else {
            if (retries > kMaxSelectRetries) {
                kova::Log("%s:%d Exceed max retries times!", kUnit, kLineMaxRetries);
                kova::Log("%s:%d %s select timeout(%ld): %s[%d]", kUnit, kLineSelectTimeout,
                          kLoopName, waitSeconds, strerror(err), err);
                mgr.SetError(CRED_REQ_ERR_TIMEOUT);
                return false;
            }
            if (err != EINPROGRESS && err != EAGAIN) {
                kova::Log("%s:%d %s select timeout(%ld): %s[%d]", kUnit, kLineSelectTimeout,
                          kLoopName, waitSeconds, strerror(err), err);
                mgr.SetError(CRED_REQ_ERR_TIMEOUT);
                return false;
            }
            // A connection still in progress earns another whole wait, a limited number of times.
            code = curl_multi_perform(multi, &running);
            ++retries;
            quietSince = Clock::now();
            if (code != CURLM_OK) {
                return MultiFailed(mgr, kLineRetryPerformFail, code);
            }
        }
        code = Advance(multi, &running, mgr, control);
        if (code != CURLM_OK) {
            return MultiFailed(mgr, kLineReadyPerformFail, code);
        }
    }
    return true;
}

}  // namespace

bool CredRequestMgr::curlHandlerProcess(CURLM *multi, long waitSeconds) {
    return kova::Guarded(kUnit, kLineMgrException, false,
                         [&] { return DriveTransfers(*this, multi, waitSeconds, nullptr); });
}

}  // namespace KOVA
