// Connections that outlive a request: the process-wide pool of idle libcurl easy handles that
// every KOVA::CredRequest takes its handle from and gives it back to.
//
// Design, and why:
// - A libcurl easy handle keeps its own cache of live connections and TLS sessions between
//   transfers; a fresh handle means a fresh TCP connection and TLS handshake. libcurl's share
//   interface shares DNS answers and TLS sessions between handles on several threads, but not
//   one connection cache between handles that perform at the same time (its documentation of
//   CURL_LOCK_DATA_CONNECT says so). So the unit of reuse is the handle itself: a request takes
//   an idle handle made earlier for the same server and TLS settings; curl_easy_reset returns
//   every option to its default but keeps the handle's connections, session cache and share;
//   the request holds the handle for its lifetime (every Process of one request uses it), and
//   its destruction gives the handle back. A handle is either in the pool or held by one
//   request, so one thread at a time uses it.
// - Every handle is attached to one share handle for DNS answers and TLS sessions, locked with
//   one mutex per kind of data, so a second connection to a server (a concurrent request)
//   resumes the TLS session of the first instead of a full handshake.
// - A key holds scheme, host and port of the URL and the TLS settings connections are made
//   under (verification on or off, CA file, pinned key): a request that verifies certificates
//   never finds a handle whose connections were made without verification, and the reverse.
//   libcurl compares the TLS settings of a cached connection as well; the key keeps the
//   handles apart in the first place.
// - Not pooled (an empty key): requests with a TLS context callback, which get their own
//   handshake every time; URLs libcurl cannot parse; every request while reuse is switched off
//   (environment variable kovacredential_no_reuse, read with secure_getenv at each take).
//   Their handles are cleaned up when given back.
// - Bounds: at most kMaxIdleHandles handles wait in the pool (the longest idle goes first),
//   none longer than kMaxIdleSeconds (checked whenever the pool is used); each handle keeps at
//   most kMaxConnectsPerHandle connections, none idle longer than kMaxIdleSeconds
//   (CURLOPT_MAXCONNECTS, CURLOPT_MAXAGE_CONN).
// - fork: a child starts with an empty pool and a share of its own. The handles and the share
//   it inherited are abandoned, never cleaned up: clean-up would close the parent's sockets
//   and send TLS close_notify on them. A handle that a request in the child inherited is
//   replaced by a copy of its options before the child uses it (FreshIfInherited) and
//   abandoned when given back. The generation of the pool tells inherited handles apart.
// - The request manager runs transfers in a multi handle per thread, kept between runs (see
//   ThreadMulti); the handles in it keep their share, so its new connections resume TLS
//   sessions too.
// - Exit: the first handle registers an exit handler that closes the idle handles and the
//   share. Registered after libcurl's first initialisation (and OpenSSL's own exit handler),
//   it runs before them. Handles given back after it ran are cleaned up at once.
//
// All functions may be called from any thread.
#ifndef KOVA_REQUEST_CRED_REQUEST_POOL_H
#define KOVA_REQUEST_CRED_REQUEST_POOL_H

#include <string>

#include <curl/curl.h>

namespace KOVA {

class CredRequestPool {
  public:
    static constexpr size_t kMaxIdleHandles = 32;
    static constexpr long kMaxIdleSeconds = 60;
    static constexpr long kMaxConnectsPerHandle = 4;

    // The TLS settings a connection is made under.
    struct Tls {
        bool verify = false;
        std::string caFile;
        std::string pinnedKey;
    };

    // The pool key of a request to `server` (ServerOf of its URL) under `tls`; empty (not
    // pooled) when reuse is switched off or `server` is empty.
    static std::string KeyOf(const std::string &server, const Tls &tls);

    // A handle for `key`: an idle one, reset to libcurl's defaults, or a new one (attached to the
    // share when `key` is not empty). Null when libcurl cannot make one. `*generation` receives
    // the pool's generation, for Release and FreshIfInherited.
    static CURL *Acquire(const std::string &key, unsigned *generation);
    // Gives back a handle from Acquire, with its key and generation. It waits in the pool when
    // its key is not empty, the pool is still open and it was taken in this process; a handle
    // inherited across fork is abandoned; any other is cleaned up.
    static void Release(CURL *curl, const std::string &key, unsigned generation);
    // For a handle taken before a fork, in the child: a copy with the same options and none of
    // the state (abandoning the inherited one), not pooled (`*key` cleared); otherwise `curl`.
    // Null when the copy cannot be made.
    static CURL *FreshIfInherited(CURL *curl, std::string *key, unsigned *generation);
    // "scheme://host:port" of `url` (scheme and host in lower case, the scheme's port when the
    // URL names none); empty when libcurl cannot parse it. The same URL as the thread's last
    // one is not parsed again.
    static std::string ServerOf(const std::string &url);

    // The multi handle the request manager runs its transfers on, on this thread. While a
    // handle is in a multi handle it uses that multi handle's connection cache, so one per run
    // would close every connection at the end of the run; this one is kept between runs, one
    // per thread because a multi handle serves one thread at a time. It goes with the thread,
    // with CloseIdle on the thread, and in a child after fork (abandoned there like the
    // pool). While reuse is off it is a new one for each run, which `*owned` then tells the
    // caller to clean up. Null when libcurl cannot make one.
    static CURLM *ThreadMulti(bool *owned);
    // Cleans up every idle handle, closing their connections, and the calling thread's multi
    // handle (which must hold no transfer).
    static void CloseIdle();
    // Whether reuse is on (kovacredential_no_reuse unset).
    static bool ReuseEnabled();
    // The current generation: it changes in a child after fork.
    static unsigned Generation();
};

}  // namespace KOVA

#endif  // KOVA_REQUEST_CRED_REQUEST_POOL_H
