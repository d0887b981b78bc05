#include "platform/device/Membership.h"

#include "platform/base/Try.h"
#include "platform/device/Accounts.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdint>

namespace ost::platform {

namespace {

/// What the UUIDs of all groups begin with ("ostrand-" as a custom UUID, version 8); the group's number follows, most
/// significant byte first.
constexpr std::array<std::uint8_t, 12> groupPrefix{0x6F, 0x73, 0x74, 0x72, 0x61, 0x6E,
                                                   0x84, 0x67, 0x9F, 0x72, 0x70, 0x00};

UUID uuidForGroup(gid_t gid) {
    UUID::Bytes bytes{};
    auto next = std::ranges::copy(groupPrefix, bytes.begin()).out;
    for (int shift = 24; shift >= 0; shift -= 8)
        *next++ = static_cast<std::uint8_t>(gid >> shift);
    return UUID(bytes);
}

} // namespace

std::expected<UUID, Errno> groupUUIDForName(std::string_view name) { return uuidForGroup(OST_TRY(groupForName(name))); }

std::expected<std::string, Errno> groupNameForUUID(const UUID& uuid) {
    const auto gid = groupIdForUUID(uuid);
    if (!gid)
        return std::unexpected(ENOENT);
    return groupForId(*gid);
}

std::optional<gid_t> groupIdForUUID(const UUID& uuid) {
    const auto& bytes = uuid.bytes();
    if (!std::equal(groupPrefix.begin(), groupPrefix.end(), bytes.begin()))
        return std::nullopt;
    gid_t gid = 0;
    for (auto index = groupPrefix.size(); index < bytes.size(); ++index)
        gid = gid << 8 | bytes[index];
    return gid;
}

} // namespace ost::platform
