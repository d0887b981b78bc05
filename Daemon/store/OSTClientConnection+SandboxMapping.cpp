#include "platform/base/Log.h"
#include "platform/device/SandboxUserState.h"
#include "store/OSTClientConnection.h"

namespace ost {

namespace {

enum class SandboxItemType : std::uint64_t { data = 1, appGroup = 2, system = 4, systemGroup = 8 };

struct SandboxItem {
    std::uint32_t userId;
    SandboxItemType type;
};

/// The item of a class that has one; what belongs to the system is kept for user 0.
SandboxItem itemOf(std::uint32_t userId, OSTContainerClass containerClass) {
    if (containerClass == OSTContainerClass::dataSystem)
        return {OSTRootUserId, SandboxItemType::system};
    if (containerClass == OSTContainerClass::sharedSystemGroup)
        return {OSTRootUserId, SandboxItemType::systemGroup};
    return {userId,
            containerClass == OSTContainerClass::sharedAppGroup ? SandboxItemType::appGroup : SandboxItemType::data};
}

} // namespace

bool OSTClientConnection::_setSandboxContainerMappingForUser(const OSTContainerName& name,
                                                             std::optional<std::string_view> url) {
    const auto containerClass = name.containerClass;
    if (isBundleClass(containerClass))
        return true;
    if (!isPerUserClass(containerClass) && !isSystemClass(containerClass)) {
        platform::logError("Unsupported class for setting sandbox container mapping: %llu", containerClass);
        return false;
    }
    const auto item = itemOf(name.userId, containerClass);
    const auto identifier = *name.identifier;
    const auto type = static_cast<std::uint64_t>(item.type);
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
