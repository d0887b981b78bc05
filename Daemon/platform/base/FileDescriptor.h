#pragma once

#include "platform/base/Errno.h"

#include <unistd.h>

#include <cstdint>
#include <expected>
#include <utility>

namespace ost::platform {

/// Owns one open descriptor and closes it. Move-only; an empty one holds -1. Not thread-safe, like the int it wraps.
class FileDescriptor {
public:
    FileDescriptor() noexcept = default;
    explicit FileDescriptor(int fd) noexcept : _fd(fd) {}
    FileDescriptor(FileDescriptor&& other) noexcept : _fd(std::exchange(other._fd, -1)) {}
    FileDescriptor& operator=(FileDescriptor&& other) noexcept {
        if (this != &other)
            reset(std::exchange(other._fd, -1));
        return *this;
    }
    FileDescriptor(const FileDescriptor&) = delete;
    FileDescriptor& operator=(const FileDescriptor&) = delete;
    ~FileDescriptor() { reset(); }

    [[nodiscard]] int get() const noexcept { return _fd; }
    [[nodiscard]] explicit operator bool() const noexcept { return _fd >= 0; }

    /// Gives the descriptor up without closing it.
    [[nodiscard]] int release() noexcept { return std::exchange(_fd, -1); }

    /// Closes the held descriptor, keeping errno, and takes `fd` instead.
    void reset(int fd = -1) noexcept;

private:
    int _fd = -1;
};

/// Keeps the descriptors 0 to 2 from becoming something else in a process that was started without them.
void openMissingStandardFiles();

/// Opens `path`, relative to the directory `base` or absolute, and follows no symbolic link, neither on the way (ELOOP)
/// nor at its end. Close-on-exec. `resolve` adds further RESOLVE_ flags of openat2.
[[nodiscard]] std::expected<FileDescriptor, Errno> openWithoutLinks(int base, const char* path, int flags,
                                                                    std::uint64_t resolve = 0);

} // namespace ost::platform
