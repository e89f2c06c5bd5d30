// Port layer: the core-library services of the host platform that the credential store and
// the encryption helpers call. The error slot is public (kovaplatform.h); the rest is
// internal to the library.
#ifndef KOVA_PLATFORM_VLIBC_H
#define KOVA_PLATFORM_VLIBC_H

#include <stddef.h>

#include "kovacredential/kovaplatform.h"

// C functions of the host's core library, as the error slot is.
extern "C" {

// Creates `path` as an empty regular file (mode 0600 before the caller's chmod) when it does
// not exist, creating missing parent folders with mode 0700 first. An existing file is left
// as it is. A symbolic link as the last component is never followed: the call fails with
// ELOOP, also when the link dangles. Returns 0 on success, -1 with errno set on failure.
int VLIBCFileTouch(const char *path);

// Standard Base64 (RFC 4648 alphabet, '=' padding, no line breaks) of inLen bytes into `out`,
// NUL-terminated. Returns non-zero on success, 0 when out is null or outSize cannot hold the
// text and its NUL. `flags` is reserved and must be 0.
int VLIBCBase64SzEncodeFull(const unsigned char *in, size_t inLen, char *out, size_t outSize,
                            int flags);

// Decodes textLen bytes of Base64 text (padding optional, no white space allowed) into `out`.
// *outLen holds the buffer's size on entry and the decoded size on return. Returns non-zero on
// success, 0 on a character outside the alphabet, bad padding or a buffer too small.
int VLIBCBase64Decode(const char *text, size_t textLen, unsigned char *out, size_t *outLen);

}  // extern "C"

#endif  // KOVA_PLATFORM_VLIBC_H
