#include "service/OSTAttributeCommands.h"

#include "Protocol/OSTKeys.h"
#include "platform/base/Log.h"
#include "platform/codec/IPCValue.h"
#include "protection/OSTDataProtectionManager.h"
#include "service/OSTRequestReaders.h"

#include <cerrno>
#include <utility>

namespace ost {

namespace {

/// The info value of a request; none when it has none.
std::expected<std::optional<OSTValue>, OSTErrorCode> infoValueOf(const platform::IPCRequest& request) {
    const auto item = request.item(requestKey::infoValue);
    if (!item)
        return std::nullopt;
    auto value = platform::propertyListValue(*item);
    if (!value) {
        // To take it for a missing one would remove what is stored.
        platform::logAs(platform::LogLevel::error, "setInfoValue", "Value of %@ is no property-list value",
                        requestKey::infoValue);
        return std::unexpected(OSTErrorCode::invalidParameter);
    }
    return value;
}

/// Puts a value into the reply. A user may have put one into a metadata file that no message holds.
OSTCommandResult put(platform::IPCReply& reply, std::string_view key, const OSTValue& value) {
    if (!platform::fitsIntoMessage(value)) {
        reply.clear();
        return std::unexpected(static_cast<OSTErrorCode>(EMSGSIZE));
    }
    auto encoder = reply.encoder(key);
    platform::encodePropertyListValue(encoder, value);
    return {};
}

} // namespace

OSTCommandResult OSTSetInfoValueCommand(const platform::IPCRequest& request, platform::IPCReply& /*reply*/,
                                        OSTClientConnection& client) {
    const auto container = OST_TRY(OSTReadContainer(request, client));
    const auto value = OST_TRY(infoValueOf(request));
    return client.setInfoValue(value, request.stringValue(requestKey::infoKey), container);
}

OSTCommandResult OSTInfoValueCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                     OSTClientConnection& client) {
    const auto container = OST_TRY(OSTReadContainer(request, client));
    const auto value = OST_TRY(client.infoValueForKey(request.stringValue(requestKey::infoKey), container));
    return put(reply, replyKey::infoValue, value);
}

OSTCommandResult OSTMetadataCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                    OSTClientConnection& client) {
    const auto container = OST_TRY(OSTReadContainer(request, client));
    const auto record = OST_TRY(client.metadataForUser(container));
    reply.set(replyKey::path, record->url);
    reply.set(replyKey::transient, record->transient);
    if (request.booleanValue(requestKey::infoDictRequested) && record->info)
        return put(reply, replyKey::infoDictionary, OSTValue(record->info));
    return {};
}

OSTCommandResult OSTRecreateDefaultStructureCommand(const platform::IPCRequest& request, platform::IPCReply& /*reply*/,
                                                    OSTClientConnection& client) {
    return client.recreateDefaultStructureForUser(OST_TRY(OSTReadContainer(request, client)));
}

OSTCommandResult OSTRegenerateDirectoryUUIDCommand(const platform::IPCRequest& request, platform::IPCReply& /*reply*/,
                                                   OSTClientConnection& client) {
    return client.regenerateDirectoryUUIDForUser(OST_TRY(OSTReadContainer(request, client)));
}

OSTCommandResult OSTSetDataProtectionCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                             OSTClientConnection& client) {
    auto answer = [reply = std::move(reply)](OSTErrorCode code) mutable {
        reply.set(replyKey::error, static_cast<std::uint64_t>(code));
        reply.send();
    };
    const auto container = OSTReadContainer(request, client);
    if (!container) {
        answer(container.error());
        return {};
    }
    OSTDataProtectionManager::defaultManager().setDataProtectionOnDataContainerForUser(
        {.container = container->name,
         .dataProtectionClass = static_cast<std::int32_t>(request.signedValue(requestKey::dataProtectionClass)),
         .isSecondOrThirdPartyApp = request.booleanValue(requestKey::isThirdParty),
         .retryIfLocked = request.booleanValue(requestKey::retryIfLocked)},
        std::move(answer));
    return {};
}

} // namespace ost
