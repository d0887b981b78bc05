#pragma once

#include <string_view>

namespace ost {

/// Entitlements whose names begin so are rights over the daemon itself.
inline constexpr std::string_view OSTEntitlementPrefix = "com.tamarok.private.Ostrand.";

/// The entitlements that commands ask for and clients hold.
inline constexpr std::string_view OSTEntitlementAllowed = "com.tamarok.private.Ostrand.allowed"; ///< every command
inline constexpr std::string_view OSTEntitlementNone =
    "com.tamarok.private.Ostrand.none"; ///< of a command: asks for none
inline constexpr std::string_view OSTEntitlementOtherIdLookup = "com.tamarok.private.Ostrand.otherIdLookup";
inline constexpr std::string_view OSTEntitlementWipeContainer = "com.tamarok.private.Ostrand.wipeContainer";
inline constexpr std::string_view OSTEntitlementDataMigration = "com.tamarok.private.Ostrand.dataMigration";

/// The entitlements that give an identifier containers beside its own.
inline constexpr const char* OSTApplicationGroupsKey = "com.tamarok.security.application-groups";
inline constexpr const char* OSTSystemGroupsKey = "com.tamarok.security.system-groups";
inline constexpr const char* OSTSystemGroupsFallbackKey = "com.tamarok.security.system-group-containers";
inline constexpr const char* OSTSystemContainerKey = "com.tamarok.security.system-container"; ///< a boolean
/// What the identifiers of system groups begin with; others do not count.
inline constexpr std::string_view OSTSystemGroupPrefix = "systemgroup.";

} // namespace ost
