// Helpers every benchmark program shares: the median of timed rounds and the process's
// resident-set figures.
#ifndef KOVA_BENCH_BENCH_SUPPORT_H
#define KOVA_BENCH_BENCH_SUPPORT_H

#include <algorithm>
#include <fstream>
#include <string>
#include <vector>

namespace kova_bench {

// The median of `values` (the upper one of an even count); 0 for none.
inline double Median(std::vector<double> values) {
    std::sort(values.begin(), values.end());
    return values.empty() ? 0 : values[values.size() / 2];
}

// A "kB" field of /proc/self/status (VmRSS: resident now, VmHWM: its peak); -1 when it cannot
// be read.
inline long StatusKb(const char *field) {
    std::ifstream status("/proc/self/status");
    const std::string prefix = std::string(field) + ":";
    for (std::string line; std::getline(status, line);) {
        if (line.rfind(prefix, 0) == 0) {
            return std::stol(line.substr(prefix.size()));
        }
    }
    return -1;
}

}  // namespace kova_bench

#endif  // KOVA_BENCH_BENCH_SUPPORT_H
