#include "Client/CodeSigning.h"

#include "Protocol/OSTKeys.h"
#include "platform/base/Try.h"
#include "platform/codec/IPCValue.h"

#include <cerrno>

namespace ostrand {

using ost::OSTCommand;
using ost::OSTDictionary;
using ost::platform::CBORItem;

namespace optionKey = ost::optionKey;
namespace replyKey = ost::replyKey;
namespace requestKey = ost::requestKey;

namespace {

Request requestFor(OSTCommand command, const std::optional<std::string>& identifier) {
    Request request(command);
    if (identifier)
        request.key(requestKey::identifier).text(*identifier);
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
    const auto dictionary = reply.find(replyKey::groupContainers);
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
    return std::string(OST_TRY(reply.promised(replyKey::path, &CBORItem::asText)));
}

} // namespace

OSTDictionary RegistrationOptions::dictionary() const {
    OSTDictionary dictionary;
    if (dataContainerClass != 0)
        dictionary.set(optionKey::dataContainerClass, dataContainerClass);
    if (parent)
        dictionary.set(optionKey::parentBundleIdentifier, *parent);
    if (placeholder)
        dictionary.set(optionKey::placeholder, true);
    if (byCaller)
        dictionary.set(optionKey::registeredByCaller, true);
    return dictionary;
}

Result<void> registerCodeSigning(Connection& connection, const Registration& registration) {
    auto request = requestFor(OSTCommand::registerCodeSigning, registration.identifier);
    addDictionary(request, requestKey::codeSigningInfo, registration.info);
    addDictionary(request, requestKey::optionsDictionary, registration.options);
    return done(connection, request);
}

Result<void> removeCodeSigning(Connection& connection, const std::string& identifier) {
    return done(connection, requestFor(OSTCommand::registerCodeSigning, identifier));
}

Result<OSTDictionary> codeSigningInfo(Connection& connection, const std::string& identifier) {
    const auto reply = OST_TRY(connection.call(requestFor(OSTCommand::codeSigningInfo, identifier)));
    const auto item = reply.find(replyKey::infoDictionary);
    const auto value = item ? ost::platform::propertyListValue(*item) : std::nullopt;
    if (!value || !value->asDictionary())
        return incomprehensible();
    return *value->asDictionary();
}

Result<void> invalidateCodeSigningWithoutBundle(Connection& connection) {
    return done(connection, Request(OSTCommand::invalidateCodeSigning));
}

Result<GroupPaths> groupContainerPaths(Connection& connection, std::uint64_t user,
                                       const std::optional<std::string>& identifier) {
    auto request = requestFor(OSTCommand::groupContainerPaths, identifier);
    request.key(requestKey::container.userId).unsignedNumber(user);
    return pathsFrom(connection, request);
}

Result<GroupPaths> systemGroupContainerPaths(Connection& connection, const std::optional<std::string>& identifier) {
    return pathsFrom(connection, requestFor(OSTCommand::systemGroupContainerPaths, identifier));
}

Result<std::vector<std::string>> groupIdentifiers(Connection& connection, std::uint64_t user,
                                                  const std::optional<std::string>& identifier) {
    auto request = requestFor(OSTCommand::groupIdentifiers, identifier);
    request.key(requestKey::container.userId).unsignedNumber(user);
    const auto reply = OST_TRY(connection.call(request));
    const auto array = reply.find(replyKey::groupIdentifiers);
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
    return pathFrom(connection, requestFor(OSTCommand::systemContainerPath, identifier));
}

Result<std::string> systemGroupContainerPath(Connection& connection, const std::string& group,
                                             const std::optional<std::string>& identifier) {
    auto request = requestFor(OSTCommand::systemGroupContainerPath, identifier);
    request.key(requestKey::groupIdentifier).text(group);
    return pathFrom(connection, request);
}

} // namespace ostrand
