#pragma once

#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>

// What the compiler checks when it is clang: a member that is guarded is used only where its mutex is held, and a
// function that requires a mutex is called only there.
#if defined(__clang__)
#define OST_THREAD_ATTRIBUTE(attribute) __attribute__((attribute))
#else
#define OST_THREAD_ATTRIBUTE(attribute)
#endif

#define OST_CAPABILITY(name) OST_THREAD_ATTRIBUTE(capability(name))
#define OST_SCOPED_CAPABILITY OST_THREAD_ATTRIBUTE(scoped_lockable)
#define OST_GUARDED_BY(mutex) OST_THREAD_ATTRIBUTE(guarded_by(mutex))
#define OST_REQUIRES(...) OST_THREAD_ATTRIBUTE(requires_capability(__VA_ARGS__))
#define OST_EXCLUDES(...) OST_THREAD_ATTRIBUTE(locks_excluded(__VA_ARGS__))
#define OST_ACQUIRE(...) OST_THREAD_ATTRIBUTE(acquire_capability(__VA_ARGS__))
#define OST_RELEASE(...) OST_THREAD_ATTRIBUTE(release_capability(__VA_ARGS__))
#define OST_TRY_ACQUIRE(...) OST_THREAD_ATTRIBUTE(try_acquire_capability(__VA_ARGS__))
#define OST_ASSERT_CAPABILITY(...) OST_THREAD_ATTRIBUTE(assert_capability(__VA_ARGS__))
#define OST_NO_THREAD_ANALYSIS OST_THREAD_ATTRIBUTE(no_thread_safety_analysis)

namespace ost::platform {

/// A mutex of the standard library that the compiler knows by name. Taken through `MutexLock`.
template<typename Standard>
class OST_CAPABILITY("mutex") AnnotatedMutex {
public:
    AnnotatedMutex() = default;
    AnnotatedMutex(const AnnotatedMutex&) = delete;
    AnnotatedMutex& operator=(const AnnotatedMutex&) = delete;

    void lock() OST_ACQUIRE() { _mutex.lock(); }
    void unlock() OST_RELEASE() { _mutex.unlock(); }
    [[nodiscard]] bool try_lock() OST_TRY_ACQUIRE(true) { return _mutex.try_lock(); }

private:
    template<typename>
    friend class BasicMutexLock;

    Standard _mutex;
};

using Mutex = AnnotatedMutex<std::mutex>;
using RecursiveMutex = AnnotatedMutex<std::recursive_mutex>;

/// Holds a mutex from construction to destruction, but for the time between `unlock` and `lock`.
template<typename Standard>
class OST_SCOPED_CAPABILITY BasicMutexLock {
public:
    explicit BasicMutexLock(AnnotatedMutex<Standard>& mutex) OST_ACQUIRE(mutex) : _lock(mutex._mutex) {}
    /// Takes over a mutex that the caller holds.
    BasicMutexLock(AnnotatedMutex<Standard>& mutex, std::adopt_lock_t held) OST_REQUIRES(mutex)
        : _lock(mutex._mutex, held) {}
    BasicMutexLock(const BasicMutexLock&) = delete;
    BasicMutexLock& operator=(const BasicMutexLock&) = delete;
    ~BasicMutexLock() OST_RELEASE() = default;

    void lock() OST_ACQUIRE() { _lock.lock(); }
    void unlock() OST_RELEASE() { _lock.unlock(); }

private:
    friend class Condition;

    std::unique_lock<Standard> _lock;
};

template<typename Standard>
BasicMutexLock(AnnotatedMutex<Standard>&) -> BasicMutexLock<Standard>;

using MutexLock = BasicMutexLock<std::mutex>;

/// A condition variable. A predicate is called with the mutex held; it says so itself, with `OST_REQUIRES`.
class Condition {
public:
    void notifyOne() { _condition.notify_one(); }
    void notifyAll() { _condition.notify_all(); }

    template<std::predicate Predicate>
    void wait(MutexLock& lock, Predicate predicate) {
        _condition.wait(lock._lock, std::ref(predicate));
    }
    /// False when the time is over and `predicate` does not hold.
    template<std::predicate Predicate>
    [[nodiscard]] bool waitFor(MutexLock& lock, std::chrono::nanoseconds time, Predicate predicate) {
        return _condition.wait_for(lock._lock, time, std::ref(predicate));
    }
    template<std::predicate Predicate>
    [[nodiscard]] bool waitUntil(MutexLock& lock, std::chrono::steady_clock::time_point deadline, Predicate predicate) {
        return _condition.wait_until(lock._lock, deadline, std::ref(predicate));
    }

private:
    std::condition_variable _condition;
};

} // namespace ost::platform
