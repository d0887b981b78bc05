#include "platform/device/AccessControlList.h"

#include "platform/base/Try.h"
#include "platform/device/ExtendedAttributes.h"
#include "platform/device/Membership.h"

#include <sys/stat.h>

#include <algorithm>
#include <array>
#include <bit>
#include <cerrno>
#include <cstring>
#include <map>
#include <span>

namespace ost::platform {

namespace {

constexpr const char* accessAttribute = "system.posix_acl_access";
constexpr const char* defaultAttribute = "system.posix_acl_default";

/// What the kernel reads and writes as the value of both attributes: a version and then entries, little-endian.
static_assert(std::endian::native == std::endian::little);
constexpr std::uint32_t posixVersion = 2;
struct PosixEntry {
    std::uint16_t tag;
    std::uint16_t permissions; ///< 4 read, 2 write, 1 execute
    std::uint32_t id;          ///< of a named user or group
};
using PosixACL = std::vector<PosixEntry>; // in ascending order of tags, as the kernel requires

enum PosixTag : std::uint16_t {
    owner = 0x01,
    namedUser = 0x02,
    owningGroup = 0x04,
    namedGroup = 0x08,
    mask = 0x10,
    other = 0x20
};
constexpr std::uint32_t noId = 0xffffffff;
constexpr std::uint16_t everything = 7;

/// The kernel keeps no larger attribute.
constexpr std::size_t attributeLimit = 65536;
/// Enough for every ACL that the daemon makes; others are read a second time with a buffer of the full size.
constexpr std::size_t usualAttributeSize = 256;

PosixEntry* find(PosixACL& acl, PosixTag tag) {
    const auto found = std::ranges::find(acl, tag, &PosixEntry::tag);
    return found == acl.end() ? nullptr : &*found;
}

std::uint16_t permissionsOf(PosixACL& acl, PosixTag tag) {
    const auto* entry = find(acl, tag);
    return entry ? entry->permissions : std::uint16_t{0};
}

/// The ACL kept in an attribute; empty when there is none, or none possible.
std::expected<PosixACL, Errno> read(int fd, const char* attribute) {
    std::array<std::byte, usualAttributeSize> usual;
    std::vector<std::byte> large;
    std::span<std::byte> buffer(usual);
    auto size = getAttribute(fd, attribute, buffer);
    if (!size && size.error() == ERANGE) {
        large.resize(attributeLimit);
        buffer = large;
        size = getAttribute(fd, attribute, buffer);
    }
    if (!size && (size.error() == ENODATA || size.error() == EOPNOTSUPP))
        return PosixACL();
    if (!size)
        return std::unexpected(size.error());
    if (*size < sizeof posixVersion)
        return std::unexpected(EINVAL);
    PosixACL acl((*size - sizeof posixVersion) / sizeof(PosixEntry));
    std::memcpy(acl.data(), buffer.data() + sizeof posixVersion, acl.size() * sizeof(PosixEntry));
    return acl;
}

std::expected<void, Errno> write(int fd, const char* attribute, const PosixACL& acl) {
    std::vector<std::byte> value(sizeof posixVersion + acl.size() * sizeof(PosixEntry));
    std::memcpy(value.data(), &posixVersion, sizeof posixVersion);
    std::memcpy(value.data() + sizeof posixVersion, acl.data(), acl.size() * sizeof(PosixEntry));
    return setAttribute(fd, attribute, value);
}

std::expected<void, Errno> removeDefaultACL(int fd) {
    const auto removed = removeAttribute(fd, defaultAttribute);
    if (!removed && removed.error() != ENODATA && removed.error() != EOPNOTSUPP)
        return removed;
    return {};
}

/// A symbolic link, which alone does not support it, keeps its mode.
std::expected<void, Errno> changeMode(int fd, mode_t mode) {
    if (::fchmod(fd, mode) == 0 || (errno == EBADF && ::chmod(DescriptorPath(fd).text, mode) == 0) ||
        errno == EOPNOTSUPP)
        return {};
    return std::unexpected(errno);
}

/// The permissions that the mode gives, the owning group's not mistaken for the mask that `stat` shows.
struct OwnPermissions {
    std::uint16_t owner;
    std::uint16_t group;
    std::uint16_t other;
    bool isExtended; ///< the item has an extended ACL now
};

OwnPermissions permissionsOf(mode_t mode) {
    const auto bits = [&](unsigned shift) { return static_cast<std::uint16_t>(mode >> shift & everything); };
    return {.owner = bits(6), .group = bits(3), .other = bits(0), .isExtended = false};
}

std::expected<OwnPermissions, Errno> ownPermissions(int fd, mode_t mode) {
    auto own = permissionsOf(mode);
    auto acl = OST_TRY(read(fd, accessAttribute));
    own.isExtended = !acl.empty();
    if (own.isExtended)
        own.group = permissionsOf(acl, owningGroup);
    return own;
}

/// An ACL with entries for named groups, each of which gets what others get, too.
PosixACL makeACL(const OwnPermissions& own, const std::map<gid_t, std::uint16_t>& groups) {
    PosixACL acl{{owner, own.owner, noId}, {owningGroup, own.group, noId}};
    auto needed = own.group;
    for (const auto& [gid, permissions] : groups) {
        const auto granted = static_cast<std::uint16_t>(permissions | own.other);
        acl.push_back({namedGroup, granted, gid});
        needed = static_cast<std::uint16_t>(needed | granted);
    }
    if (!groups.empty())
        acl.push_back({mask, needed, noId});
    acl.push_back({other, own.other, noId});
    return acl;
}

/// The default ACL of a directory, which gives the groups what is handed down.
std::expected<void, Errno> writeDefault(int fd, const std::map<gid_t, std::uint16_t>& groups) {
    if (groups.empty())
        return removeDefaultACL(fd);
    return write(fd, defaultAttribute,
                 makeACL({.owner = everything, .group = 0, .other = 0, .isExtended = true}, groups));
}

/// To Linux, who may add to a directory may also remove from it, unless it is sticky.
bool addsOnly(std::uint32_t permissions) {
    return (permissions & AccessControlList::writeData) != 0 && (permissions & AccessControlList::deleteChild) == 0;
}

std::expected<void, Errno> setSticky(int fd, mode_t mode, bool sticky) {
    constexpr mode_t settable = 07777;
    const auto wanted = sticky ? mode | S_ISVTX : mode & ~static_cast<mode_t>(S_ISVTX);
    return wanted == mode ? std::expected<void, Errno>() : changeMode(fd, wanted & settable);
}

std::uint16_t posixPermissions(std::uint32_t permissions) {
    return static_cast<std::uint16_t>(((permissions & AccessControlList::readData) != 0 ? 4 : 0) |
                                      ((permissions & AccessControlList::writeData) != 0 ? 2 : 0) |
                                      ((permissions & AccessControlList::execute) != 0 ? 1 : 0));
}

} // namespace

std::expected<void, Errno> AccessControlList::Entry::addPermissions(std::uint32_t permissions) {
    if ((permissions & ~allPermissions) != 0)
        return std::unexpected(EINVAL);
    _permissions |= permissions;
    return {};
}

std::expected<void, Errno> AccessControlList::Entry::addFlags(std::uint32_t flags) {
    if ((flags & ~allFlags) != 0)
        return std::unexpected(EINVAL);
    _flags |= flags;
    return {};
}

std::expected<void, Errno> AccessControlList::Entry::setTag(std::uint32_t tag) {
    if (tag != extendedAllow)
        return std::unexpected(EINVAL);
    _tag = tag;
    return {};
}

std::expected<void, Errno> AccessControlList::Entry::setQualifier(const UUID& group) {
    if (!groupIdForUUID(group))
        return std::unexpected(EINVAL);
    _qualifier = group;
    return {};
}

std::expected<AccessControlList, Errno> AccessControlList::create(std::size_t entries) {
    if (entries > maximumEntries)
        return std::unexpected(EINVAL);
    AccessControlList acl;
    acl._entries.reserve(entries);
    return acl;
}

std::expected<AccessControlList::Entry*, Errno> AccessControlList::createEntry() {
    if (_entries.size() == maximumEntries)
        return std::unexpected(ENOMEM);
    return &_entries.emplace_back();
}

AccessControlList::Grants AccessControlList::_grants() const {
    Grants grants;
    const auto add = [](auto& groups, const Entry& entry) {
        auto& permissions = groups[groupIdForUUID(entry._qualifier).value()];
        permissions = static_cast<std::uint16_t>(permissions | posixPermissions(entry._permissions));
    };
    for (const auto& entry : _entries) {
        if (entry._grants() && (entry._flags & onlyInherit) == 0) {
            add(grants.governing, entry);
            grants.sticky |= addsOnly(entry._permissions);
        }
        if (entry._grants() && (entry._flags & (fileInherit | directoryInherit)) != 0)
            add(grants.handedDown, entry);
    }
    return grants;
}

std::expected<void, Errno> AccessControlList::apply(int fd) const {
    struct stat status{};
    if (::fstat(fd, &status) != 0)
        return std::unexpected(errno);
    if (S_ISLNK(status.st_mode))
        return {};
    const auto grants = _grants();
    if (S_ISDIR(status.st_mode))
        OST_TRY(setSticky(fd, status.st_mode, grants.sticky));
    const auto own = OST_TRY(ownPermissions(fd, status.st_mode));
    if (own.isExtended || !grants.governing.empty())
        OST_TRY(write(fd, accessAttribute, makeACL(own, grants.governing)));
    return S_ISDIR(status.st_mode) ? writeDefault(fd, grants.handedDown) : std::expected<void, Errno>();
}

std::expected<void, Errno> AccessControlList::applyWithMode(int fd, mode_t itemMode, mode_t mode) const {
    if (S_ISLNK(itemMode))
        return {};
    const auto grants = _grants();
    constexpr mode_t special = S_ISUID | S_ISGID | S_ISVTX; // which an ACL leaves as they are
    const mode_t sticky = S_ISDIR(itemMode) && grants.sticky ? S_ISVTX : 0;
    if ((itemMode & special) != sticky)
        OST_TRY(changeMode(fd, mode | sticky));
    OST_TRY(write(fd, accessAttribute, makeACL(permissionsOf(mode), grants.governing)));
    return S_ISDIR(itemMode) ? writeDefault(fd, grants.handedDown) : std::expected<void, Errno>();
}

std::expected<void, Errno> setModeKeepingMask(int fd, mode_t mode) {
    auto acl = OST_TRY(read(fd, accessAttribute));
    auto* group = find(acl, owningGroup);
    const auto* maskEntry = find(acl, mask);
    constexpr mode_t groupBits = 070;
    // To an item with an extended ACL, the group bits of a mode are the mask.
    const auto shownMode = maskEntry ? (mode & ~groupBits) | static_cast<mode_t>(maskEntry->permissions) << 3 : mode;
    OST_TRY(changeMode(fd, shownMode));
    const auto groupPermissions = static_cast<std::uint16_t>((mode & groupBits) >> 3);
    if (!maskEntry || group->permissions == groupPermissions)
        return {};
    group->permissions = groupPermissions;
    find(acl, owner)->permissions = static_cast<std::uint16_t>(mode >> 6 & everything);
    find(acl, other)->permissions = static_cast<std::uint16_t>(mode & everything);
    return write(fd, accessAttribute, acl);
}

std::expected<bool, Errno> applyInheritedEntries(int parentFd, int childFd) {
    auto acl = OST_TRY(read(parentFd, defaultAttribute));
    if (acl.empty())
        return false;
    struct stat status{};
    if (::fstat(childFd, &status) != 0)
        return std::unexpected(errno);
    const auto own = OST_TRY(ownPermissions(childFd, status.st_mode));
    find(acl, owner)->permissions = own.owner;
    find(acl, owningGroup)->permissions = own.group;
    find(acl, other)->permissions = own.other;
    OST_TRY(write(childFd, accessAttribute, acl));
    return true;
}

} // namespace ost::platform
