#include "Client/Containers.h"

#include "Protocol/OSTKeys.h"
#include "platform/base/Try.h"

#include <cerrno>

namespace ostrand {

using ost::OSTCommand;
using ost::platform::CBORItem;

namespace replyKey = ost::replyKey;
namespace requestKey = ost::requestKey;

namespace {

Request requestFor(OSTCommand command, const ContainerRequest& about) {
    Request request(command);
    request.key(requestKey::container.containerClass).unsignedNumber(static_cast<std::uint64_t>(about.containerClass));
    request.key(requestKey::container.userId).unsignedNumber(about.user);
    request.key(requestKey::transient).boolean(about.transient);
    return request;
}

/// One of the two containers of a replacement.
void addSide(Request& request, const requestKey::Container& keys, const ContainerReference& container) {
    request.key(keys.uuid).uuid(container.uuid);
    request.key(keys.containerClass).unsignedNumber(static_cast<std::uint64_t>(container.containerClass));
    request.key(keys.userId).unsignedNumber(container.user);
    request.key(keys.identifier).text(container.identifier);
}

Result<void> withoutAnswer(const Result<Reply>& reply) {
    if (!reply)
        return std::unexpected(reply.error());
    return {};
}

} // namespace

Result<Container> createOrLookup(Connection& connection, const ContainerRequest& about, WhenMissing whenMissing) {
    auto request = requestFor(OSTCommand::createOrLookup, about);
    if (about.identifier)
        request.key(requestKey::identifier).text(*about.identifier);
    request.key(requestKey::createIfNecessary).boolean(whenMissing == WhenMissing::create);

    const auto reply = OST_TRY(connection.call(request));
    const auto identifier = OST_TRY(reply.promised(replyKey::identifier, &CBORItem::asText));
    const auto uuid = OST_TRY(reply.promised(replyKey::uuid, &CBORItem::asUUID));
    const auto path = OST_TRY(reply.promised(replyKey::path, &CBORItem::asText));
    const bool existed = OST_TRY(reply.promised(replyKey::existed, &CBORItem::asBoolean));
    return Container{std::string(identifier), uuid, std::string(path), existed};
}

Result<std::vector<ListedContainer>> list(Connection& connection, const ContainerRequest& about) {
    const auto reply = OST_TRY(connection.call(requestFor(OSTCommand::list, about)));
    const auto identifiers = reply.find(replyKey::identifiers);
    const auto uuids = reply.find(replyKey::uuids);
    if (!identifiers || !uuids || identifiers->count() != uuids->count())
        return std::unexpected(Error::transport(EBADMSG));

    std::vector<ListedContainer> containers;
    containers.reserve(identifiers->count());
    auto uuidItem = uuids->elements().begin();
    for (const auto identifierItem : identifiers->elements()) {
        const auto identifier = identifierItem.asText();
        const auto uuid = (*uuidItem++).asUUID();
        if (!identifier || !uuid)
            return std::unexpected(Error::transport(EBADMSG));
        containers.push_back({std::string(*identifier), *uuid});
    }
    return containers;
}

Result<void> stageForDeletion(Connection& connection, const std::vector<ContainerReference>& containers) {
    Request request(OSTCommand::stageForDelete);
    const auto array = [&](std::string_view key, auto writeElement) {
        auto elements = request.key(key);
        elements.beginArray(containers.size());
        for (const auto& container : containers)
            writeElement(elements, container);
    };
    array(requestKey::containers.containerClass, [](auto& elements, const auto& container) {
        elements.unsignedNumber(static_cast<std::uint64_t>(container.containerClass));
    });
    array(requestKey::containers.uuid, [](auto& elements, const auto& container) { elements.uuid(container.uuid); });
    array(requestKey::containers.userId,
          [](auto& elements, const auto& container) { elements.unsignedNumber(container.user); });
    array(requestKey::containers.identifier,
          [](auto& elements, const auto& container) { elements.text(container.identifier); });
    return withoutAnswer(connection.call(request));
}

Result<void> deleteContainer(Connection& connection, const ContainerRequest& about) {
    auto request = requestFor(OSTCommand::deleteContainer, about);
    if (about.identifier)
        request.key(requestKey::identifier).text(*about.identifier);
    return withoutAnswer(connection.call(request));
}

Result<void> destroyDeathRow(Connection& connection) {
    return withoutAnswer(connection.call(Request(OSTCommand::destroyDeathRow)));
}

Result<std::uint32_t> beginDestroyingDeathRow(Connection& connection) {
    return connection.send(Request(OSTCommand::destroyDeathRow));
}

Result<void> replace(Connection& connection, const std::optional<ContainerReference>& oldContainer,
                     const ContainerReference& newContainer) {
    Request request(OSTCommand::replace);
    if (oldContainer)
        addSide(request, requestKey::oldContainer, *oldContainer);
    addSide(request, requestKey::newContainer, newContainer);
    return withoutAnswer(connection.call(request));
}

} // namespace ostrand
