#pragma once

#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"
#include "platform/base/Mutex.h"
#include "platform/threads/EventSource.h"
#include "platform/threads/WorkerPool.h"

#include <chrono>
#include <cstdint>
#include <expected>
#include <map>
#include <memory>
#include <optional>
#include <span>
#include <utility>

namespace ost::platform {

/// Posts `EventSource::deadlineEvent` to sources whose deadline has passed. It is armed only while somebody has a
/// deadline, and setting a later one than the earliest costs no system call.
///
/// Threads: any. Ownership: shared with the pool from `start` to `stop`; the pool must outlive that. Keeps a source
/// that has a deadline.
class DeadlineTimer final : public EventSource {
public:
    using Time = std::chrono::steady_clock::time_point;

    explicit DeadlineTimer(WorkerPool& pool) : _pool(pool) {}

    /// Fails with an errno when the kernel has no descriptor left for it.
    [[nodiscard]] std::expected<void, Errno> start();
    /// Forgets all deadlines.
    void stop();

    /// Replaces the deadline `before` of `source`, which the caller remembers, by `after`.
    void change(const std::shared_ptr<EventSource>& source, std::optional<Time> before, std::optional<Time> after);

private:
    void serve(std::uint32_t events, std::span<char> scratch) override;
    void _armFor(Time time) OST_REQUIRES(_mutex);

    WorkerPool& _pool;
    WorkerPool::Watch _watch = WorkerPool::Watch::none;
    FileDescriptor _timer;

    Mutex _mutex;
    std::map<std::pair<Time, EventSource*>, std::shared_ptr<EventSource>> _deadlines OST_GUARDED_BY(_mutex);
    std::optional<Time> _armed OST_GUARDED_BY(_mutex); ///< when the timer fires next
};

} // namespace ost::platform
