#include "Protocol/OSTSandboxItem.h"
#include "model/OSTGlobalConfiguration.h"
#include "platform/base/Log.h"
#include "platform/base/Path.h"
#include "platform/device/SandboxUserState.h"
#include "store/OSTClientConnection.h"
#include "store/OSTContainerCache.h"

namespace ost {

namespace {

/// The live container of which the item speaks: that of the class in whose directory its path lies.
std::optional<OSTContainerName> containerOf(const platform::SandboxUserStateItem& item) {
    const auto holder = platform::pathByDeletingLastComponent(item.path);
    for (auto number = 1U; number < static_cast<unsigned>(OSTContainerClass::max); ++number) {
        const auto containerClass = static_cast<OSTContainerClass>(number);
        const auto userId = isSystemClass(containerClass) ? OSTSystemUserId : item.userId;
        const auto ofClass = OSTSandboxItemOf(userId, containerClass);
        if (!ofClass || ofClass->userId != item.userId || static_cast<std::uint64_t>(ofClass->type) != item.type)
            continue;
        const auto directory =
            OSTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(userId, containerClass, false);
        if (directory && *directory == holder)
            return OSTContainerName{userId, containerClass, item.key};
    }
    return std::nullopt;
}

} // namespace

void OSTClientConnection::_repairSandboxContainerMappings() {
    platform::removeUnfinishedSandboxUserStateItems();
    for (const auto& item : platform::danglingSandboxUserStateItems())
        if (const auto name = containerOf(item))
            _correctSandboxContainerMapping(*name);
}

void OSTClientConnection::_correctSandboxContainerMapping(OSTContainerName name) {
    name.transient = false;
    const auto found = OSTContainerCache::sharedInstance().containerForUser(name);
    if (found)
        _setSandboxContainerMappingForUser(name, (*found)->url);
    else if (found.error().is(OSTErrorCode::notFound))
        _setSandboxContainerMappingForUser(name, std::nullopt);
}

bool OSTClientConnection::_setSandboxContainerMappingForUser(const OSTContainerName& name,
                                                             std::optional<std::string_view> url) {
    const auto containerClass = name.containerClass;
    if (isBundleClass(containerClass))
        return true;
    if (!isPerUserClass(containerClass) && !isSystemClass(containerClass)) {
        platform::logError("Unsupported class for setting sandbox container mapping: %llu", containerClass);
        return false;
    }
    const auto item = *OSTSandboxItemOf(name.userId, containerClass);
    const auto identifier = *name.identifier;
    const auto type = static_cast<std::uint64_t>(item.type);
    // In one step where that works: a crash between two would leave the sandbox without the item.
    if (url && platform::setSandboxUserStateItem(item.userId, type, identifier, url))
        return true;
    if (const auto removed = platform::setSandboxUserStateItem(item.userId, type, identifier, std::nullopt); !removed) {
        platform::logError(
            "Failed to remove mapping for user: %u, itemType: %llu, identifier: %s, class: %llu, path: %s : %d",
            item.userId, type, identifier, containerClass, nullptr, removed.error());
        return false;
    }
    if (!url)
        return true;
    if (const auto set = platform::setSandboxUserStateItem(item.userId, type, identifier, url); !set) {
        platform::logError(
            "Failed to set mapping for user: %u, itemType: %llu, identifier %s, class: %llu, path: %s : %d",
            item.userId, type, identifier, containerClass, *url, set.error());
        return false;
    }
    return true;
}

} // namespace ost
