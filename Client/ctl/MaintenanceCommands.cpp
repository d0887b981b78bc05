#include "Client/Maintenance.h"
#include "Client/StoreCheck.h"
#include "Client/ctl/Commands.h"
#include "Client/ctl/ContainerArguments.h"
#include "Client/ctl/Terminal.h"
#include "Client/ctl/Values.h"
#include "Client/ctl/Waiting.h"
#include "platform/base/Text.h"
#include "platform/base/Try.h"

#include <unistd.h>

#include <algorithm>
#include <tuple>

namespace ostrand::ctl {

namespace {

constexpr Operand identifierOperand{"ID", "the container's identifier"};
constexpr Operand identifierOperands{"ID", "identifiers of containers; without one, all containers are measured",
                                     Operand::Count::any};
constexpr Operand crashesOperand{"COUNT", "how often the daemon ends"};
constexpr Option anyClassOption{"class", "C", "the container class; without one, every class of the user"};
constexpr Option bytesOption{"bytes", "", "sizes in bytes"};

constexpr int findingsStatus = 1;
constexpr int incompleteStatus = 2;

/// A container and the bytes that it takes.
struct Usage {
    ContainerReference container;
    std::uint64_t bytes;
};

std::vector<ContainerClass> classesOf(std::uint64_t user) {
    std::vector<ContainerClass> classes;
    for (std::uint64_t number = 1; ost::isValidContainerClass(static_cast<ContainerClass>(number)); ++number) {
        const auto containerClass = static_cast<ContainerClass>(number);
        if (user == ost::OSTCurrentUserPlaceholder
                ? ost::isPerUserClass(containerClass)
                : ost::OSTUserIdFitsClass(containerClass, static_cast<std::uint32_t>(user)))
            classes.push_back(containerClass);
    }
    return classes;
}

std::expected<std::vector<ContainerReference>, Failure> containersToMeasure(const Arguments& arguments,
                                                                            Connection& connection) {
    std::vector<ContainerClass> classes;
    std::optional<std::uint64_t> user;
    if (const auto name = arguments.value(anyClassOption.name)) {
        classes.push_back(OST_TRY(classNamed(*name)));
        user = OST_TRY(userOf(arguments, classes.front()));
    } else {
        user = OST_TRY(userOf(arguments, ContainerClass::dataApplication));
        classes = classesOf(*user);
    }
    const auto wanted = arguments.values(identifierOperands.name);
    std::vector<ContainerReference> containers;
    for (const auto containerClass : classes)
        for (auto& listed : OST_TRY(orFailure(list(connection, {containerClass, *user, {}, false}))))
            if (wanted.empty() || std::ranges::find(wanted, listed.identifier) != wanted.end())
                containers.push_back({containerClass, *user, std::move(listed.identifier), listed.uuid});
    for (const auto& identifier : wanted)
        if (std::ranges::find(containers, identifier, &ContainerReference::identifier) == containers.end())
            return std::unexpected(Failure::local("no container of that class and user: " + escaped(identifier)));
    return containers;
}

std::expected<std::vector<Usage>, Failure>
measure(Connection& connection, const std::vector<ContainerReference>& containers, bool showProgress) {
    std::vector<Usage> usages;
    const ProgressLine progress(showProgress);
    for (const auto& container : containers) {
        usages.push_back({container, OST_TRY(orFailure(diskUsage(connection, container)))});
        progress.show(std::to_string(usages.size()) + " of " + std::to_string(containers.size()) +
                      " containers measured");
    }
    std::ranges::sort(usages, [](const Usage& one, const Usage& other) {
        return std::tie(other.bytes, one.container.identifier) < std::tie(one.bytes, other.container.identifier);
    });
    return usages;
}

Outcome usage(const Arguments& arguments) {
    auto connection = OST_TRY(connectToDevice(arguments));
    const auto containers = OST_TRY(containersToMeasure(arguments, connection));
    const auto usages = OST_TRY(measure(connection, containers, !arguments.has("json")));
    const bool exact = arguments.has(bytesOption.name);
    Report report;
    Table table;
    ost::OSTArray rows;
    std::uint64_t total = 0;
    for (const auto& [container, bytes] : usages) {
        total += bytes;
        table.add({sizeText(bytes, exact), std::string(pathComponentForContainerClass(container.containerClass)),
                   escaped(container.identifier)});
        rows.emplace_back(ost::OSTDictionary({{"identifier", container.identifier},
                                              {"uuid", container.uuid.string()},
                                              {"class", static_cast<std::uint64_t>(container.containerClass)},
                                              {"bytes", bytes}}));
    }
    table.add({sizeText(total, exact), "in all"});
    report.text = table.text();
    report.json.set("containers", std::move(rows));
    report.json.set("bytes", total);
    return report;
}

Outcome wipeOne(const Arguments& arguments) {
    const auto containerClass = OST_TRY(classOf(arguments));
    const auto identifier = *arguments.value(identifierOperand.name);
    const auto user = OST_TRY(userOf(arguments, containerClass));
    auto connection = OST_TRY(connectToDevice(arguments));
    OST_TRY(orFailure(wipe(connection, {containerClass, user, identifier, false})));
    Report report;
    report.text = "wiped " + escaped(identifier) + "\n";
    report.json.set("wiped", identifier);
    return report;
}

Outcome migrateAll(const Arguments& arguments) {
    auto connection = OST_TRY(connectToDevice(arguments, betweenReports));
    const auto begin = std::chrono::steady_clock::now();
    const ProgressLine progress(!arguments.has("json"));
    OST_TRY(waitForReply(connection, beginMigration(connection), [&] {
        progress.show("migrating for " + secondsSince(begin) + " s; ostrandctl watch shows what is done");
    }));
    Report report;
    report.text = "migrated; the daemon's log says what was done\n";
    report.json.set("migrated", ost::OSTValue(true));
    return report;
}

Outcome runRetryTest(const Arguments& arguments) {
    const auto text = *arguments.value(crashesOperand.name);
    const auto crashes = ost::platform::numberIn<std::uint64_t>(text);
    if (!crashes)
        return std::unexpected(Failure::usage("\"" + escaped(text) + "\" is no number"));
    const auto user = OST_TRY(userOf(arguments, ContainerClass::dataApplication));
    auto connection = OST_TRY(connectToDevice(arguments));
    OST_TRY(orFailure(retryTest(connection, user, *crashes)));
    Report report;
    report.text = "the test is over\n";
    report.json.set("done", "retry-test");
    return report;
}

std::string lineOf(const char* name, const std::string& value) {
    return std::string("    ") + name + ": " + escaped(value) + "\n";
}

Outcome findingsOf(const Arguments& arguments) {
    auto connection = OST_TRY(connectToDevice(arguments));
    const auto found = OST_TRY(orFailure(checkStore(connection, deviceDirectory(arguments))));
    Report report;
    ost::OSTArray findings;
    for (const auto& [path, what, meaning, repair] : found.findings) {
        report.text += styled(escaped(path), Style::strong, STDOUT_FILENO) + "\n" + lineOf("found", what) +
                       lineOf("means", meaning) + lineOf("repair", repair);
        findings.emplace_back(
            ost::OSTDictionary({{"path", path}, {"found", what}, {"means", meaning}, {"repair", repair}}));
    }
    for (const auto& unreadable : found.unreadable)
        report.text += "cannot look at " + escaped(unreadable) + "\n";
    for (const auto& waiting : found.waiting)
        report.text += "waiting: " + escaped(waiting) + "\n";
    report.text +=
        std::to_string(found.containers) + " containers, " + std::to_string(found.findings.size()) + " findings\n";
    report.json.set("findings", std::move(findings));
    report.json.set("unreadable", ost::OSTArray(found.unreadable.begin(), found.unreadable.end()));
    report.json.set("waiting", ost::OSTArray(found.waiting.begin(), found.waiting.end()));
    report.json.set("containers", static_cast<std::uint64_t>(found.containers));
    report.exitStatus = !found.unreadable.empty() ? incompleteStatus : !found.findings.empty() ? findingsStatus : 0;
    return report;
}

Outcome check(const Arguments& arguments) {
    auto outcome = findingsOf(arguments);
    if (!outcome) // nothing was found, and nothing was looked at
        outcome.error().exitStatus = incompleteStatus;
    return outcome;
}

} // namespace

std::vector<Command> maintenanceCommands() {
    return {
        {"wipe",
         "replaces the content of a data container by that of a new one",
         {identifierOperand},
         {classOption, userOption},
         classesAndUsers,
         wipeOne,
         R"({"wiped": "string"})"},
        {"usage",
         "shows what containers take on disk, the largest first",
         {identifierOperands},
         {anyClassOption, userOption, bytesOption},
         "The size of a bundle is measured once and kept. Without --user, it is the current user's containers.",
         usage,
         R"({"containers": [{"identifier": "string", "uuid": "string", "class": "number", "bytes": "number"}], "bytes": "number"})"},
        {"check",
         "looks at the store, which it leaves as it is, and says what does not agree",
         {},
         {},
         "Exit status: 0 nothing was found, 1 something was, 2 not everything could be looked at.",
         check,
         R"({"containers": "number", "findings": [{"path": "string", "found": "string", "means": "string", "repair": "string"}], "unreadable": ["string"], "waiting": ["string"]})"},
        {"migrate",
         "changes what older releases left behind, and waits for it",
         {},
         {},
         "",
         migrateAll,
         R"({"migrated": "boolean"})"},
        {"retry-test",
         "ends the daemon of an internal build COUNT times, once for each call, for tests of clients",
         {crashesOperand},
         {userOption},
         "",
         runRetryTest,
         R"({"done": "string"})"},
    };
}

} // namespace ostrand::ctl
