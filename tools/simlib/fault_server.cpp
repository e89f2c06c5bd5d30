#include "simlib/fault_server.h"

#include <errno.h>
#include <string.h>

#include <zlib.h>

namespace kovasim {

namespace {

struct FaultInfo {
    Fault fault;
    const char *name;
};

const FaultInfo kFaults[] = {
    {Fault::kSilent, "silent"},
    {Fault::kResetHeaders, "reset-headers"},
    {Fault::kResetBody, "reset-body"},
    {Fault::kGarbageStatus, "garbage-status"},
    {Fault::kManyHeaders, "many-headers"},
    {Fault::kHugeHeader, "huge-header"},
    {Fault::kBadChunk, "bad-chunk"},
    {Fault::kPlainOnTls, "plain-on-tls"},
    {Fault::kTlsOnPlain, "tls-on-plain"},
    {Fault::kHugeBody, "huge-body"},
};

// How long a silent connection is held at most when the client never gives up.
constexpr int kSilentHoldMs = 24 * 3600 * 1000;

void Misbehave(Fault fault, RawServer::Connection &c) {
    switch (fault) {
        case Fault::kSilent:
            c.WaitForClose(kSilentHoldMs);
            break;
        case Fault::kResetHeaders:
            c.Send("HTTP/1.1 200 OK\r\nContent-Type: application/js");
            c.Pause(100);
            c.Reset();
            break;
        case Fault::kResetBody:
            c.Send(
                "HTTP/1.1 200 OK\r\nContent-Type: application/json\r\nContent-Length: "
                "1000000\r\n\r\n{\"success\":true,\"data\":{\"text\":\"" +
                std::string(1000, 'a'));
            c.Pause(100);
            c.Reset();
            break;
        case Fault::kGarbageStatus:
            c.Send("KOVA/9.9 \x01\x02 garbage\r\nContent-Length: 2\r\n\r\nok");
            break;
        case Fault::kManyHeaders: {
            std::string head = "HTTP/1.1 200 OK\r\n";
            for (int i = 0; i < kFaultHeaderCount; ++i) {
                head += "X-Kova-" + std::to_string(i) + ": " + std::to_string(i) + "\r\n";
            }
            c.Send(head + "Content-Length: 2\r\n\r\nok");
            break;
        }
        case Fault::kHugeHeader:
            c.Send("HTTP/1.1 200 OK\r\nX-Kova-Huge: " + std::string(kFaultHeaderLineBytes, 'h') +
                   "\r\nContent-Length: 2\r\n\r\nok");
            break;
        case Fault::kBadChunk:
            c.Send(
                "HTTP/1.1 200 OK\r\nTransfer-Encoding: chunked\r\n\r\n4\r\nkova\r\n"
                "zz\r\nnot a chunk\r\n0\r\n\r\n");
            break;
        case Fault::kPlainOnTls:
            // What a plain HTTP server says to the TLS handshake it cannot read, sent at once.
            c.Send(
                "HTTP/1.1 400 Bad Request\r\nContent-Length: 11\r\nConnection: close\r\n\r\n"
                "bad request");
            break;
        case Fault::kHugeBody: {
            if (!c.Send("HTTP/1.1 200 OK\r\nContent-Type: application/octet-stream\r\n"
                        "Content-Length: " +
                        std::to_string(kFaultBodyBytes) + "\r\n\r\n")) {
                break;
            }
            // One block sent again and again: the server's own memory stays flat.
            const std::string block(size_t{1} << 20, 'b');
            for (uint64_t sent = 0; sent < kFaultBodyBytes; sent += block.size()) {
                const uint64_t left = kFaultBodyBytes - sent;
                if (!c.Send(block.data(), left < block.size() ? left : block.size())) {
                    break;  // the client gave up
                }
            }
            break;
        }
        case Fault::kTlsOnPlain:
            break;  // served by a TLS listener, not here
    }
}

}  // namespace

const std::vector<Fault> &AllFaults() {
    static const std::vector<Fault> faults = [] {
        std::vector<Fault> all;
        for (const FaultInfo &f : kFaults) {
            all.push_back(f.fault);
        }
        return all;
    }();
    return faults;
}

const char *FaultName(Fault fault) {
    for (const FaultInfo &f : kFaults) {
        if (f.fault == fault) {
            return f.name;
        }
    }
    return "";
}

bool FaultFromName(const std::string &name, Fault *fault) {
    for (const FaultInfo &f : kFaults) {
        if (name == f.name) {
            *fault = f.fault;
            return true;
        }
    }
    return false;
}

std::string GzipBomb(uint64_t bytes) {
    z_stream z = {};
    // Window bits 15 + 16: a gzip header and trailer around the deflate data.
    if (deflateInit2(&z, 9, Z_DEFLATED, 15 + 16, 9, Z_DEFAULT_STRATEGY) != Z_OK) {
        return "";
    }
    const std::vector<unsigned char> zeros(size_t{1} << 20, 0);
    std::vector<unsigned char> out(size_t{1} << 16);
    std::string gzip;
    uint64_t left = bytes;
    int flush = Z_NO_FLUSH;
    while (flush != Z_FINISH) {
        const size_t take = left < zeros.size() ? static_cast<size_t>(left) : zeros.size();
        left -= take;
        flush = left == 0 ? Z_FINISH : Z_NO_FLUSH;
        z.next_in = const_cast<unsigned char *>(zeros.data());
        z.avail_in = static_cast<uInt>(take);
        do {
            z.next_out = out.data();
            z.avail_out = static_cast<uInt>(out.size());
            deflate(&z, flush);
            gzip.append(reinterpret_cast<const char *>(out.data()), out.size() - z.avail_out);
        } while (z.avail_out == 0);
    }
    deflateEnd(&z);
    return gzip;
}

FaultServer::FaultServer(Fault fault, const std::string &host, int port)
    : fault_(fault), host_(host), port_(port) {
    if (fault_ == Fault::kTlsOnPlain) {
        LoopbackServer::Options options;
        options.host = host_;
        options.port = port_;
        options.https = true;
        options.threads = 4;
        tls_ = std::make_unique<LoopbackServer>(options);
        tls_->Fallback([](const httplib::Request &, httplib::Response &res) {
            res.set_content("{\"success\":true}", "application/json");
        });
    } else {
        // Plain HTTP on a TLS port answers the handshake at once, without waiting for a request
        // head that never comes.
        raw_ =
            std::make_unique<RawServer>([fault](RawServer::Connection &c) { Misbehave(fault, c); },
                                        host_, fault_ != Fault::kPlainOnTls, port_);
    }
}

FaultServer::~FaultServer() {
    Stop();
}

bool FaultServer::Start() {
    if (tls_) {
        if (!tls_->Start()) {
            error_ = tls_->Error();
            return false;
        }
        return true;
    }
    if (!raw_->Start()) {
        error_ = "cannot listen on " + host_ + ":" + std::to_string(port_) + " (" +
                 strerror(errno) + ")";
        return false;
    }
    return true;
}

void FaultServer::Stop() {
    if (tls_) {
        tls_->Stop();
    }
    if (raw_) {
        raw_->Stop();
    }
}

int FaultServer::Port() const {
    return tls_ ? tls_->Port() : raw_->Port();
}

std::string FaultServer::BaseUrl() const {
    return std::string(ClientUsesTls() ? "https" : "http") + "://" + host_ + ":" +
           std::to_string(Port());
}

}  // namespace kovasim
