#include "Client/Maintenance.h"

#include "Protocol/OSTKeys.h"
#include "platform/base/Try.h"

namespace ostrand {

using ost::OSTCommand;
using ost::platform::CBORItem;

namespace replyKey = ost::replyKey;
namespace requestKey = ost::requestKey;

namespace {

Result<void> carriedOut(Connection& connection, const Request& request) {
    if (const auto reply = connection.call(request); !reply)
        return std::unexpected(reply.error());
    return {};
}

} // namespace

Result<void> wipe(Connection& connection, const ContainerRequest& container) {
    Request request(OSTCommand::wipeData);
    const auto& keys = requestKey::container;
    request.key(keys.containerClass).unsignedNumber(static_cast<std::uint64_t>(container.containerClass));
    request.key(keys.userId).unsignedNumber(container.user);
    if (container.identifier)
        request.key(keys.identifier).text(*container.identifier);
    return carriedOut(connection, request);
}

Result<void> wipePlugIn(Connection& connection, const std::string& identifier, std::uint64_t user) {
    Request request(OSTCommand::wipePlugInData);
    request.key(requestKey::container.userId).unsignedNumber(user);
    request.key(requestKey::identifier).text(identifier);
    return carriedOut(connection, request);
}

Result<std::uint64_t> diskUsage(Connection& connection, const ContainerReference& container) {
    Request request(OSTCommand::diskUsage);
    const auto& keys = requestKey::container;
    request.key(keys.uuid).uuid(container.uuid);
    request.key(keys.containerClass).unsignedNumber(static_cast<std::uint64_t>(container.containerClass));
    request.key(keys.userId).unsignedNumber(container.user);
    request.key(keys.identifier).text(container.identifier);
    const auto reply = OST_TRY(connection.call(request));
    return reply.promised(replyKey::diskUsage, &CBORItem::asUnsigned);
}

Result<void> migrate(Connection& connection) {
    return carriedOut(connection, Request(OSTCommand::performDataMigration));
}

Result<std::uint32_t> beginMigration(Connection& connection) {
    return connection.send(Request(OSTCommand::performDataMigration));
}

Result<void> retryTest(Connection& connection, std::uint64_t user, std::uint64_t crashes) {
    Request request(OSTCommand::retryTest);
    request.key(requestKey::container.userId).unsignedNumber(user);
    request.key(requestKey::numRetryCrashes).unsignedNumber(crashes);
    return carriedOut(connection, request);
}

} // namespace ostrand
