// The transport a caller lends to the WebAPI utilities' own requests: the copy of its settings
// into each inner request, and the outcome of a failed inner request copied back.
#include "request/cred_request_transport.h"

#include <algorithm>

#include "request/cred_request_p.h"

namespace KOVA {

namespace {

// The transport of the current thread's outermost scope, and whether a failure has been
// copied back to it since that scope began. Per thread, so that callers on other threads
// never see each other's transport.
thread_local CredRequest *tTransport = nullptr;
thread_local bool tReported = false;

}  // namespace

void CredRequestPrivate::TakeTransport(const CredRequestPrivate &transport) {
    for (const char *key : {"VerifySSL", "RespTime"}) {
        if (transport.settings.isMember(key)) {
            settings[key] = transport.settings[key];
        }
    }
    if (transport.sslCtxFn != nullptr) {
        sslCtxFn = transport.sslCtxFn;
        sslCtxData = transport.sslCtxData;
    }
    caFile = transport.caFile;
    pinnedPublicKey = transport.pinnedPublicKey;
    defaultTimeout = transport.defaultTimeout;
    if (transport.deadline.IsSet()) {
        totalTimeoutMs = std::max(transport.deadline.LeftMs(), 1L);
    } else {
        totalTimeoutMs = transport.totalTimeoutMs;
    }
}

TransportScope::TransportScope(CredRequest *transport)
    : saved_(tTransport), savedReported_(tReported) {
    CredRequestPrivate *t = transport != nullptr ? CredRequestPrivate::Of(transport) : nullptr;
    if (t == nullptr || transport == saved_) {
        return;
    }
    tTransport = transport;
    tReported = false;
    t->error = CRED_REQ_ERR_NONE;
    t->curlCode = CURLE_OK;
    t->curlErrorText.clear();
    t->transferFacts = CredRequestPrivate::TransferFacts();
    t->StartDeadline();
}

TransportScope::~TransportScope() {
    tTransport = saved_;
    tReported = savedReported_;
}

bool ProcessWithTransport(CredRequest &request, bool report) {
    CredRequestPrivate *inner = CredRequestPrivate::Of(&request);
    CredRequestPrivate *transport =
        tTransport != nullptr ? CredRequestPrivate::Of(tTransport) : nullptr;
    if (inner != nullptr && transport != nullptr) {
        inner->TakeTransport(*transport);
    }
    if (request.Process(true, 0)) {
        return true;
    }
    if (report && inner != nullptr && transport != nullptr && !tReported) {
        tReported = true;
        transport->error = inner->error;
        transport->curlCode = inner->curlCode;
        transport->curlErrorText = inner->curlErrorText;
        transport->transferFacts = inner->transferFacts;
    }
    return false;
}

}  // namespace KOVA
