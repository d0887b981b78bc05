#pragma once

#include "Protocol/OSTContainerClass.h"
#include "Protocol/OSTKeys.h"
#include "platform/base/OSTError.h"
#include "platform/ipc/IPCMessage.h"
#include "store/OSTClientConnection.h"

#include <cstdint>
#include <expected>
#include <optional>
#include <string_view>

namespace ost {

/// A class and a user that a request names, the user resolved for the client.
struct OSTRequestedClassAndUser {
    OSTContainerClass containerClass;
    std::uint32_t userId;
};

/// Reads the class and the user of a request and validates the user for the client. Fails with `invalidParameter`.
[[nodiscard]] std::expected<OSTRequestedClassAndUser, OSTErrorCode>
OSTReadClassAndUser(const platform::IPCRequest& request, const OSTClientConnection& client,
                    const requestKey::Container& keys = requestKey::container);

/// Reads a container by class, user, identifier and UUID; what the request lacks is absent. Fails with
/// `invalidParameter`.
[[nodiscard]] std::expected<OSTContainerReference, OSTErrorCode> OSTReadContainer(const platform::IPCRequest& request,
                                                                                  const OSTClientConnection& client);

/// The identifier that a request names, or else the client's own.
[[nodiscard]] std::optional<std::string_view> OSTRequestedIdentifier(const platform::IPCRequest& request,
                                                                     const OSTClientConnection& client);

} // namespace ost
