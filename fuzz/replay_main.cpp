// Runs a fuzz target without libFuzzer: every file of the corpus folders given as arguments,
// then a fixed number of deterministic mutations of them (byte flips, insertions, cuts,
// splices), so the suite exercises each target on every build, sanitizers included.
#include <dirent.h>
#include <stddef.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>

#include <fstream>
#include <sstream>
#include <string>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size);

namespace {

std::vector<std::string> ReadCorpus(const char *folder) {
    std::vector<std::string> inputs;
    DIR *dir = opendir(folder);
    if (dir == nullptr) {
        return inputs;
    }
    while (struct dirent *entry = readdir(dir)) {
        if (entry->d_name[0] == '.') {
            continue;
        }
        std::ifstream in(std::string(folder) + "/" + entry->d_name, std::ios::binary);
        std::stringstream text;
        text << in.rdbuf();
        inputs.push_back(text.str());
    }
    closedir(dir);
    return inputs;
}

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
        switch (Next() % 5) {
            case 0:
                if (!s.empty())
                    s[at % s.size()] = static_cast<char>(Next());
                break;
            case 1:
                s.insert(at, 1, static_cast<char>(Next()));
                break;
            case 2:
                if (!s.empty())
                    s.erase(at % s.size(), 1 + Next() % 4);
                break;
            case 3:
                s.insert(at, seeds[Next() % seeds.size()]);
                break;
            default:
                s.resize(at);
                break;
        }
    }
    return s;
}

}  // namespace

int main(int argc, char **argv) {
    std::vector<std::string> seeds{""};
    for (int i = 1; i < argc; ++i) {
        for (auto &input : ReadCorpus(argv[i])) {
            seeds.push_back(std::move(input));
        }
    }
    const char *env = getenv("KOVA_FUZZ_REPLAY_RUNS");
    const int runs = env != nullptr ? atoi(env) : 3000;
    for (const auto &seed : seeds) {
        LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t *>(seed.data()), seed.size());
    }
    for (int i = 0; i < runs; ++i) {
        const std::string input = Mutate(seeds);
        LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t *>(input.data()), input.size());
    }
    // On standard error: a target may have pointed standard output elsewhere.
    fprintf(stderr, "%zu seeds and %d mutations ran\n", seeds.size(), runs);
    return 0;
}
