// Ours beside a peer's, in one run.
#pragma once

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <functional>
#include <vector>

namespace bench {

inline double Median(std::vector<double> values) {
    std::nth_element(values.begin(), values.begin() + static_cast<long>(values.size() / 2),
                     values.end());
    return values[values.size() / 2];
}

inline double Milliseconds(const std::function<void()>& work) {
    const auto start = std::chrono::steady_clock::now();
    work();
    return std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start)
        .count();
}

/// Ours and the peer's, in turns; the first of each is not counted.
inline void Compare(const char* what, const std::function<double()>& ours, const char* peer,
                    const std::function<double()>& theirs, int runs, const char* wanted) {
    std::vector<double> our_times;
    std::vector<double> their_times;
    for (int i = -1; i < runs; ++i) {
        const double our_time = ours();
        const double their_time = theirs();
        if (i >= 0) {
            our_times.push_back(our_time);
            their_times.push_back(their_time);
        }
    }
    const auto fastest = [](const std::vector<double>& times) {
        return *std::min_element(times.begin(), times.end());
    };
    std::printf("%-34s %9.2f ms, %-34s %9.2f ms: ratio %.2f (fastest %.2f; wanted: %s)\n", what,
                Median(our_times), peer, Median(their_times),
                Median(our_times) / Median(their_times), fastest(our_times) / fastest(their_times),
                wanted);
    std::fflush(stdout);
}

}  // namespace bench
