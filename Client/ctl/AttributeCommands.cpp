#include "Client/Attributes.h"
#include "Client/ctl/Commands.h"
#include "Client/ctl/ContainerArguments.h"
#include "Client/ctl/InfoValues.h"
#include "platform/base/Try.h"

namespace ostrand::ctl {

namespace {

constexpr Operand identifierOperand{"ID", "the container's identifier"};
constexpr Operand keyOperand{"KEY", "the info value's key"};

/// The container that the command line names, known by its UUID.
std::expected<ContainerReference, Failure> referenceFor(const Arguments& arguments, Connection& connection) {
    const auto containerClass = OST_TRY(classOf(arguments));
    const auto user = OST_TRY(userOf(arguments, containerClass));
    const auto found = OST_TRY(listedContainers(connection,
                                                {.containerClass = containerClass,
                                                 .user = user,
                                                 .identifier = {},
                                                 .transient = arguments.has(transientOption.name)},
                                                {*arguments.value(identifierOperand.name)}));
    return found.front();
}

/// What a command that only does something says.
Report reportOn(const char* done, const ContainerReference& container) {
    const auto uuid = container.uuid.string();
    Report report;
    report.text = std::string(done) + " " + uuid + "  " + escaped(container.identifier) + "\n";
    report.json.set("done", done);
    report.json.set("identifier", container.identifier);
    report.json.set("uuid", uuid);
    return report;
}

std::string lineOf(std::string name, std::string_view value) {
    constexpr std::size_t column = 12;
    name.resize(column, ' ');
    return name.append(value).append("\n");
}

std::string protectionIn(const ost::OSTDictionary& info) {
    const auto* const recorded = info.find(protectionClassKey);
    return recorded ? recorded->description() : "never set (counts as 3)";
}

Outcome show(const Arguments& arguments) {
    auto connection = OST_TRY(connectToDevice(arguments));
    const auto container = OST_TRY(referenceFor(arguments, connection));
    const auto found = OST_TRY(orFailure(metadata(connection, container)));
    const auto uuid = container.uuid.string();
    const auto number = static_cast<std::uint64_t>(container.containerClass);
    const auto user =
        container.user == ost::OSTCurrentUserPlaceholder ? "the current user" : std::to_string(container.user);
    Report report;
    report.text = lineOf("identifier", escaped(container.identifier)) + lineOf("uuid", uuid) +
                  lineOf("path", escaped(found.path)) +
                  lineOf("class", std::to_string(number) + " " +
                                      std::string(pathComponentForContainerClass(container.containerClass))) +
                  lineOf("user", user) + lineOf("transient", found.transient ? "yes" : "no") +
                  lineOf("protection", escaped(protectionIn(found.info)));
    report.text += found.info.empty() ? lineOf("info", "none") : "info\n" + treeText(found.info);
    report.json = ost::OSTDictionary({{"identifier", container.identifier},
                                      {"uuid", uuid},
                                      {"path", found.path},
                                      {"class", number},
                                      {"user", container.user},
                                      {"transient", found.transient},
                                      {"info", found.info}});
    return report;
}

Report reportOf(const ost::OSTDictionary& info) { return {.text = treeText(info), .json = info}; }

Outcome infoList(const Arguments& arguments) {
    auto connection = OST_TRY(connectToDevice(arguments));
    const auto container = OST_TRY(referenceFor(arguments, connection));
    return reportOf(OST_TRY(orFailure(metadata(connection, container))).info);
}

Outcome infoGet(const Arguments& arguments) {
    const auto key = *arguments.value(keyOperand.name);
    auto connection = OST_TRY(connectToDevice(arguments));
    const auto container = OST_TRY(referenceFor(arguments, connection));
    const auto value = OST_TRY(orFailure(infoValue(connection, container, key)));
    return reportOf(ost::OSTDictionary({{key, value}}));
}

Outcome infoSet(const Arguments& arguments) {
    const auto key = *arguments.value(keyOperand.name);
    const auto value = OST_TRY(infoValueOf(arguments));
    auto connection = OST_TRY(connectToDevice(arguments));
    const auto container = OST_TRY(referenceFor(arguments, connection));
    OST_TRY(orFailure(setInfoValue(connection, container, key, value)));
    return reportOf(ost::OSTDictionary({{key, value}}));
}

Outcome infoRemove(const Arguments& arguments) {
    auto connection = OST_TRY(connectToDevice(arguments));
    const auto container = OST_TRY(referenceFor(arguments, connection));
    OST_TRY(orFailure(setInfoValue(connection, container, *arguments.value(keyOperand.name), std::nullopt)));
    return reportOn("removed", container);
}

Outcome restoreStructure(const Arguments& arguments) {
    auto connection = OST_TRY(connectToDevice(arguments));
    const auto container = OST_TRY(referenceFor(arguments, connection));
    OST_TRY(orFailure(recreateDefaultStructure(connection, container)));
    return reportOn("restored", container);
}

Outcome renameDirectory(const Arguments& arguments) {
    auto connection = OST_TRY(connectToDevice(arguments));
    const auto container = OST_TRY(referenceFor(arguments, connection));
    OST_TRY(orFailure(regenerateDirectoryUUID(connection, container)));
    const auto path = OST_TRY(orFailure(metadata(connection, container))).path;
    auto report = reportOn("renamed", container);
    report.text += escaped(path) + "\n";
    report.json.set("path", path);
    return report;
}

} // namespace

std::vector<Command> attributeCommands() {
    const std::vector ofOneContainer{classOption, userOption, transientOption};
    auto withValue = ofOneContainer;
    std::ranges::copy(infoValueOptions, std::back_inserter(withValue));
    return {
        {"show",
         "shows what a container carries",
         {identifierOperand},
         ofOneContainer,
         classesAndUsers,
         show,
         R"({"identifier": "string", "uuid": "string", "path": "string", "class": "number", "user": "number", "transient": "boolean", "info": {"*": "any"}})"},
        {"info list",
         "shows a container's info values",
         {identifierOperand},
         ofOneContainer,
         classesAndUsers,
         infoList,
         R"({"*": "any"})"},
        {"info get",
         "shows one info value",
         {identifierOperand, keyOperand},
         ofOneContainer,
         classesAndUsers,
         infoGet,
         R"({"*": "any"})"},
        {"info set",
         "sets an info value, and returns when it is on disk",
         {identifierOperand, keyOperand, infoValueOperand},
         withValue,
         aboutInfoValues,
         infoSet,
         R"({"*": "any"})"},
        {"info remove",
         "removes an info value",
         {identifierOperand, keyOperand},
         ofOneContainer,
         classesAndUsers,
         infoRemove,
         R"({"done": "string", "identifier": "string", "uuid": "string"})"},
        {"restore-structure",
         "makes the directories again that a container of its class has",
         {identifierOperand},
         ofOneContainer,
         classesAndUsers,
         restoreStructure,
         R"({"done": "string", "identifier": "string", "uuid": "string"})"},
        {"rename-directory",
         "gives a container's directory a new name",
         {identifierOperand},
         ofOneContainer,
         classesAndUsers,
         renameDirectory,
         R"({"done": "string", "identifier": "string", "uuid": "string", "path": "string"})"},
    };
}

} // namespace ostrand::ctl
