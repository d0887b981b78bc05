#include "store/OSTLocks.h"

#include "platform/base/Assert.h"
#include "platform/base/Log.h"
#include "platform/base/Mutex.h"
#include "platform/threads/BlockingSection.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <shared_mutex>
#include <source_location>
#include <thread>

namespace ost {

namespace {

platform::Mutex tableMutex;

/// The lock of one identifier.
struct LockRecord {
    std::shared_mutex lock;
    std::uint64_t refCount OST_GUARDED_BY(tableMutex) = 0; ///< holders and waiters
    std::atomic<std::int32_t> lockState{0};                ///< 0 free, -1 held for writing, n > 0 held by n readers
};

struct LockTable {
    platform::Condition allWriterCondition;
    platform::Condition allReaderCondition;
    platform::Condition identifierWriterCondition;
    platform::Condition identifierReaderCondition;
    std::map<std::string, std::unique_ptr<LockRecord>, std::less<>> identifierToLockMap;
    std::int32_t identifierReaderCount = 0; ///< identifier locks held or being acquired for reading
    std::int32_t identifierWriterCount = 0; ///< identifier locks held or being acquired for writing
    std::int32_t allReaderWriterState = 0;  ///< 0 free, -1 held for writing, n > 0 held by n readers
    std::uint64_t allWriterTurns = 0;       ///< how often it was taken for writing
};

LockTable gOSTLocks OST_GUARDED_BY(tableMutex);

/// How many wait to take the all-identifiers lock for writing. Written under the mutex; one who holds an identifier
/// lock looks without it.
std::atomic<std::int32_t> allWritersWaiting{0};

/// The all-identifiers lock is not re-entrant: remembering what the thread holds turns a deadlock into an assertion.
thread_local std::optional<OSTLockKind> heldOfAllIdentifiers;

/// A wrong order deadlocks only when two threads meet; this finds it whenever it is taken.
thread_local bool furtherLocksForbidden = false;

/// An assertion of one of the lock functions, by whose name it goes.
void check(bool holds, const char* condition, std::source_location function) {
    if (!holds)
        platform::assertionFailed(condition, function);
}

const char* nameOf(OSTLockKind kind) { return kind == OSTLockKind::writing ? "writing" : "reading"; }

/// How often a waiter looks again before it sleeps. A look-up holds the lock for a few microseconds, for less than it
/// takes to fall asleep and be woken. At first the holder is taken to run on another processor, then to wait for this
/// one; on a single processor nobody gives the lock back meanwhile.
const unsigned looksBeforeSleep = std::thread::hardware_concurrency() > 1 ? 24 : 0;
constexpr unsigned looksBeforeYield = 8;
constexpr unsigned pausesInALook = 8;

void pauseBeforeLook(unsigned look) {
    if (look >= looksBeforeYield)
        return std::this_thread::yield();
    for (unsigned pause = 0; pause < pausesInALook; ++pause)
#if defined(__x86_64__)
        __builtin_ia32_pause();
#elif defined(__aarch64__)
        asm volatile("yield");
#else
        std::atomic_signal_fence(std::memory_order_seq_cst);
#endif
}

template<typename Predicate>
bool comesSoon(Predicate predicate) OST_REQUIRES(tableMutex) {
    for (unsigned look = 0; look < looksBeforeSleep; ++look) {
        tableMutex.unlock();
        pauseBeforeLook(look);
        tableMutex.lock();
        if (predicate())
            return true;
    }
    return false;
}

/// How long a waiter may keep its worker to itself: longer than a look-up holds the lock, so that a busy daemon does
/// not wake one worker after another only to see them wait too.
constexpr std::chrono::microseconds shortWait{500};

/// Waits for `condition`; a wait that is no longer short does not keep a listener's worker from serving others.
template<typename Predicate>
void wait(platform::Condition& condition, platform::MutexLock& lock, Predicate predicate) OST_REQUIRES(tableMutex) {
    if (predicate() || comesSoon(predicate) || condition.waitFor(lock, shortWait, predicate))
        return;
    const platform::BlockingSection blocking(platform::BlockingSection::Turn::keep);
    condition.wait(lock, predicate);
}

bool noIdentifierLocks() OST_REQUIRES(tableMutex) {
    return gOSTLocks.identifierReaderCount == 0 && gOSTLocks.identifierWriterCount == 0;
}

/// Look-ups follow each other so closely that a writer who waited for a moment without readers might wait for ever:
/// while readers are all that one waits for, no further reader joins them.
bool writerComesFirst() OST_REQUIRES(tableMutex) {
    return allWritersWaiting > 0 && gOSTLocks.allReaderWriterState > 0 && noIdentifierLocks();
}

void acquire(LockRecord& record, OSTLockKind kind, std::source_location function) {
    if (kind == OSTLockKind::writing) {
        if (!record.lock.try_lock()) {
            const platform::BlockingSection blocking;
            record.lock.lock();
        }
        std::int32_t expected = 0;
        check(record.lockState.compare_exchange_strong(expected, -1),
              "AtomicCompareAndSwap32Barrier(0, -1, &lockPtr->lockState)", function);
    } else {
        if (!record.lock.try_lock_shared()) {
            const platform::BlockingSection blocking;
            record.lock.lock_shared();
        }
        check(++record.lockState > 0, "AtomicIncrement32Barrier(&lockPtr->lockState) > 0", function);
    }
}

/// Releasing never waits, so it may happen under the mutex.
void release(LockRecord& record, std::source_location function) OST_REQUIRES(tableMutex) {
    if (record.lockState == -1) {
        std::int32_t expected = -1;
        check(record.lockState.compare_exchange_strong(expected, 0),
              "AtomicCompareAndSwap32Barrier(-1, 0, &lockPtr->lockState)", function);
        check(gOSTLocks.allReaderWriterState == 0, "gOSTLocks.allReaderWriterState == 0", function);
        check(gOSTLocks.identifierWriterCount > 0, "gOSTLocks.identifierWriterCount > 0", function);
        --gOSTLocks.identifierWriterCount;
        if (noIdentifierLocks())
            gOSTLocks.allWriterCondition.notifyOne();
        if (gOSTLocks.identifierWriterCount == 0)
            gOSTLocks.allReaderCondition.notifyAll();
        record.lock.unlock();
    } else {
        check(--record.lockState >= 0, "AtomicDecrement32Barrier(&lockPtr->lockState) >= 0", function);
        check(gOSTLocks.allReaderWriterState >= 0, "gOSTLocks.allReaderWriterState >= 0", function);
        check(gOSTLocks.identifierReaderCount > 0, "gOSTLocks.identifierReaderCount > 0", function);
        --gOSTLocks.identifierReaderCount;
        if (noIdentifierLocks() && gOSTLocks.allReaderWriterState == 0)
            gOSTLocks.allWriterCondition.notifyOne();
        record.lock.unlock_shared();
    }
}

template<typename Compare>
std::vector<std::string_view> distinct(std::vector<std::string_view> identifiers, Compare compare) {
    std::sort(identifiers.begin(), identifiers.end(), compare);
    identifiers.erase(std::unique(identifiers.begin(), identifiers.end()), identifiers.end());
    return identifiers;
}

} // namespace

void take_one_lock(std::string_view identifier, OSTLockKind kind) {
    // Readers of one identifier and of all identifiers go together.
    OST_ASSERT(!heldOfAllIdentifiers || (heldOfAllIdentifiers == OSTLockKind::reading && kind == OSTLockKind::reading));
    OST_ASSERT(!furtherLocksForbidden);
    LockRecord* record = nullptr;
    {
        platform::MutexLock lock(tableMutex);
        auto& count = kind == OSTLockKind::writing ? gOSTLocks.identifierWriterCount : gOSTLocks.identifierReaderCount;
        if (kind == OSTLockKind::writing)
            wait(gOSTLocks.identifierWriterCondition, lock,
                 []() OST_REQUIRES(tableMutex) { return gOSTLocks.allReaderWriterState == 0; });
        else
            wait(gOSTLocks.identifierReaderCondition, lock,
                 []() OST_REQUIRES(tableMutex) { return gOSTLocks.allReaderWriterState != -1; });
        auto found = gOSTLocks.identifierToLockMap.find(identifier);
        if (found == gOSTLocks.identifierToLockMap.end())
            found = gOSTLocks.identifierToLockMap.emplace(identifier, std::make_unique<LockRecord>()).first;
        record = found->second.get();
        // Nothing fails from here on, so what is counted is also given back.
        ++count;
        ++record->refCount;
    }
    platform::logDebug("Waiting to lock %@ for %s", identifier, nameOf(kind));
    acquire(*record, kind, std::source_location::current());
    platform::logDebug("Got lock on identifier %@", identifier);
}

void unlock_one_lock(std::string_view identifier) {
    const auto here = std::source_location::current();
    const platform::MutexLock lock(tableMutex);
    const auto found = gOSTLocks.identifierToLockMap.find(identifier);
    check(found != gOSTLocks.identifierToLockMap.end(), "lockPtr", here);
    LockRecord& record = *found->second;
    check(record.lockState != 0, "lockPtr->lockState != 0", here);
    release(record, here);
    --record.refCount;
    platform::logDebug("Unlocked identifier %@", identifier);
    if (record.refCount == 0) {
        platform::logDebug("Destroying lock for identifier %@", identifier);
        check(record.lockState == 0, "0 == lockPtr->lockState", here);
        gOSTLocks.identifierToLockMap.erase(found);
    }
}

void _lock_identifier(std::vector<std::string_view> identifiers, OSTLockKind kind) {
    const auto inOrder = distinct(std::move(identifiers), std::less<>());
    std::size_t taken = 0;
    try {
        for (; taken < inOrder.size(); ++taken)
            take_one_lock(inOrder[taken], kind);
    } catch (...) {
        while (taken > 0)
            unlock_one_lock(inOrder[--taken]);
        throw;
    }
}

void unlock_identifier(std::vector<std::string_view> identifiers) {
    for (const auto identifier : distinct(std::move(identifiers), std::greater<>()))
        unlock_one_lock(identifier);
}

void _lock_all_identifiers(OSTLockKind kind) {
    OST_ASSERT(!heldOfAllIdentifiers);
    OST_ASSERT(!furtherLocksForbidden);
    platform::logDebug("Waiting to lock all identifiers for %s", nameOf(kind));
    platform::MutexLock lock(tableMutex);
    if (kind == OSTLockKind::writing) {
        ++allWritersWaiting;
        wait(gOSTLocks.allWriterCondition, lock,
             []() OST_REQUIRES(tableMutex) { return noIdentifierLocks() && gOSTLocks.allReaderWriterState == 0; });
        --allWritersWaiting;
        gOSTLocks.allReaderWriterState = -1;
        ++gOSTLocks.allWriterTurns;
    } else {
        wait(gOSTLocks.allReaderCondition, lock, []() OST_REQUIRES(tableMutex) {
            return gOSTLocks.identifierWriterCount == 0 && gOSTLocks.allReaderWriterState != -1 && !writerComesFirst();
        });
        ++gOSTLocks.allReaderWriterState;
    }
    heldOfAllIdentifiers = kind;
    platform::logDebug("Locked all identifiers for %s", nameOf(kind));
}

void unlock_all_identifiers() {
    {
        const platform::MutexLock lock(tableMutex);
        check(gOSTLocks.allReaderWriterState != 0, "gOSTLocks.allReaderWriterState > 0",
              std::source_location::current());
        OST_ASSERT(heldOfAllIdentifiers);
        heldOfAllIdentifiers.reset();
        if (gOSTLocks.allReaderWriterState == -1) {
            gOSTLocks.allReaderWriterState = 0;
            gOSTLocks.allWriterCondition.notifyOne();
            gOSTLocks.allReaderCondition.notifyAll();
            gOSTLocks.identifierWriterCondition.notifyAll();
            gOSTLocks.identifierReaderCondition.notifyAll();
        } else {
            if (--gOSTLocks.allReaderWriterState == 0) {
                gOSTLocks.identifierWriterCondition.notifyAll();
                if (noIdentifierLocks())
                    gOSTLocks.allWriterCondition.notifyOne();
                gOSTLocks.allReaderCondition.notifyAll();
            }
        }
    }
    platform::logDebug("Unlocked all identifiers");
}

bool OSTGiveWayToAllIdentifiersWriter(const std::vector<std::string_view>& identifiers, OSTLockKind kind) {
    if (allWritersWaiting.load(std::memory_order_relaxed) == 0)
        return false;
    std::uint64_t before = 0;
    {
        const platform::MutexLock lock(tableMutex);
        before = gOSTLocks.allWriterTurns;
    }
    unlock_identifier(identifiers);
    {
        // Nobody stops waiting before his turn, and he tells readers when it is over.
        platform::MutexLock lock(tableMutex);
        wait(gOSTLocks.identifierReaderCondition, lock,
             [&]() OST_REQUIRES(tableMutex) { return gOSTLocks.allWriterTurns != before; });
    }
    _lock_identifier(identifiers, kind);
    return true;
}

bool OSTHoldsAllIdentifiersLock() { return heldOfAllIdentifiers == OSTLockKind::writing; }

std::size_t OSTLockRecordCount() {
    const platform::MutexLock lock(tableMutex);
    return gOSTLocks.identifierToLockMap.size();
}

OSTNoFurtherLocks::OSTNoFurtherLocks() {
    OST_ASSERT(!furtherLocksForbidden);
    furtherLocksForbidden = true;
}

OSTNoFurtherLocks::~OSTNoFurtherLocks() { furtherLocksForbidden = false; }

} // namespace ost
