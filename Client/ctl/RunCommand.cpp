#include "Client/Confinement.h"
#include "Client/LaunchedProcess.h"
#include "Client/ProcessEnvironment.h"
#include "Client/Program.h"
#include "Client/Upcall.h"
#include "Client/ctl/Commands.h"
#include "Client/ctl/Values.h"
#include "platform/base/FileName.h"
#include "platform/base/Path.h"
#include "platform/base/Text.h"
#include "platform/base/Try.h"
#include "platform/device/Accounts.h"
#include "platform/device/Applications.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <climits>
#include <filesystem>
#include <span>
#include <utility>

namespace ostrand::ctl {

namespace {

using ost::platform::Errno;
using ost::platform::FileDescriptor;

constexpr Option identifierOption{"identifier", "ID", "the application's identifier; without it, the program's own"};
constexpr Option userOption{"user", "U",
                            "a number, or the name of one of the device's accounts; 501 when none is given"};
constexpr Option pluginOption{"plugin", "", "the program is a plug-in"};
constexpr Option timeoutOption{"timeout", "SECONDS", "how long to wait for the daemon's answer; 30 when none is given"};
constexpr Option printOption{"print", "", "print the containers instead of running the program"};
constexpr Option unconfinedOption{"unconfined", "", "leave the program every right of its user"};
constexpr Operand programOperand{"PROGRAM", "a program of the host, found as a shell does"};
constexpr Operand argumentOperand{"ARGUMENT", "what it is given; behind -- also what looks like an option",
                                  Operand::Count::any};

constexpr std::uint32_t usualUser = 501;
/// A daemon whose disk is slow may take long to make containers.
constexpr std::chrono::seconds usualTimeout{30}, longestTimeout = std::chrono::hours(24);

/// What programs need of the system, beside the devices that everybody has.
constexpr std::array programDirectories{"/usr", "/bin", "/sbin", "/lib", "/lib32", "/lib64", "/libx32"};
constexpr std::array readableFiles{"/etc",        "/etc/resolv.conf", "/proc", "/sys/devices/system/cpu",
                                   "/dev/random", "/dev/urandom"};
constexpr std::array writableFiles{"/dev/null", "/dev/zero", "/dev/full", "/dev/tty"};

/// A device as the process sees it.
struct Device {
    std::string path; ///< without links
    FileDescriptor directory;

    /// What goes before a path of the device.
    [[nodiscard]] std::string prefix() const { return path == "/" ? "" : path; }
};

std::expected<Device, Failure> deviceOf(const Arguments& arguments) {
    const auto given = deviceDirectory(arguments);
    std::error_code error;
    Device device{.path = std::filesystem::canonical(given, error), .directory = {}};
    if (error)
        return std::unexpected(Failure::system("cannot find the device " + given, error.value()));
    device.directory.reset(::open(device.path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!device.directory)
        return std::unexpected(Failure::system("cannot open the device " + given, errno));
    return device;
}

std::expected<Program, Failure> programOf(const Arguments& arguments) {
    const auto name = *arguments.value(programOperand.name);
    auto program = Program::find(name);
    if (!program)
        return std::unexpected(Failure::system("cannot run " + name, program.error()));
    return *std::move(program);
}

std::expected<ost::platform::Account, Failure> accountOf(const Arguments& arguments, const Device& device) {
    const auto text = arguments.value(userOption.name);
    const auto number = text ? OST_TRY(userNamed(*text, device.path)) : usualUser;
    const auto user = static_cast<uid_t>(number);
    auto account = user == number ? ost::platform::accountForUserId(user, device.prefix()) : std::unexpected(ENOENT);
    if (account)
        return *std::move(account);
    if (account.error() == ENOENT)
        return std::unexpected(Failure::local("the device has no account of user " + std::to_string(number)));
    return std::unexpected(Failure::system("cannot read the accounts of the device", account.error()));
}

std::expected<ProcessDescription, Failure> processOf(const Arguments& arguments, const Program& program, uid_t user) {
    auto process = descriptionOf(program.identity());
    process.containerIdentifier = arguments.value(identifierOption.name);
    process.user = user;
    process.isPlugin = arguments.has(pluginOption.name);
    if (process.systemContainer && process.containerIdentifier)
        process.systemContainer = process.containerIdentifier;
    if (!process.containerIdentifier && !process.codeSigningIdentifier)
        return std::unexpected(
            Failure::local(escaped(program.path()) + " is not signed with an identifier; give one with --identifier"));
    return process;
}

const std::string& identifierOf(const ProcessDescription& process) {
    return process.containerIdentifier ? *process.containerIdentifier : *process.codeSigningIdentifier;
}

std::expected<std::chrono::seconds, Failure> timeoutOf(const Arguments& arguments) {
    const auto text = arguments.value(timeoutOption.name);
    if (!text)
        return usualTimeout;
    const auto number = ost::platform::numberIn<std::uint32_t>(*text);
    if (number && *number > 0 && *number <= longestTimeout.count())
        return std::chrono::seconds(*number);
    return std::unexpected(
        Failure::usage("\"" + escaped(*text) + "\" is no number from 1 to " + std::to_string(longestTimeout.count())));
}

std::expected<ProcessContainers, Failure> containersOf(const Device& device, const ProcessDescription& process,
                                                       std::chrono::seconds timeout) {
    auto containers = processContainers(device.path, process, timeout);
    if (!containers && containers.error() == UpcallError{UpcallError::Kind::transport, ETIMEDOUT})
        return std::unexpected(Failure::local(
            escaped(identifierOf(process)) + ": the daemon has not said for " + std::to_string(timeout.count()) +
            " s where the containers are, so nothing was started; it is stopped, or waits for its disk"));
    if (!containers)
        return std::unexpected(
            Failure::local(escaped(identifierOf(process)) + ": " + containers.error().description()));
    return *std::move(containers);
}

/// An application that runs is on record under its identifier, which has to fit there before anything is made.
std::expected<void, Failure> refuseUnrecordable(const std::string& identifier) {
    const auto name = ost::platform::fileNameForKey(identifier);
    if (!name.empty() && name.size() <= NAME_MAX)
        return {};
    return std::unexpected(Failure::local("an identifier of " + std::to_string(identifier.size()) +
                                          " bytes cannot be that of a program that runs"));
}

// --print

class PrintedContainers {
public:
    void add(std::string_view name, const std::optional<std::string>& path) {
        if (!path)
            return;
        _addLine(name, *path);
        report.json.set(std::string(name), *path);
    }

    void add(std::string_view name, std::string_view jsonName, const ProcessContainers::Groups& groups) {
        ost::OSTDictionary json;
        for (const auto& [identifier, path] : groups) {
            _addLine(name, std::string(identifier).append("  ").append(path));
            json.set(identifier, path);
        }
        if (!groups.empty())
            report.json.set(std::string(jsonName), std::move(json));
    }

    Report report;

private:
    void _addLine(std::string_view name, std::string_view value) {
        constexpr std::size_t width = 14;
        report.text.append(name).append(width - name.size(), ' ').append(escaped(value)).append("\n");
    }
};

Report printed(const ProcessContainers& containers) {
    PrintedContainers printed;
    printed.add("home", containers.home);
    printed.add("data", containers.data);
    printed.add("temporary", containers.temporary);
    printed.add("group", "groups", containers.groups);
    printed.add("system", containers.system);
    printed.add("system group", "systemGroups", containers.systemGroups);
    return std::move(printed.report);
}

// What the program may reach

Failure confinementFailure(Errno error) {
    if (error == EOPNOTSUPP)
        return Failure::local("this kernel has no Landlock to confine the program with; --unconfined does without");
    return Failure::system("cannot confine the program", error);
}

template<typename T>
std::expected<T, Failure> confining(std::expected<T, Errno> done) {
    if (!done)
        return std::unexpected(confinementFailure(done.error()));
    if constexpr (std::is_void_v<T>)
        return {};
    else
        return *std::move(done);
}

/// A directory, by whatever name.
using FileIdentity = std::pair<dev_t, ino_t>;

/// The device's directory and those above it.
std::expected<std::vector<FileIdentity>, Failure> directoriesAround(const Device& device) {
    std::vector<FileIdentity> directories;
    for (auto path = std::filesystem::path(device.path);; path = path.parent_path()) {
        struct stat status{};
        if (::stat(path.c_str(), &status) != 0)
            return std::unexpected(Failure::system("cannot examine " + path.string(), errno));
        directories.emplace_back(status.st_dev, status.st_ino);
        if (path == path.root_path())
            return directories;
    }
}

/// Makes the rules for what is the same for all programs.
class SystemRules {
public:
    SystemRules(Confinement& confinement, const Device& device, std::vector<FileIdentity> around)
        : _confinement(confinement), _device(device), _around(std::move(around)) {}

    std::expected<void, Failure> allow(std::span<const char* const> paths, FileAccess access) {
        for (const char* const path : paths)
            OST_TRY(_allow(path, access));
        return {};
    }

private:
    /// A path that does not exist needs no rule.
    std::expected<void, Failure> _allow(const char* path, FileAccess access) {
        const FileDescriptor file(::open(path, O_PATH | O_CLOEXEC));
        if (!file && errno == ENOENT)
            return {};
        struct stat status{};
        if (!file || ::fstat(file.get(), &status) != 0)
            return std::unexpected(Failure::system(std::string("cannot open ") + path, errno));
        // A device in there would be open to every program.
        if (std::ranges::find(_around, FileIdentity(status.st_dev, status.st_ino)) != _around.end())
            return std::unexpected(
                Failure::local(escaped(_device.path) + " lies in " + path + ", which every program may read"));
        return confining(_confinement.allow(file.get(), access));
    }

    Confinement& _confinement;
    const Device& _device;
    const std::vector<FileIdentity> _around;
};

/// What a program may do before it is known which containers it has.
std::expected<Confinement, Failure> systemConfinement(const Program& program, const Device& device) {
    auto confinement = OST_TRY(confining(Confinement::create()));
    SystemRules rules(confinement, device, OST_TRY(directoriesAround(device)));
    OST_TRY(rules.allow(programDirectories, FileAccess::readAndExecute));
    OST_TRY(rules.allow(readableFiles, FileAccess::read));
    OST_TRY(rules.allow(writableFiles, FileAccess::readAndWrite));
    OST_TRY(confining(confinement.allow(program.file(), FileAccess::readAndExecute)));
    return confinement;
}

/// A link on the way would lead out of the device, and is never the daemon's.
std::expected<FileDescriptor, Failure> openContainer(const Device& device, const std::string& path) {
    const auto relative = path.starts_with('/') ? path.substr(1) : path;
    auto container = ost::platform::openWithoutLinks(device.directory.get(), relative.c_str(), O_PATH | O_DIRECTORY,
                                                     RESOLVE_BENEATH);
    if (!container)
        return std::unexpected(Failure::system("cannot open " + device.prefix() + path, container.error()));
    return *std::move(container);
}

std::vector<std::string> allPaths(const ProcessContainers& containers) {
    std::vector<std::string> paths;
    for (const auto& path : {containers.data, containers.system})
        if (path)
            paths.push_back(*path);
    for (const auto* const groups : {&containers.groups, &containers.systemGroups})
        for (const auto& [identifier, path] : *groups)
            paths.push_back(path);
    return paths;
}

std::expected<void, Failure> allowContainers(Confinement& confinement, const Device& device,
                                             const ProcessContainers& containers) {
    for (const auto& path : allPaths(containers)) {
        const auto container = OST_TRY(openContainer(device, path));
        OST_TRY(confining(confinement.allow(container.get(), FileAccess::own)));
    }
    return {};
}

/// The program is told of its groups in lines.
std::expected<void, Failure> refuseLineBreaks(const ProcessContainers& containers) {
    for (const auto* const groups : {&containers.groups, &containers.systemGroups})
        for (const auto& [identifier, path] : *groups)
            if (identifier.contains('\n') || path.contains('\n'))
                return std::unexpected(Failure::local("the group " + escaped(identifier) + " has a line break"));
    return {};
}

// Running

std::expected<std::vector<gid_t>, Failure> groupsOf(const ost::platform::Account& account, const Device& device) {
    auto groups = ost::platform::groupsOf(account, device.prefix());
    if (!groups)
        return std::unexpected(Failure::system("cannot read the groups of the device", groups.error()));
    return *std::move(groups);
}

std::expected<ost::platform::ApplicationRecord, Failure>
registerChild(const LaunchedProcess& child, const std::string& identifier, const Device& device) {
    const auto instance = ost::platform::processInstance(child.id());
    auto record = instance ? ost::platform::registerApplication(identifier, *instance, device.prefix())
                           : std::unexpected(instance.error());
    if (!record)
        return std::unexpected(Failure::system("cannot register " + identifier, record.error()));
    return *std::move(record);
}

std::expected<void, Failure> refuseWhenAsserted(const std::string& identifier, const Device& device) {
    const auto reason = ost::platform::terminationAssertion(identifier, device.prefix());
    if (!reason)
        return std::unexpected(Failure::system("cannot look for termination assertions", reason.error()));
    if (*reason)
        return std::unexpected(Failure::local(
            escaped(identifier) + " must not run now: a termination assertion is held, reason: " + escaped(**reason)));
    return {};
}

/// Runs the program to its end. It is on record before anybody looks whether it may run, so that whoever forbids it
/// meanwhile finds it.
Outcome runToEnd(const Launch& launch, const std::string& identifier, const Device& device) {
    auto child = LaunchedProcess::hold(launch);
    if (!child)
        return std::unexpected(Failure::system("cannot make a process", child.error()));
    const auto record = OST_TRY(registerChild(*child, identifier, device));
    OST_TRY(refuseWhenAsserted(identifier, device));
    if (const auto released = child->release(); !released)
        return std::unexpected(Failure::system(
            "cannot run " + launch.program.path() + ": cannot " + released.error().doing, released.error().error));
    return Report{.text = {}, .json = {}, .exitStatus = child->waitForEnd(), .isPrinted = true};
}

std::vector<std::string> argumentsOf(const Arguments& arguments) {
    auto words = arguments.values(argumentOperand.name);
    words.insert(words.begin(), *arguments.value(programOperand.name));
    return words;
}

Outcome launch(const Arguments& arguments, const Device& device, Program program,
               const ost::platform::Account& account) {
    const auto timeout = OST_TRY(timeoutOf(arguments));
    const auto process = OST_TRY(processOf(arguments, program, account.uid));
    std::optional<Confinement> confinement;
    if (!arguments.has(unconfinedOption.name))
        confinement = OST_TRY(systemConfinement(program, device));
    auto groups = OST_TRY(groupsOf(account, device));
    OST_TRY(refuseUnrecordable(identifierOf(process)));
    const auto containers = OST_TRY(containersOf(device, process, timeout));
    OST_TRY(refuseLineBreaks(containers));
    if (confinement)
        OST_TRY(allowContainers(*confinement, device, containers));
    const Launch launch{
        .program = std::move(program),
        .arguments = argumentsOf(arguments),
        .environment = processEnvironment(containers, device.path, account.name, environ),
        .user = account.uid,
        .groups = std::move(groups),
        .workingDirectory = OST_TRY(openContainer(device, containers.data.value_or(""))),
        .confinement = std::move(confinement),
    };
    return runToEnd(launch, identifierOf(process), device);
}

Outcome run(const Arguments& arguments) {
    if (::geteuid() != 0)
        return std::unexpected(Failure::local("only root can give a program its containers"));
    ost::platform::openMissingStandardFiles();
    const auto device = OST_TRY(deviceOf(arguments));
    auto program = OST_TRY(programOf(arguments));
    const auto account = OST_TRY(accountOf(arguments, device));
    if (!arguments.has(printOption.name))
        return launch(arguments, device, std::move(program), account);
    const auto timeout = OST_TRY(timeoutOf(arguments));
    const auto process = OST_TRY(processOf(arguments, program, account.uid));
    return printed(OST_TRY(containersOf(device, process, timeout)));
}

} // namespace

std::vector<Command> runCommands() {
    return {
        {"run",
         "runs a program in its containers, which are made when they are missing",
         {programOperand, argumentOperand},
         {identifierOption, userOption, pluginOption, timeoutOption, printOption, unconfinedOption},
         "The program's signature says who it is and which groups it has. It runs in its data container, with the\n"
         "rights of its user but without reach into anything but its containers and what programs need of the\n"
         "system. HOME and TMPDIR lie in its data container; OSTRAND_DATA_CONTAINER, OSTRAND_GROUP_CONTAINERS,\n"
         "OSTRAND_SYSTEM_CONTAINER and OSTRAND_SYSTEM_GROUP_CONTAINERS say where everything is, groups as a line\n"
         "ID=PATH each. Of the caller's environment, PATH, TERM, TZ, LANG and LC_* are kept.\n"
         "\n"
         "The exit status is the program's, 128 and the number of the signal that ended it, or 1 when it was not\n"
         "run, for instance because the daemon did not answer in time.",
         run,
         R"({"home?": "string", "data?": "string", "temporary?": "string", "groups?": {"*": "string"}, "system?": "string", "systemGroups?": {"*": "string"}})"}};
}

} // namespace ostrand::ctl
