#include "service/OSTContainerCommands.h"

#include "service/OSTRequestReaders.h"

namespace ost {

OSTCommandResult OSTCreateOrLookupCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                          OSTClientConnection& client) {
    const auto requested = OST_TRY(OSTReadClassAndUser(request, client));
    const auto record = OST_TRY(client.createOrLookupContainerForUser(
        {.name = {.userId = requested.userId,
                  .containerClass = requested.containerClass,
                  .identifier = OSTRequestedIdentifier(request, client),
                  .transient = request.booleanValue(requestKey::transient)},
         .createIfNecessary = request.booleanValue(requestKey::createIfNecessary)}));
    reply.set(replyKey::uuid, record->uuid);
    reply.set(replyKey::existed, record->existed);
    reply.set(replyKey::path, record->url);
    reply.set(replyKey::identifier, record->identifier);
    return {};
}

OSTCommandResult OSTListCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                OSTClientConnection& client) {
    const auto requested = OST_TRY(OSTReadClassAndUser(request, client));
    const auto records = OST_TRY(client.containersForUser(requested.userId, requested.containerClass,
                                                          request.booleanValue(requestKey::transient)));
    auto identifiers = reply.encoder(replyKey::identifiers);
    identifiers.beginArray(records.size());
    for (const auto& record : records)
        identifiers.text(record->identifier);
    auto uuids = reply.encoder(replyKey::uuids);
    uuids.beginArray(records.size());
    for (const auto& record : records)
        uuids.uuid(record->uuid);
    return {};
}

} // namespace ost
