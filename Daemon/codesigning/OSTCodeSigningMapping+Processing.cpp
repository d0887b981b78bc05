#include "Protocol/OSTEntitlements.h"
#include "codesigning/OSTCodeSigningMapping.h"
#include "codesigning/OSTGroupManager.h"
#include "model/OSTContainerName.h"
#include "model/OSTFailureReport.h"
#include "platform/base/Assert.h"
#include "platform/base/Log.h"
#include "store/OSTClientConnection.h"
#include "store/OSTContainerCache.h"
#include "store/OSTLocks.h"

#include <algorithm>

namespace ost {

namespace {

const OSTDictionary* entitlementsOf(const std::shared_ptr<const OSTDictionary>& info) {
    const auto* const value = info ? info->find(OSTEntitlementsKey) : nullptr;
    return value ? value->asDictionary() : nullptr;
}

bool isTooLong(std::string_view identifier) { return identifier.size() > OSTLongestIdentifier; }

bool isTooLongText(const OSTValue& value) { return value.asString() && isTooLong(*value.asString()); }

bool namesTooLongGroup(const OSTDictionary* entitlements) {
    for (const auto& keys : {OSTGroupKeys::application, OSTGroupKeys::system})
        for (const char* const key : {keys.key, keys.fallbackKey}) {
            const auto* const groups = entitlements && key ? entitlements->find(key) : nullptr;
            if (groups && (isTooLongText(*groups) ||
                           (groups->asArray() && std::ranges::any_of(*groups->asArray(), isTooLongText))))
                return true;
        }
    return false;
}

/// The lines of all its steps go by the operation's name.
template<typename... Arguments>
void logOfProcessing(platform::Message<Arguments...> format, const Arguments&... arguments) {
    platform::logAs<Arguments...>(platform::LogLevel::error, "_onQueue_processCodeSigningInfo", format, arguments...);
}

} // namespace

/// Entries to be staged together, matched by position.
struct OSTCodeSigningMapping::Batch {
    std::vector<EntryRecord> entries;
    std::vector<std::string> identifiers;

    void stage(OSTCodeSigningEntry entry, std::string_view identifier) {
        entries.push_back(std::make_shared<const OSTCodeSigningEntry>(std::move(entry)));
        identifiers.emplace_back(identifier);
    }
};

std::expected<void, OSTErrorCode>
OSTCodeSigningMapping::processCodeSigningInfo(const std::shared_ptr<const OSTDictionary>& info,
                                              std::optional<std::string_view> identifier,
                                              const OSTRegistrationOptions& options) {
    if (!isAvailable())
        return std::unexpected(OSTErrorCode::noProcessingResult);
    if (!identifier)
        return std::unexpected(OSTErrorCode::noIdentifier);
    if (info && (isTooLong(*identifier) || isTooLong(options.parentBundleIdentifier.value_or(std::string())) ||
                 namesTooLongGroup(entitlementsOf(info)))) {
        logOfProcessing("An identifier of the registration of %@ is too long", *identifier);
        return std::unexpected(OSTErrorCode::invalidObject);
    }
    const OSTAllIdentifiersLock lock(OSTLockKind::writing);
    return _sync([&] { return _onQueue_processCodeSigningInfo(info, *identifier, options); });
}

std::expected<void, OSTErrorCode>
OSTCodeSigningMapping::processCallerRegisteredEntitlements(std::shared_ptr<const OSTDictionary> entitlements,
                                                           std::optional<std::string_view> identifier) {
    OSTDictionary info;
    info.set(OSTEntitlementsKey, std::move(entitlements));
    return processCodeSigningInfo(std::make_shared<const OSTDictionary>(std::move(info)), identifier,
                                  {.registeredByCaller = true});
}

OSTResult<void> OSTCodeSigningMapping::_onQueue_processCodeSigningInfo(const std::shared_ptr<const OSTDictionary>& info,
                                                                       std::string_view identifier,
                                                                       const OSTRegistrationOptions& options) {
    // Containers are staged for deletion without locking.
    OST_ASSERT(OSTHoldsAllIdentifiersLock());
    return OSTGuarded([&] { return _process(info, identifier, options); });
}

OSTResult<void> OSTCodeSigningMapping::_process(const std::shared_ptr<const OSTDictionary>& info,
                                                std::string_view identifier, const OSTRegistrationOptions& options) {
    Batch batch;
    const auto stored = _entry(identifier);
    OSTCodeSigningEntry entry{.codeSigningInfo = info,
                              .placeholder = options.placeholder,
                              .registeredByCaller = options.registeredByCaller,
                              .dataContainerClass = options.dataContainerClass};
    if (stored && stored->childBundleIdentifiers) {
        entry.childBundleIdentifiers = stored->childBundleIdentifiers;
        std::erase_if(*entry.childBundleIdentifiers, [&](const std::string& child) { return !_entry(child); });
    }
    // Nobody is its own child: the entry that is staged last would not have the link.
    if (options.parentBundleIdentifier && *options.parentBundleIdentifier != identifier)
        _linkToParent(identifier, *options.parentBundleIdentifier, batch);
    if (!stored || *stored != entry) {
        // While the mapping still holds what is stored: the references that go are counted in it.
        _releaseSystemContainer(identifier, entitlementsOf(info));
        _releaseGroups(identifier, entitlementsOf(info));
        batch.stage(info ? std::move(entry) : OSTCodeSigningEntry(), identifier);
    }
    if (batch.entries.empty() && !_unwritten)
        return {};
    return _setCodeSigningDictionaryValues(batch.entries, batch.identifiers);
}

void OSTCodeSigningMapping::_linkToParent(std::string_view identifier, const std::string& parent, Batch& batch) {
    const auto stored = _entry(parent);
    OSTCodeSigningEntry entry = stored ? *stored : OSTCodeSigningEntry();
    auto children = entry.childBundleIdentifiers.value_or(std::vector<std::string>());
    if (std::ranges::find(children, identifier) != children.end())
        return;
    children.emplace_back(identifier);
    platform::logDebug("Staging Child Bundles: %@ for parent ID: %@ by appending: %@", children, parent, identifier);
    entry.childBundleIdentifiers = std::move(children);
    batch.stage(std::move(entry), parent);
}

void OSTCodeSigningMapping::_releaseSystemContainer(std::string_view identifier, const OSTDictionary* newEntitlements) {
    const auto* const wanted = newEntitlements ? newEntitlements->find(OSTSystemContainerKey) : nullptr;
    if (!_onQueue_identifierHasSystemContainer(identifier) || (wanted && wanted->truthValue()))
        return;
    const auto container = OSTContainerCache::sharedInstance().containerForUser(
        {OSTSystemUserId, OSTContainerClass::dataSystem, identifier});
    if (!container) {
        logOfProcessing("Failed to retrieve system container %@: %@", identifier, container.error());
        return;
    }
    logOfProcessing("Deleting system container for ID: %@ because it is no longer in the entitlements", identifier);
    const auto staged = OSTClientConnection::sharedClientConnection().stageForDeleteContainer(**container, false);
    if (!staged)
        logOfProcessing("Failed to destroy system container with identifier %@: %llu", identifier, staged.error());
}

void OSTCodeSigningMapping::_releaseGroups(std::string_view identifier, const OSTDictionary* newEntitlements) {
    const auto& groups = OSTGroupManager::defaultManager();
    groups.handleChangeFromOldGroupContainerIds(_onQueue_appGroupIdentifiersForIdentifier(identifier),
                                                _groupList(identifier, newEntitlements, OSTGroupKeys::application),
                                                OSTGroupType::application);
    groups.handleChangeFromOldGroupContainerIds(_onQueue_systemGroupIdentifiersForIdentifier(identifier),
                                                _groupList(identifier, newEntitlements, OSTGroupKeys::system),
                                                OSTGroupType::system);
}

} // namespace ost
