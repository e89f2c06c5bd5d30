// How kovacred's requests reach a server: the options that check the server and bound the
// time, applied the same way by every command that makes requests, and the failure line that
// names a transfer's cause.
#include <string>

#include "commands.h"
#include "kovacredential/cred_request.h"

namespace kovacred {

void AddTransportOptions(CLI::App *cmd, Transport *transport) {
    cmd->add_flag("--verify", transport->verify, "verify the server certificate and host name");
}

void ApplyTransport(const Transport &transport, KOVA::CredRequest &request) {
    if (transport.verify) {
        request.SetHTTPSVerify(true);
    }
}

int FailTransfer(const std::string &what, KOVA::CredRequest &request) {
    return Fail(what, request.GetError());
}

}  // namespace kovacred
