// AES decryption of arbitrary cipher text under an arbitrary pass phrase, and the round trip:
// whatever is encrypted under a pass phrase decrypts to the same text (cut at a NUL).
// Input: one length byte, that many bytes of pass phrase, then the text.
#include <stddef.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>

#include <string>

#include "kovacredential/cred_request_util.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    if (size == 0) {
        return 0;
    }
    const size_t keyLength = data[0] < size - 1 ? data[0] : size - 1;
    const std::string passphrase(reinterpret_cast<const char *>(data + 1), keyLength);
    const std::string text(reinterpret_cast<const char *>(data + 1 + keyLength),
                           size - 1 - keyLength);

    std::string plain = "unset";
    if (!KOVA::CredRequestUtil::GetDecryptAESString(passphrase, text, plain) && plain != "unset") {
        abort();  // a failed decryption leaves the output alone
    }

    std::string cipher;
    std::string back;
    if (!KOVA::CredRequestUtil::GetEncryptAESString(passphrase, text, cipher) ||
        !KOVA::CredRequestUtil::GetDecryptAESString(passphrase, cipher, back) ||
        back != text.substr(0, strnlen(text.c_str(), text.size()))) {
        abort();
    }
    return 0;
}
