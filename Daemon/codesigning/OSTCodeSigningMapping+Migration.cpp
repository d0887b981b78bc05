#include "codesigning/OSTCodeSigningMapping.h"
#include "codesigning/OSTGroupManager.h"
#include "files/OSTDictionaryFile.h"
#include "files/OSTFileManager.h"
#include "model/OSTFailureReport.h"
#include "model/OSTGlobalConfiguration.h"
#include "model/OSTMigrationMarker.h"
#include "platform/base/Log.h"
#include "platform/base/Path.h"
#include "platform/base/Try.h"
#include "store/OSTClientConnection.h"
#include "store/OSTContainerCache.h"
#include "store/OSTLocks.h"

#include <algorithm>
#include <cerrno>
#include <functional>

namespace ost {

using platform::logDebug;
using platform::logError;
using platform::logNotice;

namespace {

constexpr std::string_view groupMarker = "ost_group_id_migration_complete.plist";
constexpr std::string_view codeSigningMarker = "ost_code_signing_migration_complete.plist";
constexpr std::string_view legacyFileName = "ost_entitlements.plist";

constexpr const char* groupIdsKey = "com.tamarok.Tessaly.GroupContainerIDs";

/// A container whose info values hold what is migrated, and that value.
struct Holder {
    OSTMetadataRecord container;
    OSTValue value;
};

void appendHolders(const std::vector<OSTMetadataRecord>& containers, const char* key, std::vector<Holder>& holders) {
    for (const auto& container : containers)
        if (const auto* const value = container->info ? container->info->find(key) : nullptr)
            holders.push_back({container, *value});
}

OSTMetadata withoutInfoValue(const OSTMetadata& container, const char* key) {
    OSTMetadata cleared = container;
    OSTDictionary info = *container.info;
    info.remove(key);
    cleared.info = info.empty() ? nullptr : std::make_shared<const OSTDictionary>(std::move(info));
    return cleared;
}

/// Removes a migrated info value from all its holders. The all-identifiers lock is held, so everybody waits meanwhile.
void clearInfoValues(const std::vector<Holder>& holders, const char* key,
                     const std::function<void(const OSTMetadata&, OSTErrorCode)>& failed) {
    std::vector<OSTMetadata> cleared;
    cleared.reserve(holders.size());
    for (const auto& holder : holders)
        cleared.push_back(withoutInfoValue(*holder.container, key));
    const auto written = OSTMetadata::writeMetadataToDisk(cleared);
    for (std::size_t i = 0; i < cleared.size(); ++i) {
        if (!written[i])
            failed(cleared[i], written[i].error().code());
        else if (const auto added = OSTContainerCache::sharedInstance().addContainerMetadata(cleared[i]); !added)
            failed(cleared[i], added.error().code());
    }
}

std::shared_ptr<const OSTDictionary> infoWithEntitlements(const OSTValue& entitlements) {
    return std::make_shared<const OSTDictionary>(std::vector<OSTDictionary::Entry>{{OSTEntitlementsKey, entitlements}});
}

/// What the legacy file says of identifiers, beside their entitlements, under keys of its own.
struct LegacyDetails {
    OSTDictionary children;
    OSTDictionary registeredByCaller;
    OSTDictionary placeholders;

    static LegacyDetails takenFrom(OSTDictionary& legacy) {
        return {.children = _take(legacy, "com.tamarok.Ostrand.ChildPluginBundleIDs"),
                .registeredByCaller = _take(legacy, "com.tamarok.Ostrand.EntitlementsRegisteredByCaller"),
                .placeholders = _take(legacy, "com.tamarok.Ostrand.PlaceholderEntitlements")};
    }

    [[nodiscard]] OSTCodeSigningEntry entry(const std::string& identifier, const OSTValue& entitlements) const {
        const auto* const registered = registeredByCaller.find(identifier);
        const bool byCaller = registered && registered->truthValue();
        return {.codeSigningInfo = infoWithEntitlements(entitlements),
                .childBundleIdentifiers = _childrenOf(identifier),
                .invalid = !byCaller,
                .placeholder = placeholders.find(identifier) != nullptr,
                .registeredByCaller = byCaller};
    }

private:
    static OSTDictionary _take(OSTDictionary& legacy, const char* key) {
        const auto* const value = legacy.find(key);
        const auto* const found = value ? value->asDictionary() : nullptr;
        OSTDictionary taken = found ? *found : OSTDictionary();
        legacy.remove(key);
        return taken;
    }

    [[nodiscard]] std::optional<std::vector<std::string>> _childrenOf(const std::string& identifier) const {
        const auto* const value = children.find(identifier);
        const auto* const list = value ? value->asArray() : nullptr;
        if (!list)
            return std::nullopt;
        std::vector<std::string> identifiers;
        for (const auto& child : *list)
            if (const auto* const text = child.asString())
                identifiers.push_back(*text);
        return identifiers;
    }
};

/// The class of the data containers that go with a bundle class; a framework has none.
std::uint64_t dataClassOf(OSTContainerClass bundleClass) {
    const auto number = static_cast<std::uint64_t>(bundleClass);
    return bundleClass == OSTContainerClass::bundleFramework ? 0 : number + 1;
}

} // namespace

void OSTCodeSigningMapping::performAllCodeSigningMigrationAndReconciliation() {
    if (!isAvailable()) {
        logError("Nothing is migrated, because the mapping file could not be read");
        return;
    }
    const OSTAllIdentifiersLock lock(OSTLockKind::writing);
    const bool groupsMigrated = _migrateAppGroupIdsFromDataContainersToFile();
    const bool legacyMigrated = _migrateDataFromLegacyEntitlementsFileToCodeSigningFile();
    const bool cachedMigrated = _migrateCachedCodeSigningInfoFromBundleContainersToMapping();
    // It deletes what nobody references, so it must know all references, and an entry that is damaged may be one.
    const bool allRead = _sync([&] { return _unreadableEntries.empty(); });
    if (groupsMigrated && legacyMigrated && cachedMigrated && allRead)
        OSTGroupManager::defaultManager().reconcileGroupContainersOfType(OSTGroupType::application);
    else
        logError("Group containers are not reconciled this time, because %s",
                 allRead ? "a migration is not complete" : "the mapping file holds damaged entries");
}

OSTResult<void> OSTCodeSigningMapping::_storeMigrated(const std::function<bool()>& storeEntries) {
    return _sync([&]() -> OSTResult<void> {
        const auto storeAll = [&] {
            const platform::LogBatch lines; // one for each identifier
            return storeEntries();
        };
        // What an earlier run stored may still be in memory alone.
        return storeAll() || _unwritten ? _writeCodeSigningMappingToDisk() : OSTResult<void>();
    });
}

bool OSTCodeSigningMapping::_hasValidEntry(std::string_view identifier) const {
    const auto entry = _entry(identifier);
    return entry && !entry->invalid;
}

bool OSTCodeSigningMapping::_migrateAppGroupIdsFromDataContainersToFile() {
    if (OSTGlobalConfiguration::sharedInstance().migrationFileExistsWithName(groupMarker))
        return true;
    logNotice("Performing group ID migration");
    std::vector<Holder> holders;
    using enum OSTContainerClass;
    for (const auto dataClass : {dataApplication, dataLoomworkPlugin, dataVPNPlugin}) {
        const auto containers =
            OSTContainerCache::sharedInstance().allContainersForUser(OSTDefaultUserId, dataClass, false);
        if (!containers) {
            logError("Failed to fetch list of containers for userId: 501, class %ld : %@", dataClass,
                     containers.error());
            return false;
        }
        appendHolders(*containers, groupIdsKey, holders);
    }
    const auto stored = _storeMigrated([&] {
        return std::ranges::count_if(holders, [&](const Holder& holder) {
                   return _migrateGroupIds(*holder.container, holder.value);
               }) > 0;
    });
    if (!stored) {
        logError("Failed to write code signing mapping to disk following group id migration: %@", stored.error());
        return false;
    }
    clearInfoValues(holders, groupIdsKey, [](const OSTMetadata& container, OSTErrorCode code) {
        logError("Failed to clear group id metadata for %@ at %@ : %llu", container.identifier, container.url, code);
    });
    writeMigrationFileToDiskWithName(groupMarker);
    logNotice("Group ID migration completed");
    return true;
}

bool OSTCodeSigningMapping::_migrateGroupIds(const OSTMetadata& container, const OSTValue& groupIds) {
    logDebug("Data container for userId: 501, identifier %@ references container IDs: %@", container.identifier,
             groupIds);
    if (_entry(container.identifier)) {
        logNotice("Deleting app group entitlements for %@ because we already have them in mapping",
                  container.identifier);
        return false;
    }
    logNotice("Migrating app group entitlements for %@", container.identifier);
    _storeEntry(container.identifier,
                {.codeSigningInfo = infoWithEntitlements(OSTDictionary({{OSTGroupKeys::application.key, groupIds}})),
                 .invalid = true,
                 .dataContainerClass = static_cast<std::uint64_t>(container.containerClass)});
    return true;
}

bool OSTCodeSigningMapping::_migrateDataFromLegacyEntitlementsFileToCodeSigningFile() {
    const auto url =
        platform::pathByAppending(OSTGlobalConfiguration::sharedInstance().libraryDirectory(), legacyFileName);
    auto legacy = OST_dictionaryWithContentsOfURL(url, OSTLargeDictionaryFileSize);
    if (!legacy && legacy.error().isPOSIX(ENOENT))
        return true;
    logNotice("Performing legacy entitlement migration");
    if (!legacy) {
        logError("Entitlement File exists at %@, but we unexpectedly cant read it", url);
        return false;
    }
    const auto details = LegacyDetails::takenFrom(*legacy);
    const auto stored = _storeMigrated([&] {
        bool any = false;
        for (const auto& [identifier, entitlements] : *legacy) {
            if (_hasValidEntry(identifier)) {
                logNotice("Already have code signing info for %@.  No need to migrate legacy entitlements.",
                          identifier);
                continue;
            }
            logNotice("Migrating legacy entitlements for %@", identifier);
            _storeEntry(identifier, details.entry(identifier, entitlements));
            any = true;
        }
        return any;
    });
    if (!stored) {
        logError("Failed to write code signing mapping to disk following legacy migration: %@", stored.error());
        return false;
    }
    const auto& files = OSTFileManager::defaultManager();
    auto removed = files.removeItemAtURL(url);
    if (removed) // for good: what it says would undo later registrations
        removed = files.makeDirectoryDurable(platform::pathByDeletingLastComponent(url));
    if (!removed)
        logError("Failed to remove legacy file at %@: %@", url, removed.error());
    logNotice("Legacy entitlement migration completed");
    return true;
}

bool OSTCodeSigningMapping::_migrateCachedCodeSigningInfoFromBundleContainersToMapping() {
    if (OSTGlobalConfiguration::sharedInstance().migrationFileExistsWithName(codeSigningMarker))
        return true;
    logNotice("Performing code signing migration");
    std::vector<Holder> holders;
    bool allListed = true;
    using enum OSTContainerClass;
    for (const auto bundleClass : {bundleApplication, bundleLoomworkPlugin, bundleVPNPlugin, bundleFramework}) {
        const auto containers =
            OSTContainerCache::sharedInstance().allContainersForUser(OSTInstallerUserId, bundleClass, false);
        if (containers)
            appendHolders(*containers, OSTCachedCodeSigningInfoKey, holders);
        else
            logError("Failed to fetch list of containers for class %llu : %@", bundleClass, containers.error());
        allListed = allListed && containers;
    }
    std::erase_if(holders, [](const Holder& holder) { return !holder.value.asDictionary(); });
    const auto stored = _storeMigrated([&] {
        return std::ranges::count_if(holders, [&](const Holder& holder) {
                   return _migrateCachedInfo(*holder.container, *holder.value.asDictionary());
               }) > 0;
    });
    if (!stored) {
        logError("Failed to write code signing mapping to disk following code signing migration: %@", stored.error());
        return false;
    }
    clearInfoValues(holders, OSTCachedCodeSigningInfoKey, [](const OSTMetadata& container, OSTErrorCode code) {
        logError("Error setting info value for identifier: %@, Class: %llu: %llu", container.identifier,
                 container.containerClass, code);
    });
    if (!allListed)
        return false;
    writeMigrationFileToDiskWithName(codeSigningMarker);
    logNotice("Code Signing migration completed");
    return true;
}

bool OSTCodeSigningMapping::_migrateCachedInfo(const OSTMetadata& bundle, const OSTDictionary& cached) {
    if (_hasValidEntry(bundle.identifier)) {
        logNotice("Deleting cached code signing info for %@ because we already have it in mapping", bundle.identifier);
        return false;
    }
    logNotice("Migrating code signing info for %@", bundle.identifier);
    _storeEntry(bundle.identifier, OSTCodeSigningEntry::withCachedInfo(cached, dataClassOf(bundle.containerClass)));
    return true;
}

} // namespace ost
