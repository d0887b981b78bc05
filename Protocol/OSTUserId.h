#pragma once

#include <cstdint>

namespace ost {

/// User ids that the system gives a meaning.
inline constexpr std::uint32_t OSTRootUserId = 0;
/// In a request: the caller; for a system service, the user of the account "mobile".
inline constexpr std::uint32_t OSTCurrentUserPlaceholder = 1;
inline constexpr std::uint32_t OSTInstallerUserId = 33;      ///< owns bundle containers
inline constexpr std::uint32_t OSTSystemUserId = 499;        ///< owner of system containers
inline constexpr std::uint32_t OSTHighestSystemUserId = 500; ///< real users are above
inline constexpr std::uint32_t OSTDefaultUserId = 501;       ///< assumed for per-user metadata that names no user

} // namespace ost
