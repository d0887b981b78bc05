#pragma once

#include "Protocol/OSTContainerClass.h"
#include "Protocol/OSTUserId.h"

#include <cstdint>
#include <optional>

namespace ost {

/// Where the sandbox keeps the paths of a class's containers.
struct OSTSandboxItem {
    enum class Type : std::uint64_t { data = 1, appGroup = 2, system = 4, systemGroup = 8 };

    std::uint32_t userId;
    Type type;
};

/// The item of a class's containers; none for bundles, which are not the sandbox's business. What belongs to the system
/// is kept for user 0.
[[nodiscard]] constexpr std::optional<OSTSandboxItem> OSTSandboxItemOf(std::uint32_t userId,
                                                                       OSTContainerClass containerClass) {
    using enum OSTSandboxItem::Type;
    if (containerClass == OSTContainerClass::dataSystem)
        return OSTSandboxItem{OSTRootUserId, system};
    if (containerClass == OSTContainerClass::sharedSystemGroup)
        return OSTSandboxItem{OSTRootUserId, systemGroup};
    if (!isPerUserClass(containerClass))
        return std::nullopt;
    return OSTSandboxItem{userId, containerClass == OSTContainerClass::sharedAppGroup ? appGroup : data};
}

} // namespace ost
