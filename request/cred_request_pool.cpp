// The process-wide pool of idle libcurl easy handles (see cred_request_pool.h for the design).
#include "request/cred_request_pool.h"

#include <ctype.h>
#include <pthread.h>
#include <stdlib.h>

#include <atomic>
#include <chrono>
#include <deque>
#include <memory>
#include <mutex>
#include <vector>

#include "platform/kova_env.h"

namespace KOVA {

namespace {

using Clock = std::chrono::steady_clock;

struct IdleHandle {
    std::string key;
    CURL *curl;
    Clock::time_point since;
};

// Everything the pool keeps. A child after fork gets a new one; the inherited one stays
// reachable through `inherited`, untouched, so that nothing of the parent's is cleaned up.
struct PoolState {
    std::mutex mutex;
    std::deque<IdleHandle> idle;  // the longest idle first
    CURLSH *share = nullptr;
    std::mutex shareLocks[CURL_LOCK_DATA_LAST];
    bool open = true;          // false once the exit handler ran
    bool exitHandler = false;  // whether it is registered
    PoolState *inherited = nullptr;
};

// Made when the library is loaded, replaced only in a child after fork (by its one thread).
PoolState *gState = new PoolState;
std::atomic<unsigned> gGeneration{1};

void LockShare(CURL *, curl_lock_data data, curl_lock_access, void *user) {
    if (data >= 0 && data < CURL_LOCK_DATA_LAST) {
        static_cast<PoolState *>(user)->shareLocks[data].lock();
    }
}

void UnlockShare(CURL *, curl_lock_data data, void *user) {
    if (data >= 0 && data < CURL_LOCK_DATA_LAST) {
        static_cast<PoolState *>(user)->shareLocks[data].unlock();
    }
}

// The share of DNS answers and TLS sessions; null when libcurl cannot make it (handles then
// work without it).
CURLSH *MakeShare(PoolState *state) {
    CURLSH *share = curl_share_init();
    if (share == nullptr) {
        return nullptr;
    }
    if (curl_share_setopt(share, CURLSHOPT_LOCKFUNC, &LockShare) != CURLSHE_OK ||
        curl_share_setopt(share, CURLSHOPT_UNLOCKFUNC, &UnlockShare) != CURLSHE_OK ||
        curl_share_setopt(share, CURLSHOPT_USERDATA, static_cast<void *>(state)) != CURLSHE_OK ||
        curl_share_setopt(share, CURLSHOPT_SHARE, CURL_LOCK_DATA_DNS) != CURLSHE_OK ||
        curl_share_setopt(share, CURLSHOPT_SHARE, CURL_LOCK_DATA_SSL_SESSION) != CURLSHE_OK) {
        curl_share_cleanup(share);
        return nullptr;
    }
    return share;
}

// Removes from the pool the handles idle too long and those beyond the cap; the caller cleans
// them up after unlocking.
void TakeExpired(PoolState &state, std::vector<CURL *> &out) {
    const Clock::time_point oldest =
        Clock::now() - std::chrono::seconds(CredRequestPool::kMaxIdleSeconds);
    while (!state.idle.empty() && (state.idle.size() > CredRequestPool::kMaxIdleHandles ||
                                   state.idle.front().since < oldest)) {
        out.push_back(state.idle.front().curl);
        state.idle.pop_front();
    }
}

// Removes every idle handle from the pool; the caller cleans them up after unlocking.
std::vector<CURL *> TakeAll(PoolState &state) {
    std::vector<CURL *> handles;
    for (const IdleHandle &h : state.idle) {
        handles.push_back(h.curl);
    }
    state.idle.clear();
    return handles;
}

void CleanUp(const std::vector<CURL *> &handles) {
    for (CURL *curl : handles) {
        curl_easy_cleanup(curl);
    }
}

// Runs at exit, before libcurl's and OpenSSL's own clean-up: closes every idle connection and
// the share. Requests still alive give their handles back to a closed pool, which cleans them
// up; while any holds one, the share stays.
void CloseAtExit() {
    PoolState *state = gState;
    std::vector<CURL *> handles;
    {
        std::lock_guard<std::mutex> lock(state->mutex);
        state->open = false;
        handles = TakeAll(*state);
    }
    CleanUp(handles);
    std::lock_guard<std::mutex> lock(state->mutex);
    if (state->share != nullptr && curl_share_cleanup(state->share) == CURLSHE_OK) {
        state->share = nullptr;
    }
}

// fork: the forking thread holds the pool's lock across the fork, so that the child finds the
// pool in a consistent state; the child then starts a new pool.
void BeforeFork() {
    gState->mutex.lock();
}

void AfterForkInParent() {
    gState->mutex.unlock();
}

void AfterForkInChild() {
    PoolState *inherited = gState;
    auto *fresh = new (std::nothrow) PoolState;
    if (fresh == nullptr) {
        // No memory for a new pool: the inherited one is emptied without clean-up instead.
        inherited->idle.clear();
        inherited->share = nullptr;
        inherited->mutex.unlock();
    } else {
        fresh->inherited = inherited;
        fresh->open = inherited->open;
        gState = fresh;
    }
    ++gGeneration;
}

const int gForkHandlers = pthread_atfork(&BeforeFork, &AfterForkInParent, &AfterForkInChild);

// The options every handle of the pool gets after a reset: bounds on its connections.
void SetPoolOptions(CURL *curl) {
    curl_easy_setopt(curl, CURLOPT_MAXCONNECTS, CredRequestPool::kMaxConnectsPerHandle);
    curl_easy_setopt(curl, CURLOPT_MAXAGE_CONN, CredRequestPool::kMaxIdleSeconds);
}

struct UrlDeleter {
    void operator()(CURLU *url) const { curl_url_cleanup(url); }
};

// One part of a parsed URL, "" when missing.
std::string UrlPart(CURLU *url, CURLUPart part, unsigned flags) {
    char *text = nullptr;
    if (curl_url_get(url, part, &text, flags) != CURLUE_OK || text == nullptr) {
        return std::string();
    }
    std::string value(text);
    curl_free(text);
    return value;
}

// The manager's multi handle of this thread (see ThreadMulti), cleaned up when the thread
// ends unless it was inherited across fork.
struct ThreadMultiHolder {
    CURLM *multi = nullptr;
    unsigned generation = 0;
    void Close() {
        if (multi != nullptr && generation == gGeneration) {
            curl_multi_cleanup(multi);
        }
        multi = nullptr;
    }
    ~ThreadMultiHolder() { Close(); }
};
thread_local ThreadMultiHolder tThreadMulti;

// The server of the URL this thread asked ServerOf for last: requests in a row mostly go to
// the same URL, which then is not parsed again.
struct LastServer {
    std::string url;
    std::string server;
};
thread_local LastServer tLastServer;

// Idle connections the manager's multi handle of a thread keeps between runs.
constexpr long kMaxIdleConnectionsPerThread = 64;

}  // namespace

bool CredRequestPool::ReuseEnabled() {
    return kova::SecureEnv(kova::kEnvNoReuse) == nullptr;
}

unsigned CredRequestPool::Generation() {
    return gGeneration;
}

std::string CredRequestPool::KeyOf(const std::string &server, const Tls &tls) {
    (void)gForkHandlers;
    if (server.empty() || !ReuseEnabled()) {
        return std::string();
    }
    // Lengths keep the free-form parts from running into each other.
    const std::string caLength = std::to_string(tls.caFile.size());
    const std::string pinLength = std::to_string(tls.pinnedKey.size());
    std::string key;
    key.reserve(server.size() + caLength.size() + tls.caFile.size() + pinLength.size() +
                tls.pinnedKey.size() + 24);
    key.append(server)
        .append(tls.verify ? " verify" : " noverify")
        .append(" ca")
        .append(caLength)
        .append(":")
        .append(tls.caFile)
        .append(" pin")
        .append(pinLength)
        .append(":")
        .append(tls.pinnedKey);
    return key;
}

std::string CredRequestPool::ServerOf(const std::string &url) {
    LastServer &last = tLastServer;
    if (!last.server.empty() && last.url == url) {
        return last.server;
    }
    std::unique_ptr<CURLU, UrlDeleter> parsed(curl_url());
    if (!parsed ||
        curl_url_set(parsed.get(), CURLUPART_URL, url.c_str(), CURLU_GUESS_SCHEME) != CURLUE_OK) {
        return std::string();
    }
    std::string scheme = UrlPart(parsed.get(), CURLUPART_SCHEME, 0);
    std::string host = UrlPart(parsed.get(), CURLUPART_HOST, 0);
    const std::string port = UrlPart(parsed.get(), CURLUPART_PORT, CURLU_DEFAULT_PORT);
    if (scheme.empty() || host.empty()) {
        return std::string();
    }
    for (std::string *text : {&scheme, &host}) {
        for (char &c : *text) {
            c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
        }
    }
    last.server = scheme + "://" + host + ":" + port;
    last.url = url;
    return last.server;
}

CURLM *CredRequestPool::ThreadMulti(bool *owned) {
    *owned = !ReuseEnabled();
    if (*owned) {
        return curl_multi_init();
    }
    ThreadMultiHolder &holder = tThreadMulti;
    if (holder.multi != nullptr && holder.generation != gGeneration) {
        holder.multi = nullptr;  // the parent's, with the parent's connections: abandoned
    }
    if (holder.multi == nullptr) {
        holder.multi = curl_multi_init();
        holder.generation = gGeneration;
        if (holder.multi != nullptr) {
            curl_multi_setopt(holder.multi, CURLMOPT_MAXCONNECTS, kMaxIdleConnectionsPerThread);
        }
    }
    return holder.multi;
}

CURL *CredRequestPool::Acquire(const std::string &key, unsigned *generation) {
    PoolState *state = gState;
    std::vector<CURL *> expired;
    CURL *curl = nullptr;
    {
        std::lock_guard<std::mutex> lock(state->mutex);
        *generation = gGeneration;
        TakeExpired(*state, expired);
        if (!key.empty() && state->open) {
            for (auto it = state->idle.rbegin(); it != state->idle.rend(); ++it) {
                if (it->key == key) {
                    curl = it->curl;
                    state->idle.erase(std::next(it).base());
                    break;
                }
            }
        }
    }
    CleanUp(expired);
    if (curl != nullptr) {
        curl_easy_reset(curl);
        SetPoolOptions(curl);
        return curl;
    }
    curl = curl_easy_init();
    if (curl == nullptr || key.empty()) {
        return curl;
    }
    {
        // After the first handle libcurl (and OpenSSL) are initialised, so the exit handler
        // registered now runs before their own.
        std::lock_guard<std::mutex> lock(state->mutex);
        if (!state->open) {
            return curl;
        }
        if (!state->exitHandler) {
            state->exitHandler = atexit(&CloseAtExit) == 0;
        }
        if (state->share == nullptr) {
            state->share = MakeShare(state);
        }
        if (state->share != nullptr) {
            curl_easy_setopt(curl, CURLOPT_SHARE, state->share);
        }
    }
    SetPoolOptions(curl);
    return curl;
}

void CredRequestPool::Release(CURL *curl, const std::string &key, unsigned generation) {
    if (curl == nullptr) {
        return;
    }
    if (generation != gGeneration) {
        return;  // taken before a fork: the parent's connections are not the child's to close
    }
    PoolState *state = gState;
    std::vector<CURL *> expired;
    bool kept = false;
    {
        std::lock_guard<std::mutex> lock(state->mutex);
        if (!key.empty() && state->open && state->exitHandler) {
            state->idle.push_back({key, curl, Clock::now()});
            kept = true;
        }
        TakeExpired(*state, expired);
    }
    if (!kept) {
        curl_easy_cleanup(curl);
    }
    CleanUp(expired);
}

CURL *CredRequestPool::FreshIfInherited(CURL *curl, std::string *key, unsigned *generation) {
    const unsigned current = gGeneration;
    if (curl == nullptr || *generation == current) {
        return curl;
    }
    // A copy has the options and none of the connections, sessions or share.
    CURL *copy = curl_easy_duphandle(curl);
    key->clear();
    *generation = current;
    return copy;
}

void CredRequestPool::CloseIdle() {
    PoolState *state = gState;
    std::vector<CURL *> handles;
    {
        std::lock_guard<std::mutex> lock(state->mutex);
        handles = TakeAll(*state);
    }
    CleanUp(handles);
    tThreadMulti.Close();
}

}  // namespace KOVA
