#pragma once

#include "files/OSTFileManager.h"
#include "platform/base/OSTError.h"
#include "protection/OSTDataProtectionChange.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>

namespace ost {

/// One change of one container's data-protection class: a first pass on the thread that asks for it and, when the
/// device is locked, further ones after unlocks, each on the lock-state queue.
///
/// Threads: one at a time. Ownership: whatever refers to it, which is the request during the first pass and the queue
/// while it is parked. A pass that ends early leaves every item with its old or its new class.
class OSTDataProtectionChangeOperation : public std::enable_shared_from_this<OSTDataProtectionChangeOperation> {
public:
    [[nodiscard]] static std::shared_ptr<OSTDataProtectionChangeOperation> withChange(OSTDataProtectionChange change);

    [[nodiscard]] const OSTDataProtectionChange& change() const { return _change; }

    /// Whether the container was wiped since: another directory has its UUID and path then. The caller holds its lock.
    [[nodiscard]] bool containerIsAnother() const;

    /// Is run once, just before the first retry.
    void setRetryStartBlock(std::move_only_function<void()> block) { _retryStartBlock = std::move(block); }
    /// Is run once, when the change has ended; `error` is null when it succeeded.
    void setCompletionBlock(std::move_only_function<void(bool wasLocked, const OSTError* error)> block) {
        _completionBlock = std::move(block);
    }

    /// Runs a pass, and so on until the change has ended or is parked. Waits for another change of the container that
    /// is being made.
    void performChangeOperation();

private:
    explicit OSTDataProtectionChangeOperation(OSTDataProtectionChange change);

    /// Why a pass came to an end at a locked device; none when it reached its end.
    using LockedError = std::optional<OSTError>;

    [[nodiscard]] OSTResult<LockedError> _runChangeOperationNeedToRetry() const;
    /// Makes passes until one says what there is to say.
    [[nodiscard]] OSTResult<LockedError> _changeItems() const;
    void _parkUntilUnlocked();
    void _complete(bool wasLocked, const OSTError* error);

    const OSTDataProtectionChange _change;
    const std::optional<OSTItemIdentity> _directory; ///< the container's, when the change was asked for
    bool _retried = false;
    std::move_only_function<void()> _retryStartBlock;
    std::move_only_function<void(bool, const OSTError*)> _completionBlock;
};

} // namespace ost
