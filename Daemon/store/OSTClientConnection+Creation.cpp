#include "files/OSTFileManager.h"
#include "model/OSTFailureReport.h"
#include "model/OSTGlobalConfiguration.h"
#include "platform/base/Path.h"
#include "platform/base/UUID.h"
#include "store/OSTClientConnection.h"
#include "store/OSTContainerCache.h"
#include "store/OSTLocks.h"
#include "store/OSTStoreDelegate.h"

#include <array>
#include <span>

namespace ost {

using platform::lastPathComponent;
using platform::pathByAppending;
using platform::pathByDeletingLastComponent;

namespace {

/// Owner and group of everything inside a system container; what its services may do there, an access-control list
/// says.
constexpr std::uint32_t systemContentOwner = 4294967294;

constexpr std::array<std::string_view, 5> dataSubDirectories = {"Documents", "Library", "Library/Caches",
                                                                "Library/Preferences", "tmp"};
constexpr std::array<std::string_view, 2> groupSubDirectories = {"Library", "Library/Caches"};

std::span<const std::string_view> subDirectoriesOf(OSTContainerClass containerClass) {
    if (isBundleClass(containerClass))
        return {};
    if (containerClass == OSTContainerClass::sharedAppGroup || containerClass == OSTContainerClass::sharedSystemGroup)
        return groupSubDirectories;
    return dataSubDirectories;
}

/// The record of a container as the answer of the look-up that made it: later ones get the shared record.
OSTMetadataRecord asMadeNow(const OSTMetadata& record) {
    auto copy = std::make_shared<OSTMetadata>(record);
    copy->existed = false;
    return copy;
}

} // namespace

std::expected<OSTMetadataRecord, OSTErrorCode>
OSTClientConnection::createOrLookupContainerForUser(const OSTContainerLookup& lookup) const {
    return OSTGuarded([&]() -> OSTResult<OSTMetadataRecord> {
        OST_TRY(_checkLookup(lookup));
        std::string staging;
        auto entry = OSTGuarded([&] { return _lookUpOrCreate(lookup, staging); });
        if (!staging.empty()) {
            if (const auto cleared = _moveItemAtURLToDeathRow(staging, StartPass::yes); !cleared)
                return std::unexpected(OSTCreateError(OSTErrorCode::stagingRemovalFailed, cleared.error(),
                                                      "Failed to remove staging dir: %@", staging));
        }
        const auto [record, placement] = OST_TRY(std::move(entry));
        if (placement == OSTPlacement::pending)
            OST_TRY(_makePlaceDurable(*record));
        return record;
    });
}

OSTResult<void> OSTClientConnection::_makePlaceDurable(const OSTMetadata& record) {
    const auto durable = OSTFileManager::defaultManager().makeDirectoryDurable(pathByDeletingLastComponent(record.url));
    if (!durable)
        return std::unexpected(OSTCreateError(OSTErrorCode::moveToLiveFailed, durable.error(),
                                              "Failed to make sure of live dir: %@", record.url));
    OSTContainerCache::sharedInstance().placementReachedDisk(record);
    return {};
}

OSTResult<void> OSTClientConnection::_checkLookup(const OSTContainerLookup& lookup) const {
    const auto& [userId, containerClass, identifier, transient] = lookup.name;
    if (!identifier || !isValidContainerClass(containerClass))
        return std::unexpected(OSTCreateError(OSTErrorCode::invalidObject,
                                              "Can't act on an invalid object: userId: %u, ID: %@, class: %ld", userId,
                                              identifier, containerClass));
    if (!OSTUserIdFitsClass(containerClass, userId))
        return std::unexpected(OSTCreateError(OSTErrorCode::invalidObject, "Invalid userId %u for class %ld, ID: %@",
                                              userId, containerClass, *identifier));
    if (containerClass == OSTContainerClass::dataSystem && !_identity.allowOtherIdLookup &&
        !OSTStoreDelegate::shared().identifierHasSystemContainer(*identifier))
        return std::unexpected(OSTCreateError(OSTErrorCode::notEntitled,
                                              "%@ not entitled for a system container, but %@ is trying", *identifier,
                                              _identity.clientBundleIdentifier));
    return {};
}

OSTResult<OSTCacheEntry> OSTClientConnection::_lookUpOrCreate(const OSTContainerLookup& lookup,
                                                              std::string& staging) const {
    {
        // Look-ups change nothing, but for the transient container that is thrown away.
        const OSTAllIdentifiersLock lock(lookup.name.transient ? OSTLockKind::writing : OSTLockKind::reading,
                                         lookup.useLocking);
        const auto found = OST_TRY(_lookUp(lookup));
        if (found.entry.record)
            return found.entry;
        if (found.threwTransientAway)
            return _putInPlaceOfThrownAway(lookup.name, staging);
        if (!lookup.useLocking)
            return _putInPlace(OST_TRY(_buildInStaging(lookup.name, staging)), staging);
    }
    // Building waits for the disk. Without the lock, creations do so side by side and share the disk's commits.
    auto built = OST_TRY(_buildInStaging(lookup.name, staging));
    const OSTAllIdentifiersLock lock(OSTLockKind::writing);
    const auto made = OST_TRY(_lookUp(lookup)); // by another creation meanwhile
    return made.entry.record ? made.entry : _putInPlace(std::move(built), staging);
}

OSTResult<OSTCacheEntry> OSTClientConnection::_putInPlaceOfThrownAway(const OSTContainerName& name,
                                                                      std::string& staging) {
    // Under the lock of the look-up, because the cache still has the container that was thrown away.
    auto made = OSTGuarded(
        [&]() -> OSTResult<OSTCacheEntry> { return _putInPlace(OST_TRY(_buildInStaging(name, staging)), staging); });
    if (!made)
        // Or what has passed when the next creation comes would be its failure for good.
        static_cast<void>(OSTContainerCache::sharedInstance().removeContainerForUser(name));
    return made;
}

OSTResult<OSTClientConnection::LookUpResult> OSTClientConnection::_lookUp(const OSTContainerLookup& lookup) const {
    const auto found = OSTContainerCache::sharedInstance().entryForUser(lookup.name);
    if (found && !lookup.name.transient)
        return LookUpResult{.entry = *found};
    if (lookup.createIfNecessary && (found || found.error().is(OSTErrorCode::notFound)))
        OST_TRY(_checkNewIdentifier(lookup.name));
    if (found) {
        // A transient container is never reused.
        const auto& url = found->record->url;
        auto removed = _settleReplacementsAt(url);
        if (removed)
            removed = _moveItemAtURLToDeathRow(url, StartPass::yes);
        if (removed && !lookup.createIfNecessary) // else the wait for the new one's place carries it
            removed = OSTFileManager::defaultManager().makeDirectoryDurable(pathByDeletingLastComponent(url));
        if (!removed)
            return std::unexpected(OSTCreateError(OSTErrorCode::transientRemovalFailed, removed.error(),
                                                  "Failed to remove transient container at %@", url));
    } else if (!found.error().is(OSTErrorCode::notFound)) {
        return std::unexpected(found.error());
    }
    if (!lookup.createIfNecessary)
        return std::unexpected(OSTCreateError(OSTErrorCode::notFound, OSTLogging::silent, nullptr,
                                              "Container with identifier: \"%@\" Not Found", lookup.name.identifier));
    return LookUpResult{.threwTransientAway = found.has_value()};
}

OSTResult<void> OSTClientConnection::_checkNewIdentifier(const OSTContainerName& name) {
    if (name.identifier->size() <= OSTLongestIdentifier)
        return {};
    return std::unexpected(OSTCreateError(
        OSTErrorCode::invalidObject, "Can't make a container with an identifier of %llu bytes: userId: %u, class: %ld",
        name.identifier->size(), name.userId, name.containerClass));
}

OSTResult<OSTMetadata> OSTClientConnection::_buildInStaging(const OSTContainerName& name, std::string& staging) {
    staging = pathByAppending(OSTGlobalConfiguration::sharedInstance().stagingDirectory(),
                              platform::UUID::generate().string());
    if (const auto made = _createTopLevelContainerDirectory(staging, name.containerClass, name.userId); !made)
        return std::unexpected(OSTCreateError(OSTErrorCode::stagingCreationFailed, made.error(),
                                              "Failed to create staging dir at %@ : %@", staging, made.error()));
    OSTMetadata metadata{.uid = name.userId,
                         .uuid = platform::UUID::generate(),
                         .containerClass = name.containerClass,
                         .identifier = std::string(*name.identifier),
                         .url = staging,
                         .transient = name.transient};
    auto pendingFile = OST_TRY(metadata.writeMetadataToNewDirectory());
    if (isSystemClass(name.containerClass))
        OST_TRY(OSTFileManager::defaultManager().setTopLevelSystemContainerACLAtURL(staging));
    OST_TRY(_createSubDirectories(staging, name.userId, name.containerClass));
    // All of it at the end, so that the first of the file system's commits carries the rest.
    OST_TRY(metadata.makeMetadataDurable(std::move(pendingFile)));
    OST_TRY(_makeSubDirectoriesDurable(staging, name.containerClass));
    return metadata;
}

OSTResult<OSTCacheEntry> OSTClientConnection::_putInPlace(OSTMetadata metadata, std::string& staging) {
    const auto liveParent = OSTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(
        metadata.uid, metadata.containerClass, metadata.transient);
    const auto liveName = OSTStoreDelegate::shared()
                              .wellknownContainerForId(metadata.identifier, metadata.containerClass)
                              .value_or(std::string(lastPathComponent(staging)));
    const auto liveURL = pathByAppending(liveParent.value_or(std::string()), liveName);
    const auto moved = liveParent ? OSTFileManager::defaultManager().moveItemAtURL(staging, liveURL)
                                  : OSTResult<void>(std::unexpected(OSTCreatePOSIXError(
                                        liveParent.error(), "User %u has no container directories", metadata.uid)));
    if (!moved)
        return std::unexpected(OSTCreateError(OSTErrorCode::moveToLiveFailed, moved.error(),
                                              "Failed to move staging dir: %@ to live dir: %@", staging, liveURL));
    staging.clear();

    metadata.url = liveURL;
    const auto added = OSTContainerCache::sharedInstance().addContainerMetadata(metadata, OSTPlacement::pending);
    if (!added)
        return std::unexpected(OSTCreateError(OSTErrorCode::cacheAddFailed, added.error(),
                                              "Failed to add to cache for %u : %@, url: %@, transient: %d",
                                              metadata.uid, metadata, liveURL, metadata.transient));
    return OSTCacheEntry{asMadeNow(**added), OSTPlacement::pending};
}

OSTResult<void> OSTClientConnection::_createTopLevelContainerDirectory(const std::string& url,
                                                                       OSTContainerClass containerClass,
                                                                       std::uint32_t owner) {
    if (isBundleClass(containerClass))
        owner = OSTInstallerUserId;
    else if (isSystemClass(containerClass))
        owner = OSTRootUserId;
    return OSTFileManager::defaultManager().createDirectoryAtURL(
        url, {.withIntermediateDirectories = true, .mode = 0755, .owner = owner, .protectionClass = 0});
}

OSTResult<void> OSTClientConnection::_createSubDirectories(const std::string& url, std::uint32_t userId,
                                                           OSTContainerClass containerClass) {
    const bool system = isSystemClass(containerClass);
    for (const auto name : subDirectoriesOf(containerClass)) {
        const auto made = _createDefaultDirectory(pathByAppending(url, name), system ? 0 : 0755,
                                                  system ? systemContentOwner : userId);
        if (!made)
            return std::unexpected(OSTCreateError(OSTErrorCode::subDirectoryCreationFailed, made.error(),
                                                  "Failed to create sub-dir at %@%@", url, name));
    }
    return {};
}

OSTResult<void> OSTClientConnection::_makeSubDirectoriesDurable(const std::string& url,
                                                                OSTContainerClass containerClass) {
    for (const auto name : subDirectoriesOf(containerClass)) {
        const auto durable = OSTFileManager::defaultManager().makeDirectoryDurable(pathByAppending(url, name));
        if (!durable)
            return std::unexpected(OSTCreateError(OSTErrorCode::subDirectoryCreationFailed, durable.error(),
                                                  "Failed to create sub-dir at %@%@", url, name));
    }
    return {};
}

OSTResult<void> OSTClientConnection::_createDefaultDirectory(const std::string& url, std::uint16_t mode,
                                                             std::uint32_t owner) {
    return OSTFileManager::defaultManager().createDirectoryAtURL(
        url, {.withIntermediateDirectories = true, .mode = mode, .owner = owner});
}

std::expected<std::vector<OSTMetadataRecord>, OSTErrorCode>
OSTClientConnection::containersForUser(std::uint32_t userId, OSTContainerClass containerClass, bool transient) const {
    return OSTGuarded([&]() -> OSTResult<std::vector<OSTMetadataRecord>> {
        if (!isValidContainerClass(containerClass))
            return std::unexpected(OSTCreateError(OSTErrorCode::invalidObject,
                                                  "Can't act on an invalid container-userId: %u, class: %ld", userId,
                                                  containerClass));
        OSTAllIdentifiersLock lock(OSTLockKind::reading);
        const auto entries =
            OST_TRY(OSTContainerCache::sharedInstance().allEntriesForUser(userId, containerClass, transient));
        lock.unlock();
        std::vector<OSTMetadataRecord> records;
        records.reserve(entries.size());
        // What may be forgotten in a power cut is not said to be there; the log has the reason.
        for (const auto& [record, placement] : entries)
            if (placement == OSTPlacement::durable || _makePlaceDurable(*record))
                records.push_back(record);
        return records;
    });
}

} // namespace ost
