#include "codesigning/OSTGroupManager.h"

#include "codesigning/OSTCodeSigningMapping.h"
#include "model/OSTFailureReport.h"
#include "model/OSTGlobalConfiguration.h"
#include "platform/base/Assert.h"
#include "platform/base/Log.h"
#include "store/OSTContainerCache.h"
#include "store/OSTLocks.h"

#include <algorithm>
#include <unordered_set>

namespace ost {

namespace {

/// Where the containers of a group type lie.
struct GroupPlace {
    std::uint32_t userId;
    OSTContainerClass containerClass;
};

constexpr GroupPlace placeOf(OSTGroupType type) {
    if (type == OSTGroupType::system)
        return {OSTSystemUserId, OSTContainerClass::sharedSystemGroup};
    return {OSTDefaultUserId, OSTContainerClass::sharedAppGroup};
}

OSTError invalidIdentifier(std::uint32_t userId, std::source_location where) {
    return OSTCreateErrorAt(where, OSTErrorCode::invalidObject, nullptr,
                            "Can't act on an invalid object: userId: %u, ID: %@", userId, nullptr);
}

bool userHasHome(std::uint32_t userId) {
    const auto* const configuration = OSTGlobalConfiguration::sharedInstance().getPerUserConfigurationForUserId(userId);
    return configuration && configuration->existsUserBaseDirectory();
}

} // namespace

const OSTGroupManager& OSTGroupManager::defaultManager() {
    static const OSTGroupManager manager;
    return manager;
}

std::expected<OSTGroupManager::Paths, OSTErrorCode>
OSTGroupManager::groupContainerPathsForUser(std::uint32_t userId, OSTClientConnection& client,
                                            std::optional<std::string_view> identifier) const {
    const auto here = std::source_location::current();
    return OSTGuarded([&]() -> OSTResult<Paths> {
        if (!identifier)
            return std::unexpected(invalidIdentifier(userId, here));
        const OSTAllIdentifiersLock lock(OSTLockKind::writing);
        auto& mapping = OSTCodeSigningMapping::sharedInstance();
        const bool system = userId == OSTSystemUserId;
        const auto groups = system ? mapping.systemGroupIdentifiersForIdentifier(*identifier)
                                   : mapping.appGroupIdentifiersForIdentifier(*identifier);
        client.setAllowGroupIdLookup();
        Paths found;
        const auto containerClass = placeOf(system ? OSTGroupType::system : OSTGroupType::application).containerClass;
        for (const auto& group : groups.value_or(std::vector<std::string>())) {
            const auto record = client.createOrLookupContainerForUser(
                {.name = {userId, containerClass, group}, .createIfNecessary = true, .useLocking = false});
            if (record)
                found.emplace(group, (*record)->url);
            else
                platform::logError("Failed to create or lookup group container-userId: %u, ID: %@ : %llu", userId,
                                   group, record.error());
        }
        return found;
    });
}

std::expected<std::vector<std::string>, OSTErrorCode>
OSTGroupManager::groupContainerIdentifiersForUser(std::uint32_t userId,
                                                  std::optional<std::string_view> identifier) const {
    const auto here = std::source_location::current();
    return OSTGuarded([&]() -> OSTResult<std::vector<std::string>> {
        if (!identifier)
            return std::unexpected(invalidIdentifier(userId, here));
        const OSTAllIdentifiersLock lock(OSTLockKind::writing);
        return OSTCodeSigningMapping::sharedInstance()
            .appGroupIdentifiersForIdentifier(*identifier)
            .value_or(std::vector<std::string>());
    });
}

void OSTGroupManager::handleChangeFromOldGroupContainerIds(const GroupList& oldGroups, const GroupList& newGroups,
                                                           OSTGroupType type) const {
    if (oldGroups == newGroups || !oldGroups)
        return;
    std::vector<std::string> left = *oldGroups;
    if (newGroups) {
        const std::unordered_set<std::string_view> kept(newGroups->begin(), newGroups->end());
        std::erase_if(left, [&](const std::string& group) { return kept.contains(group); });
    }
    _removeReferenceForGroupIdentifiers(left, type);
}

bool OSTGroupManager::_mayCountReferencesOfType(OSTGroupType type) {
    const bool isAvailable = OSTCodeSigningMapping::sharedInstance().isAvailable();
    if (!isAvailable)
        platform::logError("Failed to get reference count information for group type: %ld", type);
    return isAvailable;
}

std::optional<OSTGroupManager::ReferenceCounts>
OSTGroupManager::_copyReferenceCountSetOfType(OSTGroupType type, const std::vector<std::string>& groups) {
    if (!_mayCountReferencesOfType(type))
        return std::nullopt;
    ReferenceCounts counts;
    for (const auto& group : groups)
        counts.emplace(group, 0);
    OSTCodeSigningMapping::sharedInstance().iterateGroupIdsWithKey(
        type == OSTGroupType::system ? OSTGroupKeys::system : OSTGroupKeys::application,
        [&](const std::string& identifier, const OSTCodeSigningMapping::GroupViews* referenced) {
            if (!referenced)
                return;
            platform::logAs(platform::LogLevel::debug, "_copyReferenceCountSetOfType",
                            "Entitlements for identifier %@ references container IDs: %@", identifier, *referenced);
            for (const auto group : *referenced)
                if (const auto found = counts.find(group); found != counts.end())
                    ++found->second;
        });
    return counts;
}

void OSTGroupManager::_removeReferenceForGroupIdentifiers(const std::vector<std::string>& groups, OSTGroupType type) {
    if (groups.empty())
        return;
    const auto [userId, containerClass] = placeOf(type);
    auto counts = _copyReferenceCountSetOfType(type, groups);
    if (counts && (type == OSTGroupType::system || userHasHome(userId)))
        _removeGroupContainersIfNeededforUser(userId, containerClass, groups, *std::move(counts));
}

void OSTGroupManager::_removeGroupContainersIfNeededforUser(std::uint32_t userId, OSTContainerClass groupContainerClass,
                                                            const std::vector<std::string>& groups,
                                                            ReferenceCounts referenceCounts) {
    for (const auto& group : groups) {
        auto& count = referenceCounts[group];
        if (count != 1) {
            platform::logDebug("Reference count for user: %u, ID: %@ is %ld", userId, group, count);
        } else if (const auto container =
                       OSTContainerCache::sharedInstance().containerForUser({userId, groupContainerClass, group})) {
            platform::logNotice("Last reference to group container %@ for %u is going away; removing it.", group,
                                userId);
            _stageForDeletion(**container, "_removeGroupContainersIfNeededforUser");
        } else {
            platform::logDebug("Failed to retrieve group container %@ for %u : %@.  May not exist for this user", group,
                               userId, container.error());
        }
        if (count > 0)
            --count;
    }
}

void OSTGroupManager::reconcileGroupContainersOfType(OSTGroupType type) const {
    OST_ASSERT(OSTHoldsAllIdentifiersLock());
    OST_ASSERT(type == OSTGroupType::application);
    const auto [userId, containerClass] = placeOf(type);
    if (!_mayCountReferencesOfType(type) || !userHasHome(userId))
        return;
    const auto containers = OSTContainerCache::sharedInstance().allContainersForUser(userId, containerClass, false);
    if (!containers) {
        platform::logError("Failed to fetch group container list for %u: %@", userId, containers.error());
        return;
    }
    std::vector<std::string> groups;
    for (const auto& container : *containers)
        groups.push_back(container->identifier);
    if (const auto counts = _copyReferenceCountSetOfType(type, groups))
        _cleanupUnreferencedGroupContainersForUser(userId, *containers, *counts);
}

void OSTGroupManager::_cleanupUnreferencedGroupContainersForUser(std::uint32_t userId,
                                                                 const std::vector<OSTMetadataRecord>& containers,
                                                                 const ReferenceCounts& referenceCounts) {
    for (const auto& container : containers) {
        if (referenceCounts.at(container->identifier) > 0)
            continue;
        platform::logError("Removing group container with identifier %@ for %u", container->identifier, userId);
        _stageForDeletion(*container, "_cleanupUnreferencedGroupContainersForUser");
    }
}

void OSTGroupManager::_stageForDeletion(const OSTMetadata& container, std::string_view operation) {
    const auto staged = OSTClientConnection::sharedClientConnection().stageForDeleteContainer(container, false);
    if (!staged)
        platform::logAs(platform::LogLevel::error, operation,
                        "Failed to destroy group container with identifier %@ for %u: %llu", container.identifier,
                        container.uid, staged.error());
}

} // namespace ost
