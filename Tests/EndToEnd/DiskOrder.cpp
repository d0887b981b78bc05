#include "EndToEnd/DiskOrder.h"

#include "Protocol/OSTContainerClass.h"
#include "files/OSTFileManager.h"
#include "platform/base/Path.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/uio.h>
#include <unistd.h>

#include <algorithm>
#include <array>

namespace ost::test {

using platform::FileDescriptor;
using platform::isAtOrBelow;

namespace {

constexpr std::string_view noteOfItem = "trusted.ostrand.sandbox-item";
constexpr std::string_view deathRow = "/private/var/root/Library/Caches/com.tamarok.ostrandd/Dead";
constexpr std::string_view staging = "/private/var/root/Library/Caches/com.tamarok.ostrandd/Staging";
constexpr std::string_view library = "/private/var/root/Library/Ostrand";
constexpr std::string_view replaceFiles = "/private/var/root/Library/Ostrand/Replace";
constexpr std::string_view oldBundles = "/private/var/mobile/Containers/Bundle";
const std::string bundles = "/private/var/containers/Bundle";
constexpr std::string_view sandboxItems = "/private/var/db/sandbox-state";

/// The class directory at or above a path; empty when there is none.
std::string_view classDirectoryOf(std::string_view path) {
    for (unsigned number = 1; number < static_cast<unsigned>(OSTContainerClass::max); ++number) {
        const auto component = '/' + std::string(OSTContainerClassPathComponents[number]);
        if (const auto found = path.find(component); found != std::string_view::npos)
            if (isAtOrBelow(path, path.substr(0, found + component.size())))
                return path.substr(0, found + component.size());
    }
    return {};
}

bool isClassDirectory(std::string_view path) { return classDirectoryOf(path) == path; }

std::string textOf(pid_t thread, std::uint64_t address) {
    constexpr std::size_t page = 4096;
    std::string text;
    for (;;) {
        std::array<char, page> buffer;
        const iovec own{buffer.data(), page - address % page};
        const iovec others{reinterpret_cast<void*>(address), own.iov_len}; // NOLINT(performance-no-int-to-ptr)
        const auto count = ::process_vm_readv(thread, &own, 1, &others, 1, 0);
        if (count <= 0)
            return text;
        const std::string_view read(buffer.data(), static_cast<std::size_t>(count));
        text += read.substr(0, read.find('\0'));
        if (read.find('\0') != std::string_view::npos)
            return text;
        address += read.size();
    }
}

FileDescriptor descriptorOf(pid_t thread, std::uint64_t number) {
    const auto path = "/proc/" + std::to_string(thread) + "/fd/" + std::to_string(static_cast<int>(number));
    return FileDescriptor(::open(path.c_str(), O_PATH | O_CLOEXEC));
}

struct stat statusOf(int item) {
    struct stat status{};
    (void)::fstat(item, &status);
    return status;
}

} // namespace

void DiskOrder::operator()(const GatedCall& call) {
    const std::lock_guard lock(_mutex);
    _lookAtWhatIsNew();
    const auto& argument = call.arguments;
    const auto own = [&](unsigned index) { return descriptorOf(call.thread, argument[index]); };
    switch (call.number) {
    case SYS_openat:
        if ((argument[2] & O_CREAT) != 0)
            _makesFile(_place(call, 0, 1));
        break;
    case SYS_mkdirat:
        if (const auto place = _place(call, 0, 1); !_itemAt(place))
            _markNames(place, {}, "made");
        break;
    case SYS_symlinkat:
        _markNames(_place(call, 1, 2), {}, "linked");
        break;
    case SYS_renameat:
    case SYS_renameat2:
        _moves(_place(call, 0, 1), _place(call, 2, 3));
        break;
    case SYS_unlinkat:
        _removes(_place(call, 0, 1));
        break;
    case SYS_fchownat: {
        const auto place = _place(call, 0, 1);
        _mark(place.name.empty() ? own(0).get() : _itemAt(place).get(), {Kind::attributes}, "its owner");
        break;
    }
    case SYS_setxattr: // through a descriptor's path
        _mark(descriptorOf(call.thread, std::stoul(textOf(call.thread, argument[0]).substr(14))).get(),
              {Kind::attributes}, "its attributes");
        break;
    case SYS_fsetxattr:
        if (textOf(call.thread, argument[1]) == noteOfItem)
            break;
        [[fallthrough]];
    case SYS_fchmod:
    case SYS_fchown:
    case SYS_fremovexattr:
    case SYS_write:
    case SYS_ftruncate:
        _mark(own(0).get(), {Kind::attributes}, "what it holds");
        break;
    case SYS_fsync:
    case SYS_fdatasync:
        _waits(own(0).get(), false);
        break;
    case SYS_syncfs:
        _waits(own(0).get(), true);
        break;
    default:
        break;
    }
}

std::vector<std::string> DiskOrder::notOnDisk() {
    const std::lock_guard lock(_mutex);
    _lookAtWhatIsNew();
    std::vector<std::string> found;
    for (const auto& [identity, change] : _changes)
        if (_counts(change))
            found.push_back(_pathOf(change.item.get()) + ": " + change.reason);
    return found;
}

std::vector<std::string> DiskOrder::takenTooEarly() {
    const std::lock_guard lock(_mutex);
    return _tooEarly;
}

std::set<std::string> DiskOrder::waitedFor() {
    const std::lock_guard lock(_mutex);
    return _waitedFor;
}

void DiskOrder::forget(bool isSuccessor) {
    const std::lock_guard lock(_mutex);
    _changes.clear();
    _new.clear();
    _tooEarly.clear();
    _waitedFor.clear();
    _isSuccessor = isSuccessor;
}

DiskOrder::Place DiskOrder::_place(const GatedCall& call, unsigned directory, unsigned path) const {
    const auto text = textOf(call.thread, call.arguments[path]);
    const auto slash = text.rfind('/');
    const auto holder = slash == std::string::npos ? "." : text.substr(0, slash);
    auto base = text.starts_with('/') ? FileDescriptor(::open(_image.c_str(), O_PATH | O_CLOEXEC))
                                      : descriptorOf(call.thread, call.arguments[directory]);
    const auto relative = holder.starts_with('/') ? holder.substr(1) : holder;
    FileDescriptor opened(::openat(base.get(), relative.empty() ? "." : relative.c_str(), O_PATH | O_CLOEXEC));
    return {std::move(opened), slash == std::string::npos ? text : text.substr(slash + 1)};
}

std::string DiskOrder::_pathOf(int item) const {
    std::error_code failed;
    const auto path = std::filesystem::read_symlink("/proc/self/fd/" + std::to_string(item), failed).string();
    return path.starts_with(_image.native()) ? path.substr(_image.native().size()) : std::string();
}

FileDescriptor DiskOrder::_itemAt(const Place& place) const {
    return FileDescriptor(::openat(place.directory.get(), place.name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
}

void DiskOrder::_lookAtWhatIsNew() {
    for (const auto& place : std::exchange(_new, {}))
        if (const auto item = _itemAt(place))
            _mark(item.get(), {Kind::attributes}, "made");
}

void DiskOrder::_mark(int item, const std::set<Kind>& kinds, const std::string& reason) {
    const auto status = statusOf(item);
    if (!S_ISREG(status.st_mode) && !S_ISDIR(status.st_mode))
        return;
    auto& change = _changes[{status.st_dev, status.st_ino}];
    change.item = FileDescriptor(::fcntl(item, F_DUPFD_CLOEXEC, 0));
    change.kinds.insert(kinds.begin(), kinds.end());
    change.reason += (change.reason.empty() ? "" : ", ") + reason;
}

void DiskOrder::_markNames(const Place& place, std::set<Kind> kinds, const std::string& reason) {
    kinds.insert(Kind::names);
    if (!place.name.starts_with(".temp."))
        _mark(place.directory.get(), kinds, place.name + " " + reason);
}

void DiskOrder::_makesFile(Place place) {
    if (_itemAt(place))
        return;
    _markNames(place, {}, "made");
    _new.push_back(std::move(place));
}

void DiskOrder::_removes(const Place& place) {
    const auto path = _pathOf(place.directory.get());
    if (!_itemAt(place) || isAtOrBelow(path, sandboxItems))
        return;
    if (path == replaceFiles)
        _judgeDiscard(place.name);
    const auto removed = path + "/" + place.name;
    if (isAtOrBelow(removed, oldBundles))
        _requireOnDisk(removed + " goes", [&](const Change& change, const std::string& receiver) {
            return change.kinds.contains(Kind::received) &&
                   isAtOrBelow(receiver, bundles + removed.substr(oldBundles.size()));
        });
    // The twin of a container, whose move an earlier process may not have waited for.
    if (const std::string held(classDirectoryOf(removed));
        _isSuccessor && held.size() < removed.size() && isAtOrBelow(held, oldBundles) &&
        !_waitedFor.contains(bundles + held.substr(oldBundles.size())))
        _tooEarly.push_back(removed + " goes before the place of its twin is waited for");
    _markNames(place, {}, "removed");
}

void DiskOrder::_moves(const Place& from, const Place& to) {
    const auto item = _itemAt(from);
    if (!item)
        return;
    const bool isDirectory = S_ISDIR(statusOf(item.get()).st_mode);
    const auto source = _pathOf(from.directory.get()), destination = _pathOf(to.directory.get());
    if (!isAtOrBelow(destination, deathRow))
        _requireOnDisk(destination + "/" + to.name + " comes from " + source,
                       [&](const Change&, const std::string& path) { return isAtOrBelow(path, _pathOf(item.get())); });
    if (isDirectory)
        _judgeContainer(source, destination);
    if (source == replaceFiles)
        _judgeDiscard(from.name);
    if (to.name == OSTMetadataFileName)
        _requireOnDisk(destination + " is described anew",
                       [&](const Change&, const std::string& path) { return path.starts_with(destination + "/"); });
    if (destination == library && to.name.ends_with("_migration_complete.plist"))
        _requireOnDisk(to.name + " is written",
                       [&](const Change& change, const std::string&) { return _counts(change); });
    const std::set<Kind> parked =
        isClassDirectory(source) && destination == staging ? std::set{Kind::parked} : std::set<Kind>();
    _markNames(from, parked, "left");
    _markNames(to, isDirectory ? std::set{Kind::received} : std::set<Kind>(), "came");
    if (!parked.empty())
        _mark(to.directory.get(), parked, "parking");
}

void DiskOrder::_judgeContainer(const std::string& from, const std::string& to) {
    if (isClassDirectory(from))
        _requireOnDisk("a container leaves " + from, [](const Change& change, const std::string& path) {
            return change.kinds.contains(Kind::names) && path == replaceFiles;
        });
    if (isClassDirectory(from) && isClassDirectory(to))
        _requireOnDisk("a container comes into " + to,
                       [](const Change& change, const std::string&) { return change.kinds.contains(Kind::parked); });
}

void DiskOrder::_judgeDiscard(const std::string& name) {
    _requireOnDisk("the replace file " + name + " goes", [](const Change& change, const std::string& path) {
        return change.kinds.contains(Kind::received) && isClassDirectory(path);
    });
    if (_isSuccessor && std::ranges::none_of(_waitedFor, isClassDirectory))
        _tooEarly.push_back("the replace file " + name + " goes before a place of an earlier process is waited for");
}

void DiskOrder::_waits(int item, bool wholeFileSystem) {
    const auto status = statusOf(item);
    _waitedFor.insert(_pathOf(item));
    if (!wholeFileSystem) {
        _changes.erase({status.st_dev, status.st_ino});
        return;
    }
    _waitedFor.insert(_pathOf(item) + ofFileSystem);
    std::erase_if(_changes, [&](const auto& change) { return change.first.first == status.st_dev; });
}

bool DiskOrder::_counts(const Change& change) const {
    const auto path = _pathOf(change.item.get());
    constexpr std::array freely{deathRow, staging, replaceFiles};
    if (path.empty() || path.ends_with(" (deleted)") || path.find("/Library/Logs/") != std::string::npos ||
        path.find("/.temp.") != std::string::npos || !path.starts_with("/private/var/") ||
        path.starts_with("/private/var/run") ||
        std::ranges::any_of(freely, [&](auto place) { return isAtOrBelow(path, place); }))
        return false;
    const bool isOfLayout = !path.starts_with(library) && !isAtOrBelow(path, sandboxItems) &&
                            (classDirectoryOf(path).empty() || isClassDirectory(path));
    return change.kinds.contains(Kind::names) || !isOfLayout;
}

void DiskOrder::_requireOnDisk(const std::string& step, const auto& isNeeded) {
    for (const auto& [identity, change] : _changes)
        if (const auto path = _pathOf(change.item.get()); !path.empty() && isNeeded(change, path))
            _tooEarly.push_back(std::string(step).append(" before ").append(path).append(": ").append(change.reason));
}

} // namespace ost::test
