#include "Client/Attributes.h"
#include "Client/ctl/Commands.h"
#include "Client/ctl/ContainerArguments.h"
#include "Client/ctl/Terminal.h"
#include "Client/ctl/Values.h"
#include "Client/ctl/Waiting.h"
#include "platform/base/Try.h"
#include "platform/device/DeviceLockState.h"
#include "platform/device/ProtectionClass.h"

#include <fcntl.h>

#include <charconv>
#include <cstdio>
#include <filesystem>

namespace ostrand::ctl {

namespace {

namespace fs = std::filesystem;
using ost::platform::FileDescriptor;

constexpr Operand identifierOperand{"ID", "the data container's identifier"};
constexpr Option protectionOption{"class", "N", "the protection class that the container gets",
                                  Option::Count::required};
constexpr Option containerClassOption{"container-class", "C", "the container class; else 2, Data/Application"};
constexpr Option retryOption{"retry-if-locked", "", "wait for an unlock when the device is locked"};
constexpr Option outsideOption{"outside-developer", "", "the application is not the system's own: 0, 1 and 3 only"};

constexpr std::string_view aboutProtection =
    "Classes of protection: 0 none, 1 to 3 only with the keys of an unlocked device, 4 always readable; 2 cannot be\n"
    "asked for. A container that was never given one counts as 3. Without --user, the container is the current user's.";

constexpr std::int64_t highestClass = 4;

std::expected<DataProtection, Failure> changeOf(const Arguments& arguments) {
    DataProtection change{.identifier = *arguments.value(identifierOperand.name),
                          .outsideDeveloper = arguments.has(outsideOption.name),
                          .retryIfLocked = arguments.has(retryOption.name)};
    const auto text = *arguments.value(protectionOption.name);
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), change.protectionClass);
    if (error != std::errc{} || end != text.data() + text.size() || change.protectionClass < 0 ||
        change.protectionClass > highestClass)
        return std::unexpected(Failure::usage("\"" + escaped(text) + "\" is no protection class; they are 0 to 4"));
    if (const auto containerClass = arguments.value(containerClassOption.name))
        change.containerClass = OST_TRY(classNamed(*containerClass));
    change.user = OST_TRY(userOf(arguments, change.containerClass));
    return change;
}

ContainerRequest containerOf(const DataProtection& change) {
    return {.containerClass = change.containerClass,
            .user = change.user,
            .identifier = change.identifier,
            .transient = false};
}

/// Tells a person how far a change is that takes its time.
class Progress {
public:
    /// `container` is the container's directory as this process sees it, empty when it cannot be told.
    Progress(std::string device, std::string container, std::int64_t protectionClass)
        : _device(std::move(device)), _container(std::move(container)), _class(protectionClass) {}

    void report() {
        if (!_toldOfLock && ost::platform::deviceLockState(_device) == ost::platform::deviceLocked) {
            std::fputs("the device is locked: waiting for an unlock\n", stderr);
            _toldOfLock = true;
        }
        if (_line.isShown())
            _line.show(std::to_string(_itemsDone()) + " items have the class");
    }

private:
    /// Opens nothing that could wait, and follows no link.
    [[nodiscard]] bool _hasClass(const fs::path& item, const fs::path& holder) const {
        constexpr int look = O_PATH | O_NOFOLLOW | O_CLOEXEC;
        const FileDescriptor descriptor(::open(item.c_str(), look));
        const FileDescriptor directory(::open(holder.c_str(), look));
        return descriptor && directory && ost::platform::protectionClass(descriptor.get(), directory.get()) == _class;
    }

    [[nodiscard]] std::uint64_t _itemsDone() const {
        std::uint64_t count = 0;
        for (const auto* const name : {"Documents", "Library", "tmp", "Quibbet"}) {
            std::error_code failure;
            for (fs::recursive_directory_iterator item(fs::path(_container) / name, failure), end;
                 !failure && item != end; item.increment(failure))
                if (!item->is_symlink(failure) && _hasClass(item->path(), item->path().parent_path()))
                    ++count;
        }
        return count;
    }

    std::string _device, _container;
    std::int64_t _class;
    bool _toldOfLock = false;
    ProgressLine _line{true};
};

/// Whether the class was recorded, as it is whenever the change succeeded. An item that may not be changed is errno 1,
/// which the wire cannot tell from success.
std::expected<bool, Failure> isRecorded(Connection& connection, const DataProtection& change) {
    const auto found = OST_TRY(listedContainers(connection, containerOf(change), {change.identifier}));
    const auto value = infoValue(connection, found.front(), protectionClassKey);
    constexpr std::int64_t neverSet = 3;
    return (value ? value->unsignedValue() : neverSet) == static_cast<std::uint64_t>(change.protectionClass);
}

Outcome protect(const Arguments& arguments) {
    const auto change = OST_TRY(changeOf(arguments));
    const auto device = deviceDirectory(arguments);
    auto others = OST_TRY(connectToDevice(arguments));
    const auto container = createOrLookup(others, containerOf(change), WhenMissing::fail);
    Progress progress(device, container ? device + container->path : "", change.protectionClass);
    auto connection = OST_TRY(connectToDevice(arguments, betweenReports));
    OST_TRY(waitForReply(connection, beginSettingDataProtection(connection, change), [&] {
        if (!arguments.has("json"))
            progress.report();
    }));
    if (!OST_TRY(isRecorded(others, change)))
        return std::unexpected(Failure::local("the change ended at an item that may not be changed; the daemon's log "
                                              "names it"));
    Report report;
    report.text = escaped(change.identifier) + " has protection class " + std::to_string(change.protectionClass) + "\n";
    report.json.set("identifier", change.identifier);
    report.json.set("protectionClass", change.protectionClass);
    return report;
}

} // namespace

std::vector<Command> protectionCommands() {
    return {
        {"protect",
         "gives a data container another protection class, and returns when that is done",
         {identifierOperand},
         {protectionOption, containerClassOption, userOption, retryOption, outsideOption},
         aboutProtection,
         protect,
         R"({"identifier": "string", "protectionClass": "number"})"},
    };
}

} // namespace ostrand::ctl
