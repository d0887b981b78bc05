#include "files/OSTFileManager.h"
#include "model/OSTFailureReport.h"
#include "model/OSTGlobalConfiguration.h"
#include "platform/base/Immortal.h"
#include "platform/base/PassingReason.h"
#include "platform/base/Path.h"
#include "platform/threads/Transactions.h"
#include "store/OSTClientConnection.h"
#include "store/OSTContainerCache.h"
#include "store/OSTLocks.h"
#include "store/OSTStoreDelegate.h"

#include <algorithm>
#include <array>
#include <cerrno>

namespace ost {

using platform::lastPathComponent;
using platform::pathByAppending;
using platform::pathByDeletingLastComponent;

namespace {

/// How often a move to death row is tried again when a pass removed the unique directory that was made for it. A pass
/// removes what it has listed, once, so more than a few losses in a row have another cause.
constexpr int movesToDeathRow = 16;

/// Whether nothing but a change of the item or of its place will let a failed removal succeed.
bool isForGood(const OSTError& removal) {
    constexpr std::array reasons{EPERM, EBUSY, EROFS, ENOTEMPTY, EXDEV};
    return !platform::isReasonThatPasses(removal) ||
           std::ranges::any_of(reasons, [&](int reason) { return removal.isPOSIX(reason); });
}

/// How often a removal is tried in all when something came into the item behind the removal's back: a unique directory
/// gets its item, and an application may still be at work in its container.
constexpr int removals = 8;

/// Waits until what was taken out of the directories is out of them on disk: what was answered as deleted must not be
/// back after a power cut. All are tried; fails when one could not be waited for.
OSTResult<void> makeDeletionsDurable(const std::set<std::string>& directories) {
    OSTResult<void> result;
    for (const auto& directory : directories)
        if (const auto durable = OSTFileManager::defaultManager().makeDirectoryDurable(directory); !durable)
            result = std::unexpected(OSTCreateError(OSTErrorCode::deletionFailed, durable.error(),
                                                    "Failed to make sure of deletion in: %@", directory));
    return result;
}

} // namespace

platform::WorkQueue& OSTDeathRowQueue() {
    static platform::Immortal queue([] { return platform::WorkQueue("com.tamarok.ostrandd.deathrow"); });
    return *queue;
}

std::expected<void, OSTErrorCode>
OSTClientConnection::stageForDeleteContainersWithUsers(const OSTDeletion& deletion) const {
    return OSTGuarded([&]() -> OSTResult<void> {
        if (deletion.uuids.size() != deletion.classes.size() || deletion.uuids.size() != deletion.identifiers.size())
            return std::unexpected(
                OSTCreateError(OSTErrorCode::invalidObject,
                               "Can't act on an invalid input: UUIDString count: %ld, class count: %ld, ID count: %ld",
                               deletion.uuids.size(), deletion.classes.size(), deletion.identifiers.size()));
        std::set<std::string> directories;
        OSTAllIdentifiersLock lock(OSTLockKind::writing);
        // A list of users that is too short is the caller's mistake, which the guard reports.
        for (std::size_t i = 0; i < deletion.uuids.size(); ++i) {
            const auto staged = _stageForDeletion(
                {{deletion.userIds.at(i), deletion.classes[i], deletion.identifiers[i]}, deletion.uuids[i]},
                directories);
            if (!staged && !staged.error().is(OSTErrorCode::deletionFailed)) // one that stays does not keep the others
                return staged;
        }
        lock.unlock();
        return makeDeletionsDurable(directories);
    });
}

std::expected<void, OSTErrorCode> OSTClientConnection::stageForDeleteContainer(const OSTMetadata& container,
                                                                               bool useLocking) const {
    return OSTGuarded([&]() -> OSTResult<void> {
        std::set<std::string> directories;
        OSTAllIdentifiersLock lock(OSTLockKind::writing, useLocking);
        OST_TRY(_stageForDeletion({container.name(), container.uuid}, directories));
        lock.unlock();
        return makeDeletionsDurable(directories);
    });
}

OSTResult<void> OSTClientConnection::_stageForDeletion(const OSTContainerReference& reference,
                                                       std::set<std::string>& directories) const {
    const auto& [name, uuid] = reference;
    if (!uuid || !name.identifier || !isValidContainerClass(name.containerClass)) {
        static_cast<void>(OSTCreateError(OSTErrorCode::invalidObject,
                                         "Can't act on an invalid object: userId: %u, UUID: %@, ID: %@, Class: %ld",
                                         name.userId, uuid, name.identifier, name.containerClass));
        return {};
    }
    const auto record = OST_TRY(OSTContainerCache::sharedInstance().containerForUser(name, *uuid));
    return record ? _stageContainer(*record, directories) : OSTResult<void>();
}

OSTResult<void> OSTClientConnection::_stageContainer(const OSTMetadata& metadata,
                                                     std::set<std::string>& directories) const {
    OST_TRY(_settleReplacementsAt(metadata.url));
    const auto& files = OSTFileManager::defaultManager();
    const auto destination =
        pathByAppending(OSTGlobalConfiguration::sharedInstance().deathrowDirectory(), lastPathComponent(metadata.url));
    if (isBundleClass(metadata.containerClass))
        OSTStoreDelegate::shared().removeCodeSigningDictionariesForIdentifierAndItsChildren(metadata.identifier);
    if (const auto moved = files.moveItemAtURL(metadata.url, destination); !moved) {
        platform::logDebug("Couldn't stage for deletion from %@ to %@: %@", metadata.url, destination, moved.error());
        if (const auto removed = files.removeItemAtURL(metadata.url); !removed)
            return std::unexpected(OSTCreateError(OSTErrorCode::deletionFailed, "Failed to delete container at %@: %@",
                                                  metadata.url, removed.error()));
    }
    directories.emplace(pathByDeletingLastComponent(metadata.url));
    if (!_setSandboxContainerMappingForUser(metadata.name(), std::nullopt))
        platform::logError("Failed to remove container mapping in delete operation of %@, %llu", metadata.identifier,
                           metadata.containerClass);
    if (const auto removed = OSTContainerCache::sharedInstance().removeContainerForUser(metadata.name()); !removed)
        return std::unexpected(OSTCreateError(OSTErrorCode::cacheRemoveFailed, removed.error(),
                                              "Failed to remove from cache id: %@, class: %ld, transient: %d",
                                              metadata.identifier, metadata.containerClass, metadata.transient));
    return {};
}

std::expected<void, OSTErrorCode> OSTClientConnection::deleteContainerForUser(const OSTContainerName& name) const {
    const auto record = createOrLookupContainerForUser({.name = name});
    if (!record) {
        platform::logError("Failed to lookup existing container to delete-identifier: %@, class: %ld, transient: %d",
                           name.identifier, name.containerClass, name.transient);
        return std::unexpected(record.error());
    }
    return stageForDeleteContainer(**record);
}

OSTResult<void> OSTClientConnection::_moveItemAtURLToDeathRow(const std::string& url,
                                                              StartPass startDeletionThread) const {
    const auto& files = OSTFileManager::defaultManager();
    for (int attempt = 1;; ++attempt) {
        // A directory of its own keeps two items of the same name from colliding.
        const auto unique =
            files.createTemporaryDirectoryInDirectoryURL(OSTGlobalConfiguration::sharedInstance().deathrowDirectory());
        if (!unique)
            return std::unexpected(OSTCreateError(OSTErrorCode::moveToDeathRowFailed, unique.error(),
                                                  "Failed to create unique directory at: %@", url));
        const auto destination = pathByAppending(*unique, lastPathComponent(url));
        const auto moved = files.moveItemAtURL(url, destination);
        if (moved)
            break;
        if (moved.error().isPOSIX(ENOENT)) {
            if (files.itemDoesNotExistAtURL(url))
                return {};
            if (attempt < movesToDeathRow)
                continue;
        }
        return std::unexpected(OSTCreateError(OSTErrorCode::moveToDeathRowFailed, moved.error(),
                                              "Failed to move item at: %@ to: %@", url, destination));
    }
    if (startDeletionThread == StartPass::yes)
        deleteContainersOnDeathRowWithCompletion();
    return {};
}

void OSTClientConnection::deleteContainersOnDeathRowWithCompletion(DeathRowCompletion completion) const {
    async_with_transaction(OSTDeathRowQueue(), [completion = std::move(completion)]() mutable {
        const auto error = _emptyDeathRow();
        if (completion)
            completion(static_cast<std::int64_t>(error ? error->code() : OSTErrorCode::success));
    });
}

std::optional<OSTError> OSTClientConnection::_emptyDeathRow() {
    // Asked for once: a pass does not make the directory again, so one that has gone is reported.
    static platform::Immortal held([] { return OSTGlobalConfiguration::sharedInstance().deathrowDirectory(); });
    const auto& deathRow = *held;
    const auto items = OSTFileManager::defaultManager().urlsForItemsInDirectoryAtURL(deathRow);
    if (!items) {
        if (items.error().isPOSIX(ENOENT))
            return items.error();
        return OSTCreateError(OSTErrorCode::deletionFailed, items.error(), "Failed to get items for deletion: %@ : %@",
                              deathRow, items.error());
    }
    std::optional<OSTError> passError;
    for (const auto& item : *items) {
        const auto path = pathByAppending(deathRow, item.name);
        const auto removed = _removeItemOrMoveToTempAtURL(path);
        if (!removed)
            passError =
                OSTCreateError(OSTErrorCode::destructionFailed, removed.error(), "Failed to destroy item at: %@", path);
        else if (*removed)
            passError = *removed;
    }
    return passError;
}

OSTResult<std::optional<OSTError>> OSTClientConnection::_removeItemOrMoveToTempAtURL(const std::string& url) {
    const auto& files = OSTFileManager::defaultManager();
    auto removed = files.removeItemAtURL(url);
    for (int tries = 1; tries < removals && !removed && removed.error().isPOSIX(ENOTEMPTY); ++tries)
        removed = files.removeItemAtURL(url);
    if (removed || removed.error().isPOSIX(ENOENT))
        return std::nullopt;
    if (!isForGood(removed.error())) // the next pass may
        return removed.error();
    platform::logDebug("Couldn't remove, so moving item to /tmp: %@ : %@", url, removed.error());
    const auto parked = files.moveItemAtURL(url, pathByAppending(OSTParkingDirectory, lastPathComponent(url)));
    if (!parked)
        return std::unexpected(OSTCreateError(OSTErrorCode::moveAsideFailed, parked.error(),
                                              "Failed to move dir: %@ to: %@", url, OSTParkingDirectory));
    return removed.error();
}

} // namespace ost
