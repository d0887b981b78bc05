#include "protection/OSTDataProtectionChangeOperation.h"

#include "model/OSTFailureReport.h"
#include "platform/base/Immortal.h"
#include "platform/base/Log.h"
#include "platform/base/Mutex.h"
#include "platform/base/Path.h"
#include "platform/device/DeviceLockState.h"
#include "platform/threads/BlockingSection.h"
#include "protection/OSTDataProtectionPass.h"
#include "protection/OSTLockStateQueue.h"
#include "store/OSTContainerCache.h"

#include <cerrno>
#include <set>
#include <utility>

namespace ost {

namespace {

/// A container's turn to be changed, until its class is on record. Of two changes side by side the record would be that
/// of one, and some of the items those of the other.
class ChangeTurn {
public:
    explicit ChangeTurn(const platform::UUID& container) : _container(container) {
        auto& turns = _turns();
        platform::MutexLock lock(turns.mutex);
        const auto take = [&]() OST_REQUIRES(turns.mutex) { return turns.taken.insert(container).second; };
        if (take())
            return;
        const platform::BlockingSection blocking;
        turns.givenBack.wait(lock, take);
    }
    ChangeTurn(const ChangeTurn&) = delete;
    ChangeTurn& operator=(const ChangeTurn&) = delete;
    ~ChangeTurn() {
        auto& turns = _turns();
        const platform::MutexLock lock(turns.mutex);
        turns.taken.erase(_container);
        turns.givenBack.notifyAll();
    }

private:
    struct Turns {
        platform::Mutex mutex;
        platform::Condition givenBack;
        std::set<platform::UUID> taken OST_GUARDED_BY(mutex);
    };
    static Turns& _turns() {
        static platform::Immortal turns([] { return Turns(); });
        return *turns;
    }

    const platform::UUID _container;
};

/// No device is locked and unlocked again that often, each time at the wrong moment.
constexpr unsigned mostPasses = 50;

std::optional<OSTItemIdentity> identityOf(const OSTMetadata& metadata) {
    const auto identity = OSTFileManager::defaultManager().identityOfItemAtURL(metadata.url);
    return identity ? std::optional(*identity) : std::nullopt;
}

} // namespace

std::shared_ptr<OSTDataProtectionChangeOperation>
OSTDataProtectionChangeOperation::withChange(OSTDataProtectionChange change) {
    return std::shared_ptr<OSTDataProtectionChangeOperation>(new OSTDataProtectionChangeOperation(std::move(change)));
}

OSTDataProtectionChangeOperation::OSTDataProtectionChangeOperation(OSTDataProtectionChange change)
    : _change(std::move(change)), _directory(identityOf(*_change.dataContainerMetadata)) {}

bool OSTDataProtectionChangeOperation::containerIsAnother() const {
    const auto found = OSTContainerCache::sharedInstance().containerForUser(_change.dataContainerMetadata->name());
    return found && _directory && identityOf(**found) != _directory;
}

void OSTDataProtectionChangeOperation::performChangeOperation() {
    const auto& metadata = *_change.dataContainerMetadata;
    const ChangeTurn turn(metadata.uuid);
    const auto pass = _runChangeOperationNeedToRetry();
    if (!pass) {
        platform::logNotice("Operation to update protection classes for user: %u, id: %@, containerClass: %llu to "
                            "class %d failed with error %@",
                            metadata.uid, metadata.identifier, metadata.containerClass, _change.newDataProtectionClass,
                            pass.error());
        return _complete(false, &pass.error());
    }
    const auto& lockedError = *pass;
    if (!lockedError)
        return _complete(false, nullptr);
    if (_change.retryIfLocked)
        return _parkUntilUnlocked();
    const auto error =
        OSTCreateError(OSTErrorCode::lockedWithoutRetry, *lockedError,
                       "Tried to update user: %u, id: %@, containerClass: %llu to protection class "
                       "%d, but was locked and didn't retry",
                       metadata.uid, metadata.identifier, metadata.containerClass, _change.newDataProtectionClass);
    _complete(true, &error);
}

OSTResult<OSTDataProtectionChangeOperation::LockedError>
OSTDataProtectionChangeOperation::_runChangeOperationNeedToRetry() const {
    return OSTGuarded([&]() -> OSTResult<LockedError> {
        const platform::BlockingSection blocking;
        auto lockedError = OST_TRY(_changeItems());
        // The class is recorded next, and what is recorded has happened. The container itself may have moved by now.
        if (!lockedError)
            OST_TRY(OSTFileManager::defaultManager().makeFileSystemDurable(
                platform::pathByDeletingLastComponent(_change.dataContainerMetadata->url)));
        return lockedError;
    });
}

OSTResult<OSTDataProtectionChangeOperation::LockedError> OSTDataProtectionChangeOperation::_changeItems() const {
    for (unsigned passes = 1;; ++passes) {
        OSTDataProtectionPass pass(_change, _directory);
        auto ended = pass.run();
        if (ended)
            return std::nullopt;
        if (!ended.error().isPOSIX(EPERM))
            return std::unexpected(ended.error());
        if (platform::deviceLockState() == platform::deviceLocked)
            return ended.error();
        // The device was locked for a moment, unless something else forbids it.
        if (pass.metFixedItem() || passes == mostPasses)
            return std::unexpected(ended.error());
    }
}

void OSTDataProtectionChangeOperation::_parkUntilUnlocked() {
    const auto& metadata = *_change.dataContainerMetadata;
    platform::logNotice("Retrying container protection update to %d on next unlock for user: %u, id: %@, "
                        "containerClass: %llu",
                        _change.newDataProtectionClass, metadata.uid, metadata.identifier, metadata.containerClass);
    run_when_unlocked([self = shared_from_this()] {
        if (!std::exchange(self->_retried, true) && self->_retryStartBlock)
            self->_retryStartBlock();
        self->performChangeOperation();
    });
}

void OSTDataProtectionChangeOperation::_complete(bool wasLocked, const OSTError* error) {
    if (_completionBlock)
        _completionBlock(wasLocked, error);
}

} // namespace ost
