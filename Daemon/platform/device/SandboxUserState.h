#pragma once

#include "platform/base/Errno.h"

#include <cstdint>
#include <expected>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

namespace ost::platform {

/// Where the sandbox finds a user's state items: one symbolic link for each, USER/TYPE/NAME, pointing at the item's
/// path.
inline constexpr const char* sandboxStateDirectory = "/private/var/db/sandbox-state";

/// Sets the state item `key` of a user and type to `path`, in one rename, or removes it when there is none; removing an
/// item that is absent succeeds. An item that was set has reached the disk. NAME is the key as `fileNameForKey` writes
/// it. Fails with an errno: ENAMETOOLONG when the key is too long for a file name.
///
/// Threads: any, but not two at a time for one item.
[[nodiscard]] std::expected<void, Errno> setSandboxUserStateItem(std::uint32_t userId, std::uint64_t type,
                                                                 std::string_view key,
                                                                 std::optional<std::string_view> path);

/// Notes on a container, whose directory is open, that it has an item of the user and type from now on, or is about to
/// get one. The note is an extended attribute that goes with the directory and that only root can write.
[[nodiscard]] std::expected<void, Errno> noteSandboxUserStateItem(std::uint32_t userId, std::uint64_t type,
                                                                  int container);
[[nodiscard]] bool hasNoteOfSandboxUserStateItem(int container);

/// The keys of a user's items of one type; none at all when no container was ever noted for them, or when they cannot
/// be listed.
[[nodiscard]] std::optional<std::set<std::string>> keysOfSandboxUserStateItems(std::uint32_t userId,
                                                                               std::uint64_t type);

/// An item as its link has it.
struct SandboxUserStateItem {
    std::uint32_t userId;
    std::uint64_t type;
    std::string key;
    std::string path;
};

/// Removes what a crash left of items that were being set. Nobody may be setting one.
void removeUnfinishedSandboxUserStateItems();

/// The items at whose path nothing is. What cannot be looked at is passed over.
[[nodiscard]] std::vector<SandboxUserStateItem> danglingSandboxUserStateItems();

} // namespace ost::platform
