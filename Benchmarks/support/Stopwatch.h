#pragma once

#include <chrono>
#include <functional>

namespace ost::benchmarks {

using Clock = std::chrono::steady_clock;

[[nodiscard]] inline double secondsSince(Clock::time_point start) {
    return std::chrono::duration<double>(Clock::now() - start).count();
}

[[nodiscard]] inline double secondsOf(const std::function<void()>& work) {
    const auto start = Clock::now();
    work();
    return secondsSince(start);
}

} // namespace ost::benchmarks
