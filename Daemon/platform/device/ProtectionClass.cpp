#include "platform/device/ProtectionClass.h"

#include "platform/base/Try.h"
#include "platform/device/DeviceLockState.h"
#include "platform/device/ExtendedAttributes.h"

#include <sys/stat.h>
#include <sys/xattr.h>

#include <array>
#include <cerrno>
#include <charconv>
#include <optional>
#include <span>

namespace ost::platform {

namespace {

constexpr const char* classAttribute = "trusted.ostrand.protection-class";
constexpr std::size_t classTextLimit = 11; // "-2147483648"

bool needsKeys(std::int32_t protectionClass) { return protectionClass >= 1 && protectionClass <= 3; }

int errorOfAttribute(int error) { return error == EOPNOTSUPP ? EBADF : error; }

/// Absent when none is recorded, or nothing that could be one.
std::expected<std::optional<std::int32_t>, Errno> recordedClass(int fd) {
    std::array<char, classTextLimit> text;
    const auto size = getAttribute(fd, classAttribute, std::as_writable_bytes(std::span(text)));
    if (!size && (size.error() == ENODATA || size.error() == ERANGE))
        return std::nullopt;
    if (!size)
        return std::unexpected(errorOfAttribute(size.error()));
    std::int32_t number = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + *size, number);
    if (error != std::errc{} || end != text.data() + *size)
        return std::nullopt;
    return number;
}

std::expected<void, Errno> recordClass(int fd, std::int32_t protectionClass, int flags) {
    std::array<char, classTextLimit> text;
    const auto end = std::to_chars(text.data(), text.data() + text.size(), protectionClass).ptr;
    return setAttribute(fd, classAttribute, std::as_bytes(std::span(text.data(), end)), flags);
}

} // namespace

std::expected<std::int32_t, Errno> protectionClass(int fd, int parentFd) {
    if (const auto recorded = OST_TRY(recordedClass(fd)))
        return *recorded;
    struct stat status{};
    if (::fstat(fd, &status) != 0)
        return std::unexpected(errno);
    if (S_ISDIR(status.st_mode))
        return defaultDirectoryProtectionClass;
    const auto ofParent = recordedClass(parentFd);
    if (ofParent && *ofParent && **ofParent >= 1 && **ofParent <= 4)
        return **ofParent;
    return defaultFileProtectionClass;
}

std::expected<void, Errno> setProtectionClass(int fd, std::int32_t protectionClass) {
    // The common case is one call: an item without a recorded class may always be given one that needs no keys.
    if (!needsKeys(protectionClass)) {
        const auto recorded = recordClass(fd, protectionClass, XATTR_CREATE);
        if (recorded)
            return {};
        if (recorded.error() != EEXIST)
            return std::unexpected(errorOfAttribute(recorded.error()));
    }
    if (OST_TRY(deviceLockState()) == deviceLocked &&
        (needsKeys(protectionClass) || needsKeys(OST_TRY(recordedClass(fd)).value_or(defaultDirectoryProtectionClass))))
        return std::unexpected(EPERM);
    const auto recorded = recordClass(fd, protectionClass, 0);
    if (!recorded)
        return std::unexpected(errorOfAttribute(recorded.error()));
    return {};
}

} // namespace ost::platform
