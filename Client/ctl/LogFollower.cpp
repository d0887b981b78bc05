#include "Client/ctl/LogFollower.h"

#include "Client/DeviceFiles.h"
#include "platform/base/Try.h"

#include <cerrno>
#include <fcntl.h>
#include <sys/inotify.h>
#include <sys/stat.h>

namespace ostrand::ctl {

using ost::platform::Errno;
using ost::platform::FileDescriptor;

namespace {

constexpr const char* logDirectory = "/private/var/root/Library/Logs/Ostrand";
constexpr const char* logName = "ostrandd.log";

FileDescriptor openLog(int directory) {
    return FileDescriptor(::openat(directory, logName, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
}

} // namespace

std::expected<LogFollower, Errno> LogFollower::open(const std::string& device) {
    const auto files = OST_TRY(DeviceFiles::of(device));
    auto directory = OST_TRY(files.open(logDirectory, O_RDONLY | O_DIRECTORY));
    FileDescriptor changes(::inotify_init1(IN_CLOEXEC));
    const auto path = "/proc/self/fd/" + std::to_string(directory.get());
    if (!changes || ::inotify_add_watch(changes.get(), path.c_str(), IN_MODIFY | IN_CREATE | IN_MOVED_TO) < 0)
        return std::unexpected(errno);
    return LogFollower(std::move(directory), std::move(changes));
}

std::vector<std::string> LogFollower::read() {
    std::vector<std::string> lines;
    _readOn(lines);
    if (_isReplaced()) {
        _file = openLog(_directory.get());
        _offset = 0;
        _begun.clear();
        _readOn(lines);
    }
    return lines;
}

/// Whether the name stands for another file than the open one.
bool LogFollower::_isReplaced() const {
    struct stat named{}, held{};
    if (::fstatat(_directory.get(), logName, &named, AT_SYMLINK_NOFOLLOW) != 0)
        return false;
    return !_file || ::fstat(_file.get(), &held) != 0 || held.st_ino != named.st_ino || held.st_dev != named.st_dev;
}

void LogFollower::_readOn(std::vector<std::string>& lines) {
    struct stat status{};
    if (!_file || ::fstat(_file.get(), &status) != 0)
        return;
    if (status.st_size < _offset) { // it began anew
        _offset = 0;
        _begun.clear();
    }
    char buffer[16 * 1024];
    for (ssize_t count = 0; (count = ::pread(_file.get(), buffer, sizeof buffer, _offset)) > 0; _offset += count)
        _begun.append(buffer, static_cast<std::size_t>(count));
    std::size_t begin = 0;
    for (auto end = _begun.find('\n'); end != _begun.npos; end = _begun.find('\n', begin)) {
        lines.push_back(_begun.substr(begin, end - begin));
        begin = end + 1;
    }
    _begun.erase(0, begin);
}

std::expected<void, Errno> LogFollower::wait() {
    alignas(inotify_event) char events[4096];
    if (::read(_changes.get(), events, sizeof events) < 0 && errno != EINTR)
        return std::unexpected(errno);
    return {};
}

} // namespace ostrand::ctl
