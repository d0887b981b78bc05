#pragma once

#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"
#include "platform/base/Mutex.h"
#include "platform/threads/EventSource.h"
#include "platform/threads/TurnGroup.h"

#include <pthread.h>

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <expected>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

namespace ost::platform {

/// Threads that wait for descriptors and serve what they find themselves, without handing it to another thread.
///
/// As many threads as there are processors serve sources that share turns. One more runs, so that the others never wait
/// for one of these, which the system may have set aside. A thread that enters a `BlockingSection` is replaced for that
/// long by a parked or a new one; those that are then too many park when they have finished, and end when nobody needs
/// them for a while.
///
/// A source is watched edge-triggered and registered once; an event that arrives while its source is being served is
/// remembered in the source. One that is still not finished after some rounds goes to the end of a queue, so no source
/// can keep the others waiting. Sources that share turns are served only as many at a time as there are turns.
///
/// Threads: any may call. Destroying the pool stops it and waits for every thread.
class WorkerPool {
public:
    struct Options {
        std::size_t sources;        ///< most descriptors watched at a time
        unsigned sharedThreads = 0; ///< that serve sources with turns; 0: one for each processor, and at least 2
        std::chrono::milliseconds idleTime = std::chrono::seconds(5); ///< how long a parked thread stays
    };

    /// Fails with an errno when the kernel has no descriptors left for it. `name` becomes the name of the threads.
    [[nodiscard]] static std::expected<std::unique_ptr<WorkerPool>, Errno> create(std::string name,
                                                                                  const Options& options);
    ~WorkerPool();
    WorkerPool(const WorkerPool&) = delete;
    WorkerPool& operator=(const WorkerPool&) = delete;

    /// Starts the threads. Fails with an errno when not even one can be started.
    [[nodiscard]] std::expected<void, Errno> start();

    /// Lets no source be served any more and waits until every thread has ended, at most until `deadline`. Gives
    /// whether all have. Not from a thread of the pool.
    bool stop(std::optional<std::chrono::steady_clock::time_point> deadline);
    /// Whether `stop` has been called: a source that has more to do leaves it.
    [[nodiscard]] bool isStopping() const { return _stopping.load(std::memory_order_relaxed); }

    /// Names a watched descriptor.
    enum class Watch : std::uint64_t { none = ~std::uint64_t{0} };

    /// Watches `fd` for the epoll `events` and serves `source` when they occur; keeps `source` until `remove`.
    [[nodiscard]] std::expected<Watch, Errno> add(std::shared_ptr<EventSource> source, int fd, std::uint32_t events);
    /// Watches for other events; those that are there already are reported at once.
    void change(Watch watch, int fd, std::uint32_t events);
    /// Ends a watch and lets go of its source. Events that a thread has already taken are still served.
    void remove(Watch watch, int fd);

    /// Serves `source` with `events` soon.
    void post(const std::shared_ptr<EventSource>& source, std::uint32_t events);

private:
    friend class BlockingSection;

    struct Slot {
        Mutex mutex;
        /// Grows at each removal, so that late events find nobody.
        std::uint32_t generation OST_GUARDED_BY(mutex) = 0;
        std::shared_ptr<EventSource> source OST_GUARDED_BY(mutex);
    };

    WorkerPool(std::string name, const Options& options, FileDescriptor epoll, FileDescriptor wake);

    static void* _threadMain(void* pool);
    [[nodiscard]] int _startThread();
    void _waitAndServe();
    [[nodiscard]] bool _mayGoOn();
    [[nodiscard]] bool _park(MutexLock& lock) OST_REQUIRES(_mutex);
    void _endThread();
    void _replaceBlockedThread();
    void _returnFromBlocking();

    void _serveWatched(std::uint64_t watch, std::uint32_t events, std::span<char> scratch);
    void _servePosted(std::span<char> scratch);
    void _run(const std::shared_ptr<EventSource>& source, std::span<char> scratch);
    [[nodiscard]] bool _mayRun(const std::shared_ptr<EventSource>& source);
    void _giveTurnBack(TurnGroup& turns);
    void _giveThreadBack();
    void _enqueue(std::shared_ptr<EventSource> source);

    // Constant after construction.
    const std::string _name;
    const unsigned _target; ///< threads that should run
    const std::size_t _maximumThreads;
    const std::chrono::milliseconds _idleTime;
    const FileDescriptor _epoll;
    const FileDescriptor _wake; ///< an eventfd: its count is the length of _posted, or huge once the pool stops

    // Own locking.
    std::vector<Slot> _slots;
    TurnGroup _sharedThreads;                 ///< turns of all sources that share turns
    std::atomic<unsigned> _runningThreads{0}; ///< neither parked nor blocked; written under _mutex
    std::atomic<bool> _stopping{false};       ///< written under _mutex

    Mutex _mutex;
    Condition _called; ///< a parked thread is called up, or the pool stops
    Condition _ended;  ///< the last thread has ended
    std::size_t _threads OST_GUARDED_BY(_mutex) = 0;
    std::size_t _parked OST_GUARDED_BY(_mutex) = 0;
    /// Parked threads that are called up and have not woken yet.
    std::size_t _calls OST_GUARDED_BY(_mutex) = 0;
    /// Joined by the next thread that ends, or by `stop`.
    std::optional<pthread_t> _lastEnded OST_GUARDED_BY(_mutex);
    std::vector<std::uint32_t> _freeSlots OST_GUARDED_BY(_mutex);

    Mutex _postedMutex;
    std::deque<std::shared_ptr<EventSource>> _posted OST_GUARDED_BY(_postedMutex);
};

} // namespace ost::platform
