#pragma once

#include <algorithm>
#include <ctime>

namespace rolvane::test {

// The least processor time of the calling thread, in seconds, that one of several calls takes: what other programs do
// meanwhile counts little. `measured` is called with a function that notes the start.
template <class Call>
double leastCpuSeconds(Call&& measured, int repetitions = 5) {
    const auto now = [] {
        timespec time{};
        ::clock_gettime(CLOCK_THREAD_CPUTIME_ID, &time);
        return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) * 1e-9;
    };
    double least = 1e9;
    for (int i = 0; i < repetitions; ++i) {
        double start = now();
        measured([&] { start = now(); });
        least = std::min(least, now() - start);
    }
    return least;
}

} // namespace rolvane::test
