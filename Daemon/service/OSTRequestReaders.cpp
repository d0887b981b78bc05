#include "service/OSTRequestReaders.h"

#include "model/OSTUserIdentity.h"

namespace ost {

std::expected<OSTRequestedClassAndUser, OSTErrorCode> OSTReadClassAndUser(const platform::IPCRequest& request,
                                                                          const OSTClientConnection& client,
                                                                          const requestKey::Container& keys) {
    const auto containerClass = static_cast<OSTContainerClass>(request.unsignedValue(keys.containerClass));
    // Only the low half of the number is a user id.
    const auto userId = static_cast<std::uint32_t>(request.unsignedValue(keys.userId));
    const auto resolved = OST_TRY(validateUserId(userId, containerClass, client.identity().clientUserId));
    return OSTRequestedClassAndUser{containerClass, resolved};
}

std::expected<OSTContainerReference, OSTErrorCode> OSTReadContainer(const platform::IPCRequest& request,
                                                                    const OSTClientConnection& client) {
    const auto requested = OST_TRY(OSTReadClassAndUser(request, client));
    return OSTContainerReference{.name = {.userId = requested.userId,
                                          .containerClass = requested.containerClass,
                                          .identifier = request.stringValue(requestKey::identifier)},
                                 .uuid = request.uuidValue(requestKey::container.uuid)};
}

std::optional<std::string_view> OSTRequestedIdentifier(const platform::IPCRequest& request,
                                                       const OSTClientConnection& client) {
    if (const auto identifier = request.stringValue(requestKey::identifier))
        return identifier;
    return client.identity().clientBundleIdentifier;
}

} // namespace ost
