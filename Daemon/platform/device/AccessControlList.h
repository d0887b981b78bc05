#pragma once

#include "platform/base/Errno.h"
#include "platform/base/UUID.h"

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <expected>
#include <map>
#include <vector>

namespace ost::platform {

/// An extended access-control list: entries that grant groups the permissions of the platform's ACL model. It lives in
/// memory until it is applied to an item, as the nearest thing Linux enforces: a POSIX.1e ACL.
///
/// A list is a value; one object belongs to one thread at a time.
class AccessControlList {
public:
    /// Permission bits. Of these Linux tells apart reading, writing and searching.
    static constexpr std::uint32_t readData = 0x2;
    static constexpr std::uint32_t writeData = 0x4; ///< of a directory: add file
    static constexpr std::uint32_t execute = 0x8;   ///< of a directory: search
    static constexpr std::uint32_t deleteChild = 0x40;
    static constexpr std::uint32_t allPermissions = 0x3ffe;

    /// Flag bits.
    static constexpr std::uint32_t inherited = 0x10;
    static constexpr std::uint32_t fileInherit = 0x20;
    static constexpr std::uint32_t directoryInherit = 0x40;
    static constexpr std::uint32_t limitInherit = 0x80;
    static constexpr std::uint32_t onlyInherit = 0x100;
    static constexpr std::uint32_t allFlags = 0x1f0;

    /// The one tag that can be enforced.
    static constexpr std::uint32_t extendedAllow = 1;

    /// More entries than this a list does not take, as on the platform.
    static constexpr std::size_t maximumEntries = 128;

    /// One entry. It grants nothing until it has a tag and a qualifier. The setters fail with EINVAL for bits, tags or
    /// qualifiers that the model does not have.
    class Entry {
    public:
        std::expected<void, Errno> addPermissions(std::uint32_t permissions);
        std::expected<void, Errno> addFlags(std::uint32_t flags);
        std::expected<void, Errno> setTag(std::uint32_t tag);
        /// `group` is a group's UUID of the membership service.
        std::expected<void, Errno> setQualifier(const UUID& group);

        [[nodiscard]] std::uint32_t permissions() const { return _permissions; }
        [[nodiscard]] std::uint32_t flags() const { return _flags; }
        [[nodiscard]] std::uint32_t tag() const { return _tag; }
        [[nodiscard]] const UUID& qualifier() const { return _qualifier; }

    private:
        friend class AccessControlList;
        [[nodiscard]] bool _grants() const { return _tag == extendedAllow && _qualifier != UUID(); }

        std::uint32_t _permissions = 0;
        std::uint32_t _flags = 0;
        std::uint32_t _tag = 0;
        UUID _qualifier;
    };

    /// An empty list with room for `entries` entries; it takes more of them, too. EINVAL for more than it can ever
    /// take.
    [[nodiscard]] static std::expected<AccessControlList, Errno> create(std::size_t entries);

    /// Appends an empty entry, which stays where it is until the next one is created. ENOMEM when the list is full.
    [[nodiscard]] std::expected<Entry*, Errno> createEntry();

    [[nodiscard]] const std::vector<Entry>& entries() const { return _entries; }

    /// Replaces the extended ACL of the item behind `fd`, which may have been opened with O_PATH.
    ///
    /// Entries that govern the item become named groups of its access ACL, beside its own mode bits; those to be
    /// inherited become named groups of a directory's default ACL. A named group is never granted less than others,
    /// because it does not fall back to them. A directory that an entry governs with add file and without delete child
    /// becomes sticky, so that who may add items removes and renames none but his own; any other one is not. In the
    /// default ACL the owner has everything, so that a service keeps access to what it makes itself, and the owning
    /// group and others have nothing, so that nobody else gets any. A symbolic link is left alone: on Linux its
    /// permissions are never looked at. Fails with the errno of reading or writing the ACL.
    [[nodiscard]] std::expected<void, Errno> apply(int fd) const;

    /// The same, and gives the item the permissions of `mode`, without looking at it: its own mode is `itemMode`.
    [[nodiscard]] std::expected<void, Errno> applyWithMode(int fd, mode_t itemMode, mode_t mode) const;

private:
    /// What groups get.
    struct Grants {
        std::map<gid_t, std::uint16_t> governing;
        std::map<gid_t, std::uint16_t> handedDown;
        bool sticky = false;
    };

    AccessControlList() = default;
    [[nodiscard]] Grants _grants() const;

    std::vector<Entry> _entries;
};

/// Sets the mode of the item behind `fd`, which may have been opened with O_PATH. When the item has an extended ACL,
/// the bits of the group go to the owning group and the mask stays, so that no entry loses or gains anything. A
/// symbolic link, which has no mode of its own on Linux, is left alone. Fails with the errno of changing the mode.
[[nodiscard]] std::expected<void, Errno> setModeKeepingMask(int fd, mode_t mode);

/// Gives the directory just made behind `childFd` what it inherits from the directory behind `parentFd`, without the
/// mode it was made with masking it. The rest of its mode stays. True when there was something to inherit. Both may
/// have been opened with O_PATH. Fails with the errno of reading or writing an ACL.
[[nodiscard]] std::expected<bool, Errno> applyInheritedEntries(int parentFd, int childFd);

} // namespace ost::platform
