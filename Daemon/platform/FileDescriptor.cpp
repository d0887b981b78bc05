#include "platform/FileDescriptor.h"

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

} // namespace ost::platform
