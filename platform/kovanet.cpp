// Port layer: the address family of a numeric host text.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <string.h>

#include <string>

#include "kovacredential/kovaplatform.h"

extern "C" int KOVANetGetAddrType(const char *host) {
    if (host == nullptr || *host == '\0') {
        return -1;
    }
    unsigned char buf[sizeof(struct in6_addr)];
    if (inet_pton(AF_INET, host, buf) == 1) {
        return AF_INET;
    }
    // An IPv6 literal may carry a zone ("fe80::1%eth0"); the zone is not part of the address.
    std::string addr(host);
    size_t zone = addr.find('%');
    if (zone != std::string::npos) {
        addr.resize(zone);
    }
    if (inet_pton(AF_INET6, addr.c_str(), buf) == 1) {
        return AF_INET6;
    }
    return -1;
}
