#include "codesigning/OSTCodeSigningMapping.h"

#include "Protocol/OSTEntitlements.h"
#include "files/OSTDictionaryFile.h"
#include "files/OSTFileManager.h"
#include "model/OSTGlobalConfiguration.h"
#include "platform/base/Assert.h"
#include "platform/base/Immortal.h"
#include "platform/base/Log.h"
#include "platform/base/PassingReason.h"
#include "platform/base/Path.h"
#include "store/OSTContainerCache.h"
#include "store/OSTLocks.h"

#include <algorithm>
#include <array>
#include <cerrno>

namespace ost {

namespace {

/// Whether a client that carries the entitlements would change nothing by registering itself again.
bool isOwnRegistration(const OSTCodeSigningEntry& entry, const std::shared_ptr<const OSTDictionary>& entitlements) {
    const auto* const held = entry.codeSigningInfo->size() == 1 ? entry.entitlements() : nullptr;
    return held && entitlements && (held == entitlements.get() || *held == *entitlements) && !entry.invalid &&
           !entry.placeholder && !entry.childBundleIdentifiers && entry.dataContainerClass == 0;
}

} // namespace

constinit const OSTGroupKeys OSTGroupKeys::application{OSTApplicationGroupsKey, nullptr};
constinit const OSTGroupKeys OSTGroupKeys::system{OSTSystemGroupsKey, OSTSystemGroupsFallbackKey};

OSTCodeSigningMapping& OSTCodeSigningMapping::sharedInstance() {
    static platform::Immortal mapping([] { return OSTCodeSigningMapping(); });
    return *mapping;
}

void OSTCodeSigningMapping::_readWhenPossible() {
    const auto read = _readCodeSigningMappingFromDisk();
    if (read)
        _reading = Reading::done;
    else if (!platform::isReasonThatPasses(read.error()))
        _reading = Reading::failed;
    if (!read)
        platform::logError("Unable to read mapping file from disk.  This is bad");
}

bool OSTCodeSigningMapping::isAvailable() {
    if (_reading == Reading::pending && !_codeSignQueue.isCurrent())
        _sync([] {});
    return _reading == Reading::done;
}

// The public operations

bool OSTCodeSigningMapping::codeSigningInfoExistForIdentifier(std::string_view identifier) {
    return _sync([&] { return _onQueue_codeSigningInfoForIdentifier(identifier, Request::internal) != nullptr; });
}

bool OSTCodeSigningMapping::identifierHasCallerRegisteredEntitlements(std::string_view identifier) {
    return _sync([&] {
        const auto entry = _entry(identifier);
        return entry && entry->registeredByCaller;
    });
}

bool OSTCodeSigningMapping::callerIsToBeRegistered(std::string_view identifier,
                                                   const std::shared_ptr<const OSTDictionary>& entitlements) {
    return _sync([&] {
        const auto entry = _onQueue_codeSigningInfoForIdentifier(identifier, Request::internal);
        return !entry || (entry->registeredByCaller && !isOwnRegistration(*entry, entitlements));
    });
}

bool OSTCodeSigningMapping::identifierHasSystemContainer(std::string_view identifier) {
    return _sync([&] { return _onQueue_identifierHasSystemContainer(identifier); });
}

std::uint64_t OSTCodeSigningMapping::dataContainerTypeForIdentifier(std::string_view identifier) {
    return _sync([&] {
        const auto entry = _entry(identifier);
        return entry ? entry->dataContainerClass : 0;
    });
}

std::optional<std::vector<std::string>>
OSTCodeSigningMapping::appGroupIdentifiersForIdentifier(std::string_view identifier) {
    return _sync([&] { return _onQueue_appGroupIdentifiersForIdentifier(identifier); });
}

std::optional<std::vector<std::string>>
OSTCodeSigningMapping::systemGroupIdentifiersForIdentifier(std::string_view identifier) {
    return _sync([&] { return _onQueue_systemGroupIdentifiersForIdentifier(identifier); });
}

std::shared_ptr<const OSTDictionary>
OSTCodeSigningMapping::getCodeSigningInfoForIdentifier(std::string_view identifier) {
    const OSTAllIdentifiersLock lock(OSTLockKind::writing);
    return _sync([&]() -> std::shared_ptr<const OSTDictionary> {
        const auto entry = _onQueue_codeSigningInfoForIdentifier(identifier, Request::external);
        return entry ? entry->codeSigningInfo : nullptr;
    });
}

void OSTCodeSigningMapping::removeCodeSigningDictionariesForIdentifierAndItsChildren(std::string_view identifier) {
    if (!isAvailable())
        return;
    _sync([&] {
        for (const auto& each : _childrenAndIdentifier(identifier))
            if (const auto removed = _onQueue_processCodeSigningInfo(nullptr, each, {}); !removed)
                platform::logAs(platform::LogLevel::error,
                                "_onQueue_removeCodeSigningDictionariesForIdentifierAndItsChildren",
                                "Failed to clear entitlements for %@ : %llu", each, removed.error().code());
    });
}

OSTResult<void>
OSTCodeSigningMapping::invalidateCodeSigningInfoForIdentifierAndItsChildren(std::string_view identifier) {
    return _sync([&]() -> OSTResult<void> {
        if (!isAvailable())
            return {};
        const auto invalidate = [&](const std::string& each) {
            const auto stored = _entry(each);
            if (!stored)
                return false;
            auto entry = *stored;
            entry.invalid = true;
            _codeSigningMappingDict.insert_or_assign(each,
                                                     std::make_shared<const OSTCodeSigningEntry>(std::move(entry)));
            return true;
        };
        auto children = _childrenAndIdentifier(identifier);
        if (invalidate(children.back()))
            platform::logDebug("Invalidating code signing info for %@", identifier);
        children.pop_back();
        for (const auto& child : children)
            if (invalidate(child))
                platform::logDebug("Invalidating code signing info for %@ child: %@", identifier, child);
        return _writeCodeSigningMappingToDisk();
    });
}

std::expected<void, OSTErrorCode> OSTCodeSigningMapping::invalidateCodeSigningInfoForAppsWithoutBundleContainer() {
    if (!isAvailable())
        return std::unexpected(OSTErrorCode::noProcessingResult);
    const OSTAllIdentifiersLock lock(OSTLockKind::writing);
    return _sync([&]() -> OSTResult<void> {
        for (auto& [identifier, entry] : _codeSigningMappingDict) {
            if (entry->registeredByCaller || _hasBundleContainer(identifier))
                continue;
            platform::logDebug("Invalidating the code signing info for: %@", identifier);
            auto invalidated = *entry;
            invalidated.invalid = true;
            entry = std::make_shared<const OSTCodeSigningEntry>(std::move(invalidated));
        }
        return _writeCodeSigningMappingToDisk();
    });
}

bool OSTCodeSigningMapping::_hasBundleContainer(std::string_view identifier) const {
    using enum OSTContainerClass;
    return std::ranges::any_of(std::array{bundleApplication, bundleLoomworkPlugin, bundleVPNPlugin}, [&](auto bundle) {
        return OSTContainerCache::sharedInstance()
            .containerForUser({OSTInstallerUserId, bundle, identifier})
            .has_value();
    });
}

std::vector<std::pair<std::string, OSTCodeSigningMapping::EntryRecord>>
OSTCodeSigningMapping::entriesOfIdentifierAndItsChildren(std::string_view identifier) {
    return _sync([&] {
        std::vector<std::pair<std::string, EntryRecord>> entries;
        for (auto& each : _childrenAndIdentifier(identifier)) {
            auto entry = _entry(each);
            entries.emplace_back(std::move(each), std::move(entry));
        }
        return entries;
    });
}

void OSTCodeSigningMapping::restoreEntries(const std::vector<std::pair<std::string, EntryRecord>>& entries) {
    if (!isAvailable())
        return;
    _sync([&] {
        // As they were, those without information too, which staging would drop.
        for (const auto& [identifier, entry] : entries)
            if (entry)
                _codeSigningMappingDict.insert_or_assign(identifier, entry);
            else
                _codeSigningMappingDict.erase(identifier);
        // What fails is in the log; memory has the entries, and the next successful write stores them.
        (void)_writeCodeSigningMappingToDisk();
    });
}

// On the queue

std::vector<std::string> OSTCodeSigningMapping::_childrenAndIdentifier(std::string_view identifier) const {
    const auto entry = _entry(identifier);
    auto identifiers =
        entry ? entry->childBundleIdentifiers.value_or(std::vector<std::string>()) : std::vector<std::string>();
    identifiers.emplace_back(identifier);
    return identifiers;
}

OSTCodeSigningMapping::EntryRecord OSTCodeSigningMapping::_entry(std::string_view identifier) const {
    OST_ASSERT(_codeSignQueue.isCurrent());
    const auto found = _codeSigningMappingDict.find(identifier);
    return found == _codeSigningMappingDict.end() ? nullptr : found->second;
}

OSTCodeSigningMapping::EntryRecord
OSTCodeSigningMapping::_onQueue_codeSigningInfoForIdentifier(std::string_view identifier, Request request) {
    if (!isAvailable())
        return nullptr;
    auto entry = _entry(identifier);
    if (entry && request == Request::external && (entry->placeholder || entry->invalid))
        return nullptr;
    if (!entry)
        entry = _migrateFromBundleContainer(identifier);
    return entry && entry->codeSigningInfo ? entry : nullptr;
}

OSTCodeSigningMapping::EntryRecord OSTCodeSigningMapping::_migrateFromBundleContainer(std::string_view identifier) {
    const auto bundle = OSTContainerCache::sharedInstance().containerForUser(
        {OSTInstallerUserId, OSTContainerClass::bundleApplication, identifier});
    const auto* const cached = bundle && (*bundle)->info ? (*bundle)->info->find(OSTCachedCodeSigningInfoKey) : nullptr;
    if (!cached || !cached->asDictionary())
        return nullptr;
    platform::logAs(platform::LogLevel::notice, "_onQueue_codeSigningInfoForIdentifier",
                    "Migrating code signing info from bundle container upon request for %@", (*bundle)->identifier);
    _storeEntry((*bundle)->identifier,
                OSTCodeSigningEntry::withCachedInfo(*cached->asDictionary(),
                                                    static_cast<std::uint64_t>(OSTContainerClass::dataApplication)));
    if (const auto written = _writeCodeSigningMappingToDisk(); !written)
        platform::logAs(platform::LogLevel::error, "_onQueue_codeSigningInfoForIdentifier",
                        "Failed to write code signing mapping to disk during current identifier migration of %@: %@",
                        (*bundle)->identifier, written.error());
    return _entry(identifier);
}

void OSTCodeSigningMapping::_storeEntry(const std::string& identifier, OSTCodeSigningEntry entry) {
    _codeSigningMappingDict.insert_or_assign(identifier, std::make_shared<const OSTCodeSigningEntry>(std::move(entry)));
    _unreadableEntries.erase(identifier);
}

bool OSTCodeSigningMapping::_onQueue_identifierHasSystemContainer(std::string_view identifier) {
    const auto entry = _onQueue_codeSigningInfoForIdentifier(identifier, Request::internal);
    const auto* const entitlements = entry ? entry->entitlements() : nullptr;
    const auto* const value = entitlements ? entitlements->find(OSTSystemContainerKey) : nullptr;
    return value && value->truthValue();
}

OSTCodeSigningMapping::GroupList
OSTCodeSigningMapping::_onQueue_appGroupIdentifiersForIdentifier(std::string_view identifier) {
    const auto entry = _onQueue_codeSigningInfoForIdentifier(identifier, Request::internal);
    return _groupList(identifier, entry ? entry->entitlements() : nullptr, OSTGroupKeys::application);
}

OSTCodeSigningMapping::GroupList
OSTCodeSigningMapping::_onQueue_systemGroupIdentifiersForIdentifier(std::string_view identifier) {
    const auto entry = _onQueue_codeSigningInfoForIdentifier(identifier, Request::internal);
    auto groups = _groupList(identifier, entry ? entry->entitlements() : nullptr, OSTGroupKeys::system);
    if (groups)
        std::erase_if(*groups, [](const std::string& group) {
            if (group.starts_with(OSTSystemGroupPrefix))
                return false;
            platform::logAs(platform::LogLevel::error, "_onQueue_systemGroupIdentifiersForIdentifier",
                            "System group ID %@ does not have proper prefix, ignoring.", group);
            return true;
        });
    return groups;
}

OSTCodeSigningMapping::GroupList OSTCodeSigningMapping::_groupList(std::string_view identifier,
                                                                   const OSTDictionary* entitlements,
                                                                   const OSTGroupKeys& keys) {
    GroupViews groups;
    if (!_findGroups(identifier, entitlements, keys, groups))
        return std::nullopt;
    return std::vector<std::string>(groups.begin(), groups.end());
}

bool OSTCodeSigningMapping::_findGroups(std::string_view identifier, const OSTDictionary* entitlements,
                                        const OSTGroupKeys& keys, GroupViews& groups) {
    const bool found = _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, keys.key, groups);
    if (!keys.fallbackKey || (found && !groups.empty()))
        return found;
    return _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, keys.fallbackKey, groups);
}

void OSTCodeSigningMapping::iterateGroupIdsWithKey(
    const OSTGroupKeys& keys,
    const std::function<void(const std::string& identifier, const GroupViews* groups)>& block) {
    if (!_codeSignQueue.isCurrent())
        return _sync([&] { iterateGroupIdsWithKey(keys, block); });
    GroupViews groups; // One for all: copies would be most of the work.
    for (const auto& [identifier, entry] : _codeSigningMappingDict)
        block(identifier, _findGroups(identifier, entry->entitlements(), keys, groups) ? &groups : nullptr);
}

bool OSTCodeSigningMapping::_copyApplicationGroupEntitlementForIdentifier(std::string_view identifier,
                                                                          const OSTDictionary* entitlements,
                                                                          const char* groupKey, GroupViews& groups) {
    groups.clear();
    const auto* const value = entitlements ? entitlements->find(groupKey) : nullptr;
    if (!value)
        return false;
    if (const auto* const group = value->asString()) {
        groups.emplace_back(*group);
        return true;
    }
    const auto* const array = value->asArray();
    if (!array) {
        platform::logError("Entitlement %@ for %@ does not contain supported types; ignoring.", groupKey, identifier);
        return false;
    }
    for (const auto& element : *array) {
        const auto* const group = element.asString();
        if (!group) {
            platform::logError("Entitlement %@ for %@ contains non-string values; ignoring.", groupKey, identifier);
            return false;
        }
        groups.emplace_back(*group);
    }
    std::ranges::sort(groups);
    const auto repeated = std::ranges::unique(groups);
    groups.erase(repeated.begin(), repeated.end());
    return true;
}

// The file

std::string OSTCodeSigningMapping::_mappingFileURL() {
    return platform::pathByAppending(OSTGlobalConfiguration::sharedInstance().libraryDirectory(),
                                     "ost_code_signing_info.plist");
}

OSTResult<void> OSTCodeSigningMapping::_readCodeSigningMappingFromDisk() {
    const auto url = _mappingFileURL();
    const auto dictionary = OST_dictionaryWithContentsOfURL(url, OSTLargeDictionaryFileSize);
    if (!dictionary) {
        if (dictionary.error().isPOSIX(ENOENT)) {
            platform::logNotice("No code signing info file found.  We will create one now");
            return {};
        }
        platform::logError("Failed to read code signing mapping file at %@ : %@", url, dictionary.error());
        return std::unexpected(dictionary.error());
    }
    // An earlier process may have been killed before it had waited for the file. This one answers for it.
    OST_TRY(OSTFileManager::defaultManager().makeDirectoryDurable(platform::pathByDeletingLastComponent(url)));
    for (const auto& [identifier, value] : *dictionary) {
        if (const auto* const serialized = value.asDictionary()) {
            _codeSigningMappingDict.emplace_hint(_codeSigningMappingDict.end(), identifier,
                                                 std::make_shared<const OSTCodeSigningEntry>(
                                                     OSTCodeSigningEntry::withSerializedDictionary(*serialized)));
        } else {
            platform::logError("Skipping the code signing info of %@, which is no dictionary", identifier);
            _unreadableEntries.emplace(identifier, value);
        }
    }
    return {};
}

OSTResult<void> OSTCodeSigningMapping::_writeCodeSigningMappingToDisk() {
    std::vector<OSTDictionary::Entry> serialized;
    serialized.reserve(_codeSigningMappingDict.size() + _unreadableEntries.size());
    for (const auto& [identifier, entry] : _codeSigningMappingDict)
        serialized.emplace_back(identifier, entry->serialize());
    for (const auto& [identifier, value] : _unreadableEntries)
        serialized.emplace_back(identifier, value);
    const OSTDictionary dictionary(std::move(serialized));
    const auto url = _mappingFileURL();
    const auto written = OST_writeToURL(dictionary, url, OSTLargeDictionaryFileSize);
    _unwritten = !written;
    if (!written)
        return std::unexpected(OSTCreateError(OSTErrorCode::mappingWriteFailed, written.error(),
                                              "Failed to write entitlement mapping file at %@ : %@", url, dictionary));
    return {};
}

OSTResult<void> OSTCodeSigningMapping::_setCodeSigningDictionaryValues(const std::vector<EntryRecord>& entries,
                                                                       const std::vector<std::string>& identifiers) {
    if (entries.size() != identifiers.size())
        return std::unexpected(OSTCreateError(OSTErrorCode::countsDiffer,
                                              "Can't act on an invalid input: values count: %ld, IDs count: %ld",
                                              entries.size(), identifiers.size()));
    bool changed = false;
    for (std::size_t i = 0; i < entries.size(); ++i) {
        const EntryRecord entry = entries[i] && entries[i]->codeSigningInfo ? entries[i] : nullptr;
        const auto stored = _entry(identifiers[i]);
        if ((!entry && !stored) || (entry && stored && *entry == *stored))
            continue;
        if (entry)
            _codeSigningMappingDict.insert_or_assign(identifiers[i], entry);
        else
            _codeSigningMappingDict.erase(identifiers[i]);
        _unreadableEntries.erase(identifiers[i]);
        platform::logDebug("Staging Code Signing Mapping for ID: %@ : %@", identifiers[i], entry);
        changed = true;
    }
    if (!changed && !_unwritten)
        return {};
    const auto written = _writeCodeSigningMappingToDisk();
    if (!written)
        platform::logError("Error writing code signing mappings to disk after set : %@", written.error());
    else
        platform::logDebug("Wrote code signing mappings to disk after set");
    return written;
}

} // namespace ost
