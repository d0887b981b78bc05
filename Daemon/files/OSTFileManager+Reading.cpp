#include "files/OSTFileManager.h"

#include "files/OSTPathResolution.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

namespace ost {

namespace {

/// Reads up to `size` bytes to the end of `buffer`, which has that much room, or to the end of the file.
std::expected<std::size_t, platform::Errno> readFully(int file, char* buffer, std::size_t size) {
    std::size_t filled = 0;
    while (filled < size) {
        const ssize_t count = ::read(file, buffer + filled, size - filled);
        if (count < 0 && errno != EINTR)
            return std::unexpected(errno);
        if (count == 0)
            break;
        filled += static_cast<std::size_t>(std::max<ssize_t>(count, 0));
    }
    return filled;
}

} // namespace

std::expected<void, platform::Errno> OSTFileManager::readFile(int directory, std::string_view relativePath,
                                                              std::size_t maximumSize, std::string& buffer) const {
    const auto file = OST_TRY(OSTOpenItem(directory, relativePath, O_RDONLY));
    struct stat status{};
    if (::fstat(file.get(), &status) != 0)
        return std::unexpected(errno);
    if (!S_ISREG(status.st_mode))
        return std::unexpected(S_ISDIR(status.st_mode) ? EISDIR : EINVAL);
    const auto size = static_cast<std::size_t>(status.st_size);
    if (size > maximumSize)
        return std::unexpected(EFBIG);

    // What is appended meanwhile is left for the next reader: files that matter here are replaced, never extended.
    platform::Errno error = 0;
    buffer.resize_and_overwrite(size, [&](char* bytes, std::size_t room) {
        const auto filled = readFully(file.get(), bytes, room);
        error = filled ? platform::Errno(0) : filled.error();
        return filled.value_or(0);
    });
    if (error != 0)
        return std::unexpected(error);
    return {};
}

OSTResult<std::string> OSTFileManager::readFileAtURL(std::string_view path, std::size_t maximumSize) const {
    std::string bytes;
    if (const auto read = readFile(AT_FDCWD, path, maximumSize, bytes); !read)
        return std::unexpected(OSTCreatePOSIXError(read.error(), "read of %@ failed: %s", path, read.error()));
    return bytes;
}

} // namespace ost
