// A server that misbehaves on purpose: each fault is one way a hostile or broken peer can
// answer an HTTP(S) request. Tests run clients against it to show that they end with an error
// in bounded time and memory; `kovasim --fault MODE` serves one fault so that users can try
// their own programs against it.
#ifndef KOVASIM_FAULT_SERVER_H
#define KOVASIM_FAULT_SERVER_H

#include <stdint.h>

#include <memory>
#include <string>
#include <vector>

#include "simlib/loopback_server.h"

namespace kovasim {

enum class Fault {
    kSilent,         // "silent": accepts, reads the request and never answers
    kResetHeaders,   // "reset-headers": a TCP reset in the middle of the response headers
    kResetBody,      // "reset-body": a TCP reset in the middle of the body
    kGarbageStatus,  // "garbage-status": a status line that is no HTTP
    kManyHeaders,    // "many-headers": 10,000 response headers, then a short body
    kHugeHeader,     // "huge-header": one header line of 1 MB
    kBadChunk,       // "bad-chunk": a chunked body whose chunk size is no hexadecimal number
    kPlainOnTls,     // "plain-on-tls": plain HTTP where the client expects TLS
    kTlsOnPlain,     // "tls-on-plain": a TLS server where the client expects plain HTTP
    kHugeBody,       // "huge-body": a 200 MB body (with its Content-Length), sent at full speed
};

// Every fault, in the order above.
const std::vector<Fault> &AllFaults();
// The command-line name of a fault ("silent", "reset-headers", ...).
const char *FaultName(Fault fault);
// The fault named `name`; false for an unknown name.
bool FaultFromName(const std::string &name, Fault *fault);

// Number of headers of kManyHeaders and size of the kHugeHeader line and kHugeBody body.
constexpr int kFaultHeaderCount = 10000;
constexpr size_t kFaultHeaderLineBytes = size_t{1} << 20;
constexpr uint64_t kFaultBodyBytes = uint64_t{200} * 1000 * 1000;

// A gzip stream that decodes to `bytes` zero bytes: about a thousandth of that on the wire. A
// server that sends it with "Content-Encoding: gzip" tests a client's bound on decoded data.
std::string GzipBomb(uint64_t bytes);

class FaultServer {
  public:
    // Serves `fault` on `host` (`port` 0 picks a free one) once started.
    explicit FaultServer(Fault fault, const std::string &host = "127.0.0.1", int port = 0);
    ~FaultServer();
    FaultServer(const FaultServer &) = delete;
    FaultServer &operator=(const FaultServer &) = delete;

    bool Start();
    void Stop();
    Fault GetFault() const { return fault_; }
    int Port() const;
    // Whether clients are meant to reach it with "https" (the scheme they expect, which the
    // server then does not speak for kPlainOnTls).
    bool ClientUsesTls() const { return fault_ == Fault::kPlainOnTls; }
    // "http://HOST:PORT" or "https://HOST:PORT" as ClientUsesTls says.
    std::string BaseUrl() const;
    // Why Start failed.
    const std::string &Error() const { return error_; }

  private:
    Fault fault_;
    std::string host_;
    int port_;
    std::string error_;
    std::unique_ptr<RawServer> raw_;       // every fault but kTlsOnPlain
    std::unique_ptr<LoopbackServer> tls_;  // kTlsOnPlain: a real TLS listener
};

}  // namespace kovasim

#endif  // KOVASIM_FAULT_SERVER_H
