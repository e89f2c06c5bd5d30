// Port layer: the platform token service that supplies the token and AES key of encrypted
// (AES) parameters. The host installs a provider; without one every request for a token fails.
#include <stddef.h>

#include <atomic>

#include "kovacredential/kovaplatform.h"

namespace {
std::atomic<KOVACloudServiceHxtokenProvider> gProvider{nullptr};
}

extern "C" void KOVACloudServiceHxtokenSetProvider(KOVACloudServiceHxtokenProvider provider) {
    gProvider = provider;
}

extern "C" int KOVACloudServiceHxtokenGetToken(char *token, size_t tokenSize, char *key,
                                               size_t keySize) {
    const KOVACloudServiceHxtokenProvider provider = gProvider;
    if (provider == nullptr || token == nullptr || key == nullptr || tokenSize == 0 ||
        keySize == 0) {
        return -1;
    }
    token[0] = '\0';
    key[0] = '\0';
    int ret = provider(token, tokenSize, key, keySize);
    token[tokenSize - 1] = '\0';
    key[keySize - 1] = '\0';
    return ret;
}
