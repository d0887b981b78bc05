#include "files/OSTKnownFile.h"

#include "files/OSTPathResolution.h"
#include "platform/base/Try.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <chrono>

namespace ost {

namespace {

using namespace std::chrono_literals;

/// Longer than a tick of any kernel's clock, of which a file system takes its times.
constexpr std::chrono::nanoseconds tick = 20ms;
/// For a file system that keeps whole seconds, or pairs of them.
constexpr std::chrono::nanoseconds coarseTick = 3s;

bool meansAbsent(int errnoValue) { return errnoValue == ENOENT || errnoValue == ENOTDIR || errnoValue == ELOOP; }

} // namespace

std::expected<bool, platform::Errno> OSTKnownFile::look(const std::string& path, const char* name) {
    // Links on the way need no thought here: the directory that they might lead to is the very one that was reached
    // without them.
    if (_seen && _statusOf(AT_FDCWD, path.c_str()) == _seen)
        return true;
    _seen.reset();
    auto found = _lookInside(path, name);
    if (!found && meansAbsent(found.error()))
        return false;
    return found;
}

std::expected<bool, platform::Errno> OSTKnownFile::_lookInside(const std::string& path, const char* name) {
    const auto directory = OST_TRY(OSTOpenItem(AT_FDCWD, path, O_PATH | O_DIRECTORY));
    // Before the look: what happens after it is then seen the next time.
    const auto status = _statusOf(directory.get(), "");
    struct stat file{};
    if (::fstatat(directory.get(), name, &file, AT_SYMLINK_NOFOLLOW) != 0)
        return std::unexpected(errno);
    if (S_ISLNK(file.st_mode))
        return false;
    if (status && _isSettled(*status))
        _seen = status;
    return true;
}

std::optional<OSTKnownFile::Status> OSTKnownFile::_statusOf(int directory, const char* path) {
    struct stat status{};
    if (::fstatat(directory, path, &status, AT_SYMLINK_NOFOLLOW | AT_EMPTY_PATH) != 0)
        return std::nullopt;
    return Status{status.st_dev, status.st_ino, status.st_ctim.tv_sec, status.st_ctim.tv_nsec};
}

bool OSTKnownFile::_isSettled(const Status& status) {
    const auto changed =
        std::chrono::seconds(status.changedSeconds) + std::chrono::nanoseconds(status.changedNanoseconds);
    const auto age = std::chrono::system_clock::now().time_since_epoch() - changed;
    return age > (status.changedNanoseconds == 0 ? coarseTick : tick);
}

} // namespace ost
