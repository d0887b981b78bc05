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
#include "store/OSTSandboxItems.h"
#include "store/OSTStoreDelegate.h"

#include <cerrno>
#include <source_location>

namespace ost {

using platform::isAtOrBelow;
using platform::lastPathComponent;
using platform::pathByAppending;
using platform::pathByDeletingLastComponent;

namespace {

OSTError failedRecovery(const OSTReplaceFile& file, const OSTError& cause) {
    return OSTCreateError(OSTErrorCode::replaceFileInvalid, cause, "Failed to recover replace move: %@ to %@",
                          file.stagingURL, file.oldURL);
}

OSTResult<void> moveBack(const OSTReplaceFile& file) {
    const auto& files = OSTFileManager::defaultManager();
    platform::logDebug("Recovering from failed replace by moving: %@ to %@", file.stagingURL, file.oldURL);
    // Neither was seen, but one that could not be looked for may be there.
    const auto moved =
        files.itemDoesNotExistAtURL(file.oldURL) && files.itemDoesNotExistAtURL(file.destinationURL)
            ? files.moveItemAtURL(file.stagingURL, file.oldURL)
            : std::unexpected(OSTCreatePOSIXError(EAGAIN, "%@ or %@ may exist", file.oldURL, file.destinationURL));
    return moved ? moved : std::unexpected(failedRecovery(file, moved.error()));
}

/// Puts the old container back when neither it nor the new one is in place, and waits until what is in place is there
/// on disk. Without its file, what is in staging is thrown away.
OSTResult<void> recover(const OSTReplaceFile& file) {
    const auto& files = OSTFileManager::defaultManager();
    const bool newIsInPlace = files.itemExistsAtURL(file.destinationURL);
    if (!files.itemExistsAtURL(file.oldURL) && !newIsInPlace)
        OST_TRY(moveBack(file));
    const auto& place = newIsInPlace ? file.destinationURL : file.oldURL;
    const auto durable = files.makeDirectoryDurable(pathByDeletingLastComponent(place));
    return durable ? durable : std::unexpected(failedRecovery(file, durable.error()));
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
    bool sandboxIsTold = false; ///< of the destination

    [[nodiscard]] OSTResult<void> makeParkingDurable() const;
    [[nodiscard]] OSTError failedMove(const OSTError& cause,
                                      std::source_location where = std::source_location::current()) const;
};

/// The old container must be in staging, and out of its place, before the new one comes there: a power cut would leave
/// two of them, or none that a start could put back.
OSTResult<void> OSTClientConnection::ReplaceOperation::makeParkingDurable() const {
    if (!oldIsParked)
        return {};
    const auto durable = OSTFileManager::defaultManager().makeMoveDurable(oldContainer->url, stagingURL);
    if (!durable)
        return std::unexpected(OSTCreateError(OSTErrorCode::moveOldToStagingFailed, durable.error(),
                                              "Failed to move old %@ to staging %@", oldContainer->url, stagingURL));
    return {};
}

OSTError OSTClientConnection::ReplaceOperation::failedMove(const OSTError& cause, std::source_location where) const {
    const auto old = oldContainer ? std::optional(oldContainer->url) : std::nullopt;
    return OSTCreateErrorAt(where, OSTErrorCode::replacingMoveFailed, &cause, "Failed to replace: %@ with: %@ at: %@",
                            old, newContainer->url, destination);
}

std::expected<void, OSTErrorCode> OSTClientConnection::replaceContainer(const OSTReplacement& replacement) const {
    return OSTGuarded([&]() -> OSTResult<void> {
        OST_TRY(_checkReplacement(replacement));
        OSTAllIdentifiersLock lock(OSTLockKind::writing);
        ReplaceOperation operation;
        OST_TRY(_replaceOrRestore(replacement, operation));
        lock.unlock();
        // The new one must not be back where it was, as well. Its destination has been waited for.
        const auto source = pathByDeletingLastComponent(operation.newContainer->url);
        const auto durable = OSTFileManager::defaultManager().makeDirectoryDurable(source);
        return durable ? durable : std::unexpected(operation.failedMove(durable.error()));
    });
}

OSTResult<void> OSTClientConnection::_replaceOrRestore(const OSTReplacement& replacement,
                                                       ReplaceOperation& operation) const {
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
    if (operation.sandboxIsTold && !operation.newIsInPlace)
        _correctSandboxContainerMapping(operation.newContainer->name());
    if (!operation.replaceFileURL.empty())
        OST_TRY(_cleanUpReplacement(replacement, operation));
    return replaced;
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
            OST_TRY(_discardReplaceFilesOf(side->url));
    // A third container in the new one's place would be served no more, and stay on disk beside it.
    if (!operation.oldContainer || operation.oldContainer->identifier != operation.newContainer->identifier)
        OST_TRY(_checkNothingLives(operation));
    if (operation.oldContainer) {
        OST_TRY(_parkOldContainer(operation));
    } else {
        OST_TRY(OSTReplaceFile::makeDiscardsDurable()); // which the next replace file does otherwise
    }
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
    name.transient = operation.transient;
    const auto living = OSTContainerCache::sharedInstance().containerForUser(name);
    if (living && operation.oldContainer && (*living)->url == operation.newContainer->url) // no third one
        return {};
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
    OSTMetadata metadata = *operation.newContainer;
    if (replacement.preserveOldUUID) {
        // A container that has taken its place has its UUID for good, whatever happens then.
        metadata.uuid = *replacement.oldContainer.uuid;
        operation.newHasOldUUID = true;
        OST_TRY(metadata.writeMetadataToDisk());
    }
    OST_TRY(operation.makeParkingDurable());
    if (!operation.transient)
        OSTNoteSandboxItem(metadata);
    if (const auto moved = files.moveItemAtURL(operation.newContainer->url, destination); !moved)
        return std::unexpected(operation.failedMove(moved.error()));
    operation.newIsInPlace = true;
    operation.sandboxIsTold = true; // first, so that one commit of the file system makes both durable
    if (!_setSandboxContainerMappingForUser(name, destination))
        platform::logError("Failed to set container mapping in replace operation of %@, %llu", *name.identifier,
                           name.containerClass);
    // Before the replace file goes, which would otherwise be gone after a power cut while the move had not happened. A
    // move that cannot be made sure of is taken back.
    const auto durable = files.makeDirectoryDurable(pathByDeletingLastComponent(destination));
    if (!durable && files.moveItemAtURL(destination, operation.newContainer->url)) {
        operation.newIsInPlace = false;
        // Where it is again, before anybody makes durable that it has left its destination.
        static_cast<void>(files.makeDirectoryDurable(pathByDeletingLastComponent(operation.newContainer->url)));
        return std::unexpected(operation.failedMove(durable.error()));
    }

    OST_TRY(_forgetContainer(name));
    metadata.url = destination;
    metadata.transient = operation.transient;
    const auto added = OSTContainerCache::sharedInstance().addContainerMetadata(metadata);
    if (!added)
        return std::unexpected(OSTCreateError(OSTErrorCode::cacheAddFailed, added.error(),
                                              "Failed to add to cache: %@, url: %@, transient: %d", metadata,
                                              destination, operation.transient));
    if (!durable) { // and could not be taken back: the next start decides by what has reached the disk
        operation.replaceFileURL.clear();
        return std::unexpected(operation.failedMove(durable.error()));
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
    OSTReplaceFile::wasDiscarded();
    return moved;
}

OSTResult<void> OSTClientConnection::_settleReplacementsAt(std::string_view place) const {
    OST_TRY(_discardReplaceFilesOf(place));
    return OSTReplaceFile::makeDiscardsDurable();
}

OSTResult<void> OSTClientConnection::_discardReplaceFilesOf(std::string_view place) const {
    const auto& files = OSTFileManager::defaultManager();
    const auto directory = OSTGlobalConfiguration::sharedInstance().replaceDirectoryPath();
    const auto items = files.urlsForItemsInDirectoryAtURL(directory);
    if (!items && !platform::isAbsence(items.error()))
        return std::unexpected(OSTCreateError(OSTErrorCode::replaceFileInvalid, items.error(),
                                              "Failed to get items at replace URL%@ : %@", directory, items.error()));
    for (const auto& item : items.value_or(std::vector<OSTDirectoryItem>())) {
        const auto url = pathByAppending(directory, item.name);
        const auto file = OSTReplaceFile::readReplaceFileAtUrl(url);
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
    const auto file = OSTReplaceFile::_readAndValidateReplaceFileAtUrl(url);
    // What is parked in staging waits with its file until that can be read again.
    if (!file && platform::isReasonThatPasses(file.error()))
        return {};
    // A file that is not valid is in the log, and is only discarded.
    if (file) {
        platform::logDebug("Doing a replace of %@ with info: %@", url, *file);
        OST_TRY(recover(*file));
    }
    if (const auto removed = _discardReplaceFile(url, StartPass::no); !removed)
        return std::unexpected(OSTCreateError(OSTErrorCode::replaceCleanupFailed, removed.error(),
                                              "Failed to remove replace file at %@", url));
    return {};
}

} // namespace ost
