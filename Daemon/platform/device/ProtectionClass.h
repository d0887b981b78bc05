#pragma once

#include "platform/base/Errno.h"

#include <cstdint>
#include <expected>

namespace ost::platform {

/// The data-protection class of a regular file or directory, kept in an extended attribute that only root can write.
/// Classes 1, 2 and 3 need keys that a locked device does not have.
///
/// Threads: any.

/// What a file or directory counts as when neither it nor its parent has been given a class.
inline constexpr std::int32_t defaultFileProtectionClass = 3;
inline constexpr std::int32_t defaultDirectoryProtectionClass = 0;

/// The class of the item behind `fd`: its recorded one; else, for a directory, 0; else the recorded class of the parent
/// directory behind `parentFd` when that is 1 to 4; else 3. `parentFd` may have been opened with O_PATH, or be -1 where
/// it is known that the item is a directory. Fails with EBADF when the item cannot carry a class.
[[nodiscard]] std::expected<std::int32_t, Errno> protectionClass(int fd, int parentFd);

/// Records a class. While the device is locked, fails with EPERM when the new or the recorded class is 1, 2 or 3; fails
/// with EBADF when the item cannot carry a class, else with the errno of writing.
[[nodiscard]] std::expected<void, Errno> setProtectionClass(int fd, std::int32_t protectionClass);

} // namespace ost::platform
