#pragma once

#include "platform/base/Errno.h"

#include <sys/types.h>

#include <cstdint>
#include <expected>
#include <string>

namespace ost::platform {

/// What the kernel says about the mount that an open file lies on.
struct Mount {
    std::string fileSystem; ///< its type, such as "ext4" or "fuse.sshfs"
    bool forbidsSetUserId = false;
};

/// Finds a mount in the mount table of a process, whose directory in /proc is open as `process`. No file system is
/// asked, so that none can keep its caller waiting. The table shows what that process can reach; where the mount itself
/// is not in it, another one of the same `device` stands for it. Fails with ENOENT when there is neither, with EFBIG
/// when the table is too long to be searched for a client, or with the errno of reading it.
[[nodiscard]] std::expected<Mount, Errno> findMount(int process, std::uint64_t mountId, dev_t device);

} // namespace ost::platform
