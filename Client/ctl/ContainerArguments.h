#pragma once

#include "Client/Containers.h"
#include "Client/ctl/Arguments.h"

#include <string>
#include <vector>

namespace ostrand::ctl {

// How the command line names containers.

inline constexpr Option classOption{"class", "C", "the container class: 1 to 13, or its name, such as Data/Application",
                                    Option::Count::required};
inline constexpr Option userOption{"user", "U", "the user: a number, or the name of one of the device's accounts"};
inline constexpr Option transientOption{"transient", "", "ask for a transient container"};

/// What help says of classes and users.
inline constexpr std::string_view classesAndUsers =
    "Classes:\n"
    "   1 Bundle/Application      2 Data/Application      3 Bundle/LoomworkPlugin\n"
    "   4 Data/LoomworkPlugin     5 Bundle/VPNPlugin      6 Data/VPNPlugin\n"
    "   7 Shared/AppGroup         8 Bundle/Framework      9 Data/VexelService\n"
    "  10 Data/InternalDaemon    11 Data/TempDir         12 Data/System\n"
    "  13 Shared/SystemGroup\n"
    "Without --user, bundles belong to user 33, system containers to 499 and all others to the current user (1).";

[[nodiscard]] std::expected<ContainerClass, Failure> classOf(const Arguments& arguments);

/// The user that is given, or else the one to whom containers of the class usually belong.
[[nodiscard]] std::expected<std::uint64_t, Failure> userOf(const Arguments& arguments, ContainerClass containerClass);

/// The containers of these identifiers, found by listing, because a look-up would throw a transient one away.
[[nodiscard]] std::expected<std::vector<ContainerReference>, Failure>
listedContainers(Connection& connection, const ContainerRequest& about, const std::vector<std::string>& identifiers);

} // namespace ostrand::ctl
