#include "files/OSTFileManager.h"
#include "model/OSTFailureReport.h"
#include "platform/base/Log.h"
#include "platform/base/Path.h"
#include "store/OSTClientConnection.h"
#include "store/OSTContainerCache.h"
#include "store/OSTLocks.h"
#include "store/OSTSandboxItems.h"
#include "store/OSTStoreDelegate.h"

#include <cerrno>

namespace ost {

using platform::lastPathComponent;
using platform::pathByAppending;
using platform::pathByDeletingLastComponent;

namespace {

OSTResult<void> checkReference(const OSTContainerReference& container) {
    if (!container.uuid || !isValidContainerClass(container.name.containerClass))
        return std::unexpected(OSTCreateError(OSTErrorCode::invalidObject,
                                              "Can't act on an invalid object: userId: %u, UUID: %@, Class: %ld",
                                              container.name.userId, container.uuid, container.name.containerClass));
    return {};
}

bool holdsInfo(const OSTMetadata& metadata, const std::shared_ptr<const OSTDictionary>& info) {
    return metadata.info && info ? *metadata.info == *info : metadata.info == info;
}

/// A write that failed at its last step has put a file in place that may not last. One that cannot be read may be that.
void takeBackWhatWasWritten(const OSTMetadata& record) {
    const auto onDisk = OSTMetadata::readAndValidateMetadataAtUrl(record.url, record.uid, OSTCheckClassPath::no);
    if (!onDisk || !holdsInfo(*onDisk, record.info))
        static_cast<void>(record.writeMetadataToDisk());
}

OSTResult<OSTMetadataRecord> putIntoCache(const OSTMetadata& metadata, OSTPlacement placement) {
    auto added = OSTContainerCache::sharedInstance().addContainerMetadata(metadata, placement);
    if (!added)
        return std::unexpected(OSTCreateError(OSTErrorCode::cacheAddFailed, added.error(),
                                              "Failed to add to cache: %@, url: %@, transient: %d", metadata,
                                              metadata.url, metadata.transient));
    return added;
}

OSTError failedMove(const std::string& from, const std::string& to, const OSTError& cause) {
    return OSTCreateError(OSTErrorCode::moveToNewUUIDFailed, cause, "Failed to move dir: %@ to new UUID dir: %@", from,
                          to);
}

OSTResult<void> moveDirectory(const OSTMetadata& record, const std::string& to) {
    const auto wellknownName =
        OSTStoreDelegate::shared().wellknownContainerForId(record.identifier, record.containerClass);
    if (wellknownName == lastPathComponent(record.url))
        return std::unexpected(
            failedMove(record.url, to, OSTCreatePOSIXError(EBUSY, "%@ is a name that others know", *wellknownName)));
    if (const auto moved = OSTFileManager::defaultManager().moveItemAtURL(record.url, to); !moved)
        return std::unexpected(failedMove(record.url, to, moved.error()));
    return {};
}

template<typename T>
std::expected<T, OSTErrorCode> valueOrCode(OSTResult<T> result) {
    if (!result)
        return std::unexpected(result.error().code());
    if constexpr (std::is_void_v<T>)
        return {};
    else
        return *std::move(result);
}

} // namespace

OSTResult<OSTMetadataRecord> OSTClientConnection::_container(const OSTContainerReference& container) {
    const auto& [name, uuid] = container;
    auto entry = OST_TRY(OSTContainerCache::sharedInstance().entryForUser(name, *uuid));
    if (!entry.record)
        return std::unexpected(OSTCreateError(OSTErrorCode::notFound,
                                              "No Container with userId: %u UUID: %@, identifier: %@, Class: %ld",
                                              name.userId, uuid->string(), name.identifier, name.containerClass));
    // What is answered, or done inside, must not get lost with the container.
    if (entry.placement == OSTPlacement::pending)
        OST_TRY(_makePlaceDurable(*entry.record));
    return entry.record;
}

std::expected<void, OSTErrorCode> OSTClientConnection::setInfoValue(const std::optional<OSTValue>& value,
                                                                    std::optional<std::string_view> key,
                                                                    const OSTContainerReference& container,
                                                                    OSTUseLocking useLocking) const {
    return valueOrCode(OSTGuarded([&]() -> OSTResult<void> {
        OST_TRY(checkReference(container));
        if (!key)
            return std::unexpected(
                OSTCreateError(OSTErrorCode::invalidParameter, "Can't set nil or non-VxString key: %@", key));
        if (value && key->size() > OSTLongestIdentifier)
            return std::unexpected(
                OSTCreateError(OSTErrorCode::invalidParameter, "Can't set a key of %llu bytes", key->size()));
        const OSTIdentifierLock lock({container.uuid->string()}, OSTLockKind::writing,
                                     useLocking == OSTUseLocking::yes);
        const auto record = OST_TRY(_container(container));
        OSTDictionary info = record->info ? *record->info : OSTDictionary();
        if (value)
            info.set(std::string(*key), *value);
        else
            info.remove(*key);
        return _changeInfo(*record, std::move(info));
    }));
}

OSTResult<void> OSTClientConnection::_changeInfo(const OSTMetadata& record, OSTDictionary info) {
    OSTMetadata changed = record;
    changed.info = info.empty() ? nullptr : std::make_shared<const OSTDictionary>(std::move(info));
    if (auto written = changed.writeMetadataToDisk(); !written) {
        takeBackWhatWasWritten(record);
        return written;
    }
    OST_TRY(putIntoCache(changed, OSTPlacement::durable));
    return {};
}

std::expected<OSTValue, OSTErrorCode> OSTClientConnection::infoValueForKey(std::optional<std::string_view> key,
                                                                           const OSTContainerReference& container,
                                                                           OSTUseLocking useLocking) const {
    return valueOrCode(OSTGuarded([&]() -> OSTResult<OSTValue> {
        OST_TRY(checkReference(container));
        if (!key)
            return std::unexpected(
                OSTCreateError(OSTErrorCode::invalidParameter, "Can't get nil or non-VxString key: %@", key));
        const OSTIdentifierLock lock({container.uuid->string()}, OSTLockKind::reading,
                                     useLocking == OSTUseLocking::yes);
        const auto record = OST_TRY(_container(container));
        const OSTValue* const value = record->info ? record->info->find(*key) : nullptr;
        if (!value)
            return std::unexpected(OSTCreateError(OSTErrorCode::noInfoValue, OSTLogging::silent, nullptr,
                                                  "Didn't find info value for key: %@", *key));
        return *value;
    }));
}

std::expected<OSTMetadataRecord, OSTErrorCode>
OSTClientConnection::metadataForUser(const OSTContainerReference& container) const {
    return valueOrCode(OSTGuarded([&]() -> OSTResult<OSTMetadataRecord> {
        OST_TRY(checkReference(container));
        const OSTIdentifierLock lock({container.uuid->string()}, OSTLockKind::reading);
        return _container(container);
    }));
}

std::expected<void, OSTErrorCode>
OSTClientConnection::recreateDefaultStructureForUser(const OSTContainerReference& container) const {
    return valueOrCode(OSTGuarded([&]() -> OSTResult<void> {
        OST_TRY(checkReference(container));
        const OSTIdentifierLock lock({container.uuid->string()}, OSTLockKind::writing);
        const auto record = OST_TRY(_container(container));
        OST_TRY(_createSubDirectories(record->url, container.name.userId, record->containerClass));
        const auto& files = OSTFileManager::defaultManager();
        if (!isSystemClass(record->containerClass)) {
            OST_TRY(_makeSubDirectoriesDurable(record->url, record->containerClass));
            return files.makeDirectoryDurable(record->url);
        }
        OST_TRY(files.standardizeACLsForSystemContainerAtURL(record->url));
        return files.makeFileSystemDurable(record->url); // any item may have changed
    }));
}

std::expected<void, OSTErrorCode>
OSTClientConnection::regenerateDirectoryUUIDForUser(const OSTContainerReference& container) const {
    return valueOrCode(OSTGuarded([&]() -> OSTResult<void> {
        OST_TRY(checkReference(container));
        const auto [old, moved] = OST_TRY(_moveToNewUUID(container));
        // Without the lock: look-ups do not wait for the disk meanwhile, and make sure of the place themselves.
        if (const auto durable = _makePlaceDurable(*moved); !durable)
            return std::unexpected(failedMove(old->url, moved->url, durable.error()));
        return {};
    }));
}

OSTResult<OSTClientConnection::MovedContainer>
OSTClientConnection::_moveToNewUUID(const OSTContainerReference& container) const {
    const OSTIdentifierLock lock({container.uuid->string()}, OSTLockKind::writing);
    auto record = OST_TRY(_container(container));
    OSTMetadata changed = *record;
    changed.url = pathByAppending(pathByDeletingLastComponent(record->url), platform::UUID::generate().string());
    OST_TRY(_settleReplacementsAt(record->url));
    // The sandbox's item is that of the live container of the name.
    if (!record->transient)
        OSTNoteSandboxItem(*record);
    OST_TRY(moveDirectory(*record, changed.url));
    if (!record->transient && !_setSandboxContainerMappingForUser(record->name(), changed.url))
        platform::logError("Failed to set container mapping in regenerate operation of %@, %llu", record->identifier,
                           record->containerClass);
    return MovedContainer{.before = std::move(record), .after = OST_TRY(putIntoCache(changed, OSTPlacement::pending))};
}

} // namespace ost
