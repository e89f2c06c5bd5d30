#include "simlib/link_relay.h"

#include <errno.h>
#include <fcntl.h>
#include <netdb.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <deque>
#include <list>
#include <vector>

namespace kovasim {

struct LinkRelay::Target {
    sockaddr_storage addr{};
    socklen_t len = 0;
};

namespace {

using Clock = std::chrono::steady_clock;

constexpr size_t kReadSize = 64 * 1024;
constexpr size_t kMaxInFlight = 4 * 1024 * 1024;

// Bytes read from one side, to be written to the other once due; an empty chunk with `eof`
// stands for the orderly close that followed them.
struct Chunk {
    Clock::time_point due;
    std::string bytes;
    bool eof = false;
};

// One direction of a relayed connection.
struct Direction {
    int from = -1;
    int to = -1;
    std::deque<Chunk> queue;
    size_t inFlight = 0;
    size_t written = 0;    // of the front chunk
    bool readEof = false;  // `from` has closed its sending side
    bool sentEof = false;  // and that close has crossed to `to`
    bool blocked = false;  // `to` would not take more bytes: wait for POLLOUT
};

struct Pair {
    int client = -1;
    int server = -1;
    bool connecting = true;
    Clock::time_point usableAt;
    Direction up;    // client to server
    Direction down;  // server to client
    bool dead = false;
};

void SetNonBlocking(int fd) {
    fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK);
}

// Closes with a TCP reset, as a peer that failed would.
void CloseWithReset(int fd) {
    if (fd < 0) {
        return;
    }
    linger l{1, 0};
    setsockopt(fd, SOL_SOCKET, SO_LINGER, &l, sizeof(l));
    close(fd);
}

void ClosePair(Pair &p, bool reset) {
    if (reset) {
        CloseWithReset(p.client);
        CloseWithReset(p.server);
    } else {
        close(p.client);
        if (p.server >= 0) {
            close(p.server);
        }
    }
    p.client = p.server = -1;
    p.dead = true;
}

// Writes what is due of `d`. False when `to` failed.
bool Flush(Direction &d, Clock::time_point now, std::atomic<long long> &counter) {
    while (!d.queue.empty() && d.queue.front().due <= now) {
        Chunk &c = d.queue.front();
        if (c.eof) {
            shutdown(d.to, SHUT_WR);
            d.sentEof = true;
            d.queue.pop_front();
            continue;
        }
        const ssize_t n =
            send(d.to, c.bytes.data() + d.written, c.bytes.size() - d.written, MSG_NOSIGNAL);
        if (n < 0) {
            if (errno == EAGAIN || errno == EWOULDBLOCK) {
                d.blocked = true;
                return true;
            }
            if (errno == EINTR) {
                continue;
            }
            return false;
        }
        counter += n;
        d.written += static_cast<size_t>(n);
        if (d.written == c.bytes.size()) {
            d.inFlight -= c.bytes.size();
            d.written = 0;
            d.queue.pop_front();
        }
    }
    d.blocked = false;
    return true;
}

// Reads what `d.from` has sent and queues it to cross at `due`. False on a failed side.
bool Take(Direction &d, Clock::time_point due) {
    std::string buf(kReadSize, '\0');
    const ssize_t n = recv(d.from, buf.data(), buf.size(), 0);
    if (n < 0) {
        return errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR;
    }
    if (n == 0) {
        d.readEof = true;
        d.queue.push_back(Chunk{due, std::string(), true});
        return true;
    }
    buf.resize(static_cast<size_t>(n));
    d.inFlight += buf.size();
    d.queue.push_back(Chunk{due, std::move(buf), false});
    return true;
}

}  // namespace

LinkRelay::LinkRelay(const Options &options) : options_(options) {}

LinkRelay::~LinkRelay() {
    Stop();
}

bool LinkRelay::Start() {
    if (thread_.joinable()) {
        return true;
    }
    addrinfo hints{};
    hints.ai_family = AF_UNSPEC;
    hints.ai_socktype = SOCK_STREAM;
    addrinfo *found = nullptr;
    const std::string port = std::to_string(options_.toPort);
    const int gai = getaddrinfo(options_.toHost.c_str(), port.c_str(), &hints, &found);
    if (gai != 0 || found == nullptr) {
        error_ = "cannot resolve " + options_.toHost + ": " + gai_strerror(gai);
        return false;
    }
    target_ = std::make_shared<Target>();
    memcpy(&target_->addr, found->ai_addr, found->ai_addrlen);
    target_->len = found->ai_addrlen;
    freeaddrinfo(found);

    listenFd_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
    const int one = 1;
    setsockopt(listenFd_, SOL_SOCKET, SO_REUSEADDR, &one, sizeof(one));
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    addr.sin_port = htons(static_cast<uint16_t>(options_.listenPort));
    socklen_t len = sizeof(addr);
    if (listenFd_ < 0 || bind(listenFd_, reinterpret_cast<sockaddr *>(&addr), sizeof(addr)) != 0 ||
        listen(listenFd_, 1024) != 0 ||
        getsockname(listenFd_, reinterpret_cast<sockaddr *>(&addr), &len) != 0 ||
        pipe2(wakeFds_, O_CLOEXEC | O_NONBLOCK) != 0) {
        error_ = std::string("cannot listen on 127.0.0.1:") + std::to_string(options_.listenPort) +
                 ": " + strerror(errno);
        Stop();
        return false;
    }
    port_ = ntohs(addr.sin_port);
    thread_ = std::thread([this] { Run(); });
    return true;
}

void LinkRelay::Stop() {
    if (thread_.joinable()) {
        const char byte = 0;
        while (write(wakeFds_[1], &byte, 1) < 0 && errno == EINTR) {
        }
        thread_.join();
    }
    for (int *fd : {&listenFd_, &wakeFds_[0], &wakeFds_[1]}) {
        if (*fd >= 0) {
            close(*fd);
            *fd = -1;
        }
    }
}

void LinkRelay::Run() {
    const auto rtt = std::chrono::milliseconds(options_.rttMs);
    const auto half = std::chrono::microseconds(options_.rttMs * 500);
    std::list<Pair> pairs;
    std::vector<pollfd> fds;
    std::vector<Pair *> owners;  // pair of fds[i], null for the wake pipe and the listener
    for (;;) {
        const Clock::time_point now = Clock::now();
        Clock::time_point next = Clock::time_point::max();
        fds.clear();
        owners.clear();
        fds.push_back(pollfd{wakeFds_[0], POLLIN, 0});
        fds.push_back(pollfd{listenFd_, POLLIN, 0});
        owners.resize(2, nullptr);
        for (auto it = pairs.begin(); it != pairs.end();) {
            Pair &p = *it;
            if (!p.dead && !p.connecting &&
                (!Flush(p.up, now, bytesUp_) || !Flush(p.down, now, bytesDown_))) {
                ClosePair(p, true);
            }
            if (!p.dead && p.up.sentEof && p.down.sentEof) {
                ClosePair(p, false);
            }
            if (p.dead) {
                it = pairs.erase(it);
                continue;
            }
            short clientEvents = 0;
            short serverEvents = p.connecting ? POLLOUT : 0;
            if (!p.up.readEof && p.up.inFlight < kMaxInFlight) {
                clientEvents |= POLLIN;
            }
            if (!p.connecting && !p.down.readEof && p.down.inFlight < kMaxInFlight) {
                serverEvents |= POLLIN;
            }
            for (Direction *d : {&p.up, &p.down}) {
                if (d->blocked) {
                    (d == &p.up ? serverEvents : clientEvents) |= POLLOUT;
                } else if (!d->queue.empty() && !p.connecting) {
                    next = std::min(next, d->queue.front().due);
                }
            }
            fds.push_back(pollfd{p.client, clientEvents, 0});
            fds.push_back(pollfd{p.server, serverEvents, 0});
            owners.push_back(&p);
            owners.push_back(&p);
            ++it;
        }
        int timeout = -1;
        if (next != Clock::time_point::max()) {
            const auto wait = std::chrono::ceil<std::chrono::milliseconds>(next - now).count();
            timeout = static_cast<int>(std::max<long long>(0, wait));
        }
        if (poll(fds.data(), fds.size(), timeout) < 0 && errno != EINTR) {
            break;
        }
        if (fds[0].revents != 0) {
            break;
        }
        const Clock::time_point polled = Clock::now();
        for (size_t i = 2; i < fds.size(); i += 2) {
            Pair &p = *owners[i];
            const short clientEvents = fds[i].revents;
            const short serverEvents = fds[i + 1].revents;
            if (p.connecting && serverEvents != 0) {
                int err = 0;
                socklen_t errLen = sizeof(err);
                getsockopt(p.server, SOL_SOCKET, SO_ERROR, &err, &errLen);
                if (err != 0) {
                    ClosePair(p, true);
                    continue;
                }
                p.connecting = false;
            } else if (!p.connecting && (serverEvents & (POLLIN | POLLHUP | POLLERR)) != 0 &&
                       !p.down.readEof && !Take(p.down, std::max(polled, p.usableAt) + half)) {
                ClosePair(p, true);
                continue;
            }
            if ((clientEvents & (POLLIN | POLLHUP | POLLERR)) != 0 && !p.up.readEof &&
                !Take(p.up, std::max(polled, p.usableAt) + half)) {
                ClosePair(p, true);
            }
        }
        if (fds[1].revents != 0) {
            for (;;) {
                const int client =
                    accept4(listenFd_, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
                if (client < 0) {
                    break;
                }
                ++accepted_;
                Pair p;
                p.client = client;
                p.usableAt = Clock::now() + rtt;
                p.server = socket(target_->addr.ss_family, SOCK_STREAM | SOCK_CLOEXEC, 0);
                if (p.server < 0) {
                    CloseWithReset(client);
                    continue;
                }
                SetNonBlocking(p.server);
                const int one = 1;
                setsockopt(client, IPPROTO_TCP, TCP_NODELAY, &one, sizeof(one));
                setsockopt(p.server, IPPROTO_TCP, TCP_NODELAY, &one, sizeof(one));
                if (connect(p.server, reinterpret_cast<const sockaddr *>(&target_->addr),
                            target_->len) != 0 &&
                    errno != EINPROGRESS) {
                    ClosePair(p, true);
                    continue;
                }
                p.up.from = p.down.to = p.client;
                p.up.to = p.down.from = p.server;
                pairs.push_back(std::move(p));
            }
        }
    }
    for (Pair &p : pairs) {
        ClosePair(p, true);
    }
}

}  // namespace kovasim
