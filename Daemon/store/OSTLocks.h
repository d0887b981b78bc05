#pragma once

#include "platform/base/Assert.h"

#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace ost {

/// Reader/writer locks on identifiers, and one daemon-wide reader/writer lock on all of them.
///
/// | held by another thread         | keeps out                                         |
/// |--------------------------------|---------------------------------------------------|
/// | all identifiers, for writing   | everybody                                         |
/// | all identifiers, for reading   | writers of all identifiers and of any identifier  |
/// | one identifier, for writing    | readers and writers of it and of all identifiers  |
/// | one identifier, for reading    | writers of it and of all identifiers              |
///
/// No lock is re-entrant. A holder of the all-identifiers lock may take an identifier lock only to read both.
///
/// Order: identifiers of one call are taken in ascending order, so that two callers cannot wait for each other. The
/// code-signing mapping's queue comes after the locks: its work runs under `OSTNoFurtherLocks`.
///
/// Threads: any. Misuse stops the process: unlocking what is not locked, taking the all-identifiers lock twice, taking
/// a lock where that is forbidden. Code takes the locks through the guards below, which are made of the functions.
enum class OSTLockKind : bool { reading, writing };

void take_one_lock(std::string_view identifier, OSTLockKind kind);
void unlock_one_lock(std::string_view identifier);

/// Takes the lock of each identifier, each distinct one once.
void _lock_identifier(std::vector<std::string_view> identifiers, OSTLockKind kind);
void unlock_identifier(std::vector<std::string_view> identifiers);

void _lock_all_identifiers(OSTLockKind kind);
/// Releases the all-identifiers lock, of either kind.
void unlock_all_identifiers();

/// Releases the locks of these identifiers for the turn of one who waits to take the all-identifiers lock for writing.
/// False, at the cost of a look, when nobody waits.
[[nodiscard]] bool OSTGiveWayToAllIdentifiersWriter(const std::vector<std::string_view>& identifiers, OSTLockKind kind);

/// Whether the calling thread holds the all-identifiers lock for writing.
[[nodiscard]] bool OSTHoldsAllIdentifiersLock();

/// The number of live lock records: identifiers that somebody holds or waits for.
[[nodiscard]] std::size_t OSTLockRecordCount();

/// Holds the all-identifiers lock from construction to `unlock` or destruction.
class OSTAllIdentifiersLock {
public:
    explicit OSTAllIdentifiersLock(OSTLockKind kind) : OSTAllIdentifiersLock(kind, true) {}
    /// Holds nothing when `useLocking` is false: the caller's caller holds the lock for writing, which is asserted.
    OSTAllIdentifiersLock(OSTLockKind kind, bool useLocking) : _locked(useLocking) {
        if (useLocking)
            _lock_all_identifiers(kind);
        else
            OST_ASSERT(OSTHoldsAllIdentifiersLock());
    }
    OSTAllIdentifiersLock(const OSTAllIdentifiersLock&) = delete;
    OSTAllIdentifiersLock& operator=(const OSTAllIdentifiersLock&) = delete;
    ~OSTAllIdentifiersLock() { unlock(); }

    void unlock() {
        if (std::exchange(_locked, false))
            unlock_all_identifiers();
    }

private:
    bool _locked;
};

/// Holds the locks of some identifiers from construction to destruction.
class OSTIdentifierLock {
public:
    /// Holds nothing when `useLocking` is false: the caller's caller holds the locks.
    OSTIdentifierLock(std::vector<std::string> identifiers, OSTLockKind kind, bool useLocking = true)
        : _identifiers(useLocking ? std::move(identifiers) : std::vector<std::string>()), _kind(kind) {
        _lock_identifier(_views(), kind);
    }
    OSTIdentifierLock(const OSTIdentifierLock&) = delete;
    OSTIdentifierLock& operator=(const OSTIdentifierLock&) = delete;
    ~OSTIdentifierLock() { unlock_identifier(_views()); }

    /// For long work: when somebody waits for all identifiers, gives the locks back, lets him have his turn and takes
    /// them again. Gives whether it did; what they guard may be another then.
    [[nodiscard]] bool giveWay() { return OSTGiveWayToAllIdentifiersWriter(_views(), _kind); }

private:
    [[nodiscard]] std::vector<std::string_view> _views() const { return {_identifiers.begin(), _identifiers.end()}; }

    const std::vector<std::string> _identifiers;
    const OSTLockKind _kind;
};

/// Forbids the calling thread to take any of these locks, from construction to destruction; giving one back stays
/// allowed. Not to be nested.
class OSTNoFurtherLocks {
public:
    OSTNoFurtherLocks();
    OSTNoFurtherLocks(const OSTNoFurtherLocks&) = delete;
    OSTNoFurtherLocks& operator=(const OSTNoFurtherLocks&) = delete;
    ~OSTNoFurtherLocks();
};

} // namespace ost
