#include "files/OSTFileManager.h"

#include "files/OSTOwnFiles.h"
#include "files/OSTPathResolution.h"
#include "platform/base/Log.h"
#include "platform/base/Path.h"
#include "platform/device/AccessControlList.h"
#include "platform/device/Membership.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <vector>

namespace ost {

using platform::AccessControlList;
using platform::FileDescriptor;

namespace {

/// The group that all system services belong to.
constexpr std::string_view systemGroup = "systemusers";

constexpr std::uint32_t allPermissions = 0x3ffe;
constexpr std::uint32_t allButDeleteChild = 0x3fbe;
constexpr std::uint32_t addToDirectory = 0x624; ///< add file and sub-directory, read and write extended attributes
constexpr std::uint32_t toNewItems = AccessControlList::fileInherit | AccessControlList::directoryInherit;

/// User and group of what lies below the top of a system container, -2.
constexpr std::uint32_t nobody = 4294967294;

constexpr mode_t executeBits = S_IXUSR | S_IXGRP | S_IXOTH;

OSTResult<void> createSystemUserACEInACL(AccessControlList& acl, std::uint32_t permissions, std::uint32_t flags) {
    const auto entry = acl.createEntry();
    if (!entry)
        return std::unexpected(
            OSTCreateError(OSTErrorCode::accessControlListFailed, "acl_create_entry() failed: %s", entry.error()));
    const auto group = platform::groupUUIDForName(systemGroup);
    if (!group)
        return std::unexpected(
            OSTCreateError(OSTErrorCode::accessControlListFailed, "groupuuid_resolve() failed: %s", group.error()));
    if (const auto added = (*entry)->addPermissions(permissions); !added)
        return std::unexpected(OSTCreateError(OSTErrorCode::accessControlListFailed,
                                              "acl_add_perm() failed to set perms %x: %s", permissions, added.error()));
    if (const auto added = (*entry)->addFlags(flags); !added)
        return std::unexpected(OSTCreateError(OSTErrorCode::accessControlListFailed,
                                              "acl_add_flag_np() failed to set flags %x: %s", flags, added.error()));
    if (const auto set = (*entry)->setTag(AccessControlList::extendedAllow); !set)
        return std::unexpected(
            OSTCreateError(OSTErrorCode::accessControlListFailed, "acl_set_tag_type() failed: %s", set.error()));
    if (const auto set = (*entry)->setQualifier(*group); !set)
        return std::unexpected(
            OSTCreateError(OSTErrorCode::accessControlListFailed, "acl_set_qualifier() failed: %s", set.error()));
    return {};
}

enum class ItemKind : std::uint8_t { file, directory, topDirectory };

/// An ACL with room for `count` entries that holds the one for items of the kind. To the top directory itself that
/// entry gives nothing.
OSTResult<AccessControlList> copySystemContainerACLWithNumACEs(std::size_t count, ItemKind kind) {
    auto acl = AccessControlList::create(count);
    if (!acl)
        return std::unexpected(
            OSTCreateError(OSTErrorCode::accessControlListFailed, "acl_init() failed: %s", acl.error()));
    if (kind == ItemKind::file)
        OST_TRY(createSystemUserACEInACL(*acl, allButDeleteChild, AccessControlList::inherited));
    else if (kind == ItemKind::directory)
        OST_TRY(createSystemUserACEInACL(*acl, allPermissions, toNewItems));
    else
        OST_TRY(createSystemUserACEInACL(*acl, allPermissions, toNewItems | AccessControlList::onlyInherit));
    return *std::move(acl);
}

OSTResult<AccessControlList> copyTopLevelSystemContainerACL() {
    auto acl = OST_TRY(copySystemContainerACLWithNumACEs(2, ItemKind::topDirectory));
    OST_TRY(createSystemUserACEInACL(acl, addToDirectory, 0));
    return acl;
}

bool isMetadataFile(std::string_view path) { return path.contains(OSTMetadataFileName); }

/// An item of a walk, held so that what was looked at is what is changed.
struct HeldItem {
    FileDescriptor descriptor; // O_PATH
    struct stat status;

    static std::expected<HeldItem, platform::Errno> open(int directory, std::string_view path) {
        HeldItem item{.descriptor = OST_TRY(OSTOpenItem(directory, path, O_PATH)), .status = {}};
        if (::fstat(item.descriptor.get(), &item.status) != 0)
            return std::unexpected(errno);
        return item;
    }
};

std::expected<void, platform::Errno> changeOwner(const HeldItem& item, std::uint32_t userId, std::uint32_t groupId) {
    if (::fchownat(item.descriptor.get(), "", userId, groupId, AT_EMPTY_PATH) != 0)
        return std::unexpected(errno);
    return {};
}

void logChown(const std::string& path, platform::Errno error) {
    platform::logError("Could not chown %s: %s", path, error);
}

void logChmod(const std::string& path, platform::Errno error) {
    platform::logError("Could not chmod %s: %s", path, error);
}

void logForeignFiles(const OSTOwnFiles& ownFiles) {
    for (const auto& path : ownFiles.others())
        logChown(path, EMLINK);
}

/// The three ACLs of a system container and how its items get them.
struct SystemContainerStandard {
    AccessControlList topDirectory;
    AccessControlList directory;
    AccessControlList file;

    void applyToTop(const HeldItem& item, const std::string& path) const {
        if (!S_ISDIR(item.status.st_mode))
            return _apply(file, item, path);
        if (const auto applied = topDirectory.apply(item.descriptor.get()); !applied)
            platform::logError("Failed to set top level ACL on dir %s: %s", path, applied.error());
    }

    void applyBelowTop(const HeldItem& item, const std::string& path) const {
        _apply(S_ISDIR(item.status.st_mode) ? directory : file, item, path);
        if (const auto changed = platform::setModeKeepingMask(item.descriptor.get(), 0); !changed)
            logChmod(path, changed.error());
        if (const auto changed = changeOwner(item, nobody, nobody); !changed)
            logChown(path, changed.error());
    }

private:
    static void _apply(const AccessControlList& acl, const HeldItem& item, const std::string& path) {
        if (const auto applied = acl.apply(item.descriptor.get()); !applied)
            platform::logError("Failed to set ACL on dir %s: %s", path, applied.error());
    }
};

void applyStandardOwnership(const HeldItem& item, const std::string& path, std::uint32_t userId,
                            std::uint32_t groupId) {
    const auto& status = item.status;
    if (status.st_uid != userId || status.st_gid != groupId)
        if (const auto changed = changeOwner(item, userId, groupId); !changed)
            logChown(path, changed.error());
    const mode_t mode = S_ISDIR(status.st_mode) || (status.st_mode & executeBits) != 0 ? 0755 : 0644;
    if (const auto changed = platform::setModeKeepingMask(item.descriptor.get(), mode); !changed)
        logChmod(path, changed.error());
}

/// What a walk calls to have `change` applied to each item once.
auto changingItems(OSTOwnFiles& ownFiles, auto change) {
    return [&ownFiles, change](const OSTTreeEntry& entry) -> OSTResult<void> {
        if (entry.visit == OSTTreeEntry::Visit::directoryAfter || isMetadataFile(entry.path))
            return {};
        const auto item = HeldItem::open(entry.directory, entry.name);
        if (!item)
            logChown(entry.path, item.error());
        else if (ownFiles.contains(item->status, entry.path))
            change(*item, entry.path);
        return {};
    };
}

} // namespace

OSTResult<void> OSTFileManager::setTopLevelSystemContainerACLAtURL(std::string_view path) const {
    const auto acl = OST_TRY(copyTopLevelSystemContainerACL());
    const auto directory = OSTOpenItem(AT_FDCWD, path, O_PATH | O_DIRECTORY);
    const auto applied = directory ? acl.apply(directory->get()) : std::unexpected(directory.error());
    if (!applied)
        return std::unexpected(OSTCreateError(OSTErrorCode::accessControlListFailed, "Failed to set ACL on %@: %s",
                                              path, applied.error()));
    return {};
}

OSTResult<void> OSTFileManager::standardizeACLsForSystemContainerAtURL(std::string_view path) const {
    const SystemContainerStandard standard{.topDirectory = OST_TRY(copyTopLevelSystemContainerACL()),
                                           .directory =
                                               OST_TRY(copySystemContainerACLWithNumACEs(1, ItemKind::directory)),
                                           .file = OST_TRY(copySystemContainerACLWithNumACEs(1, ItemKind::file))};
    OSTOwnFiles ownFiles;
    auto walked =
        _traverseDirectory(path, changingItems(ownFiles, [&](const HeldItem& item, const std::string& itemPath) {
                               if (itemPath == path)
                                   standard.applyToTop(item, itemPath);
                               else
                                   standard.applyBelowTop(item, itemPath);
                           }));
    logForeignFiles(ownFiles);
    return walked;
}

OSTResult<void> OSTFileManager::standardizeAllSystemContainerACLsAtURL(std::string_view path) const {
    const auto items = urlsForItemsInDirectoryAtURL(path);
    if (!items) {
        if (items.error().isPOSIX(ENOENT))
            return {};
        platform::logError("Failed to get items at URL%@ : %@", path, items.error());
        return std::unexpected(items.error());
    }
    if (items->empty())
        return {};
    std::vector<std::string> containers;
    containers.reserve(items->size());
    for (const auto& item : *items)
        containers.push_back(platform::pathByAppending(path, item.name));
    platform::logNotice("Potential containers requiring ACL migration: %@", containers);

    OSTResult<void> result;
    for (const auto& container : containers) {
        auto standardized = standardizeACLsForSystemContainerAtURL(container);
        if (standardized)
            continue;
        platform::logError("Failed to set system container ACL at %@: %@", container, standardized.error());
        result = std::move(standardized);
    }
    return result;
}

OSTResult<void> OSTFileManager::standardizeOwnershipAtURL(std::string_view path, std::uint32_t userId,
                                                          std::uint32_t groupId) const {
    const auto change = [&](const HeldItem& item, const std::string& itemPath) {
        applyStandardOwnership(item, itemPath, userId, groupId);
    };
    OSTOwnFiles ownFiles;
    auto walked = _traverseDirectory(path, changingItems(ownFiles, change));
    logForeignFiles(ownFiles);

    // A walk that stopped early may have left the top as it was.
    const auto top = HeldItem::open(AT_FDCWD, path);
    if (!top)
        return std::unexpected(OSTCreatePOSIXError(top.error(), "Could not stat %s: %s", path, top.error()));
    const std::string topPath(path);
    if (!isMetadataFile(topPath) && OSTOwnFiles().contains(top->status, topPath))
        change(*top, topPath);
    return walked;
}

} // namespace ost
