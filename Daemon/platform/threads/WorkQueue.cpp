#include "platform/threads/WorkQueue.h"

#include "platform/base/Assert.h"
#include "platform/threads/ThreadName.h"

#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <vector>

namespace ost::platform {

namespace {

/// Lowers the calling thread alone: Linux keeps both priorities per thread. The disk priority is the lowest that still
/// makes progress; the idle class could hold a directory's lock for seconds while others keep the disk busy.
void takeBackgroundPriority() {
    constexpr int lowestNice = 19;
    constexpr int bestEffortClass = 2;
    constexpr int classShift = 13;
    constexpr int lowestLevel = 7;
    constexpr int callingThread = 1; // IOPRIO_WHO_PROCESS with id 0
    ::setpriority(PRIO_PROCESS, static_cast<id_t>(::gettid()), lowestNice);
    ::syscall(SYS_ioprio_set, callingThread, 0, (bestEffortClass << classShift) | lowestLevel);
}

/// Runs work and destroys it. Whatever it throws has nobody to go to.
void perform(WorkQueue::Work work) noexcept { work(); }

} // namespace

WorkQueue::WorkQueue(std::string label) : _label(std::move(label)) {}

WorkQueue::~WorkQueue() { stop(); }

void WorkQueue::async(Work work) {
    OST_ASSERT(work);
    const MutexLock lock(_mutex);
    if (_stopped)
        return;
    if (!_worker.joinable())
        _worker = std::thread([this] { _runWorker(); });
    _entries.push_back({std::move(work), nullptr});
    _wakeNext();
}

void WorkQueue::suspend() {
    const MutexLock lock(_mutex);
    ++_suspensions;
}

void WorkQueue::resume() {
    const MutexLock lock(_mutex);
    OST_ASSERT(_suspensions > 0);
    --_suspensions;
    _wakeNext();
}

void WorkQueue::setTargetBackgroundPriority() {
    const MutexLock lock(_mutex);
    OST_ASSERT(!_worker.joinable());
    _background = true;
}

void WorkQueue::abandon() {
    std::vector<Work> abandoned; // goes last and without the lock: what it holds may do anything when it is let go
    const MutexLock lock(_mutex);
    _stopped = true;
    for (auto& entry : _entries)
        if (!entry.waiter)
            abandoned.push_back(std::move(entry.work));
    std::erase_if(_entries, [](const Entry& entry) { return !entry.waiter; });
    _workerTurnCame.notifyOne();
    _wakeNext();
}

void WorkQueue::stop() {
    OST_ASSERT(!isCurrent());
    abandon();
    std::thread worker;
    {
        const MutexLock lock(_mutex);
        worker = std::move(_worker);
    }
    if (worker.joinable())
        worker.join();
}

void WorkQueue::_enter() {
    OST_ASSERT(!isCurrent());
    MutexLock lock(_mutex);
    if (!_mayBegin() || !_entries.empty()) {
        Waiter waiter;
        _entries.push_back({{}, &waiter});
        waiter.turnCame.wait(lock,
                             [&]() OST_REQUIRES(_mutex) { return _mayBegin() && _entries.front().waiter == &waiter; });
        _entries.pop_front();
    }
    _begin();
}

void WorkQueue::_leave() {
    const MutexLock lock(_mutex);
    _finish();
}

void WorkQueue::_runWorker() {
    setCurrentThreadName(_label);
    MutexLock lock(_mutex);
    if (_background)
        takeBackgroundPriority();
    while (true) {
        _workerTurnCame.wait(lock, [&]() OST_REQUIRES(_mutex) { return _stopped || _workerIsNext(); });
        if (_stopped)
            return;
        Work work = std::move(_entries.front().work);
        _entries.pop_front();
        _begin();
        lock.unlock();
        perform(std::move(work));
        lock.lock();
        _finish();
    }
}

void WorkQueue::_begin() {
    _busy = true;
    _owner.store(std::this_thread::get_id(), std::memory_order_relaxed);
}

void WorkQueue::_finish() {
    _busy = false;
    _owner.store({}, std::memory_order_relaxed);
    _wakeNext();
}

void WorkQueue::_wakeNext() {
    if (_entries.empty() || !_mayBegin())
        return;
    // Signalled under the lock: a waiter whose turn came is gone as soon as it can take the lock.
    auto* waiter = _entries.front().waiter;
    (waiter ? waiter->turnCame : _workerTurnCame).notifyOne();
}

} // namespace ost::platform
