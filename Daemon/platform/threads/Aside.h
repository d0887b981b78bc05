#pragma once

#include <future>
#include <system_error>
#include <thread>
#include <utility>

namespace ost::platform {

/// Starts `work` beside the caller's own, on a thread that ends with it. The future, whose destruction waits for the
/// thread, is not valid when there is but one processor or no thread is to be had: the caller then does all of the work
/// itself.
template<typename Work>
[[nodiscard]] std::future<void> startAside(Work work) {
    if (std::thread::hardware_concurrency() < 2)
        return {};
    try {
        return std::async(std::launch::async, std::move(work));
    } catch (const std::system_error&) {
        return {};
    }
}

} // namespace ost::platform
