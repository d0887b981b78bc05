#include "service/OSTContainerCommands.h"

#include "service/OSTRequestReaders.h"

namespace ost {

OSTErrorCode OSTCreateOrLookupCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                      OSTClientConnection& client) {
    const auto place = OSTRequestedPlace(request, client);
    if (!place)
        return place.error();
    const auto record =
        client.createOrLookupContainerForUser({.name = {.userId = place->userId,
                                                        .containerClass = place->containerClass,
                                                        .identifier = OSTRequestedIdentifier(request, client),
                                                        .transient = request.booleanValue("Transient")},
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
                            OSTClientConnection& client) {
    const auto place = OSTRequestedPlace(request, client);
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
