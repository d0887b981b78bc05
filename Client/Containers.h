#pragma once

#include "Client/Connection.h"
#include "Protocol/OSTContainerClass.h"
#include "platform/base/UUID.h"

#include <optional>
#include <string>
#include <vector>

namespace ostrand {

/// The kinds of container. The daemon takes any number and refuses what it does not know, so other values may be cast
/// to this type and sent.
using ContainerClass = ost::OSTContainerClass;

/// The container that a request is about.
struct ContainerRequest {
    ContainerClass containerClass;
    std::uint64_t user = ost::OSTCurrentUserPlaceholder;
    std::optional<std::string> identifier; ///< absent: the caller's own, from its signature
    bool transient = false;
};

/// A container, as a creation or look-up finds it.
struct Container {
    std::string identifier;
    ost::platform::UUID uuid;
    std::string path; ///< of the device; the host finds it below the device's directory
    bool existed;     ///< false when this very request made it
};

/// A container, as a listing shows it.
struct ListedContainer {
    std::string identifier;
    ost::platform::UUID uuid;
};

/// A container that its lister knows by its UUID.
struct ContainerReference {
    ContainerClass containerClass;
    std::uint64_t user = ost::OSTCurrentUserPlaceholder;
    std::string identifier;
    ost::platform::UUID uuid;
};

/// What a request does about a container that is not there.
enum class WhenMissing : bool { fail, create };

/// Finds the container or creates it. Any signed program may ask for its own identifier. Fails with 21 when it is not
/// there and not to be created, 11 for a class or identifier that cannot be, 38 for a user that does not fit the class.
[[nodiscard]] Result<Container> createOrLookup(Connection& connection, const ContainerRequest& request,
                                               WhenMissing whenMissing);

/// The containers of a user and class; the request's identifier plays no part. Asks for full access. Fails with 38 for
/// a user that does not fit the class.
[[nodiscard]] Result<std::vector<ListedContainer>> list(Connection& connection, const ContainerRequest& request);

// All of these ask for full access.

/// Takes containers out of their places and stages them for deletion. One that is not there is passed over in silence;
/// list again to see what is left. Fails with 38, before anything is touched, for a user that does not fit the class.
[[nodiscard]] Result<void> stageForDeletion(Connection& connection, const std::vector<ContainerReference>& containers);

/// Stages the container of that identifier, which must be given, for deletion. Fails with 21 when it is not there, with
/// 11 or 38 as above. A transient container is thrown away when the daemon looks it up, and 21 is then the answer:
/// stage it by its UUID instead.
[[nodiscard]] Result<void> deleteContainer(Connection& connection, const ContainerRequest& request);

/// Destroys what is staged for deletion, and returns when that is done. Fails with 17 when something could not be
/// destroyed, or with the errno of what had to be parked under /tmp.
[[nodiscard]] Result<void> destroyDeathRow(Connection& connection);
/// Only sends it; the reply to the number, which has nothing but its code, is to be received.
[[nodiscard]] Result<std::uint32_t> beginDestroyingDeathRow(Connection& connection);

/// Puts the new container in the place of the old one, which is staged for deletion; without an old one, makes a
/// transient container a lasting one. The two must differ in being transient, since the new one keeps its directory's
/// name. Fails with 21 when one of them is not there, 27 when the place is taken, 22, 23 or 56 when they do not go
/// together.
[[nodiscard]] Result<void> replace(Connection& connection, const std::optional<ContainerReference>& oldContainer,
                                   const ContainerReference& newContainer);

} // namespace ostrand
