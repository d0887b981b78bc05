#pragma once

#include "platform/base/Errno.h"

#include <cstddef>
#include <expected>
#include <span>

namespace ost::platform {

/// Extended attributes of the item behind a descriptor, which may have been opened with O_PATH. Errors are those of the
/// system calls.

/// Reads an attribute into `value` and returns its size; ERANGE when it is larger.
[[nodiscard]] std::expected<std::size_t, Errno> getAttribute(int fd, const char* name, std::span<std::byte> value);

/// `flags` are those of setxattr(2).
[[nodiscard]] std::expected<void, Errno> setAttribute(int fd, const char* name, std::span<const std::byte> value,
                                                      int flags = 0);

[[nodiscard]] std::expected<void, Errno> removeAttribute(int fd, const char* name);

/// The path of the item behind a descriptor, for the calls that take none opened with O_PATH. Nothing is followed
/// behind it, be the item a symbolic link itself. At most `descriptorPathSize` bytes.
inline constexpr std::size_t descriptorPathSize = sizeof "/proc/self/fd/-2147483648";
struct DescriptorPath {
    explicit DescriptorPath(int fd) noexcept;
    char text[descriptorPathSize];
};

} // namespace ost::platform
