#include "service/OSTCodeSigningCommands.h"

#include "codesigning/OSTCodeSigningMapping.h"
#include "codesigning/OSTGroupManager.h"
#include "codesigning/OSTWhitelist.h"
#include "model/OSTUserIdentity.h"
#include "platform/base/Log.h"
#include "platform/codec/IPCValue.h"
#include "service/OSTRequestReaders.h"

#include <algorithm>
#include <cerrno>

namespace ost {

namespace {

/// The user of a request about application groups, resolved for the client.
std::expected<std::uint32_t, OSTErrorCode> groupUser(const platform::IPCRequest& request,
                                                     const OSTClientConnection& client) {
    return validateUserId(static_cast<std::uint32_t>(request.unsignedValue(requestKey::container.userId)),
                          OSTContainerClass::sharedAppGroup, client.identity().clientUserId);
}

OSTCommandResult replyWithGroupPaths(const platform::IPCRequest& request, platform::IPCReply& reply,
                                     OSTClientConnection& client, std::uint32_t userId) {
    const auto paths = OST_TRY(OSTGroupManager::defaultManager().groupContainerPathsForUser(
        userId, client, OSTRequestedIdentifier(request, client)));
    auto dictionary = reply.encoder(replyKey::groupContainers);
    dictionary.beginMap(paths.size());
    for (const auto& [group, path] : paths) {
        dictionary.key(group);
        dictionary.text(path);
    }
    return {};
}

/// A value that must be a dictionary when it is there.
std::expected<std::shared_ptr<const OSTDictionary>, OSTErrorCode> dictionaryOf(const platform::IPCRequest& request,
                                                                               std::string_view key) {
    const auto item = request.item(key);
    if (!item)
        return nullptr;
    const auto value = platform::propertyListValue(*item);
    auto dictionary = value ? value->sharedDictionary() : nullptr;
    if (!dictionary) {
        // To take it for a missing one would remove what is registered.
        platform::logAs(platform::LogLevel::error, "registerCodeSigningInfo", "Value of %@ is no dictionary", key);
        return std::unexpected(OSTErrorCode::invalidParameter);
    }
    return dictionary;
}

OSTRegistrationOptions optionsOf(const OSTDictionary* dictionary) {
    OSTRegistrationOptions options;
    if (!dictionary)
        return options;
    const auto isTrue = [&](const char* key) {
        const auto* const value = dictionary->find(key);
        return value && value->truthValue();
    };
    if (const auto* const containerClass = dictionary->find(optionKey::dataContainerClass))
        options.dataContainerClass = containerClass->unsignedValue().value_or(0);
    if (const auto* const parent = dictionary->find(optionKey::parentBundleIdentifier); parent && parent->asString())
        options.parentBundleIdentifier = *parent->asString();
    options.registeredByCaller = isTrue(optionKey::registeredByCaller);
    options.placeholder = isTrue(optionKey::placeholder);
    return options;
}

/// The path of a system group container that the mapping grants to the client; none when its making failed.
std::optional<std::string> grantedGroupPath(std::optional<std::string_view> identifier, const std::string& group,
                                            OSTClientConnection& client) {
    const auto paths =
        OSTGroupManager::defaultManager().groupContainerPathsForUser(OSTSystemUserId, client, identifier);
    if (!paths || !paths->contains(group))
        return std::nullopt;
    return paths->at(group);
}

std::optional<std::string> wellknownGroupPath(const std::string& group, OSTClientConnection& client) {
    client.setAllowGroupIdLookup();
    const auto record = client.createOrLookupContainerForUser(
        {.name = {OSTSystemUserId, OSTContainerClass::sharedSystemGroup, group}, .createIfNecessary = true});
    return record ? std::optional((*record)->url) : std::nullopt;
}

} // namespace

OSTCommandResult OSTGroupContainerPathsCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                               OSTClientConnection& client) {
    return replyWithGroupPaths(request, reply, client, OST_TRY(groupUser(request, client)));
}

OSTCommandResult OSTGroupIdentifiersCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                            OSTClientConnection& client) {
    const auto userId = OST_TRY(groupUser(request, client));
    const auto groups = OST_TRY(OSTGroupManager::defaultManager().groupContainerIdentifiersForUser(
        userId, OSTRequestedIdentifier(request, client)));
    reply.set(replyKey::groupIdentifiers, groups);
    return {};
}

OSTCommandResult OSTSystemContainerPathCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                               OSTClientConnection& client) {
    const auto identifier = OSTRequestedIdentifier(request, client);
    const bool isOwn = identifier == client.identity().clientBundleIdentifier;
    if (identifier && !isOwn && OSTWhitelist::sharedWhitelist().systemContainerIdIsWellknown(*identifier))
        client.setAllowOtherIdLookup();
    const auto record = OST_TRY(client.createOrLookupContainerForUser(
        {.name = {OSTSystemUserId, OSTContainerClass::dataSystem, identifier}, .createIfNecessary = true}));
    reply.set(replyKey::path, record->url);
    return {};
}

OSTCommandResult OSTSystemGroupContainerPathsCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                                     OSTClientConnection& client) {
    return replyWithGroupPaths(request, reply, client, OSTSystemUserId);
}

OSTCommandResult OSTSystemGroupContainerPathCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                                    OSTClientConnection& client) {
    constexpr const char* function = "systemGroupContainerPath";
    const auto identifier = OSTRequestedIdentifier(request, client);
    const auto& clientIdentifier = client.identity().clientBundleIdentifier;
    const auto named = request.stringValue(requestKey::groupIdentifier);
    const std::string group(named.value_or(std::string_view()));
    const auto granted =
        clientIdentifier
            ? OSTCodeSigningMapping::sharedInstance().systemGroupIdentifiersForIdentifier(*clientIdentifier)
            : std::nullopt;
    std::optional<std::string> path;
    if (named && granted && std::ranges::find(*granted, group) != granted->end()) {
        path = grantedGroupPath(identifier, group, client);
    } else if (named && OSTWhitelist::sharedWhitelist().systemGroupContainerIdIsWellknown(group)) {
        path = wellknownGroupPath(group, client);
    } else {
        platform::logAs(platform::LogLevel::error, function, "%@ is not entitled for system group identifier: %@",
                        clientIdentifier, named);
        return std::unexpected(OSTErrorCode::notEntitled);
    }
    if (!path) {
        platform::logAs(platform::LogLevel::error, function,
                        "Did not find system group container with identifier: %@ for %@", group, identifier);
        return std::unexpected(OSTErrorCode::notFound);
    }
    reply.set(replyKey::path, *path);
    return {};
}

OSTCommandResult OSTRegisterCodeSigningCommand(const platform::IPCRequest& request, platform::IPCReply& /*reply*/,
                                               OSTClientConnection& /*client*/) {
    const auto info = OST_TRY(dictionaryOf(request, requestKey::codeSigningInfo));
    const auto options = OST_TRY(dictionaryOf(request, requestKey::optionsDictionary));
    return OSTCodeSigningMapping::sharedInstance().processCodeSigningInfo(
        info, request.stringValue(requestKey::identifier), optionsOf(options.get()));
}

OSTCommandResult OSTCodeSigningInfoCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                           OSTClientConnection& /*client*/) {
    const auto identifier = request.stringValue(requestKey::identifier);
    const auto info =
        identifier ? OSTCodeSigningMapping::sharedInstance().getCodeSigningInfoForIdentifier(*identifier) : nullptr;
    if (!info)
        return std::unexpected(OSTErrorCode::notFound);
    if (!platform::fitsIntoMessage(*info))
        return std::unexpected(static_cast<OSTErrorCode>(EMSGSIZE));
    auto encoder = reply.encoder(replyKey::infoDictionary);
    platform::encodePropertyListValue(encoder, *info);
    return {};
}

OSTCommandResult OSTInvalidateCodeSigningCommand(const platform::IPCRequest& /*request*/, platform::IPCReply& /*reply*/,
                                                 OSTClientConnection& /*client*/) {
    return OSTCodeSigningMapping::sharedInstance().invalidateCodeSigningInfoForAppsWithoutBundleContainer();
}

} // namespace ost
