#include "Client/Containers.h"
#include "Client/ctl/Commands.h"
#include "platform/Try.h"

#include <charconv>
#include <cstdio>
#include <memory>
#include <pwd.h>

namespace ostrand::ctl {

namespace {

constexpr Option classOption{"class", "C", "the container class: 1 to 13, or its name, such as Data/Application",
                             Option::Count::required};
constexpr Option userOption{"user", "U", "the user: a number, or the name of one of the device's accounts"};
constexpr Option identifierOption{"identifier", "ID", "the container's identifier; without it, the program's own"};
constexpr Option transientOption{"transient", "", "ask for a transient container"};
constexpr Operand identifierOperand{"ID", "another way to give the identifier", Operand::Count::optional};

constexpr std::string_view classesAndUsers =
    "Classes:\n"
    "   1 Bundle/Application      2 Data/Application      3 Bundle/LoomworkPlugin\n"
    "   4 Data/LoomworkPlugin     5 Bundle/VPNPlugin      6 Data/VPNPlugin\n"
    "   7 Shared/AppGroup         8 Bundle/Framework      9 Data/VexelService\n"
    "  10 Data/InternalDaemon    11 Data/TempDir         12 Data/System\n"
    "  13 Shared/SystemGroup\n"
    "Without --user, bundles belong to user 33, system containers to 499 and all others to the current user (1).";

std::optional<std::uint64_t> numberIn(std::string_view text) {
    std::uint64_t number = 0;
    const auto [end, problem] = std::from_chars(text.data(), text.data() + text.size(), number);
    return problem == std::errc{} && end == text.data() + text.size() ? std::optional(number) : std::nullopt;
}

std::expected<ContainerClass, Failure> classOf(const Arguments& arguments) {
    const auto text = *arguments.value(classOption.name);
    if (const auto number = numberIn(text))
        return static_cast<ContainerClass>(*number);
    if (const auto named = containerClassNamed(text))
        return *named;
    return std::unexpected(Failure::usage("no container class is called \"" + escaped(text) + "\""));
}

/// The user id of an account of the device, from the device's own list and not the host's.
std::expected<std::uint64_t, Failure> userOfAccount(const std::string& device, const std::string& name) {
    const std::string path = device + "/etc/passwd";
    const std::unique_ptr<FILE, int (*)(FILE*)> accounts(std::fopen(path.c_str(), "re"), &std::fclose);
    if (!accounts)
        return std::unexpected(Failure::system("cannot read " + path, errno));
    while (const passwd* account = fgetpwent(accounts.get()))
        if (name == account->pw_name)
            return account->pw_uid;
    return std::unexpected(Failure::usage("the device has no account \"" + escaped(name) + "\""));
}

std::expected<std::uint64_t, Failure> userOf(const Arguments& arguments, ContainerClass containerClass) {
    const auto text = arguments.value(userOption.name);
    if (!text)
        return usualUserOf(containerClass);
    if (const auto number = numberIn(*text))
        return *number;
    return userOfAccount(deviceDirectory(arguments), *text);
}

std::expected<ContainerRequest, Failure> containerRequestOf(const Arguments& arguments) {
    if (arguments.has(identifierOption.name) && arguments.has(identifierOperand.name))
        return std::unexpected(Failure::usage("the identifier is given twice"));
    const auto containerClass = OST_TRY(classOf(arguments));
    const auto user = OST_TRY(userOf(arguments, containerClass));
    const auto identifier =
        arguments.value(arguments.has(identifierOption.name) ? identifierOption.name : identifierOperand.name);
    return ContainerRequest{containerClass, user, identifier, arguments.has(transientOption.name)};
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
        ost::OSTDictionary entry;
        entry.set("identifier", container.identifier);
        entry.set("uuid", uuid);
        containers.emplace_back(std::move(entry));
    }
    report.json.set("containers", std::move(containers));
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
    };
}

} // namespace ostrand::ctl
