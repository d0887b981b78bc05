#include "Device/DeviceImage.h"

#include "Device/ImageLayout.h"
#include "platform/base/Errno.h"
#include "platform/base/SmallFile.h"
#include "platform/base/Try.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sched.h>
#include <sys/file.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace ost::device {

using platform::FileDescriptor;

namespace {

std::string procPathOf(const FileDescriptor& file) { return "/proc/self/fd/" + std::to_string(file.get()); }

} // namespace

std::string Failure::description() const { return "Failed to " + what + ": " + std::strerror(error); }

Failure DeviceImage::_failure(std::string_view doing, std::string_view name) const {
    return {std::string(doing) + ' ' + (name.empty() ? _path : _path / name).string(), errno};
}

Result<DeviceImage> DeviceImage::openOrMake(const std::filesystem::path& path) {
    std::error_code error;
    DeviceImage image(std::filesystem::absolute(path, error).lexically_normal());
    const bool created = !error && std::filesystem::create_directories(image._path, error);
    if (error)
        return std::unexpected(Failure{"make " + path.string(), error.value()});
    OST_TRY(image._openRoot());
    // Whatever the umask is, the users of the device live below its root.
    if (created && ::fchmod(image._root.get(), 0755) != 0)
        return std::unexpected(image._failure("open to all", ""));
    if (::faccessat(image._root.get(), accountFile, F_OK, AT_SYMLINK_NOFOLLOW) != 0)
        OST_TRY(image._makeMissingParts());
    return image;
}

Result<void> DeviceImage::_openRoot() {
    _root.reset(::open(_path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!_root)
        return std::unexpected(_failure("open", ""));
    return {};
}

Result<void> DeviceImage::_makeMissingParts() const {
    for (const ImageDirectory& directory : imageDirectories)
        OST_TRY(_makeDirectory(directory.name, directory.mode, directory.owner));
    for (const ImageFile& file : imageFiles)
        OST_TRY(_makeFile(file.name, file.content));
    return {};
}

Result<void> DeviceImage::_makeDirectory(const char* name, unsigned mode, unsigned owner) const {
    if (::mkdirat(_root.get(), name, 0700) != 0) {
        if (errno == EEXIST)
            return {};
        return std::unexpected(_failure("make", name));
    }
    const FileDescriptor directory = OST_TRY(_openDirectory(name));
    if (::fchown(directory.get(), owner, owner) != 0 || ::fchmod(directory.get(), mode) != 0)
        return std::unexpected(_failure("give away", name));
    return {};
}

Result<void> DeviceImage::_makeFile(const char* name, std::string_view content) const {
    const std::string temporary = std::string(name) + ".new";
    const FileDescriptor file(
        ::openat(_root.get(), temporary.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0644));
    if (!file || ::fchmod(file.get(), 0644) != 0 || !platform::writeAll(file.get(), content) ||
        (::renameat2(_root.get(), temporary.c_str(), _root.get(), name, RENAME_NOREPLACE) != 0 && errno != EEXIST))
        return std::unexpected(_failure("write", name));
    ::unlinkat(_root.get(), temporary.c_str(), 0);
    return {};
}

Result<FileDescriptor> DeviceImage::_openDirectory(const char* name) const {
    open_how how{};
    how.flags = O_RDONLY | O_DIRECTORY | O_CLOEXEC;
    how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS;
    FileDescriptor directory(static_cast<int>(::syscall(SYS_openat2, _root.get(), name, &how, sizeof how)));
    if (!directory)
        return std::unexpected(_failure("open", name));
    return directory;
}

Result<void> DeviceImage::reserve() {
    _reservation.reset(::openat(_root.get(), ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!_reservation)
        return std::unexpected(_failure("open", ""));
    if (::flock(_reservation.get(), LOCK_EX | LOCK_NB) != 0)
        return std::unexpected(Failure{"boot " + _path.string(), errno == EWOULDBLOCK ? EBUSY : errno});
    return {};
}

Result<void> DeviceImage::mountDeviceFileSystems() {
    if (::unshare(CLONE_NEWNS) != 0)
        return std::unexpected(Failure{"make a mount namespace", errno});
    if (::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0)
        return std::unexpected(Failure{"make the mount namespace private", errno});
    // A descriptor from outside still means the mount of the namespace it was opened in.
    OST_TRY(_openRoot());
    OST_TRY(_mount("tmpfs", "dev/shm", "tmpfs", MS_NOSUID | MS_NODEV | MS_NOEXEC, "mode=1777"));
    OST_TRY(_mount("proc", "proc", "proc", MS_NOSUID | MS_NODEV | MS_NOEXEC, nullptr));
    return {};
}

Result<void> DeviceImage::_mount(const char* source, const char* target, const char* type, unsigned long flags,
                                 const char* options) const {
    const FileDescriptor directory = OST_TRY(_openDirectory(target));
    if (::mount(source, procPathOf(directory).c_str(), type, flags, options) != 0)
        return std::unexpected(_failure("mount", target));
    return {};
}

Result<void> DeviceImage::mountHostLibraries() const {
    for (const char* name : {"usr", "lib", "lib32", "lib64", "libx32"}) {
        const std::string source = std::string("/") + name;
        if (::access(source.c_str(), F_OK) != 0)
            continue;
        OST_TRY(_makeDirectory(name, 0755, OSTRootUserId));
        OST_TRY(_mount(source.c_str(), name, nullptr, MS_BIND, nullptr));
        // A bind mount takes its flags only when it is mounted again; the directory is by now the mounted one.
        OST_TRY(_mount(nullptr, name, nullptr, MS_REMOUNT | MS_BIND | MS_RDONLY | MS_NOSUID | MS_NODEV, nullptr));
    }
    return {};
}

Result<FileDescriptor> DeviceImage::openEmptiedRunDirectory() const {
    FileDescriptor directory = OST_TRY(_openDirectory(runDirectory));
    std::error_code error;
    for (std::filesystem::directory_iterator entry(procPathOf(directory), error), end; !error && entry != end;
         entry.increment(error))
        if (std::filesystem::remove_all(entry->path(), error); error)
            break;
    if (error)
        return std::unexpected(Failure{"empty " + (_path / runDirectory).string(), error.value()});
    return directory;
}

std::expected<void, platform::Errno> DeviceImage::changeRoot() const noexcept {
    if (::fchdir(_root.get()) != 0 || ::chroot(".") != 0 || ::chdir("/") != 0)
        return std::unexpected(errno);
    return {};
}

} // namespace ost::device
