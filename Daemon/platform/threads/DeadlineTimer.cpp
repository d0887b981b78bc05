#include "platform/threads/DeadlineTimer.h"

#include "platform/base/Assert.h"

#include <sys/epoll.h>
#include <sys/timerfd.h>

#include <algorithm>
#include <cerrno>
#include <vector>

namespace ost::platform {

std::expected<void, Errno> DeadlineTimer::start() {
    // steady_clock counts CLOCK_MONOTONIC.
    _timer.reset(::timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK));
    if (!_timer)
        return std::unexpected(errno);
    const auto watch = _pool.add(shared_from_this(), _timer.get(), EPOLLIN);
    if (!watch)
        return std::unexpected(watch.error());
    _watch = *watch;
    return {};
}

void DeadlineTimer::stop() {
    if (_watch != WorkerPool::Watch::none)
        _pool.remove(std::exchange(_watch, WorkerPool::Watch::none), _timer.get());
    decltype(_deadlines) forgotten;
    const MutexLock lock(_mutex);
    forgotten.swap(_deadlines);
}

void DeadlineTimer::change(const std::shared_ptr<EventSource>& source, std::optional<Time> before,
                           std::optional<Time> after) {
    const MutexLock lock(_mutex);
    if (before)
        _deadlines.erase({*before, source.get()});
    if (!after)
        return;
    _deadlines.emplace(std::pair(*after, source.get()), source);
    if (!_armed || *after < *_armed)
        _armFor(*after);
}

void DeadlineTimer::_armFor(Time time) {
    const auto since = std::chrono::duration_cast<std::chrono::nanoseconds>(time.time_since_epoch()).count();
    constexpr std::int64_t second = 1'000'000'000;
    // All zero would disarm it.
    const auto nanoseconds = std::max<std::int64_t>(since, 1);
    const itimerspec when{.it_interval = {}, .it_value = {nanoseconds / second, nanoseconds % second}};
    OST_ASSERT(::timerfd_settime(_timer.get(), TFD_TIMER_ABSTIME, &when, nullptr) == 0);
    _armed = time;
}

void DeadlineTimer::serve(std::uint32_t /*events*/, std::span<char> /*scratch*/) {
    std::uint64_t expirations = 0;
    [[maybe_unused]] const auto count = ::read(_timer.get(), &expirations, sizeof expirations);
    std::vector<std::shared_ptr<EventSource>> expired;
    {
        const MutexLock lock(_mutex);
        const auto now = std::chrono::steady_clock::now();
        while (!_deadlines.empty() && _deadlines.begin()->first.first <= now)
            expired.push_back(std::move(_deadlines.extract(_deadlines.begin()).mapped()));
        _armed.reset();
        if (!_deadlines.empty())
            _armFor(_deadlines.begin()->first.first);
    }
    for (const auto& source : expired)
        _pool.post(source, deadlineEvent);
}

} // namespace ost::platform
