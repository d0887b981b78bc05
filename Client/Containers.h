#pragma once

#include "Client/Connection.h"
#include "Client/ContainerClass.h"
#include "platform/UUID.h"

#include <optional>
#include <string>
#include <vector>

namespace ostrand {

/// The container that a request is about.
struct ContainerRequest {
    ContainerClass containerClass;
    std::uint64_t user = currentUser;
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

/// What a request does about a container that is not there.
enum class WhenMissing : bool { fail, create };

/// Finds the container or creates it. Any signed program may ask for its own identifier. Fails with 21 when it is not
/// there and not to be created, 11 for a class or identifier that cannot be, 38 for a user that does not fit the class.
[[nodiscard]] Result<Container> createOrLookup(Connection& connection, const ContainerRequest& request,
                                               WhenMissing whenMissing);

/// The containers of a user and class; the request's identifier plays no part. Asks for full access. Fails with 38 for
/// a user that does not fit the class.
[[nodiscard]] Result<std::vector<ListedContainer>> list(Connection& connection, const ContainerRequest& request);

} // namespace ostrand
