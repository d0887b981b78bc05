#pragma once

#include "platform/base/Mutex.h"

#include <atomic>
#include <deque>
#include <functional>
#include <string>
#include <thread>
#include <type_traits>
#include <utility>

namespace ost::platform {

/// A serial work queue: pieces of work run one at a time, in the order in which they came.
///
/// Threads: every function may be called from any thread. Asynchronous work runs on one thread of the queue's own, made
/// when the first such work comes; synchronous work runs on its caller's thread when its turn has come, so that a queue
/// nobody else uses costs `sync` no more than a mutex. Invariants: at most one piece of work runs at a time; none
/// begins while the queue is suspended.
class WorkQueue {
public:
    using Work = std::move_only_function<void()>;

    /// `label` is the full name of the queue and of its thread.
    explicit WorkQueue(std::string label);
    WorkQueue(const WorkQueue&) = delete;
    WorkQueue& operator=(const WorkQueue&) = delete;

    /// Stops the queue. No thread may be inside `sync` any more.
    ~WorkQueue();

    [[nodiscard]] const std::string& label() const noexcept { return _label; }

    /// Runs `work` on the queue's thread after everything enqueued before it. `work` is destroyed in its turn, right
    /// after it has run. An exception that leaves it ends the process. A stopped queue drops `work` at once.
    void async(Work work);

    /// Runs `work` on the calling thread, in its turn, and returns its result or passes its exception on. Waits while
    /// the queue is suspended. Must not be called from work of this same queue.
    template<std::invocable Callable>
    std::invoke_result_t<Callable> sync(Callable&& work) {
        const Turn turn(*this);
        return std::invoke(std::forward<Callable>(work));
    }

    /// Lets no further work begin until `resume` has been called as often as `suspend`. Does not wait for work that
    /// runs.
    void suspend();
    /// Requires a `suspend` that has not been resumed yet.
    void resume();

    /// True inside work of this queue, asynchronous or synchronous.
    [[nodiscard]] bool isCurrent() const noexcept {
        return _owner.load(std::memory_order_relaxed) == std::this_thread::get_id();
    }

    /// Gives asynchronous work the lowest processor and disk priority. Must come before the first `async`.
    void setTargetBackgroundPriority();

    /// Abandons asynchronous work that has not begun, and waits for nothing. From then on asynchronous work is dropped,
    /// while `sync` goes on excluding and no longer heeds suspension.
    void abandon();
    /// The same, and waits for the work that runs. Must not be called from work of this same queue.
    void stop();

private:
    /// One thread inside `sync` that waits for its turn.
    struct Waiter {
        Condition turnCame;
    };
    /// Work, or the thread that waits to run its own.
    struct Entry {
        Work work;
        Waiter* waiter;
    };
    class Turn {
    public:
        explicit Turn(WorkQueue& queue) : _queue(queue) { _queue._enter(); }
        Turn(const Turn&) = delete;
        Turn& operator=(const Turn&) = delete;
        ~Turn() { _queue._leave(); }

    private:
        WorkQueue& _queue;
    };

    void _enter();
    void _leave();
    void _runWorker();

    [[nodiscard]] bool _mayBegin() const OST_REQUIRES(_mutex) { return !_busy && (_suspensions == 0 || _stopped); }
    [[nodiscard]] bool _workerIsNext() const OST_REQUIRES(_mutex) {
        return _mayBegin() && !_entries.empty() && !_entries.front().waiter;
    }
    void _begin() OST_REQUIRES(_mutex);
    void _finish() OST_REQUIRES(_mutex);
    void _wakeNext() OST_REQUIRES(_mutex);

    const std::string _label;
    /// The thread whose work runs. A thread that compares it with itself needs no lock: only it sets and clears itself.
    std::atomic<std::thread::id> _owner{};

    Mutex _mutex;
    Condition _workerTurnCame;
    std::deque<Entry> _entries OST_GUARDED_BY(_mutex);
    std::thread _worker OST_GUARDED_BY(_mutex);
    unsigned _suspensions OST_GUARDED_BY(_mutex) = 0;
    bool _busy OST_GUARDED_BY(_mutex) = false;
    bool _stopped OST_GUARDED_BY(_mutex) = false;
    bool _background OST_GUARDED_BY(_mutex) = false;
};

} // namespace ost::platform
