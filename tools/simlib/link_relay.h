// A TCP relay on loopback that behaves like a link with a set round-trip time, for tests,
// benchmarks, the demo and `kovasim link`: put it in front of any server and clients pay for
// every round trip their protocol makes.
//
// Each accepted connection is connected on to the target at once, but is usable only after one
// round trip: bytes either side sends cross after max(sent, accepted + RTT) + RTT/2. So a
// client that talks first has its first bytes arrive 1.5 RTT after connecting, as over a real
// link after the TCP handshake, and every answer comes back half a round trip later. Order is
// kept per direction; an orderly close crosses like data, a reset or a failed connect to the
// target ends both sides at once. Bandwidth is not limited, but a side whose bytes pile up
// (4 MiB in flight) is not read until they have crossed.
//
// All connections are served by one thread of the relay's own. The accessors may be called
// from any thread.
#ifndef KOVASIM_LINK_RELAY_H
#define KOVASIM_LINK_RELAY_H

#include <atomic>
#include <memory>
#include <string>
#include <thread>

namespace kovasim {

class LinkRelay {
  public:
    struct Options {
        int listenPort = 0;  // on 127.0.0.1; 0 picks a free port
        std::string toHost = "127.0.0.1";
        int toPort = 0;
        int rttMs = 50;
    };

    explicit LinkRelay(const Options &options);
    ~LinkRelay();
    LinkRelay(const LinkRelay &) = delete;
    LinkRelay &operator=(const LinkRelay &) = delete;

    // Resolves the target, binds the listener and starts relaying. False with Error() set
    // when the target cannot be resolved or the port cannot be bound.
    bool Start();
    // Ends every relayed connection and the thread.
    void Stop();
    const std::string &Error() const { return error_; }

    int Port() const { return port_; }
    // Connections accepted so far.
    int ConnectionCount() const { return accepted_; }
    // Bytes that crossed to the target and back to clients so far.
    long long BytesUp() const { return bytesUp_; }
    long long BytesDown() const { return bytesDown_; }

  private:
    void Run();

    Options options_;
    std::string error_;
    int port_ = 0;
    int listenFd_ = -1;
    int wakeFds_[2] = {-1, -1};
    std::thread thread_;
    std::atomic<int> accepted_{0};
    std::atomic<long long> bytesUp_{0};
    std::atomic<long long> bytesDown_{0};
    // The resolved target address.
    struct Target;
    std::shared_ptr<Target> target_;
};

}  // namespace kovasim

#endif  // KOVASIM_LINK_RELAY_H
