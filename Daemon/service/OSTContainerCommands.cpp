#include "service/OSTContainerCommands.h"

#include "model/OSTUserIdentity.h"

namespace ost {

namespace {

/// The class and user that a request names, the user resolved for the client.
struct RequestedPlace {
    OSTContainerClass containerClass;
    std::uint32_t userId;
};

std::expected<RequestedPlace, OSTErrorCode> requestedPlace(const platform::IPCRequest& request,
                                                           const OSTClientConnection& client) {
    const auto containerClass = static_cast<OSTContainerClass>(request.unsignedValue("ContainerClass"));
    const auto userId = static_cast<std::uint32_t>(request.unsignedValue("UserID"));
    const auto resolved = OST_TRY(validateUserId(userId, containerClass, client.identity().clientUserId));
    return RequestedPlace{containerClass, resolved};
}

/// The identifier that a request names, or else the client's own.
std::optional<std::string_view> requestedIdentifier(const platform::IPCRequest& request,
                                                    const OSTClientConnection& client) {
    if (const auto identifier = request.stringValue("Identifier"))
        return identifier;
    return client.identity().clientBundleIdentifier;
}

} // namespace

OSTErrorCode OSTCreateOrLookupCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                      const OSTClientConnection& client) {
    const auto place = requestedPlace(request, client);
    if (!place)
        return place.error();
    const auto record =
        client.createOrLookupContainerForUser({.userId = place->userId,
                                               .identifier = requestedIdentifier(request, client),
                                               .containerClass = place->containerClass,
                                               .transient = request.booleanValue("Transient"),
                                               .createIfNecessary = request.booleanValue("CreateIfNecessary")});
    if (!record)
        return record.error();
    reply.set("ReplyUUID", (*record)->uuid);
    reply.set("ReplyExisted", (*record)->existed);
    reply.set("ReplyPath", (*record)->url);
    reply.set("ReplyIdentifier", (*record)->identifier);
    return OSTErrorCode::success;
}

OSTErrorCode OSTListCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                            const OSTClientConnection& client) {
    const auto place = requestedPlace(request, client);
    if (!place)
        return place.error();
    const auto records =
        client.containersForUser(place->userId, place->containerClass, request.booleanValue("Transient"));
    if (!records)
        return records.error();
    auto identifiers = reply.encoder("ReplyIdsArray");
    identifiers.beginArray(records->size());
    for (const auto& record : *records)
        identifiers.text(record->identifier);
    auto uuids = reply.encoder("ReplyUUIDsArray");
    uuids.beginArray(records->size());
    for (const auto& record : *records)
        uuids.uuid(record->uuid);
    return OSTErrorCode::success;
}

} // namespace ost
