#include "service/OSTContainerCommands.h"

#include "service/OSTRequestReaders.h"

namespace ost {

OSTErrorCode OSTCreateOrLookupCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                      OSTClientConnection& client) {
    const auto place = OSTRequestedPlace(request, client);
    if (!place)
        return place.error();
    const auto record = client.createOrLookupContainerForUser(
        {.name = {.userId = place->userId,
                  .containerClass = place->containerClass,
                  .identifier = OSTRequestedIdentifier(request, client),
                  .transient = request.booleanValue(requestKey::transient)},
         .createIfNecessary = request.booleanValue(requestKey::createIfNecessary)});
    if (!record)
        return record.error();
    reply.set(replyKey::uuid, (*record)->uuid);
    reply.set(replyKey::existed, (*record)->existed);
    reply.set(replyKey::path, (*record)->url);
    reply.set(replyKey::identifier, (*record)->identifier);
    return OSTErrorCode::success;
}

OSTErrorCode OSTListCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                            OSTClientConnection& client) {
    const auto place = OSTRequestedPlace(request, client);
    if (!place)
        return place.error();
    const auto records =
        client.containersForUser(place->userId, place->containerClass, request.booleanValue(requestKey::transient));
    if (!records)
        return records.error();
    auto identifiers = reply.encoder(replyKey::identifiers);
    identifiers.beginArray(records->size());
    for (const auto& record : *records)
        identifiers.text(record->identifier);
    auto uuids = reply.encoder(replyKey::uuids);
    uuids.beginArray(records->size());
    for (const auto& record : *records)
        uuids.uuid(record->uuid);
    return OSTErrorCode::success;
}

} // namespace ost
