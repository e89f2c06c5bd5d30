#include "platform/vlibc.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

namespace {

// The error slot is per thread, like errno, so that concurrent callers do not read each
// other's failures.
struct ErrorSlot {
    int code = 0;
    int line = 0;
    char file[256] = "";
};
thread_local ErrorSlot tlsError;

// mkdir -p of every parent folder of `path`, mode 0700.
int MakeParents(const std::string &path) {
    for (size_t pos = path.find('/', 1); pos != std::string::npos; pos = path.find('/', pos + 1)) {
        std::string dir = path.substr(0, pos);
        if (mkdir(dir.c_str(), 0700) != 0 && errno != EEXIST) {
            return -1;
        }
    }
    return 0;
}

constexpr char kAlphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

// The two characters of every 12-bit value, so that three input bytes take two look-ups.
struct CharPairs {
    char pair[4096][2];
};
constexpr CharPairs MakeCharPairs() {
    CharPairs table{};
    for (int v = 0; v < 4096; ++v) {
        table.pair[v][0] = kAlphabet[v >> 6];
        table.pair[v][1] = kAlphabet[v & 63];
    }
    return table;
}
constexpr CharPairs kCharPairs = MakeCharPairs();

int DecodeChar(unsigned char c) {
    if (c >= 'A' && c <= 'Z')
        return c - 'A';
    if (c >= 'a' && c <= 'z')
        return c - 'a' + 26;
    if (c >= '0' && c <= '9')
        return c - '0' + 52;
    if (c == '+')
        return 62;
    if (c == '/')
        return 63;
    return -1;
}

}  // namespace

extern "C" void VLIBCErrSetEx(int code, const char *file, int line) {
    tlsError.code = code;
    tlsError.line = line;
    snprintf(tlsError.file, sizeof(tlsError.file), "%s", file ? file : "");
}

extern "C" int VLIBCErrGet(void) {
    return tlsError.code;
}

extern "C" const char *VLIBCErrorGetFile(void) {
    return tlsError.file;
}

extern "C" int VLIBCErrorGetLine(void) {
    return tlsError.line;
}

int VLIBCFileTouch(const char *path) {
    if (path == nullptr || *path == '\0') {
        errno = EINVAL;
        return -1;
    }
    if (MakeParents(path) != 0) {
        return -1;
    }
    // Never through a link (a dangling one would create its target), and never waiting on a
    // FIFO that has no reader.
    int fd = open(path, O_WRONLY | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC, 0600);
    if (fd < 0) {
        return -1;
    }
    close(fd);
    return 0;
}

int VLIBCBase64SzEncodeFull(const unsigned char *in, size_t inLen, char *out, size_t outSize,
                            int /*flags*/) {
    if (out == nullptr || (in == nullptr && inLen > 0)) {
        return 0;
    }
    size_t need = (inLen + 2) / 3 * 4 + 1;
    if (outSize < need) {
        return 0;
    }
    char *w = out;
    size_t i = 0;
    for (; i + 3 <= inLen; i += 3, w += 4) {
        const unsigned v = (in[i] << 16) | (in[i + 1] << 8) | in[i + 2];
        memcpy(w, kCharPairs.pair[v >> 12], 2);
        memcpy(w + 2, kCharPairs.pair[v & 0xFFF], 2);
    }
    if (i < inLen) {
        unsigned v = in[i] << 16;
        if (i + 1 < inLen)
            v |= in[i + 1] << 8;
        *w++ = kAlphabet[(v >> 18) & 63];
        *w++ = kAlphabet[(v >> 12) & 63];
        *w++ = (i + 1 < inLen) ? kAlphabet[(v >> 6) & 63] : '=';
        *w++ = '=';
    }
    *w = '\0';
    return 1;
}

int VLIBCBase64Decode(const char *text, size_t textLen, unsigned char *out, size_t *outLen) {
    if (text == nullptr || out == nullptr || outLen == nullptr) {
        return 0;
    }
    // Padding is only allowed at the end, at most two characters.
    size_t pad = 0;
    while (textLen > 0 && text[textLen - 1] == '=' && pad < 2) {
        --textLen;
        ++pad;
    }
    if (textLen % 4 == 1 || (pad > 0 && (textLen + pad) % 4 != 0)) {
        return 0;
    }
    size_t need = textLen / 4 * 3 + (textLen % 4 == 0 ? 0 : textLen % 4 - 1);
    if (need > *outLen) {
        return 0;
    }
    unsigned acc = 0;
    int bits = 0;
    size_t n = 0;
    for (size_t i = 0; i < textLen; ++i) {
        int v = DecodeChar(static_cast<unsigned char>(text[i]));
        if (v < 0) {
            return 0;
        }
        acc = (acc << 6) | static_cast<unsigned>(v);
        bits += 6;
        if (bits >= 8) {
            bits -= 8;
            out[n++] = static_cast<unsigned char>((acc >> bits) & 0xFF);
        }
    }
    *outLen = n;
    return 1;
}
