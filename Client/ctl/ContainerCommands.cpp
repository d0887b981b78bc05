#include "Client/Containers.h"
#include "Client/ctl/Commands.h"
#include "Client/ctl/ContainerArguments.h"
#include "Client/ctl/Values.h"
#include "platform/base/Try.h"

#include <algorithm>
#include <chrono>
#include <cstdio>

namespace ostrand::ctl {

namespace {

constexpr Option identifierOption{"identifier", "ID", "the container's identifier; without it, the program's own"};
constexpr Operand identifierOperand{"ID", "another way to give the identifier", Operand::Count::optional};
constexpr Operand identifierOperands{"ID", "the containers' identifiers", Operand::Count::several};
constexpr Option oldOption{"old", "ID", "the container that goes; without it, the new one is moved to a free place"};
constexpr Option newOption{"new", "ID", "the container that takes its place", Option::Count::required};
constexpr Option newTransientOption{"new-transient", "", "the new container is a transient one"};
constexpr Option oldUUIDOption{"old-uuid", "UUID", "the old container's UUID; else found by listing the live ones"};
constexpr Option newUUIDOption{"new-uuid", "UUID", "the new container's UUID; else found by listing"};

std::expected<ContainerRequest, Failure> containerRequestOf(const Arguments& arguments) {
    if (arguments.has(identifierOption.name) && arguments.has(identifierOperand.name))
        return std::unexpected(Failure::usage("the identifier is given twice"));
    const auto containerClass = OST_TRY(classOf(arguments));
    const auto user = OST_TRY(userOf(arguments, containerClass));
    const auto identifier =
        arguments.value(arguments.has(identifierOption.name) ? identifierOption.name : identifierOperand.name);
    return ContainerRequest{containerClass, user, identifier, arguments.has(transientOption.name)};
}

ost::OSTDictionary jsonOf(const std::string& identifier, const std::string& uuid) {
    ost::OSTDictionary json;
    json.set("identifier", identifier);
    json.set("uuid", uuid);
    return json;
}

Outcome createOrLookup(const Arguments& arguments, WhenMissing whenMissing) {
    const auto request = OST_TRY(containerRequestOf(arguments));
    auto connection = OST_TRY(connectToDevice(arguments));
    const auto container = OST_TRY(orFailure(ostrand::createOrLookup(connection, request, whenMissing)));

    const auto uuid = container.uuid.string();
    Report report;
    report.text = "identifier  " + escaped(container.identifier) + "\nuuid        " + uuid + "\npath        " +
                  escaped(container.path) + "\nstate       " + (container.existed ? "existed" : "created") + "\n";
    report.json.set("identifier", container.identifier);
    report.json.set("uuid", uuid);
    report.json.set("path", container.path);
    report.json.set("existed", container.existed);
    return report;
}

Outcome create(const Arguments& arguments) { return createOrLookup(arguments, WhenMissing::create); }
Outcome lookup(const Arguments& arguments) { return createOrLookup(arguments, WhenMissing::fail); }

Outcome list(const Arguments& arguments) {
    const auto request = OST_TRY(containerRequestOf(arguments));
    auto connection = OST_TRY(connectToDevice(arguments));
    const auto listed = OST_TRY(orFailure(ostrand::list(connection, request)));
    Report report;
    ost::OSTArray containers;
    for (const auto& container : listed) {
        const auto uuid = container.uuid.string();
        report.text += uuid + "  " + escaped(container.identifier) + "\n";
        containers.emplace_back(jsonOf(container.identifier, uuid));
    }
    report.json.set("containers", std::move(containers));
    return report;
}

Outcome deleteOne(const Arguments& arguments) {
    const auto request = OST_TRY(containerRequestOf(arguments));
    if (!request.identifier)
        return std::unexpected(Failure::usage("no identifier given"));
    auto connection = OST_TRY(connectToDevice(arguments));
    if (request.transient) {
        const auto container = OST_TRY(listedContainers(connection, request, {*request.identifier}));
        OST_TRY(orFailure(stageForDeletion(connection, container)));
    } else {
        OST_TRY(orFailure(deleteContainer(connection, request)));
    }
    Report report;
    report.text = "deleted " + escaped(*request.identifier) + "\n";
    report.json.set("deleted", *request.identifier);
    return report;
}

Outcome stage(const Arguments& arguments) {
    const auto containerClass = OST_TRY(classOf(arguments));
    const auto user = OST_TRY(userOf(arguments, containerClass));
    auto connection = OST_TRY(connectToDevice(arguments));
    const auto containers =
        OST_TRY(listedContainers(connection, {containerClass, user, {}, arguments.has(transientOption.name)},
                                 arguments.values(identifierOperands.name)));
    OST_TRY(orFailure(stageForDeletion(connection, containers)));
    Report report;
    ost::OSTArray staged;
    for (const auto& container : containers) {
        const auto uuid = container.uuid.string();
        report.text += "staged " + uuid + "  " + escaped(container.identifier) + "\n";
        staged.emplace_back(jsonOf(container.identifier, uuid));
    }
    report.json.set("staged", std::move(staged));
    return report;
}

Outcome purge(const Arguments& arguments) {
    auto connection = OST_TRY(connectToDevice(arguments));
    if (!arguments.has("json"))
        std::fputs("waiting until everything on death row is destroyed\n", stderr);
    const auto begin = std::chrono::steady_clock::now();
    OST_TRY(orFailure(destroyDeathRow(connection)));
    const std::chrono::duration<double> passed = std::chrono::steady_clock::now() - begin;
    char seconds[32];
    std::snprintf(seconds, sizeof seconds, "%.3f", passed.count());
    Report report;
    report.text = std::string("death row is empty after ") + seconds + " s\n";
    report.json.set("seconds", passed.count());
    return report;
}

/// One side of a replacement, with its UUID as given or as listed.
std::expected<ContainerReference, Failure> sideOf(const Arguments& arguments, Connection& connection,
                                                  const ContainerRequest& about, const Option& uuidOption) {
    const auto text = arguments.value(uuidOption.name);
    if (!text)
        return OST_TRY(listedContainers(connection, about, {*about.identifier})).front();
    const auto uuid = ost::platform::UUID::parse(*text);
    if (!uuid)
        return std::unexpected(Failure::usage("\"" + escaped(*text) + "\" is no UUID"));
    return ContainerReference{about.containerClass, about.user, *about.identifier, *uuid};
}

Outcome replace(const Arguments& arguments) {
    const auto containerClass = OST_TRY(classOf(arguments));
    const auto user = OST_TRY(userOf(arguments, containerClass));
    const auto oldIdentifier = arguments.value(oldOption.name);
    if (!oldIdentifier && arguments.has(oldUUIDOption.name))
        return std::unexpected(Failure::usage("--old-uuid needs --old"));
    auto connection = OST_TRY(connectToDevice(arguments));
    std::optional<ContainerReference> oldContainer;
    if (oldIdentifier)
        oldContainer = OST_TRY(sideOf(arguments, connection, {containerClass, user, oldIdentifier}, oldUUIDOption));
    const auto newContainer =
        OST_TRY(sideOf(arguments, connection,
                       {containerClass, user, arguments.value(newOption.name), arguments.has(newTransientOption.name)},
                       newUUIDOption));
    OST_TRY(orFailure(ostrand::replace(connection, oldContainer, newContainer)));
    Report report;
    const auto tell = [&](const char* side, const ContainerReference& container) {
        const auto uuid = container.uuid.string();
        report.text += std::string(side) + "  " + uuid + "  " + escaped(container.identifier) + "\n";
        report.json.set(side, jsonOf(container.identifier, uuid));
    };
    if (oldContainer)
        tell("old", *oldContainer);
    tell("new", newContainer);
    return report;
}

} // namespace

std::vector<Command> containerCommands() {
    const std::vector ofOneContainer{classOption, userOption, identifierOption, transientOption};
    return {
        {"create",
         "creates a container, or finds it when it is there",
         {identifierOperand},
         ofOneContainer,
         classesAndUsers,
         create},
        {"lookup", "finds a container", {identifierOperand}, ofOneContainer, classesAndUsers, lookup},
        {"list",
         "lists the containers of a user and class",
         {},
         {classOption, userOption, transientOption},
         classesAndUsers,
         list},
        {"delete", "stages a container for deletion", {identifierOperand}, ofOneContainer, classesAndUsers, deleteOne},
        {"stage",
         "stages containers for deletion, all of them or none when one is not there",
         {identifierOperands},
         {classOption, userOption, transientOption},
         classesAndUsers,
         stage},
        {"purge", "destroys everything that is staged for deletion, and waits for it", {}, {}, "", purge},
        {"replace",
         "puts a container in the place of another one",
         {},
         {classOption, userOption, oldOption, newOption, newTransientOption, oldUUIDOption, newUUIDOption},
         classesAndUsers,
         replace},
    };
}

} // namespace ostrand::ctl
