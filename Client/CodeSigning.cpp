#include "Client/CodeSigning.h"

#include "platform/base/Try.h"
#include "platform/codec/IPCValue.h"

#include <cerrno>

namespace ostrand {

using ost::OSTDictionary;
using ost::platform::CBORItem;

namespace {

enum Command : std::uint64_t {
    groupPathsCommand = 13,
    groupIdentifiersCommand = 14,
    systemPathCommand = 15,
    systemGroupPathsCommand = 16,
    systemGroupPathCommand = 17,
    registerCommand = 18,
    infoCommand = 19,
    invalidateCommand = 20,
};

Request requestFor(Command command, const std::optional<std::string>& identifier) {
    Request request(command);
    if (identifier)
        request.key("Identifier").text(*identifier);
    return request;
}

void addDictionary(Request& request, std::string_view key, const OSTDictionary& dictionary) {
    auto encoder = request.key(key);
    ost::platform::encodePropertyListValue(encoder, dictionary);
}

std::unexpected<Error> incomprehensible() { return std::unexpected(Error::transport(EBADMSG)); }

Result<void> done(Connection& connection, const Request& request) {
    OST_TRY(connection.call(request));
    return {};
}

Result<GroupPaths> pathsFrom(Connection& connection, const Request& request) {
    const auto reply = OST_TRY(connection.call(request));
    const auto dictionary = reply.find("ReplyGroupContainerDict");
    if (!dictionary)
        return incomprehensible();
    GroupPaths paths;
    for (const auto& [group, item] : dictionary->entries()) {
        const auto path = item.asText();
        if (!path)
            return incomprehensible();
        paths.emplace(group, *path);
    }
    return paths;
}

Result<std::string> pathFrom(Connection& connection, const Request& request) {
    const auto reply = OST_TRY(connection.call(request));
    return std::string(OST_TRY(reply.promised("ReplyPath", &CBORItem::asText)));
}

} // namespace

OSTDictionary RegistrationOptions::dictionary() const {
    OSTDictionary dictionary;
    if (dataContainerClass != 0)
        dictionary.set("com.tamarok.Ostrand.DataContainerClass", dataContainerClass);
    if (parent)
        dictionary.set("com.tamarok.Ostrand.ParentBundleID", *parent);
    if (placeholder)
        dictionary.set("com.tamarok.Ostrand.PlaceholderEntitlements", true);
    if (byCaller)
        dictionary.set("RegByCaller", true);
    return dictionary;
}

Result<void> registerCodeSigning(Connection& connection, const Registration& registration) {
    auto request = requestFor(registerCommand, registration.identifier);
    addDictionary(request, "CodeSigningInfo", registration.info);
    addDictionary(request, "OptionsDictionary", registration.options);
    return done(connection, request);
}

Result<void> removeCodeSigning(Connection& connection, const std::string& identifier) {
    return done(connection, requestFor(registerCommand, identifier));
}

Result<OSTDictionary> codeSigningInfo(Connection& connection, const std::string& identifier) {
    const auto reply = OST_TRY(connection.call(requestFor(infoCommand, identifier)));
    const auto item = reply.find("ReplyInfoDictionary");
    const auto value = item ? ost::platform::propertyListValue(*item) : std::nullopt;
    if (!value || !value->asDictionary())
        return incomprehensible();
    return *value->asDictionary();
}

Result<void> invalidateCodeSigningWithoutBundle(Connection& connection) {
    return done(connection, Request(invalidateCommand));
}

Result<GroupPaths> groupContainerPaths(Connection& connection, std::uint64_t user,
                                       const std::optional<std::string>& identifier) {
    auto request = requestFor(groupPathsCommand, identifier);
    request.key("UserID").unsignedNumber(user);
    return pathsFrom(connection, request);
}

Result<GroupPaths> systemGroupContainerPaths(Connection& connection, const std::optional<std::string>& identifier) {
    return pathsFrom(connection, requestFor(systemGroupPathsCommand, identifier));
}

Result<std::vector<std::string>> groupIdentifiers(Connection& connection, std::uint64_t user,
                                                  const std::optional<std::string>& identifier) {
    auto request = requestFor(groupIdentifiersCommand, identifier);
    request.key("UserID").unsignedNumber(user);
    const auto reply = OST_TRY(connection.call(request));
    const auto array = reply.find("ReplyGroupIdentifiersArray");
    if (!array)
        return incomprehensible();
    std::vector<std::string> groups;
    groups.reserve(array->count());
    for (const auto item : array->elements()) {
        const auto group = item.asText();
        if (!group)
            return incomprehensible();
        groups.emplace_back(*group);
    }
    return groups;
}

Result<std::string> systemContainerPath(Connection& connection, const std::optional<std::string>& identifier) {
    return pathFrom(connection, requestFor(systemPathCommand, identifier));
}

Result<std::string> systemGroupContainerPath(Connection& connection, const std::string& group,
                                             const std::optional<std::string>& identifier) {
    auto request = requestFor(systemGroupPathCommand, identifier);
    request.key("GroupIdentifier").text(group);
    return pathFrom(connection, request);
}

} // namespace ostrand
