#include "store/OSTLocks.h"

#include "platform/Assert.h"
#include "platform/BlockingSection.h"
#include "platform/Log.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <shared_mutex>
#include <thread>

namespace ost {

namespace {

/// The lock of one identifier.
struct LockRecord {
    std::shared_mutex lock;
    std::uint64_t refCount = 0;             ///< holders and waiters; guarded by the table's mutex
    std::atomic<std::int32_t> lockState{0}; ///< 0 free, -1 held for writing, n > 0 held by n readers
};

/// `mutex` guards every other field and the reference counts of the records.
struct LockTable {
    std::mutex mutex;
    std::condition_variable allWriterCondition;
    std::condition_variable allReaderCondition;
    std::condition_variable identifierWriterCondition;
    std::condition_variable identifierReaderCondition;
    std::map<std::string, std::unique_ptr<LockRecord>, std::less<>> identifierToLockMap;
    std::int32_t identifierReaderCount = 0; ///< identifier locks held or being acquired for reading
    std::int32_t identifierWriterCount = 0; ///< identifier locks held or being acquired for writing
    std::int32_t allReaderWriterState = 0;  ///< 0 free, -1 held for writing, n > 0 held by n readers
};

LockTable gOSTLocks;

/// The all-identifiers lock is not re-entrant: remembering the holder turns a deadlock into an assertion.
thread_local bool holdsAllIdentifiers = false;

/// A wrong order deadlocks only when two threads meet; this finds it whenever it is taken.
thread_local bool furtherLocksForbidden = false;

const char* nameOf(OSTLockKind kind) { return kind == OSTLockKind::writing ? "writing" : "reading"; }

/// How often a waiter looks again before it sleeps. A look-up holds the lock for a few microseconds, for less than it
/// takes to fall asleep and be woken; on a single processor nobody gives it back meanwhile.
const unsigned looksBeforeSleep = std::thread::hardware_concurrency() > 1 ? 16 : 0;

template<typename Predicate>
bool comesSoon(std::unique_lock<std::mutex>& lock, Predicate predicate) {
    for (unsigned look = 0; look < looksBeforeSleep; ++look) {
        lock.unlock();
        std::this_thread::yield();
        lock.lock();
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
void wait(std::condition_variable& condition, std::unique_lock<std::mutex>& lock, Predicate predicate) {
    if (predicate() || comesSoon(lock, predicate) || condition.wait_for(lock, shortWait, predicate))
        return;
    const platform::BlockingSection blocking;
    condition.wait(lock, predicate);
}

bool noIdentifierLocks() { return gOSTLocks.identifierReaderCount == 0 && gOSTLocks.identifierWriterCount == 0; }

void acquire(LockRecord& record, OSTLockKind kind) {
    if (kind == OSTLockKind::writing) {
        if (!record.lock.try_lock()) {
            const platform::BlockingSection blocking;
            record.lock.lock();
        }
        std::int32_t expected = 0;
        OST_ASSERT(record.lockState.compare_exchange_strong(expected, -1));
    } else {
        if (!record.lock.try_lock_shared()) {
            const platform::BlockingSection blocking;
            record.lock.lock_shared();
        }
        OST_ASSERT(++record.lockState > 0);
    }
}

/// Called with the table's mutex held. Releasing never waits, so it may happen under the mutex.
void release(LockRecord& record) {
    if (record.lockState == -1) {
        std::int32_t expected = -1;
        OST_ASSERT(record.lockState.compare_exchange_strong(expected, 0));
        OST_ASSERT(gOSTLocks.allReaderWriterState == 0);
        OST_ASSERT(gOSTLocks.identifierWriterCount > 0);
        --gOSTLocks.identifierWriterCount;
        if (noIdentifierLocks())
            gOSTLocks.allWriterCondition.notify_one();
        if (gOSTLocks.identifierWriterCount == 0)
            gOSTLocks.allReaderCondition.notify_all();
        record.lock.unlock();
    } else {
        OST_ASSERT(--record.lockState >= 0);
        OST_ASSERT(gOSTLocks.allReaderWriterState >= 0);
        OST_ASSERT(gOSTLocks.identifierReaderCount > 0);
        --gOSTLocks.identifierReaderCount;
        if (noIdentifierLocks() && gOSTLocks.allReaderWriterState == 0)
            gOSTLocks.allWriterCondition.notify_one();
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
    OST_ASSERT(!holdsAllIdentifiers);
    OST_ASSERT(!furtherLocksForbidden);
    LockRecord* record = nullptr;
    {
        std::unique_lock lock(gOSTLocks.mutex);
        if (kind == OSTLockKind::writing) {
            wait(gOSTLocks.identifierWriterCondition, lock, [] { return gOSTLocks.allReaderWriterState == 0; });
            ++gOSTLocks.identifierWriterCount;
        } else {
            wait(gOSTLocks.identifierReaderCondition, lock, [] { return gOSTLocks.allReaderWriterState != -1; });
            ++gOSTLocks.identifierReaderCount;
        }
        auto found = gOSTLocks.identifierToLockMap.find(identifier);
        if (found == gOSTLocks.identifierToLockMap.end())
            found = gOSTLocks.identifierToLockMap.emplace(identifier, std::make_unique<LockRecord>()).first;
        record = found->second.get();
        ++record->refCount;
    }
    platform::logDebug("Waiting to lock %@ for %s", identifier, nameOf(kind));
    acquire(*record, kind);
    platform::logDebug("Got lock on identifier %@", identifier);
}

void unlock_one_lock(std::string_view identifier) {
    const std::lock_guard lock(gOSTLocks.mutex);
    const auto found = gOSTLocks.identifierToLockMap.find(identifier);
    OST_ASSERT(found != gOSTLocks.identifierToLockMap.end());
    LockRecord& record = *found->second;
    OST_ASSERT(record.lockState != 0);
    release(record);
    --record.refCount;
    platform::logDebug("Unlocked identifier %@", identifier);
    if (record.refCount == 0) {
        platform::logDebug("Destroying lock for identifier %@", identifier);
        OST_ASSERT(0 == record.lockState);
        gOSTLocks.identifierToLockMap.erase(found);
    }
}

void _lock_identifier(std::vector<std::string_view> identifiers, OSTLockKind kind) {
    for (const auto identifier : distinct(std::move(identifiers), std::less<>()))
        take_one_lock(identifier, kind);
}

void unlock_identifier(std::vector<std::string_view> identifiers) {
    for (const auto identifier : distinct(std::move(identifiers), std::greater<>()))
        unlock_one_lock(identifier);
}

void _lock_all_identifiers(OSTLockKind kind) {
    OST_ASSERT(!holdsAllIdentifiers);
    OST_ASSERT(!furtherLocksForbidden);
    platform::logDebug("Waiting to lock all identifiers for %s", nameOf(kind));
    std::unique_lock lock(gOSTLocks.mutex);
    if (kind == OSTLockKind::writing) {
        wait(gOSTLocks.allWriterCondition, lock,
             [] { return noIdentifierLocks() && gOSTLocks.allReaderWriterState == 0; });
        gOSTLocks.allReaderWriterState = -1;
    } else {
        wait(gOSTLocks.allReaderCondition, lock,
             [] { return gOSTLocks.identifierWriterCount == 0 && gOSTLocks.allReaderWriterState != -1; });
        ++gOSTLocks.allReaderWriterState;
    }
    holdsAllIdentifiers = true;
    platform::logDebug("Locked all identifiers for %s", nameOf(kind));
}

void unlock_all_identifiers() {
    {
        const std::lock_guard lock(gOSTLocks.mutex);
        OST_ASSERT(holdsAllIdentifiers);
        holdsAllIdentifiers = false;
        if (gOSTLocks.allReaderWriterState == -1) {
            gOSTLocks.allReaderWriterState = 0;
            gOSTLocks.allWriterCondition.notify_one();
            gOSTLocks.allReaderCondition.notify_all();
            gOSTLocks.identifierWriterCondition.notify_all();
            gOSTLocks.identifierReaderCondition.notify_all();
        } else {
            OST_ASSERT(gOSTLocks.allReaderWriterState > 0);
            if (--gOSTLocks.allReaderWriterState == 0) {
                gOSTLocks.identifierWriterCondition.notify_all();
                if (noIdentifierLocks())
                    gOSTLocks.allWriterCondition.notify_one();
            }
        }
    }
    platform::logDebug("Unlocked all identifiers");
}

bool OSTHoldsAllIdentifiersLock() { return holdsAllIdentifiers; }

std::size_t OSTLockRecordCount() {
    const std::lock_guard lock(gOSTLocks.mutex);
    return gOSTLocks.identifierToLockMap.size();
}

OSTNoFurtherLocks::OSTNoFurtherLocks() {
    OST_ASSERT(!furtherLocksForbidden);
    furtherLocksForbidden = true;
}

OSTNoFurtherLocks::~OSTNoFurtherLocks() { furtherLocksForbidden = false; }

} // namespace ost
