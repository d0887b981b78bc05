#pragma once

#include "platform/base/Errno.h"

#include <expected>

namespace ost {

/// Copies the item `name` of the directory `from`, with everything below it, to the item `newName` of the directory
/// `to`, which must not exist: data with its holes, mode, owner, times, extended attributes and ACLs. Links are copied
/// as links; further names of one file become files of their own. Fails with EXDEV at a mount point in the source.
///
/// Requires that nobody else gets into `to` until the copy is done. After a failure a part of it is there.
[[nodiscard]] std::expected<void, platform::Errno> OSTCopyTree(int from, const char* name, int to, const char* newName);

} // namespace ost
