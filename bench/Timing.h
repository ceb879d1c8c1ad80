#pragma once

#include <cstddef>
#include <ctime>

namespace bench {

inline double secondsNow() {
    timespec now{};
    clock_gettime(CLOCK_MONOTONIC, &now);
    return static_cast<double>(now.tv_sec) + 1e-9 * static_cast<double>(now.tv_nsec);
}

/// Mean microseconds of `action`, called again and again for `seconds` after a short time for the caches to warm.
template <class F> double meanMicroseconds(double seconds, F&& action) {
    const auto meanOver = [&](double duration) {
        std::size_t count = 0;
        const double start = secondsNow();
        double end = start;
        do {
            action();
            ++count;
            end = secondsNow();
        } while (end - start < duration);
        return (end - start) / static_cast<double>(count) * 1e6;
    };
    meanOver(seconds / 10);
    return meanOver(seconds);
}

} // namespace bench
