#pragma once

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

/// User ids that the system gives a meaning.
inline constexpr std::uint32_t OSTRootUserId = 0;
inline constexpr std::uint32_t OSTCurrentUserPlaceholder = 1; ///< in a request: the current user
inline constexpr std::uint32_t OSTInstallerUserId = 33;       ///< owns bundle containers
inline constexpr std::uint32_t OSTSystemUserId = 499;         ///< owner of system containers
inline constexpr std::uint32_t OSTHighestSystemUserId = 500;  ///< real users are above
inline constexpr std::uint32_t OSTDefaultUserId = 501;        ///< assumed for per-user metadata that names no user

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

/// The directory, relative to the class's base, that holds all containers of the class: "Data/Application".
/// The class must lie in 0 to 14.
[[nodiscard]] std::string_view pathComponentForContainerClass(OSTContainerClass containerClass);

} // namespace ost
