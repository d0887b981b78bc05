#pragma once

#include "platform/base/Errno.h"
#include "platform/threads/BlockingSection.h"

#include <cerrno>
#include <expected>

namespace ost {

/// Waits for the disk with `synchronise`: `fsync`, `fdatasync` or `syncfs`. Other connections are served meanwhile.
/// Fails with its errno.
[[nodiscard]] inline std::expected<void, platform::Errno> OSTWaitForDisk(int fd, int (*synchronise)(int)) {
    const platform::BlockingSection blocking;
    if (synchronise(fd) != 0)
        return std::unexpected(errno);
    return {};
}

} // namespace ost
