#pragma once

#include "Protocol/OSTUserId.h"

#include <array>
#include <cstdint>
#include <string_view>

namespace ost {

/// What kind of directory a container is. Travels as an unsigned 64-bit number (requests, metadata files, upcalls), so
/// a value of this type may be any number until `isValidContainerClass` has accepted it.
enum class OSTContainerClass : std::uint64_t {
    undefined = 0,
    bundleApplication = 1,
    dataApplication = 2,
    bundleLoomworkPlugin = 3,
    dataLoomworkPlugin = 4,
    bundleVPNPlugin = 5,
    dataVPNPlugin = 6,
    sharedAppGroup = 7,
    bundleFramework = 8,
    dataVexelService = 9,
    dataInternalDaemon = 10,
    dataTempDir = 11,
    dataSystem = 12,
    sharedSystemGroup = 13,
    max = 14,
};

/// 1 to 13.
[[nodiscard]] constexpr bool isValidContainerClass(OSTContainerClass value) {
    return value > OSTContainerClass::undefined && value < OSTContainerClass::max;
}

/// 1, 3, 5 and 8: installed bundles, owned by the installer.
[[nodiscard]] constexpr bool isBundleClass(OSTContainerClass value) {
    const auto bit = static_cast<std::uint64_t>(value) - 1;
    return bit < 8 && ((0x95U >> bit) & 1U) != 0;
}

/// 2, 4, 6, 7, 9, 10 and 11: the data of one real user.
[[nodiscard]] constexpr bool isPerUserClass(OSTContainerClass value) {
    const auto bit = static_cast<std::uint64_t>(value) - 2;
    return bit < 10 && ((0x3b5U >> bit) & 1U) != 0;
}

/// 12 and 13: shared by system services.
[[nodiscard]] constexpr bool isSystemClass(OSTContainerClass value) {
    return (static_cast<std::uint64_t>(value) & ~std::uint64_t{1}) == 12;
}

/// Whether containers of the class may belong to the user: bundle classes to 33, system classes to 499, per-user
/// classes to any user above 500. False for every value outside 1 to 13.
[[nodiscard]] constexpr bool OSTUserIdFitsClass(OSTContainerClass containerClass, std::uint32_t userId) {
    return (isBundleClass(containerClass) && userId == OSTInstallerUserId) ||
           (isSystemClass(containerClass) && userId == OSTSystemUserId) ||
           (isPerUserClass(containerClass) && userId > OSTHighestSystemUserId);
}

/// The user to whom containers of the class belong when a caller names none: the installer for bundles, the owner of
/// system containers for system classes, else the current user.
[[nodiscard]] constexpr std::uint32_t usualUserOf(OSTContainerClass containerClass) {
    if (isBundleClass(containerClass))
        return OSTInstallerUserId;
    return isSystemClass(containerClass) ? OSTSystemUserId : OSTCurrentUserPlaceholder;
}

/// By class, the directory, relative to the class's base, that holds all containers of the class. People name the class
/// by it.
inline constexpr std::array<std::string_view, 15> OSTContainerClassPathComponents = {
    "Undefined",           "Bundle/Application", "Data/Application", "Bundle/LoomworkPlugin", "Data/LoomworkPlugin",
    "Bundle/VPNPlugin",    "Data/VPNPlugin",     "Shared/AppGroup",  "Bundle/Framework",      "Data/VexelService",
    "Data/InternalDaemon", "Data/TempDir",       "Data/System",      "Shared/SystemGroup",    "MAX",
};

/// "Data/Application". The class must lie in 0 to 14.
[[nodiscard]] constexpr std::string_view pathComponentForContainerClass(OSTContainerClass containerClass) {
    return OSTContainerClassPathComponents.at(static_cast<std::uint64_t>(containerClass));
}

} // namespace ost
