#include "files/OSTFileManager.h"
#include "model/OSTFailureReport.h"
#include "platform/base/Log.h"
#include "platform/threads/BlockingSection.h"
#include "store/OSTClientConnection.h"
#include "store/OSTContainerCache.h"
#include "store/OSTLocks.h"

#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <thread>

namespace ost {

using platform::logError;

namespace {

constexpr const char* staticDiskUsageKey = "com.tamarok.Tessaly.StaticDiskUsage";
constexpr const char* crashCounterKey = "CrashCounter";
constexpr std::string_view retryTestIdentifier = "com.tamarok.retryTest";

/// How long a client has before the daemon ends.
constexpr std::chrono::seconds timeBeforeCrash{2};

OSTContainerReference referenceTo(const OSTMetadata& record) { return {.name = record.name(), .uuid = record.uuid}; }

/// How often the retry test still has to crash. A counter of 0 is what a test left that could not remove it.
std::uint64_t crashesRemaining(const OSTMetadata& record, std::uint64_t asked) {
    const auto* const counter = record.info ? record.info->find(crashCounterKey) : nullptr;
    const auto value = counter ? counter->unsignedValue() : std::nullopt;
    if (!value)
        return asked;
    const auto left = static_cast<std::uint32_t>(*value);
    return left == 0 ? 0 : left - 1;
}

[[noreturn]] void crashForRetryTest() {
    logError("Crashing");
    {
        const platform::BlockingSection blocking;
        std::this_thread::sleep_for(timeBeforeCrash);
    }
    ::_exit(0);
}

} // namespace

std::expected<void, OSTErrorCode>
OSTClientConnection::deleteDataContainerContentForUser(const OSTContainerName& name) const {
    return OSTGuarded([&]() -> std::expected<void, OSTErrorCode> {
        OST_TRY(_checkWipe(name));
        const auto existing = createOrLookupContainerForUser({.name = name});
        if (!existing) {
            logError("Failed to lookup existing container to wipe-identifier: %@", name.identifier);
            return std::unexpected(existing.error());
        }
        auto transientName = name;
        transientName.transient = true;
        const auto fresh = createOrLookupContainerForUser({.name = transientName, .createIfNecessary = true});
        if (!fresh) {
            logError("Failed to create transient container for wipe-identifier: %@", name.identifier);
            return std::unexpected(fresh.error());
        }
        const auto replaced = replaceContainer({.oldContainer = referenceTo(**existing),
                                                .newContainer = referenceTo(**fresh),
                                                .preserveOldUUID = true,
                                                .startDeletionThread = true});
        if (!replaced)
            logError("Failed replace operation during delete all content");
        return replaced;
    });
}

std::expected<void, OSTErrorCode> OSTClientConnection::_checkWipe(const OSTContainerName& name) const {
    const auto& [userId, containerClass, identifier, transient] = name;
    if (!identifier) {
        logError("Can't wipe container with nil identifier: %@, userId: %u", identifier, userId);
        return std::unexpected(OSTErrorCode::noIdentifier);
    }
    if (!isPerUserClass(containerClass)) {
        logError("Can't wipe container non-data container of type: %llu, identifier: %@, userId: %u", containerClass,
                 *identifier, userId);
        return std::unexpected(OSTErrorCode::invalidObject);
    }
    if (_identity.allowOtherIdLookup)
        return {};
    if (containerClass != OSTContainerClass::dataLoomworkPlugin) {
        logError("Can't wipe container with of type: %llu, identifier: %@, userId: %u", containerClass, *identifier,
                 userId);
        return std::unexpected(OSTErrorCode::invalidObject);
    }
    const auto& entitled = _identity.entitledWipeIdentifiers;
    if (!entitled || std::ranges::find(*entitled, *identifier) == entitled->end()) {
        logError("Not entitled to wipe container with identifier: %@", *identifier);
        return std::unexpected(OSTErrorCode::notEntitled);
    }
    return {};
}

std::expected<std::uint64_t, OSTErrorCode>
OSTClientConnection::diskUsageForUserId(const OSTContainerReference& container) const {
    return OSTGuarded([&]() -> std::expected<std::uint64_t, OSTErrorCode> {
        const auto& [name, uuid] = container;
        if (!uuid || !isValidContainerClass(name.containerClass)) {
            logError("Can't act on an invalid object: userId: %u, UUID: %@, Class: %ld", name.userId, uuid,
                     name.containerClass);
            return std::unexpected(OSTErrorCode::invalidObject);
        }
        auto found = OST_TRY(_placeAndKnownUsage(container));
        if (found.usage)
            return *found.usage;
        // Measuring takes as long as the tree is large. It goes by descriptors, so it needs no lock, which would keep
        // every creation waiting.
        const platform::BlockingSection blocking;
        found.usage = OSTFileManager::defaultManager().diskUsageForURL(found.url);
        if (isBundleClass(name.containerClass))
            _keepUsage(container, found);
        return *found.usage;
    });
}

void OSTClientConnection::_keepUsage(const OSTContainerReference& container, const PlaceAndUsage& measured) const {
    const auto& [name, uuid] = container;
    const OSTIdentifierLock lock({uuid->string()}, OSTLockKind::writing);
    // A container that has replaced the measured one may have its place and UUID.
    const auto directory = OSTFileManager::defaultManager().identityOfItemAtURL(measured.url);
    if (!directory || *directory != measured.directory)
        return;
    const auto set = setInfoValue(OSTValue(*measured.usage), staticDiskUsageKey, container, OSTUseLocking::no);
    if (!set)
        logError("Error setting info value for userId: %u, identifier: %@, Class: %llu: %llu", name.userId,
                 name.identifier, name.containerClass, set.error());
}

std::expected<OSTClientConnection::PlaceAndUsage, OSTErrorCode>
OSTClientConnection::_placeAndKnownUsage(const OSTContainerReference& container) const {
    const auto& [name, uuid] = container;
    const OSTIdentifierLock lock({uuid->string()}, OSTLockKind::writing);
    const auto record =
        name.identifier ? OST_TRY(OSTContainerCache::sharedInstance().containerForUser(name, *uuid)) : nullptr;
    if (!record) {
        logError("No Container with userId: %u UUID: %@, identifier: %@, Class: %ld", name.userId, uuid,
                 name.identifier, name.containerClass);
        return std::unexpected(OSTErrorCode::notFound);
    }
    PlaceAndUsage found{.url = record->url};
    if (!isBundleClass(name.containerClass))
        return found;
    const auto value = infoValueForKey(staticDiskUsageKey, container, OSTUseLocking::no);
    if (value && value->isNumber())
        found.usage = value->unsignedValue();
    else if (!value && value.error() != OSTErrorCode::noInfoValue)
        logError("Error looking up info value for userId: %u, identifier: %@, Class: %llu: %llu", name.userId,
                 name.identifier, name.containerClass, value.error());
    if (found.usage)
        return found;
    if (const auto directory = OSTFileManager::defaultManager().identityOfItemAtURL(record->url))
        found.directory = *directory;
    return found;
}

std::expected<void, OSTErrorCode> OSTClientConnection::retryTestForUser(std::uint32_t userId,
                                                                        std::uint64_t crashes) const {
    return OSTGuarded([&]() -> std::expected<void, OSTErrorCode> {
        const auto record =
            createOrLookupContainerForUser({.name = {.userId = userId,
                                                     .containerClass = OSTContainerClass::dataApplication,
                                                     .identifier = retryTestIdentifier},
                                            .createIfNecessary = true});
        if (!record) {
            logError("Failed to create or lookup lookup existing container for retry test: %@", retryTestIdentifier);
            return std::unexpected(record.error());
        }
        const auto remaining = crashesRemaining(**record, crashes);
        logError("Crashes Remaining in retry test: %llu", remaining);
        OST_TRY(setInfoValue(OSTValue(remaining), crashCounterKey, referenceTo(**record)));
        if (remaining != 0)
            crashForRetryTest();
        const auto removed = stageForDeleteContainer(**record);
        if (removed)
            logError("Returning Successfully");
        else
            logError("Failed to delete retry container at : %@", (*record)->url);
        return removed;
    });
}

} // namespace ost
