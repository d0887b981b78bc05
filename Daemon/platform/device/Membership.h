#pragma once

#include "platform/base/Errno.h"
#include "platform/base/UUID.h"

#include <sys/types.h>

#include <expected>
#include <optional>
#include <string>
#include <string_view>

namespace ost::platform {

/// The membership service: groups go by UUIDs in extended ACLs. The UUID of a group is derived from its number, so it
/// is the same on every device and at every time.
///
/// Threads: any. Errors: ENOENT when there is no such group, otherwise the errno of reading the group database.

[[nodiscard]] std::expected<UUID, Errno> groupUUIDForName(std::string_view name);
[[nodiscard]] std::expected<std::string, Errno> groupNameForUUID(const UUID& uuid);

/// The number of the group, which need not exist; absent when the UUID is not that of a group.
[[nodiscard]] std::optional<gid_t> groupIdForUUID(const UUID& uuid);

} // namespace ost::platform
