#pragma once

#include <cstdint>
#include <optional>
#include <string_view>

namespace ostrand {

/// The kinds of container. The daemon takes any number and refuses what it does not know, so other values may be cast
/// to this type and sent.
enum class ContainerClass : std::uint64_t {
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
};

/// User ids with a meaning of their own in requests.
inline constexpr std::uint32_t currentUser = 1; ///< the caller; for a system service, the user of the account "mobile"
inline constexpr std::uint32_t installerUser = 33;
inline constexpr std::uint32_t systemContainerUser = 499;

/// The class's directory below its base directory ("Data/Application"), by which people name it; empty for a number
/// that is no class.
[[nodiscard]] std::string_view nameOf(ContainerClass containerClass);

/// The class of that name, in any case.
[[nodiscard]] std::optional<ContainerClass> containerClassNamed(std::string_view name);

/// The user to whom containers of the class belong when nobody says otherwise: the installer's user for bundles, the
/// system containers' user for system classes, else the current user.
[[nodiscard]] std::uint32_t usualUserOf(ContainerClass containerClass);

} // namespace ostrand
