#include "Client/Containers.h"

#include "platform/Try.h"

#include <cerrno>

namespace ostrand {

using ost::platform::CBORItem;

namespace {

enum Command : std::uint64_t { createOrLookupCommand = 0, listCommand = 1 };

Request requestFor(Command command, const ContainerRequest& about) {
    Request request(command);
    request.key("ContainerClass").unsignedNumber(static_cast<std::uint64_t>(about.containerClass));
    request.key("UserID").unsignedNumber(about.user);
    request.key("Transient").boolean(about.transient);
    return request;
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

} // namespace ostrand
