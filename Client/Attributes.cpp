#include "Client/Attributes.h"

#include "Protocol/OSTKeys.h"
#include "platform/base/Try.h"
#include "platform/codec/IPCValue.h"

#include <cerrno>

namespace ostrand {

using ost::OSTCommand;
using ost::platform::CBORItem;

namespace replyKey = ost::replyKey;
namespace requestKey = ost::requestKey;

namespace {

Request requestAbout(OSTCommand command, const ContainerReference& container) {
    Request request(command);
    const auto& keys = requestKey::container;
    request.key(keys.uuid).uuid(container.uuid);
    request.key(keys.containerClass).unsignedNumber(static_cast<std::uint64_t>(container.containerClass));
    request.key(keys.userId).unsignedNumber(container.user);
    request.key(keys.identifier).text(container.identifier);
    return request;
}

Result<void> withoutAnswer(const Result<Reply>& reply) {
    if (!reply)
        return std::unexpected(reply.error());
    return {};
}

Result<ost::OSTValue> valueIn(const Reply& reply, std::string_view key) {
    const auto item = reply.find(key);
    auto value = item ? ost::platform::propertyListValue(*item) : std::nullopt;
    if (!value)
        return std::unexpected(Error::transport(EBADMSG));
    return *std::move(value);
}

} // namespace

Result<ost::OSTValue> infoValue(Connection& connection, const ContainerReference& container, const std::string& key) {
    auto request = requestAbout(OSTCommand::infoValue, container);
    request.key(requestKey::infoKey).text(key);
    const auto reply = OST_TRY(connection.call(request));
    return valueIn(reply, replyKey::infoValue);
}

Result<void> setInfoValue(Connection& connection, const ContainerReference& container, const std::string& key,
                          const std::optional<ost::OSTValue>& value) {
    auto request = requestAbout(OSTCommand::setInfoValue, container);
    request.key(requestKey::infoKey).text(key);
    if (value) {
        auto encoder = request.key(requestKey::infoValue);
        ost::platform::encodePropertyListValue(encoder, *value);
    }
    return withoutAnswer(connection.call(request));
}

Result<ContainerMetadata> metadata(Connection& connection, const ContainerReference& container) {
    auto request = requestAbout(OSTCommand::metadata, container);
    request.key(requestKey::infoDictRequested).boolean(true);
    const auto reply = OST_TRY(connection.call(request));
    ContainerMetadata metadata{.path = std::string(OST_TRY(reply.promised(replyKey::path, &CBORItem::asText))),
                               .transient = OST_TRY(reply.promised(replyKey::transient, &CBORItem::asBoolean)),
                               .info = {}};
    if (!reply.find(replyKey::infoDictionary))
        return metadata;
    const auto info = OST_TRY(valueIn(reply, replyKey::infoDictionary));
    if (!info.asDictionary())
        return std::unexpected(Error::transport(EBADMSG));
    metadata.info = *info.asDictionary();
    return metadata;
}

Result<void> recreateDefaultStructure(Connection& connection, const ContainerReference& container) {
    return withoutAnswer(connection.call(requestAbout(OSTCommand::recreateDefaultStructure, container)));
}

Result<void> regenerateDirectoryUUID(Connection& connection, const ContainerReference& container) {
    return withoutAnswer(connection.call(requestAbout(OSTCommand::regenerateDirectoryUUID, container)));
}

Result<std::uint32_t> beginSettingDataProtection(Connection& connection, const DataProtection& change) {
    Request request(OSTCommand::setDataProtection);
    const auto& keys = requestKey::container;
    request.key(keys.containerClass).unsignedNumber(static_cast<std::uint64_t>(change.containerClass));
    request.key(keys.userId).unsignedNumber(change.user);
    request.key(keys.identifier).text(change.identifier);
    request.key(requestKey::dataProtectionClass).signedNumber(change.protectionClass);
    request.key(requestKey::isThirdParty).boolean(change.outsideDeveloper);
    request.key(requestKey::retryIfLocked).boolean(change.retryIfLocked);
    return connection.send(request);
}

Result<void> setDataProtection(Connection& connection, const DataProtection& change) {
    return withoutAnswer(connection.receive(OST_TRY(beginSettingDataProtection(connection, change))));
}

} // namespace ostrand
