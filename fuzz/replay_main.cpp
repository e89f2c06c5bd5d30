// Runs a fuzz target without libFuzzer: every file of the corpus folders given as arguments,
// then a fixed number of deterministic mutations of them (byte flips, insertions, cuts,
// splices), so the suite exercises each target on every build, sanitizers included.
#include <stddef.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <system_error>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size);

namespace {

uint64_t gState = 0x9E3779B97F4A7C15ULL;

uint64_t Next() {
    gState ^= gState << 13;
    gState ^= gState >> 7;
    gState ^= gState << 17;
    return gState;
}

std::string Mutate(const std::vector<std::string> &seeds) {
    std::string s = seeds[Next() % seeds.size()];
    const int edits = 1 + static_cast<int>(Next() % 8);
    for (int i = 0; i < edits; ++i) {
        const size_t at = s.empty() ? 0 : Next() % (s.size() + 1);
        const uint64_t kind = Next() % 5;
        if (kind == 0 && !s.empty()) {
            s[at % s.size()] = static_cast<char>(Next());
        } else if (kind == 1) {
            s.insert(at, 1, static_cast<char>(Next()));
        } else if (kind == 2 && !s.empty()) {
            s.erase(at % s.size(), 1 + Next() % 4);
        } else if (kind == 3) {
            s.insert(at, seeds[Next() % seeds.size()]);
        } else if (kind == 4) {
            s.resize(at);
        }
    }
    return s;
}

void Run(const std::string &input) {
    LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t *>(input.data()), input.size());
}

}  // namespace

int main(int argc, char **argv) {
    std::vector<std::string> seeds{""};
    for (int i = 1; i < argc; ++i) {
        std::error_code error;
        for (const auto &entry : std::filesystem::directory_iterator(argv[i], error)) {
            if (entry.path().filename().string()[0] != '.') {
                std::stringstream text;
                text << std::ifstream(entry.path(), std::ios::binary).rdbuf();
                seeds.push_back(text.str());
            }
        }
    }
    const char *env = getenv("KOVA_FUZZ_REPLAY_RUNS");
    const int runs = env != nullptr ? atoi(env) : 3000;
    for (const auto &seed : seeds) {
        Run(seed);
    }
    for (int i = 0; i < runs; ++i) {
        Run(Mutate(seeds));
    }
    // On standard error: a target may have pointed standard output elsewhere.
    fprintf(stderr, "%zu seeds and %d mutations ran\n", seeds.size(), runs);
    return 0;
}
