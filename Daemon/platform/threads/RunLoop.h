#pragma once

#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"
#include "platform/base/Mutex.h"

#include <atomic>
#include <cstdint>
#include <expected>
#include <functional>
#include <memory>
#include <thread>
#include <unordered_map>
#include <utility>
#include <vector>

namespace ost::platform {

/// The run loop of one thread, which is also that thread's work queue: handlers of descriptors and enqueued work run on
/// it one at a time.
///
/// Threads: the loop belongs to the thread that created it. `async` and `stop` may be called from any thread,
/// everything else from the loop's own.
class RunLoop {
public:
    using Work = std::move_only_function<void()>;
    /// Gets the epoll events that are due.
    using Handler = std::move_only_function<void(std::uint32_t events)>;

    /// A descriptor that the loop listens to for as long as this object lives. Move-only. May be destroyed by any
    /// handler, its own included, and must be before the loop.
    class Source {
    public:
        Source() noexcept = default;
        Source(Source&& other) noexcept : _loop(std::exchange(other._loop, nullptr)), _id(other._id) {}
        Source& operator=(Source&& other) noexcept;
        Source(const Source&) = delete;
        Source& operator=(const Source&) = delete;
        ~Source() { remove(); }

        /// Listens for other epoll events from now on; 0 pauses the source.
        void setEvents(std::uint32_t events);
        void remove() noexcept;

    private:
        friend class RunLoop;
        Source(RunLoop& loop, std::uint64_t id) noexcept : _loop(&loop), _id(id) {}

        RunLoop* _loop = nullptr;
        std::uint64_t _id = 0;
    };

    /// Fails with the errno of a missing descriptor.
    [[nodiscard]] static std::expected<std::unique_ptr<RunLoop>, Errno> create();
    RunLoop(const RunLoop&) = delete;
    RunLoop& operator=(const RunLoop&) = delete;

    /// Calls `handler` whenever `fd` has one of `events` (level-triggered). `fd` stays its owner's and must not be
    /// closed before the source is removed. Fails with the errno of epoll.
    [[nodiscard]] std::expected<Source, Errno> addSource(int fd, std::uint32_t events, Handler handler);

    /// Runs `work` on the loop's thread, in order. Work that the loop no longer comes to is destroyed with the loop.
    void async(Work work);

    /// Serves until `stop`; returns at once when `stop` came first. What a handler throws leaves `run`.
    void run();
    void stop();

private:
    struct Registration {
        int fd;
        Handler handler;
    };

    RunLoop(FileDescriptor epoll, FileDescriptor wakeUp) : _epoll(std::move(epoll)), _wakeUp(std::move(wakeUp)) {}

    void _wake();
    void _runWork();
    void _serve(std::uint64_t id, std::uint32_t events);
    void _setEvents(std::uint64_t id, std::uint32_t events);
    void _remove(std::uint64_t id) noexcept;

    const FileDescriptor _epoll;
    const FileDescriptor _wakeUp;
    const std::thread::id _thread = std::this_thread::get_id();

    // Of the loop's thread alone. Sources go by numbers that are never used twice, so an event that was fetched before
    // its source was removed finds nobody, even when the descriptor has a new owner.
    std::unordered_map<std::uint64_t, std::shared_ptr<Registration>> _sources;
    std::uint64_t _lastId = 0;

    std::atomic<bool> _stopping = false;

    Mutex _mutex;
    std::vector<Work> _work OST_GUARDED_BY(_mutex);
};

} // namespace ost::platform
