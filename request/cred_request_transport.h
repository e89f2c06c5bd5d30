// A caller's request lent to the WebAPI utilities as the transport of the requests they make
// themselves (redirect probe, description query, encryption information, login and logout
// posts): while a TransportScope lives on a thread, every such request on that thread runs
// with the transport's settings, and the first one whose failure ends the operation leaves its
// outcome in the transport.
#ifndef KOVA_REQUEST_CRED_REQUEST_TRANSPORT_H
#define KOVA_REQUEST_CRED_REQUEST_TRANSPORT_H

#include "kovacredential/cred_request.h"

namespace KOVA {

class TransportScope {
  public:
    // A null transport changes nothing: inner requests keep the transport of an enclosing
    // scope, or the library's defaults. The outermost scope of a transport clears its error,
    // libcurl code, text and transfer facts and starts its deadline (with a total time-out).
    explicit TransportScope(CredRequest *transport);
    ~TransportScope();
    TransportScope(const TransportScope &) = delete;
    TransportScope &operator=(const TransportScope &) = delete;

  private:
    CredRequest *saved_;
    bool savedReported_;
};

// Runs `request` (Process(true, 0)) with the thread's transport, if any. When it fails and
// `report` is set, its error, libcurl code and text and transfer facts go to the transport,
// unless an earlier failure of the same scope is there already.
bool ProcessWithTransport(CredRequest &request, bool report = true);

}  // namespace KOVA

#endif  // KOVA_REQUEST_CRED_REQUEST_TRANSPORT_H
