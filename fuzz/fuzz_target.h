// Shared by the fuzz targets: the entry point libFuzzer (or the replay driver) calls, handing
// the input over as text, and the check that turns a property that does not hold into a crash
// the fuzzer reports with its input.
#ifndef KOVA_FUZZ_FUZZ_TARGET_H
#define KOVA_FUZZ_FUZZ_TARGET_H

#include <stddef.h>
#include <stdint.h>
#include <stdlib.h>

#include <string>

// KOVA_FUZZ_TARGET(text) { ... } defines the target's body, run once per input `text`.
#define KOVA_FUZZ_TARGET(text)                                                \
    static void FuzzOne(const std::string &text);                             \
    extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) { \
        FuzzOne(std::string(reinterpret_cast<const char *>(data), size));     \
        return 0;                                                             \
    }                                                                         \
    static void FuzzOne(const std::string &text)

inline void Require(bool holds) {
    if (!holds) {
        abort();
    }
}

#endif  // KOVA_FUZZ_FUZZ_TARGET_H
