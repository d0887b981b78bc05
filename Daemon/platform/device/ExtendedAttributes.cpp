#include "platform/device/ExtendedAttributes.h"

#include <sys/xattr.h>

#include <cerrno>
#include <cstdio>

namespace ost::platform {

namespace {

/// The calls on descriptors refuse those opened with O_PATH; the same call on the descriptor's path does not.
template<typename OnDescriptor, typename OnPath>
std::expected<std::size_t, Errno> call(int fd, OnDescriptor onDescriptor, OnPath onPath) {
    auto result = onDescriptor(fd);
    if (result < 0 && errno == EBADF)
        result = onPath(DescriptorPath(fd).text);
    if (result < 0)
        return std::unexpected(errno);
    return static_cast<std::size_t>(result);
}

std::expected<void, Errno> withoutValue(const std::expected<std::size_t, Errno>& result) {
    if (!result)
        return std::unexpected(result.error());
    return {};
}

} // namespace

DescriptorPath::DescriptorPath(int fd) noexcept { std::snprintf(text, sizeof text, "/proc/self/fd/%d", fd); }

std::expected<std::size_t, Errno> getAttribute(int fd, const char* name, std::span<std::byte> value) {
    return call(
        fd, [&](int item) { return ::fgetxattr(item, name, value.data(), value.size()); },
        [&](const char* item) { return ::getxattr(item, name, value.data(), value.size()); });
}

std::expected<void, Errno> setAttribute(int fd, const char* name, std::span<const std::byte> value, int flags) {
    return withoutValue(call(
        fd, [&](int item) { return ::fsetxattr(item, name, value.data(), value.size(), flags); },
        [&](const char* item) { return ::setxattr(item, name, value.data(), value.size(), flags); }));
}

std::expected<void, Errno> removeAttribute(int fd, const char* name) {
    return withoutValue(call(
        fd, [&](int item) { return ::fremovexattr(item, name); },
        [&](const char* item) { return ::removexattr(item, name); }));
}

} // namespace ost::platform
