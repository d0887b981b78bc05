#include "service/OSTRemovalCommands.h"

#include "model/OSTUserIdentity.h"
#include "platform/base/Log.h"
#include "service/OSTRequestReaders.h"

#include <utility>
#include <vector>

namespace ost {

namespace {

/// Reads every element of an array; a value that is no array has none.
template<typename T, typename Read>
std::vector<T> elementsOf(const platform::IPCRequest& request, std::string_view key, Read read) {
    std::vector<T> values;
    if (const auto array = request.item(key))
        for (const auto element : array->elements())
            values.push_back(read(element));
    return values;
}

bool isArray(const platform::IPCRequest& request, std::string_view key) {
    const auto item = request.item(key);
    return item && item->type() == platform::CBORType::array;
}

std::uint64_t numberOf(const platform::CBORItem& element) { return element.asUnsigned().value_or(0); }

} // namespace

OSTCommandResult OSTReplaceCommand(const platform::IPCRequest& request, platform::IPCReply& /*reply*/,
                                   OSTClientConnection& client) {
    OSTReplacement replacement;
    auto& oldContainer = replacement.oldContainer;
    if ((oldContainer.uuid = request.uuidValue(requestKey::oldContainer.uuid))) {
        const auto requested = OST_TRY(OSTReadClassAndUser(request, client, requestKey::oldContainer));
        oldContainer.name = {.userId = requested.userId,
                             .containerClass = requested.containerClass,
                             .identifier = request.stringValue(requestKey::oldContainer.identifier)};
    }
    const auto requested = OST_TRY(OSTReadClassAndUser(request, client, requestKey::newContainer));
    replacement.newContainer = {.name = {.userId = requested.userId,
                                         .containerClass = requested.containerClass,
                                         .identifier = request.stringValue(requestKey::newContainer.identifier)},
                                .uuid = request.uuidValue(requestKey::newContainer.uuid)};
    return client.replaceContainer(replacement);
}

OSTCommandResult OSTStageForDeleteCommand(const platform::IPCRequest& request, platform::IPCReply& /*reply*/,
                                          OSTClientConnection& client) {
    OSTDeletion deletion;
    deletion.classes =
        elementsOf<OSTContainerClass>(request, requestKey::containers.containerClass, [](const auto& element) {
            return static_cast<OSTContainerClass>(numberOf(element));
        });
    deletion.uuids = elementsOf<std::optional<platform::UUID>>(request, requestKey::containers.uuid,
                                                               [](const auto& element) { return element.asUUID(); });
    const auto userIds = elementsOf<std::uint32_t>(request, requestKey::containers.userId, [](const auto& element) {
        return static_cast<std::uint32_t>(numberOf(element));
    });
    // A user without a class could not be validated.
    if (userIds.size() > deletion.classes.size())
        return std::unexpected(OSTCreateError(OSTErrorCode::invalidObject,
                                              "Can't act on an invalid input: user ID count: %ld, class count: %ld",
                                              userIds.size(), deletion.classes.size()));
    for (std::size_t i = 0; i < userIds.size(); ++i) {
        deletion.userIds.push_back(
            OST_TRY(validateUserId(userIds[i], deletion.classes[i], client.identity().clientUserId)));
    }
    if (!isArray(request, requestKey::containers.identifier))
        platform::logAs(platform::LogLevel::error, "stageContainerForDelete",
                        "Got non-Array input for the identifiers array");
    deletion.identifiers = elementsOf<std::optional<std::string_view>>(
        request, requestKey::containers.identifier, [](const auto& element) { return element.asText(); });
    return client.stageForDeleteContainersWithUsers(deletion);
}

OSTCommandResult OSTDestroyDeathRowCommand(const platform::IPCRequest& /*request*/, platform::IPCReply& reply,
                                           OSTClientConnection& client) {
    client.deleteContainersOnDeathRowWithCompletion([reply = std::move(reply)](std::int64_t code) mutable {
        reply.set(replyKey::error, static_cast<std::uint64_t>(code));
        reply.send();
    });
    return {};
}

OSTCommandResult OSTDeleteCommand(const platform::IPCRequest& request, platform::IPCReply& /*reply*/,
                                  OSTClientConnection& client) {
    const auto requested = OST_TRY(OSTReadClassAndUser(request, client));
    return client.deleteContainerForUser({.userId = requested.userId,
                                          .containerClass = requested.containerClass,
                                          .identifier = request.stringValue(requestKey::identifier),
                                          .transient = request.booleanValue(requestKey::transient)});
}

} // namespace ost
