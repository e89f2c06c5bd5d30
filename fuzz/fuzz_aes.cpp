// AES decryption of arbitrary cipher text under an arbitrary pass phrase, and the round trip:
// whatever is encrypted under a pass phrase decrypts to the same text (cut at a NUL).
// Input: one length byte, that many bytes of pass phrase, then the text.
#include <string.h>

#include "fuzz_target.h"
#include "kovacredential/cred_request_util.h"

KOVA_FUZZ_TARGET(input) {
    if (input.empty()) {
        return;
    }
    const std::string passphrase = input.substr(1, static_cast<uint8_t>(input[0]));
    const std::string text = input.substr(1 + passphrase.size());

    std::string plain = "unset";
    // A failed decryption leaves the output alone.
    Require(KOVA::CredRequestUtil::GetDecryptAESString(passphrase, text, plain) ||
            plain == "unset");
    std::string cipher, back;
    Require(KOVA::CredRequestUtil::GetEncryptAESString(passphrase, text, cipher) &&
            KOVA::CredRequestUtil::GetDecryptAESString(passphrase, cipher, back) &&
            back == text.substr(0, strnlen(text.c_str(), text.size())));
}
