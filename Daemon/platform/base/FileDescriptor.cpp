#include "platform/base/FileDescriptor.h"

#include <fcntl.h>
#include <linux/openat2.h>
#include <sys/syscall.h>

#include <cerrno>

namespace ost::platform {

void FileDescriptor::reset(int fd) noexcept {
    if (_fd >= 0) {
        // A failed operation closes its descriptors on the way out, and its errno is still to be reported.
        const int saved = errno;
        ::close(_fd);
        errno = saved;
    }
    _fd = fd;
}

void openMissingStandardFiles() {
    int file = 0;
    do
        file = ::open("/dev/null", O_RDWR);
    while (file >= 0 && file <= STDERR_FILENO);
    ::close(file);
}

std::expected<FileDescriptor, Errno> openWithoutLinks(int base, const char* path, int flags, std::uint64_t resolve) {
    open_how how{};
    how.flags = static_cast<std::uint32_t>(flags | O_NOFOLLOW | O_CLOEXEC);
    how.resolve = RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS | resolve;
    const long fd = ::syscall(SYS_openat2, base, path, &how, sizeof how);
    if (fd < 0)
        return std::unexpected(errno);
    return FileDescriptor(static_cast<int>(fd));
}

} // namespace ost::platform
