#include "platform/base/SmallFile.h"

#include "platform/base/FileDescriptor.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

namespace ost::platform {

std::expected<std::string, Errno> readSmallFile(int base, const char* path, std::size_t limit, FinalLink finalLink) {
    const int noFollow = finalLink == FinalLink::refuse ? O_NOFOLLOW : 0;
    const FileDescriptor file(::openat(base, path, O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY | noFollow));
    struct stat status{};
    if (!file || ::fstat(file.get(), &status) != 0)
        return std::unexpected(errno);
    if (!S_ISREG(status.st_mode))
        return std::unexpected(EINVAL);
    if (static_cast<std::size_t>(status.st_size) > limit)
        return std::unexpected(EFBIG);

    // One byte more than there should be tells a file that grew; a short read is the end.
    std::string content(static_cast<std::size_t>(status.st_size) + 1, '\0');
    const auto count = ::pread(file.get(), content.data(), content.size(), 0);
    if (count < 0)
        return std::unexpected(errno);
    content.resize(std::min(static_cast<std::size_t>(count), limit));
    return content;
}

std::expected<std::string, Errno> readSmallFile(const char* path, std::size_t limit, FinalLink finalLink) {
    return readSmallFile(AT_FDCWD, path, limit, finalLink);
}

std::expected<void, Errno> writeAll(int file, std::string_view bytes) {
    while (!bytes.empty()) {
        const ssize_t count = ::write(file, bytes.data(), bytes.size());
        if (count < 0 && errno != EINTR)
            return std::unexpected(errno);
        if (count > 0)
            bytes.remove_prefix(static_cast<std::size_t>(count));
    }
    return {};
}

} // namespace ost::platform
