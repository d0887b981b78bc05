#include "service/OSTContainerCommands.h"

#include "platform/base/Log.h"
#include "platform/ipc/IPCFrame.h"
#include "service/OSTRequestReaders.h"

#include <algorithm>
#include <string>
#include <vector>

namespace ost {

namespace {

/// What a container takes in a listing beside the bytes of its identifier: the heads of text and UUID, and the UUID.
constexpr std::size_t listedBesideIdentifier = 5 + 19;
/// Left for the keys and the heads of what a listing is.
constexpr std::size_t listingFrame = 256;

/// Leaves out the containers of the longest identifiers where no reply holds all.
void leaveOutWhatNoReplyHolds(std::vector<OSTMetadataRecord>& records) {
    const auto bytesOf = [](const OSTMetadataRecord& record) {
        return record->identifier.size() + listedBesideIdentifier;
    };
    std::size_t bytes = listingFrame;
    for (const auto& record : records)
        bytes += bytesOf(record);
    if (bytes <= platform::IPCFrameHeader::maximumPayload)
        return;
    std::ranges::sort(records, {}, bytesOf);
    std::vector<std::string> directories;
    for (; bytes > platform::IPCFrameHeader::maximumPayload; records.pop_back()) {
        bytes -= bytesOf(records.back());
        directories.push_back(records.back()->url);
    }
    platform::logAs(platform::LogLevel::error, "containersForUser",
                    "No reply holds the identifiers of all containers, so a listing lacks those of %@", directories);
}

} // namespace

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
    auto records = OST_TRY(client.containersForUser(requested.userId, requested.containerClass,
                                                    request.booleanValue(requestKey::transient)));
    leaveOutWhatNoReplyHolds(records);
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
