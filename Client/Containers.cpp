#include "Client/Containers.h"

#include "platform/base/Try.h"

#include <cerrno>

namespace ostrand {

using ost::platform::CBORItem;

namespace {

enum Command : std::uint64_t {
    createOrLookupCommand = 0,
    listCommand = 1,
    replaceCommand = 2,
    stageForDeletionCommand = 3,
    destroyDeathRowCommand = 4,
    deleteCommand = 10,
};

Request requestFor(Command command, const ContainerRequest& about) {
    Request request(command);
    request.key("ContainerClass").unsignedNumber(static_cast<std::uint64_t>(about.containerClass));
    request.key("UserID").unsignedNumber(about.user);
    request.key("Transient").boolean(about.transient);
    return request;
}

/// One of the two containers of a replacement; `side` is "Old" or "New".
void addSide(Request& request, const std::string& side, const ContainerReference& container) {
    request.key(side + "ContainerUUID").uuid(container.uuid);
    request.key(side + "ContainerClass").unsignedNumber(static_cast<std::uint64_t>(container.containerClass));
    request.key(side + "ContainerUserID").unsignedNumber(container.user);
    request.key(side + "Identifier").text(container.identifier);
}

Result<void> withoutAnswer(const Result<Reply>& reply) {
    if (!reply)
        return std::unexpected(reply.error());
    return {};
}

} // namespace

Result<Container> createOrLookup(Connection& connection, const ContainerRequest& about, WhenMissing whenMissing) {
    auto request = requestFor(createOrLookupCommand, about);
    if (about.identifier)
        request.key("Identifier").text(*about.identifier);
    request.key("CreateIfNecessary").boolean(whenMissing == WhenMissing::create);

    const auto reply = OST_TRY(connection.call(request));
    const auto identifier = OST_TRY(reply.promised("ReplyIdentifier", &CBORItem::asText));
    const auto uuid = OST_TRY(reply.promised("ReplyUUID", &CBORItem::asUUID));
    const auto path = OST_TRY(reply.promised("ReplyPath", &CBORItem::asText));
    const bool existed = OST_TRY(reply.promised("ReplyExisted", &CBORItem::asBoolean));
    return Container{std::string(identifier), uuid, std::string(path), existed};
}

Result<std::vector<ListedContainer>> list(Connection& connection, const ContainerRequest& about) {
    const auto reply = OST_TRY(connection.call(requestFor(listCommand, about)));
    const auto identifiers = reply.find("ReplyIdsArray");
    const auto uuids = reply.find("ReplyUUIDsArray");
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
    Request request(stageForDeletionCommand);
    const auto array = [&](std::string_view key, auto writeElement) {
        auto elements = request.key(key);
        elements.beginArray(containers.size());
        for (const auto& container : containers)
            writeElement(elements, container);
    };
    array("ContainerClassesArray", [](auto& elements, const auto& container) {
        elements.unsignedNumber(static_cast<std::uint64_t>(container.containerClass));
    });
    array("UUIDsArray", [](auto& elements, const auto& container) { elements.uuid(container.uuid); });
    array("UserIDsArray", [](auto& elements, const auto& container) { elements.unsignedNumber(container.user); });
    array("IdentifiersArray", [](auto& elements, const auto& container) { elements.text(container.identifier); });
    return withoutAnswer(connection.call(request));
}

Result<void> deleteContainer(Connection& connection, const ContainerRequest& about) {
    auto request = requestFor(deleteCommand, about);
    if (about.identifier)
        request.key("Identifier").text(*about.identifier);
    return withoutAnswer(connection.call(request));
}

Result<void> destroyDeathRow(Connection& connection) {
    return withoutAnswer(connection.call(Request(destroyDeathRowCommand)));
}

Result<void> replace(Connection& connection, const std::optional<ContainerReference>& oldContainer,
                     const ContainerReference& newContainer) {
    Request request(replaceCommand);
    if (oldContainer)
        addSide(request, "Old", *oldContainer);
    addSide(request, "New", newContainer);
    return withoutAnswer(connection.call(request));
}

} // namespace ostrand
