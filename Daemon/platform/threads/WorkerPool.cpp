#include "platform/threads/WorkerPool.h"

#include "platform/base/Assert.h"
#include "platform/base/Log.h"
#include "platform/threads/BlockingSection.h"
#include "platform/threads/ThreadName.h"
#include "platform/threads/TurnGroup.h"

#include <sys/epoll.h>
#include <sys/eventfd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <exception>
#include <thread>
#include <utility>

namespace ost::platform {

namespace {

/// What a request's work needs at the most, with room for sanitizers; thousands of threads may be blocked at a time.
constexpr std::size_t stackSize = 512 * 1024;
/// Room to receive many small requests, or a good part of a large one, with one call.
constexpr std::size_t scratchSize = 64 * 1024;
/// What a source that shares turns gets of it, so that its round stays short.
constexpr std::size_t scratchSizeWithTurns = 4 * 1024;
/// How often a source whose work does not end is served before others get their turn.
constexpr unsigned roundsInARow = 4;

constexpr std::uint64_t wakeKey = ~std::uint64_t{0};
/// More than can ever be read back, so that the eventfd stays readable for every thread.
constexpr std::uint64_t wakeEverybody = std::uint64_t{1} << 62;

/// The pool whose thread this is, and how many blocking sections it is inside.
thread_local WorkerPool* currentPool = nullptr;
thread_local unsigned blockingDepth = 0;
/// The group of the source that this thread serves.
thread_local TurnGroup* currentTurns = nullptr;

unsigned sharedThreadsFor(const WorkerPool::Options& options) {
    return options.sharedThreads > 0 ? options.sharedThreads : std::max(2U, std::thread::hardware_concurrency());
}

/// Signals are for the main thread, but for those that a fault of the thread itself raises.
sigset_t signalsOfOthers() {
    sigset_t signals;
    sigfillset(&signals);
    for (const int own : {SIGSEGV, SIGBUS, SIGFPE, SIGILL, SIGABRT, SIGTRAP, SIGSYS})
        sigdelset(&signals, own);
    return signals;
}

} // namespace

std::expected<std::unique_ptr<WorkerPool>, Errno> WorkerPool::create(std::string name, const Options& options) {
    FileDescriptor epoll(::epoll_create1(EPOLL_CLOEXEC));
    FileDescriptor wake(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK | EFD_SEMAPHORE));
    if (!epoll || !wake)
        return std::unexpected(errno);
    epoll_event event{.events = EPOLLIN, .data = {.u64 = wakeKey}};
    if (::epoll_ctl(epoll.get(), EPOLL_CTL_ADD, wake.get(), &event) != 0)
        return std::unexpected(errno);
    return std::unique_ptr<WorkerPool>(new WorkerPool(std::move(name), options, std::move(epoll), std::move(wake)));
}

WorkerPool::WorkerPool(std::string name, const Options& options, FileDescriptor epoll, FileDescriptor wake)
    : _name(std::move(name)), _target(sharedThreadsFor(options) + 1), _maximumThreads(options.sources + _target),
      _idleTime(options.idleTime), _epoll(std::move(epoll)), _wake(std::move(wake)), _slots(options.sources),
      _sharedThreads(sharedThreadsFor(options)) {
    // From the back, so that the first slots are the first to be used.
    for (auto index = static_cast<std::uint32_t>(options.sources); index-- > 0;)
        _freeSlots.push_back(index);
}

WorkerPool::~WorkerPool() { stop(std::nullopt); }

std::expected<void, Errno> WorkerPool::start() {
    for (unsigned started = 0; started < _target; ++started) {
        {
            const MutexLock lock(_mutex);
            ++_threads;
            ++_runningThreads;
        }
        if (const int error = _startThread(); error != 0 && started == 0)
            return std::unexpected(error);
    }
    return {};
}

bool WorkerPool::stop(std::optional<std::chrono::steady_clock::time_point> deadline) {
    OST_ASSERT(currentPool != this);
    MutexLock lock(_mutex);
    if (!_stopping.exchange(true)) {
        const std::uint64_t count = wakeEverybody;
        OST_ASSERT(::write(_wake.get(), &count, sizeof count) == sizeof count);
        _called.notifyAll();
    }
    const auto allEnded = [&]() OST_REQUIRES(_mutex) { return _threads == 0; };
    if (!deadline)
        _ended.wait(lock, allEnded);
    else if (!_ended.waitUntil(lock, *deadline, allEnded))
        return false;
    if (const auto last = std::exchange(_lastEnded, std::nullopt)) {
        lock.unlock();
        ::pthread_join(*last, nullptr);
    }
    return true;
}

// Threads

/// Starts a thread that is counted already, and takes it off the counts when that fails.
int WorkerPool::_startThread() {
    pthread_attr_t attributes;
    ::pthread_attr_init(&attributes);
    ::pthread_attr_setstacksize(&attributes, stackSize);
    const auto signals = signalsOfOthers();
    ::pthread_attr_setsigmask_np(&attributes, &signals);
    pthread_t thread{};
    const Errno error = ::pthread_create(&thread, &attributes, &_threadMain, this);
    ::pthread_attr_destroy(&attributes);
    if (error != 0) {
        logError("cannot start a thread of %@: %s", _name, error);
        const MutexLock lock(_mutex);
        --_threads;
        --_runningThreads;
        _ended.notifyAll();
    }
    return error;
}

void* WorkerPool::_threadMain(void* argument) {
    auto& pool = *static_cast<WorkerPool*>(argument);
    currentPool = &pool;
    setCurrentThreadName(pool._name);
    pool._waitAndServe();
    pool._endThread();
    return nullptr;
}

void WorkerPool::_waitAndServe() {
    const auto memory = std::make_unique_for_overwrite<char[]>(scratchSize);
    const std::span scratch(memory.get(), scratchSize);
    while (_mayGoOn()) {
        // One event at a time: a second one would wait for the work of the first although another thread is free.
        epoll_event event{};
        if (::epoll_wait(_epoll.get(), &event, 1, -1) != 1)
            continue;
        if (event.data.u64 == wakeKey)
            _servePosted(scratch);
        else
            _serveWatched(event.data.u64, event.events, scratch);
    }
}

/// Whether this thread waits for another event. One that is too many parks first. A thread that gets `false` is no
/// longer counted as running.
bool WorkerPool::_mayGoOn() {
    if (_runningThreads.load(std::memory_order_relaxed) <= _target && !_stopping.load(std::memory_order_relaxed))
        return true;
    MutexLock lock(_mutex);
    if (_stopping) {
        --_runningThreads;
        return false;
    }
    return _runningThreads <= _target || _park(lock);
}

/// Waits until the thread is needed again; false when it is not, for so long that it should end.
bool WorkerPool::_park(MutexLock& lock) {
    --_runningThreads;
    ++_parked;
    const bool woken = _called.waitFor(lock, _idleTime, [&]() OST_REQUIRES(_mutex) { return _calls > 0 || _stopping; });
    --_parked;
    if (!woken)
        return false;
    if (_calls > 0) {
        // The caller has counted this thread as running.
        --_calls;
        if (!_stopping)
            return true;
        --_runningThreads;
    }
    return false;
}

/// The last act of a thread. Each joins the one that ended before it, so that nobody else has to.
void WorkerPool::_endThread() {
    std::optional<pthread_t> previous;
    {
        const MutexLock lock(_mutex);
        previous = std::exchange(_lastEnded, ::pthread_self());
        if (--_threads == 0)
            _ended.notifyAll();
    }
    // From here on the pool may be gone.
    if (previous)
        ::pthread_join(*previous, nullptr);
}

void WorkerPool::_replaceBlockedThread() {
    {
        const MutexLock lock(_mutex);
        --_runningThreads;
        if (_stopping || _runningThreads >= _target)
            return;
        if (_parked > _calls) {
            ++_runningThreads;
            ++_calls;
            _called.notifyOne();
            return;
        }
        if (_threads >= _maximumThreads)
            return;
        ++_threads;
        ++_runningThreads;
    }
    [[maybe_unused]] const int error = _startThread();
}

void WorkerPool::_returnFromBlocking() {
    const MutexLock lock(_mutex);
    ++_runningThreads;
}

BlockingSection::BlockingSection(Turn turn) {
    if (!currentPool || blockingDepth++ > 0)
        return;
    currentPool->_replaceBlockedThread();
    if (!currentTurns)
        return;
    currentPool->_giveThreadBack();
    if (turn == Turn::giveAway) {
        _gaveTurnAway = true;
        currentPool->_giveTurnBack(*currentTurns);
    }
}

BlockingSection::~BlockingSection() {
    if (!currentPool || --blockingDepth > 0)
        return;
    if (_gaveTurnAway)
        currentTurns->takeAnyway();
    if (currentTurns)
        currentPool->_sharedThreads.takeAnyway();
    currentPool->_returnFromBlocking();
}

// Sources

std::expected<WorkerPool::Watch, Errno> WorkerPool::add(std::shared_ptr<EventSource> source, int fd,
                                                        std::uint32_t events) {
    std::uint32_t index = 0;
    {
        const MutexLock lock(_mutex);
        if (_freeSlots.empty())
            return std::unexpected(ENOSPC);
        index = _freeSlots.back();
        _freeSlots.pop_back();
    }
    auto& slot = _slots[index];
    Watch watch{};
    {
        const MutexLock lock(slot.mutex);
        slot.source = std::move(source);
        watch = static_cast<Watch>(std::uint64_t{slot.generation} << 32 | index);
    }
    epoll_event event{.events = events | EPOLLET, .data = {.u64 = static_cast<std::uint64_t>(watch)}};
    if (::epoll_ctl(_epoll.get(), EPOLL_CTL_ADD, fd, &event) != 0) {
        const int error = errno;
        remove(watch, -1);
        return std::unexpected(error);
    }
    return watch;
}

void WorkerPool::change(Watch watch, int fd, std::uint32_t events) {
    epoll_event event{.events = events | EPOLLET, .data = {.u64 = static_cast<std::uint64_t>(watch)}};
    OST_ASSERT(::epoll_ctl(_epoll.get(), EPOLL_CTL_MOD, fd, &event) == 0);
}

void WorkerPool::remove(Watch watch, int fd) {
    const auto index = static_cast<std::uint32_t>(watch);
    auto& slot = _slots[index];
    if (fd >= 0)
        OST_ASSERT(::epoll_ctl(_epoll.get(), EPOLL_CTL_DEL, fd, nullptr) == 0);
    std::shared_ptr<EventSource> source;
    {
        const MutexLock lock(slot.mutex);
        OST_ASSERT(slot.generation == static_cast<std::uint64_t>(watch) >> 32);
        // 2^32 - 1 would make the last slot's key the wake key.
        slot.generation = (slot.generation + 1) & 0x7fffffff;
        source = std::move(slot.source);
    }
    const MutexLock lock(_mutex);
    _freeSlots.push_back(index);
}

void WorkerPool::post(const std::shared_ptr<EventSource>& source, std::uint32_t events) {
    if ((source->_state.fetch_or(events | EventSource::_running) & EventSource::_running) == 0 && _mayRun(source))
        _enqueue(source);
}

/// Takes what a source that shares turns needs: one of its group, then one of the threads for such. One that does not
/// get both is kept, and served when it has them.
bool WorkerPool::_mayRun(const std::shared_ptr<EventSource>& source) {
    return !source->_turns || (source->_turns->take(source) && _sharedThreads.take(source));
}

void WorkerPool::_giveTurnBack(TurnGroup& turns) {
    if (auto next = turns.giveBack(); next && _sharedThreads.take(next))
        _enqueue(std::move(next));
}

void WorkerPool::_giveThreadBack() {
    if (auto next = _sharedThreads.giveBack())
        _enqueue(std::move(next));
}

void WorkerPool::_enqueue(std::shared_ptr<EventSource> source) {
    {
        const MutexLock lock(_postedMutex);
        _posted.push_back(std::move(source));
    }
    // Fails only once the pool stops and the count is huge; then nobody is to be woken.
    const std::uint64_t one = 1;
    [[maybe_unused]] const auto written = ::write(_wake.get(), &one, sizeof one);
}

void WorkerPool::_serveWatched(std::uint64_t watch, std::uint32_t events, std::span<char> scratch) {
    std::shared_ptr<EventSource> source;
    auto& slot = _slots[static_cast<std::uint32_t>(watch)];
    {
        const MutexLock lock(slot.mutex);
        if (slot.generation == watch >> 32)
            source = slot.source;
    }
    if (source && (source->_state.fetch_or(events | EventSource::_running) & EventSource::_running) == 0 &&
        _mayRun(source))
        _run(source, scratch);
}

void WorkerPool::_servePosted(std::span<char> scratch) {
    std::uint64_t one = 0;
    if (_stopping.load() || ::read(_wake.get(), &one, sizeof one) != sizeof one)
        return;
    std::shared_ptr<EventSource> source;
    {
        const MutexLock lock(_postedMutex);
        if (_posted.empty()) {
            OST_ASSERT(_stopping); // what was read belongs to the huge count
            return;
        }
        source = std::move(_posted.front());
        _posted.pop_front();
    }
    _run(source, scratch);
}

/// Serves a source whose running bit and turn this thread holds, until nothing is left to serve or its share is used
/// up.
void WorkerPool::_run(const std::shared_ptr<EventSource>& source, std::span<char> scratch) {
    const auto turns = source->_turns;
    currentTurns = turns.get();
    const unsigned rounds = turns ? 1 : roundsInARow;
    bool finished = false;
    for (unsigned round = 0; !finished && round < rounds && !_stopping.load(std::memory_order_relaxed); ++round) {
        const auto events = source->_state.exchange(EventSource::_running) & ~EventSource::_running;
        source->serve(events, turns ? scratch.first(scratchSizeWithTurns) : scratch);
        auto expected = EventSource::_running;
        finished = source->_state.compare_exchange_strong(expected, 0);
    }
    currentTurns = nullptr;
    if (turns) {
        _giveThreadBack();
        _giveTurnBack(*turns);
    }
    if (!finished && _mayRun(source))
        _enqueue(source);
}

} // namespace ost::platform
