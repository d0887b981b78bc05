#include "Client/Attributes.h"
#include "Client/Containers.h"
#include "Client/Maintenance.h"
#include "Client/ctl/Commands.h"
#include "Client/ctl/ContainerArguments.h"
#include "Client/ctl/DeathRow.h"
#include "Client/ctl/Terminal.h"
#include "Client/ctl/Values.h"
#include "Client/ctl/Waiting.h"
#include "platform/base/Try.h"

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>

namespace ostrand::ctl {

namespace {

constexpr Option identifierOption{"identifier", "ID", "the container's identifier; without it, the program's own"};
constexpr Operand identifierOperand{"ID", "another way to give the identifier", Operand::Count::optional};
constexpr Operand identifierOperands{"ID", "the containers' identifiers", Operand::Count::several};
constexpr Option dryRunOption{"dry-run", "", "say what would go, how much it is, and leave it as it is"};
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

/// What a deletion would take, as it is now.
Outcome wouldDelete(Connection& connection, const std::vector<ContainerReference>& containers) {
    Report report;
    Table table;
    ost::OSTArray rows;
    std::uint64_t total = 0;
    for (const auto& container : containers) {
        const auto bytes = OST_TRY(orFailure(diskUsage(connection, container)));
        const auto path = OST_TRY(orFailure(metadata(connection, container))).path;
        total += bytes;
        table.add({sizeText(bytes), container.uuid.string(), escaped(container.identifier), escaped(path)});
        auto row = jsonOf(container.identifier, container.uuid.string());
        row.set("path", path);
        row.set("bytes", bytes);
        rows.emplace_back(std::move(row));
    }
    report.text =
        table.text() + sizeText(total) + "  in " + countOf(containers.size(), "container") + " would be deleted\n";
    report.json.set("wouldDelete", std::move(rows));
    report.json.set("bytes", total);
    return report;
}

Outcome deleteOne(const Arguments& arguments) {
    const auto request = OST_TRY(containerRequestOf(arguments));
    if (!request.identifier)
        return std::unexpected(Failure::usage("no identifier given"));
    auto connection = OST_TRY(connectToDevice(arguments));
    if (arguments.has(dryRunOption.name))
        return wouldDelete(connection, OST_TRY(listedContainers(connection, request, {*request.identifier})));
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
    if (arguments.has(dryRunOption.name))
        return wouldDelete(connection, containers);
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

Outcome wouldDestroy(const std::string& device) {
    const auto items = deathRowOf(device);
    if (!items)
        return std::unexpected(Failure::system("cannot look at death row", items.error()));
    Report report;
    Table table;
    ost::OSTArray rows;
    std::uint64_t total = 0;
    for (const auto& [name, identifier, files, bytes, measured] : *items) {
        total += bytes;
        table.add({sizeText(bytes), countOf(files, "file") + (measured ? "" : " at least"), escaped(name),
                   escaped(identifier)});
        rows.emplace_back(ost::OSTDictionary(
            {{"name", name}, {"identifier", identifier}, {"files", files}, {"bytes", bytes}, {"measured", measured}}));
    }
    report.text = table.text() + sizeText(total) + "  in " + countOf(items->size(), "item") + " would be destroyed\n";
    report.json.set("wouldDestroy", std::move(rows));
    report.json.set("bytes", total);
    return report;
}

Outcome purge(const Arguments& arguments) {
    const auto device = deviceDirectory(arguments);
    if (arguments.has(dryRunOption.name))
        return wouldDestroy(device);
    auto connection = OST_TRY(connectToDevice(arguments, betweenReports));
    if (!arguments.has("json"))
        std::fputs("waiting until everything on death row is destroyed\n", stderr);
    const auto begin = std::chrono::steady_clock::now();
    {
        const ProgressLine progress(!arguments.has("json"));
        OST_TRY(waitForReply(connection, beginDestroyingDeathRow(connection), [&] {
            if (progress.isShown())
                progress.show(countOf(deathRowLength(device), "item") + " left");
        }));
    }
    const auto seconds = secondsSince(begin);
    Report report;
    report.text = "death row is empty after " + seconds + " s\n";
    report.json.set("seconds", std::strtod(seconds.c_str(), nullptr));
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
         create,
         R"({"identifier": "string", "uuid": "string", "path": "string", "existed": "boolean"})"},
        {"lookup",
         "finds a container",
         {identifierOperand},
         ofOneContainer,
         classesAndUsers,
         lookup,
         R"({"identifier": "string", "uuid": "string", "path": "string", "existed": "boolean"})"},
        {"list",
         "lists the containers of a user and class",
         {},
         {classOption, userOption, transientOption},
         classesAndUsers,
         list,
         R"({"containers": [{"identifier": "string", "uuid": "string"}]})"},
        {"delete",
         "stages a container for deletion",
         {identifierOperand},
         {classOption, userOption, identifierOption, transientOption, dryRunOption},
         classesAndUsers,
         deleteOne,
         R"({"deleted?": "string", "wouldDelete?": [{"identifier": "string", "uuid": "string", "path": "string", "bytes": "number"}], "bytes?": "number"})"},
        {"stage",
         "stages containers for deletion, all of them or none when one is not there",
         {identifierOperands},
         {classOption, userOption, transientOption, dryRunOption},
         classesAndUsers,
         stage,
         R"({"staged?": [{"identifier": "string", "uuid": "string"}], "wouldDelete?": [{"identifier": "string", "uuid": "string", "path": "string", "bytes": "number"}], "bytes?": "number"})"},
        {"purge",
         "destroys everything that is staged for deletion, and waits for it",
         {},
         {dryRunOption},
         "",
         purge,
         R"({"seconds?": "number", "wouldDestroy?": [{"name": "string", "identifier": "string", "files": "number", "bytes": "number", "measured": "boolean"}], "bytes?": "number"})"},
        {"replace",
         "puts a container in the place of another one",
         {},
         {classOption, userOption, oldOption, newOption, newTransientOption, oldUUIDOption, newUUIDOption},
         classesAndUsers,
         replace,
         R"({"old?": {"identifier": "string", "uuid": "string"}, "new": {"identifier": "string", "uuid": "string"}})"},
    };
}

} // namespace ostrand::ctl
