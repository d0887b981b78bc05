#include "files/OSTTreeCopy.h"

#include "files/OSTPathResolution.h"
#include "files/OSTTreeCursor.h"
#include "platform/base/Try.h"

#include <fcntl.h>
#include <linux/limits.h>
#include <sys/sendfile.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <string>

namespace ost {

using platform::FileDescriptor;
using Result = std::expected<void, platform::Errno>;

namespace {

Result succeeded(int returned) {
    if (returned < 0)
        return std::unexpected(errno);
    return {};
}

/// As much as one system call may copy, so that a copy can be interrupted by the end of the process.
constexpr std::size_t copyChunk = std::size_t{64} << 20U;

bool cannotCopyInKernel(int error) {
    return error == EXDEV || error == EINVAL || error == EOPNOTSUPP || error == ENOSYS;
}

/// Copies the bytes from `begin` to `end`, fewer when the source has become shorter.
Result copyRange(int from, int to, off_t begin, off_t end) {
    if (::lseek(from, begin, SEEK_SET) < 0 || ::lseek(to, begin, SEEK_SET) < 0)
        return std::unexpected(errno);
    bool sharing = true; // copy_file_range can share blocks, but not between all file systems
    for (off_t left = end - begin; left > 0;) {
        const std::size_t size = std::min(static_cast<std::size_t>(left), copyChunk);
        const ssize_t copied =
            sharing ? ::copy_file_range(from, nullptr, to, nullptr, size, 0) : ::sendfile(to, from, nullptr, size);
        if (copied < 0 && sharing && cannotCopyInKernel(errno))
            sharing = false;
        else if (copied < 0 && errno != EINTR)
            return std::unexpected(errno);
        else if (copied == 0)
            return {};
        left -= std::max<ssize_t>(copied, 0);
    }
    return {};
}

/// Copies what a file holds and leaves its holes, which may be larger than the disk.
Result copyData(int from, int to, const struct stat& status) {
    constexpr off_t blockSize = 512;
    if (status.st_blocks * blockSize >= status.st_size)
        return copyRange(from, to, 0, status.st_size);
    for (off_t end = 0; end < status.st_size;) {
        const off_t begin = ::lseek(from, end, SEEK_DATA);
        if (begin < 0 && errno == ENXIO)
            break; // nothing but a hole is left
        end = begin < 0 ? -1 : ::lseek(from, begin, SEEK_HOLE);
        if (end < 0)
            return std::unexpected(errno);
        OST_TRY(copyRange(from, to, begin, end));
    }
    return succeeded(::ftruncate(to, status.st_size));
}

Result copyExtendedAttribute(int from, int to, const char* name) {
    std::array<char, XATTR_SIZE_MAX> value; // on the stack, and not initialised: most files have one or two
    const ssize_t size = ::fgetxattr(from, name, value.data(), value.size());
    if (size < 0)
        return std::unexpected(errno);
    if (::fsetxattr(to, name, value.data(), static_cast<std::size_t>(size), 0) == 0 || errno == ENOTSUP)
        return {};
    return std::unexpected(errno);
}

/// The ACLs are among them.
Result copyExtendedAttributes(int from, int to) {
    std::array<char, XATTR_LIST_MAX> names;
    const ssize_t size = ::flistxattr(from, names.data(), names.size());
    if (size < 0 && errno != ENOTSUP)
        return std::unexpected(errno);
    for (const char* name = names.data(); name < names.data() + size; name += std::char_traits<char>::length(name) + 1)
        OST_TRY(copyExtendedAttribute(from, to, name));
    return {};
}

Result copyAttributes(int from, int to) {
    struct stat status{};
    OST_TRY(succeeded(::fstat(from, &status)));
    OST_TRY(succeeded(::fchown(to, status.st_uid, status.st_gid)));
    OST_TRY(copyExtendedAttributes(from, to));
    // Behind the owner, whose change clears bits of the mode, and behind the ACL, whose mask the group bits are.
    OST_TRY(succeeded(::fchmod(to, status.st_mode & static_cast<mode_t>(ALLPERMS))));
    const timespec times[] = {status.st_atim, status.st_mtim};
    return succeeded(::futimens(to, times));
}

Result copyFile(int from, const char* name, int to, const char* newName) {
    const FileDescriptor source = OST_TRY(OSTOpenItem(from, name, O_RDONLY, OSTMounts::stayOut));
    struct stat status{};
    OST_TRY(succeeded(::fstat(source.get(), &status)));
    if (!S_ISREG(status.st_mode))
        return std::unexpected(ESTALE); // it has been replaced since it was looked at
    const FileDescriptor copy(::openat(to, newName, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, S_IRUSR));
    if (!copy)
        return std::unexpected(errno);
    OST_TRY(copyData(source.get(), copy.get(), status));
    return copyAttributes(source.get(), copy.get());
}

Result copyLink(int from, const char* name, int to, const char* newName) {
    std::array<char, PATH_MAX> target;
    const ssize_t length = ::readlinkat(from, name, target.data(), target.size());
    if (length < 0)
        return std::unexpected(errno);
    if (static_cast<std::size_t>(length) == target.size())
        return std::unexpected(ENAMETOOLONG);
    target[static_cast<std::size_t>(length)] = '\0';
    return succeeded(::symlinkat(target.data(), to, newName));
}

/// Makes a FIFO, socket or device anew, without opening the one that is there.
Result copySpecial(int to, const char* newName, const struct stat& status) {
    OST_TRY(succeeded(::mknodat(to, newName, status.st_mode, status.st_rdev)));
    return succeeded(::fchmodat(to, newName, status.st_mode & static_cast<mode_t>(ALLPERMS), 0));
}

Result copyOwnerAndTimes(int to, const char* newName, const struct stat& status) {
    OST_TRY(succeeded(::fchownat(to, newName, status.st_uid, status.st_gid, AT_SYMLINK_NOFOLLOW)));
    const timespec times[] = {status.st_atim, status.st_mtim};
    return succeeded(::utimensat(to, newName, times, AT_SYMLINK_NOFOLLOW));
}

/// Copies one item; a directory is only made, without its attributes. Answers whether it is one.
std::expected<bool, platform::Errno> copyItem(int from, const char* name, int to, const char* newName) {
    struct stat status{};
    OST_TRY(succeeded(::fstatat(from, name, &status, AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT)));
    if (S_ISDIR(status.st_mode)) {
        OST_TRY(succeeded(::mkdirat(to, newName, S_IRWXU)));
        return true;
    }
    if (S_ISREG(status.st_mode)) {
        OST_TRY(copyFile(from, name, to, newName));
        return false;
    }
    OST_TRY(S_ISLNK(status.st_mode) ? copyLink(from, name, to, newName) : copySpecial(to, newName, status));
    OST_TRY(copyOwnerAndTimes(to, newName, status));
    return false;
}

} // namespace

Result OSTCopyTree(int from, const char* name, int to, const char* newName) {
    if (!OST_TRY(copyItem(from, name, to, newName)))
        return {};
    OSTTreeCursor source(OST_TRY(OSTOpenSubdirectory(from, name)), {});
    OSTTreeCursor copy(OST_TRY(OSTOpenSubdirectory(to, newName)), {});
    for (;;) {
        if (OST_TRY(source.next())) {
            if (!OST_TRY(copyItem(source.directory(), source.name(), copy.directory(), source.name())))
                continue;
            OST_TRY(copy.enter(source.name()));
            OST_TRY(source.enter());
        } else {
            // Behind its content, which would change its times.
            OST_TRY(copyAttributes(source.directory(), copy.directory()));
            if (source.depth() == 0)
                return {};
            OST_TRY(source.leave());
            OST_TRY(copy.leave());
        }
    }
}

} // namespace ost
