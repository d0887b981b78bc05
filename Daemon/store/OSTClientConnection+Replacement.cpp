#include "files/OSTDictionaryFile.h"
#include "files/OSTFileManager.h"
#include "model/OSTFailureReport.h"
#include "model/OSTGlobalConfiguration.h"
#include "platform/base/Log.h"
#include "platform/base/PassingReason.h"
#include "platform/base/Path.h"
#include "platform/base/UUID.h"
#include "platform/device/CrashReport.h"
#include "store/OSTClientConnection.h"
#include "store/OSTContainerCache.h"
#include "store/OSTLocks.h"
#include "store/OSTReplaceFile.h"
#include "store/OSTStoreDelegate.h"

#include <cerrno>

namespace ost {

using platform::lastPathComponent;
using platform::pathByAppending;
using platform::pathByDeletingLastComponent;

namespace {

bool isAtOrBelow(std::string_view path, std::string_view place) {
    return path.starts_with(place) && (path.size() == place.size() || path[place.size()] == '/');
}

} // namespace

/// How far one replacement has come, and so what has to be undone or cleaned up when it stops.
struct OSTClientConnection::ReplaceOperation {
    OSTMetadataRecord oldContainer; ///< null when there is none
    OSTMetadataRecord newContainer;
    std::string destination;
    bool transient = false; ///< of the container at the destination

    std::string replaceFileURL; ///< empty while there is none to be discarded
    std::string stagingURL;     ///< where the old container is parked
    bool oldIsParked = false;
    bool oldIsForgotten = false; ///< by the cache
    bool newHasOldUUID = false;  ///< in its metadata file
    OSTStoreDelegate::Restoration restoreCodeSigning;
    bool newIsInPlace = false;
};

std::expected<void, OSTErrorCode> OSTClientConnection::replaceContainer(const OSTReplacement& replacement) const {
    return OSTGuarded([&]() -> OSTResult<void> {
        OST_TRY(_checkReplacement(replacement));
        const OSTAllIdentifiersLock lock(OSTLockKind::writing);
        ReplaceOperation operation;
        const auto replaced = OSTGuarded([&] { return _replace(replacement, operation); });
        if (operation.newHasOldUUID && !operation.newIsInPlace)
            // What fails is in the log; the container is found by the UUID that the cache holds, until the next start.
            static_cast<void>(operation.newContainer->writeMetadataToDisk());
        if (operation.oldIsParked && !operation.newIsInPlace) {
            const auto restored = _restoreOldContainer(operation);
            if (!restored && replaced.error().is(OSTErrorCode::exceptionCaught))
                platform::crashWithMessage(restored.error().description());
            // What could not be put back is left to the next start, for which the replace file stays.
            if (!restored)
                return replaced;
        }
        if (!operation.replaceFileURL.empty())
            OST_TRY(_cleanUpReplacement(replacement, operation));
        return replaced;
    });
}

OSTResult<void> OSTClientConnection::_checkReplacement(const OSTReplacement& replacement) {
    const auto& [oldName, oldUUID] = replacement.oldContainer;
    const auto& [newName, newUUID] = replacement.newContainer;
    if (!newUUID || !isValidContainerClass(newName.containerClass))
        return std::unexpected(OSTCreateError(OSTErrorCode::invalidObject,
                                              "Can't act on an invalid object: new userId: %u, newUUID: %@, Class: %ld",
                                              newName.userId, newUUID, newName.containerClass));
    if (!oldUUID) {
        if (replacement.preserveOldUUID)
            return std::unexpected(OSTCreateError(OSTErrorCode::invalidObject,
                                                  "Can't have a nil oldContainerUUID when preserving the UUID"));
        return {};
    }
    if (!isValidContainerClass(oldName.containerClass))
        return std::unexpected(OSTCreateError(OSTErrorCode::invalidObject,
                                              "Can't act on an invalid object: old userId: %u, oldUUID: %@, Class: %ld",
                                              oldName.userId, oldUUID, oldName.containerClass));
    if (oldName.containerClass != newName.containerClass)
        return std::unexpected(OSTCreateError(OSTErrorCode::classesDiffer,
                                              "Can't replace containers of different class types: %ld and %ld",
                                              oldName.containerClass, newName.containerClass));
    if (oldName.userId != newName.userId)
        return std::unexpected(OSTCreateError(OSTErrorCode::usersDiffer,
                                              "Can't replace containers of different userIds: %u and %u",
                                              oldName.userId, newName.userId));
    return {};
}

OSTResult<void> OSTClientConnection::_replace(const OSTReplacement& replacement, ReplaceOperation& operation) const {
    OST_TRY(_findSides(replacement, operation));
    for (const auto& side : {operation.oldContainer, operation.newContainer})
        if (side)
            OST_TRY(_settleReplacementsAt(side->url));
    if (operation.oldContainer)
        OST_TRY(_parkOldContainer(operation));
    else
        OST_TRY(_checkNothingLives(operation));
    return _putNewContainerInPlace(replacement, operation);
}

OSTResult<OSTMetadataRecord> OSTClientConnection::_containerOfSide(const OSTContainerReference& side) {
    const auto& [name, uuid] = side;
    auto record =
        name.identifier ? OST_TRY(OSTContainerCache::sharedInstance().containerForUser(name, *uuid)) : nullptr;
    if (!record)
        return std::unexpected(OSTCreateError(OSTErrorCode::notFound,
                                              "No Container with userId: %u UUID: %@, identifier: %@, Class: %ld",
                                              name.userId, *uuid, name.identifier, name.containerClass));
    return record;
}

OSTResult<void> OSTClientConnection::_findSides(const OSTReplacement& replacement, ReplaceOperation& operation) {
    if (replacement.oldContainer.uuid) {
        operation.oldContainer = OST_TRY(_containerOfSide(replacement.oldContainer));
        operation.transient = operation.oldContainer->transient;
    }
    operation.newContainer = OST_TRY(_containerOfSide(replacement.newContainer));
    const auto& newURL = operation.newContainer->url;
    if (operation.oldContainer && operation.oldContainer->url == newURL)
        return std::unexpected(
            OSTCreateError(OSTErrorCode::replacedByItself, "Can't replace the same container at %@", newURL));
    if (!platform::UUID::parse(lastPathComponent(newURL)))
        return std::unexpected(
            OSTCreateError(OSTErrorCode::unexpectedPath, "Invalid URL (last path component not UUID): %@", newURL));
    if (replacement.preserveOldUUID) {
        operation.destination = operation.oldContainer->url;
        return {};
    }
    const auto directory = OSTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(
        operation.newContainer->uid, operation.newContainer->containerClass, operation.transient);
    if (!directory)
        return std::unexpected(OSTCreateError(OSTErrorCode::replacingMoveFailed,
                                              "Failed to find the directory for %@: %@", newURL, directory.error()));
    operation.destination = pathByAppending(*directory, lastPathComponent(newURL));
    const auto& files = OSTFileManager::defaultManager();
    if (files.itemDoesNotExistAtURL(operation.destination))
        return {};
    if (!files.itemExistsAtURL(operation.destination))
        return std::unexpected(OSTCreateError(OSTErrorCode::replacingMoveFailed,
                                              "Failed to find out whether anything is at %@", operation.destination));
    return std::unexpected(
        OSTCreateError(OSTErrorCode::alreadyExists, "Container already exists at %@", operation.destination));
}

OSTResult<void> OSTClientConnection::_checkNothingLives(const ReplaceOperation& operation) {
    auto name = operation.newContainer->name();
    name.transient = false;
    const auto living = OSTContainerCache::sharedInstance().containerForUser(name);
    if (living)
        return std::unexpected(OSTCreateError(OSTErrorCode::alreadyExists,
                                              "Container with identifier: %@, class: %ld, transient: %d already exists",
                                              *name.identifier, name.containerClass, name.transient));
    if (!living.error().is(OSTErrorCode::notFound))
        return std::unexpected(living.error());
    return {};
}

OSTResult<void> OSTClientConnection::_parkOldContainer(ReplaceOperation& operation) {
    const auto token = platform::UUID::generate().string();
    operation.replaceFileURL = OSTReplaceFile::urlOfToken(token);
    operation.stagingURL = pathByAppending(OSTGlobalConfiguration::sharedInstance().stagingDirectory(), token);
    const auto& old = *operation.oldContainer;

    const auto written = OSTReplaceFile{.oldURL = old.url,
                                        .newURL = operation.newContainer->url,
                                        .stagingURL = operation.stagingURL,
                                        .destinationURL = operation.destination}
                             ._writeToDiskReplaceAt(operation.replaceFileURL);
    if (!written) {
        platform::logError("Failed to write replace file: %@", written.error());
        return written;
    }
    if (const auto parked = OSTFileManager::defaultManager().moveItemAtURL(old.url, operation.stagingURL); !parked)
        return std::unexpected(OSTCreateError(OSTErrorCode::moveOldToStagingFailed, parked.error(),
                                              "Failed to move old %@ to staging %@", old.url, operation.stagingURL));
    operation.oldIsParked = true;
    OST_TRY(_forgetContainer(old.name()));
    operation.oldIsForgotten = true;
    if (!isBundleClass(old.containerClass))
        return {};
    auto& codeSigning = OSTStoreDelegate::shared();
    operation.restoreCodeSigning = codeSigning.rememberIdentifierAndItsChildren(old.identifier);
    const auto invalidated = codeSigning.invalidateCodeSigningInfoForIdentifierAndItsChildren(old.identifier);
    if (!invalidated)
        platform::logError("Failed to invalidate code signing info for %@", old.identifier);
    return invalidated;
}

OSTResult<void> OSTClientConnection::_forgetContainer(const OSTContainerName& name) {
    const auto removed = OSTContainerCache::sharedInstance().removeContainerForUser(name);
    if (!removed)
        return std::unexpected(OSTCreateError(OSTErrorCode::cacheRemoveFailed, removed.error(),
                                              "Failed to remove from cache id: %@, class: %ld, transient: %d",
                                              *name.identifier, name.containerClass, name.transient));
    return {};
}

OSTResult<void> OSTClientConnection::_putNewContainerInPlace(const OSTReplacement& replacement,
                                                             ReplaceOperation& operation) const {
    const auto name = operation.newContainer->name();
    const auto& destination = operation.destination;
    const auto& files = OSTFileManager::defaultManager();
    const auto failedMove = [&](const OSTError& cause) {
        const auto old = operation.oldContainer ? std::optional(operation.oldContainer->url) : std::nullopt;
        return OSTCreateError(OSTErrorCode::replacingMoveFailed, cause, "Failed to replace: %@ with: %@ at: %@", old,
                              operation.newContainer->url, destination);
    };
    OSTMetadata metadata = *operation.newContainer;
    if (replacement.preserveOldUUID) {
        // A container that has taken its place has its UUID for good, whatever happens then.
        metadata.uuid = *replacement.oldContainer.uuid;
        operation.newHasOldUUID = true;
        OST_TRY(metadata.writeMetadataToDisk());
    }
    if (const auto moved = files.moveItemAtURL(operation.newContainer->url, destination); !moved)
        return std::unexpected(failedMove(moved.error()));
    // Before the replace file goes, which would otherwise be gone after a power cut while the move had not happened. A
    // move that cannot be made sure of is taken back.
    operation.newIsInPlace = true;
    const auto durable = files.makeDirectoryDurable(pathByDeletingLastComponent(destination));
    if (!durable && files.moveItemAtURL(destination, operation.newContainer->url)) {
        operation.newIsInPlace = false;
        return std::unexpected(failedMove(durable.error()));
    }

    OST_TRY(_forgetContainer(name));
    if (!_setSandboxContainerMappingForUser(name, destination))
        platform::logError("Failed to set container mapping in replace operation of %@, %llu", *name.identifier,
                           name.containerClass);
    metadata.url = destination;
    metadata.transient = operation.transient;
    const auto added = OSTContainerCache::sharedInstance().addContainerMetadata(metadata);
    if (!added)
        return std::unexpected(OSTCreateError(OSTErrorCode::cacheAddFailed, added.error(),
                                              "Failed to add to cache: %@, url: %@, transient: %d", metadata,
                                              destination, operation.transient));
    if (!durable) { // and could not be taken back: the next start decides by what has reached the disk
        operation.replaceFileURL.clear();
        return std::unexpected(failedMove(durable.error()));
    }
    return {};
}

OSTResult<void> OSTClientConnection::_restoreOldContainer(ReplaceOperation& operation) {
    const auto& files = OSTFileManager::defaultManager();
    const auto& old = *operation.oldContainer;
    platform::logDebug("Recovering from exception by moving: %@ to %@", operation.stagingURL, old.url);
    // Something that stands in the old place is not to be replaced by what was there before.
    auto restored = files.itemExistsAtURL(old.url)
                        ? OSTResult<void>(std::unexpected(OSTCreatePOSIXError(EEXIST, "%@ is occupied", old.url)))
                        : files.moveItemAtURL(operation.stagingURL, old.url);
    if (restored) {
        if (operation.restoreCodeSigning)
            operation.restoreCodeSigning();
        if (operation.oldIsForgotten)
            static_cast<void>(OSTContainerCache::sharedInstance().addContainerMetadata(old));
        restored = files.makeDirectoryDurable(pathByDeletingLastComponent(old.url));
    }
    if (!restored)
        return std::unexpected(OSTCreateError(OSTErrorCode::replaceFileInvalid, restored.error(),
                                              "Failed to recover replace move: %@ to %@", operation.stagingURL,
                                              old.url));
    return {};
}

OSTResult<void> OSTClientConnection::_cleanUpReplacement(const OSTReplacement& replacement,
                                                         const ReplaceOperation& operation) const {
    // What was never made needs no place on death row, which a full disk may not have.
    const auto& files = OSTFileManager::defaultManager();
    if (!operation.oldIsParked && files.itemDoesNotExistAtURL(operation.replaceFileURL))
        return {};
    std::optional<OSTError> error;
    if (const auto removed = _moveItemAtURLToDeathRow(operation.stagingURL, StartPass::no); !removed)
        error = OSTCreateError(OSTErrorCode::replaceCleanupFailed, removed.error(), "Failed to remove staging dir: %@",
                               operation.stagingURL);
    const auto start = replacement.startDeletionThread ? StartPass::yes : StartPass::no;
    if (const auto removed = _discardReplaceFile(operation.replaceFileURL, start); !removed)
        error = OSTCreateError(OSTErrorCode::replaceCleanupFailed, removed.error(), "Failed to remove replace file: %@",
                               operation.replaceFileURL);
    if (error)
        return std::unexpected(*error);
    return {};
}

OSTResult<void> OSTClientConnection::_discardReplaceFile(const std::string& url, StartPass startDeletionThread) const {
    const auto moved = _moveItemAtURLToDeathRow(url, startDeletionThread);
    // One that stayed would speak for containers that live on, and mislead a later start when these have gone.
    if (!moved)
        static_cast<void>(OSTFileManager::defaultManager().removeItemAtURL(url));
    return moved;
}

OSTResult<void> OSTClientConnection::_settleReplacementsAt(std::string_view place) const {
    const auto& files = OSTFileManager::defaultManager();
    const auto directory = OSTGlobalConfiguration::sharedInstance().replaceDirectory();
    const auto items = files.urlsForItemsInDirectoryAtURL(directory);
    if (!items && !platform::isAbsence(items.error()))
        return std::unexpected(OSTCreateError(OSTErrorCode::replaceFileInvalid, items.error(),
                                              "Failed to get items at replace URL%@ : %@", directory, items.error()));
    for (const auto& item : items.value_or(std::vector<OSTDirectoryItem>())) {
        const auto url = pathByAppending(directory, item.name);
        const auto file = OSTReplaceFile::_readAndValidateReplaceFileAtUrl(url);
        if (!file && platform::isReasonThatPasses(file.error()))
            return std::unexpected(file.error());
        if (!file || !(isAtOrBelow(file->oldURL, place) || isAtOrBelow(file->destinationURL, place)))
            continue;
        if (!_discardReplaceFile(url, StartPass::no) && !files.itemDoesNotExistAtURL(url))
            return std::unexpected(
                OSTCreateError(OSTErrorCode::replaceCleanupFailed, "Failed to remove replace file at %@", url));
    }
    return {};
}

OSTResult<void> OSTClientConnection::_recoverFromReplaceOperations() const {
    const auto& files = OSTFileManager::defaultManager();
    const auto directory = OSTGlobalConfiguration::sharedInstance().replaceDirectory();
    files.removeUnfinishedItemsInDirectoryURL(directory);
    const auto items = files.urlsForItemsInDirectoryAtURL(directory);
    if (!items) {
        if (!items.error().isPOSIX(ENOENT))
            platform::logError("Failed to get items at replace URL%@ : %@", directory, items.error());
        return {};
    }
    for (const auto& item : *items)
        OST_TRY(_recoverFromReplaceFile(pathByAppending(directory, item.name)));
    return {};
}

OSTResult<void> OSTClientConnection::_recoverFromReplaceFile(const std::string& url) const {
    const auto& files = OSTFileManager::defaultManager();
    const auto file = OSTReplaceFile::_readAndValidateReplaceFileAtUrl(url);
    // What is parked in staging waits with its file until that can be read again.
    if (!file && platform::isReasonThatPasses(file.error()))
        return {};
    // A file that is not valid is in the log, and is only discarded.
    if (file) {
        platform::logDebug("Doing a replace of %@ with info: %@", url, *file);
        if (!files.itemExistsAtURL(file->oldURL) && !files.itemExistsAtURL(file->destinationURL)) {
            platform::logDebug("Recovering from failed replace by moving: %@ to %@", file->stagingURL, file->oldURL);
            // Neither was seen, but one that could not be looked for may be there.
            auto moved = files.itemDoesNotExistAtURL(file->oldURL) && files.itemDoesNotExistAtURL(file->destinationURL)
                             ? files.moveItemAtURL(file->stagingURL, file->oldURL)
                             : std::unexpected(OSTCreatePOSIXError(EAGAIN, "%@ or %@ may exist", file->oldURL,
                                                                   file->destinationURL));
            if (moved)
                moved = files.makeDirectoryDurable(pathByDeletingLastComponent(file->oldURL));
            if (!moved)
                return std::unexpected(OSTCreateError(OSTErrorCode::replaceFileInvalid, moved.error(),
                                                      "Failed to recover replace move: %@ to %@", file->stagingURL,
                                                      file->oldURL));
        }
    }
    if (const auto removed = _discardReplaceFile(url, StartPass::no); !removed)
        return std::unexpected(OSTCreateError(OSTErrorCode::replaceCleanupFailed, removed.error(),
                                              "Failed to remove replace file at %@", url));
    return {};
}

} // namespace ost
