// Host platform services that callers of the library use directly: the per-thread error slot
// every failing store function fills, the token service behind encrypted (AES) parameters,
// and the address-family query.
//
// Concurrency: every function may run on several threads at once; the error slot is per
// thread.
#ifndef KOVACREDENTIAL_KOVAPLATFORM_H
#define KOVACREDENTIAL_KOVAPLATFORM_H

#include <stddef.h>

#include "kovacred_export.h"

#ifdef __cplusplus
extern "C" {
#endif

// Error codes recorded in the error slot by the credential store.
#define KOVA_ERR_OUT_OF_MEMORY 0x0200     // 512: an allocation failed
#define KOVA_ERR_DB_OPEN 0x0900           // 2304: the database cannot be opened
#define KOVA_ERR_DB_READBACK 0x0B00       // 2816: a written row is not found when read back
#define KOVA_ERR_INVALID_ARGUMENT 0x0D00  // 3328: an argument was rejected

// Records `code` with the source `file` and `line` that detected it, replacing the previous
// error of the calling thread. `file` is copied (at most 255 bytes kept); null reads back as "".
KOVA_EXPORT void VLIBCErrSetEx(int code, const char *file, int line);

// The code of the calling thread's last recorded error; 0 when none was recorded.
KOVA_EXPORT int VLIBCErrGet(void);

// The file of the last recorded error ("" when none); valid until the thread records another.
KOVA_EXPORT const char *VLIBCErrorGetFile(void);

// The line of the last recorded error; 0 when none was recorded.
KOVA_EXPORT int VLIBCErrorGetLine(void);

// A token provider fills `token` (at most tokenSize bytes) and `key` (at most keySize bytes)
// with NUL-terminated texts and returns 0 or more; a negative result means failure.
typedef int (*KOVACloudServiceHxtokenProvider)(char *token, size_t tokenSize, char *key,
                                               size_t keySize);

// Installs the process-wide token provider; null removes it. It may be replaced at any time;
// a request already asking for a token may still use the old one.
KOVA_EXPORT void KOVACloudServiceHxtokenSetProvider(KOVACloudServiceHxtokenProvider provider);

// Asks the installed provider for a token and an AES key. Returns -1 when no provider is
// installed, when a buffer is null or has size 0; otherwise the provider's result. On success
// both buffers hold NUL-terminated text (terminated by this function whatever the provider did).
KOVA_EXPORT int KOVACloudServiceHxtokenGetToken(char *token, size_t tokenSize, char *key,
                                                size_t keySize);

// The address family of a numeric host text: AF_INET (2) for an IPv4 literal, AF_INET6 (10)
// for an IPv6 literal (without brackets, optionally with a %zone), -1 for anything else,
// including host names and null. Never resolves names.
KOVA_EXPORT int KOVANetGetAddrType(const char *host);

#ifdef __cplusplus
}
#endif

#endif  // KOVACREDENTIAL_KOVAPLATFORM_H
