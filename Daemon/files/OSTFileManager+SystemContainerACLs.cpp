#include "files/OSTFileManager.h"

#include "files/OSTOwnFiles.h"
#include "files/OSTPathResolution.h"
#include "files/OSTSharedWalk.h"
#include "platform/base/Log.h"
#include "platform/base/Mutex.h"
#include "platform/base/Path.h"
#include "platform/device/AccessControlList.h"
#include "platform/device/Membership.h"

#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <expected>
#include <utility>
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

/// An item that is held, so that what was looked at is what is changed.
struct HeldItem {
    FileDescriptor descriptor; // open with O_PATH or for reading
    struct stat status;

    static std::expected<HeldItem, platform::Errno> from(std::expected<FileDescriptor, platform::Errno> opened) {
        HeldItem item{.descriptor = OST_TRY(std::move(opened)), .status = {}};
        if (::fstat(item.descriptor.get(), &item.status) != 0)
            return std::unexpected(errno);
        return item;
    }
};

bool changeOwner(int item, const std::string& path, std::uint32_t userId, std::uint32_t groupId) {
    if (::fchownat(item, "", userId, groupId, AT_EMPTY_PATH) == 0)
        return true;
    platform::logError("Could not chown %s: %s", path, platform::Errno(errno));
    return false;
}

void logChmod(const std::string& path, platform::Errno error) {
    platform::logError("Could not chmod %s: %s", path, error);
}

/// What the items of a tree shall be. Two threads use it at once.
class TreeStandard {
public:
    /// How an item of this kind, which is no directory, is held.
    [[nodiscard]] virtual int accessTo([[maybe_unused]] unsigned char type) const { return O_PATH; }
    [[nodiscard]] virtual bool isMetBy(const struct stat& status) const = 0;
    /// What cannot be changed is logged.
    virtual void apply(int item, const struct stat& status, const std::string& path) const = 0;

protected:
    ~TreeStandard() = default;
};

/// The three ACLs of a system container, whose items below the top have nothing else.
class SystemContainerStandard final : public TreeStandard {
public:
    SystemContainerStandard(std::string_view top, AccessControlList topDirectory, AccessControlList directory,
                            AccessControlList file)
        : _top(top), _topDirectory(std::move(topDirectory)), _directory(std::move(directory)), _file(std::move(file)) {}

    /// Attributes of what is open with O_PATH are reached through /proc, which takes longer.
    [[nodiscard]] int accessTo(unsigned char type) const override { return type == DT_REG ? O_RDONLY : O_PATH; }
    [[nodiscard]] bool isMetBy(const struct stat& /*status*/) const override { return false; } // ACLs do not show in it
    void apply(int item, const struct stat& status, const std::string& path) const override {
        if (path != _top)
            _applyBelowTop(item, status, path);
        else if (!S_ISDIR(status.st_mode))
            _logUnlessApplied(_file.apply(item), path);
        else if (const auto applied = _topDirectory.apply(item); !applied)
            platform::logError("Failed to set top level ACL on dir %s: %s", path, applied.error());
    }

private:
    void _applyBelowTop(int item, const struct stat& status, const std::string& path) const {
        changeOwner(item, path, nobody, nobody); // first: the old one could change the rest until then
        const auto& acl = S_ISDIR(status.st_mode) ? _directory : _file;
        if (_logUnlessApplied(acl.applyWithMode(item, status.st_mode, 0), path))
            return;
        if (const auto changed = platform::setModeKeepingMask(item, 0); !changed)
            logChmod(path, changed.error());
    }
    static bool _logUnlessApplied(const std::expected<void, platform::Errno>& applied, const std::string& path) {
        if (!applied)
            platform::logError("Failed to set ACL on dir %s: %s", path, applied.error());
        return applied.has_value();
    }

    std::string _top;
    AccessControlList _topDirectory;
    AccessControlList _directory;
    AccessControlList _file;
};

/// One owner and the usual modes.
class OwnershipStandard final : public TreeStandard {
public:
    OwnershipStandard(std::uint32_t userId, std::uint32_t groupId) : _userId(userId), _groupId(groupId) {}

    [[nodiscard]] bool isMetBy(const struct stat& status) const override {
        return _isOwnedRight(status) && _hasRightMode(status);
    }
    void apply(int item, const struct stat& status, const std::string& path) const override {
        struct stat now = status;
        // The old owner could change the mode until he lost the item.
        if (!_isOwnedRight(status) && changeOwner(item, path, _userId, _groupId) && ::fstat(item, &now) != 0)
            return logChmod(path, errno);
        if (_hasRightMode(now))
            return;
        if (const auto changed = platform::setModeKeepingMask(item, _modeOf(now)); !changed)
            logChmod(path, changed.error());
    }

private:
    [[nodiscard]] bool _isOwnedRight(const struct stat& status) const {
        return status.st_uid == _userId && status.st_gid == _groupId;
    }
    /// Under an extended ACL the group's bits are the mask: what is granted to whom is within the mode then, too.
    static bool _hasRightMode(const struct stat& status) {
        return S_ISLNK(status.st_mode) || (status.st_mode & static_cast<mode_t>(ALLPERMS)) == _modeOf(status);
    }
    static mode_t _modeOf(const struct stat& status) {
        return S_ISDIR(status.st_mode) || (status.st_mode & executeBits) != 0 ? 0755 : 0644;
    }

    std::uint32_t _userId;
    std::uint32_t _groupId;
};

/// Brings every item of a tree to a standard once, but for metadata files and files with names outside the tree.
class TreeChange final : public OSTTreeVisitor {
public:
    explicit TreeChange(const TreeStandard& standard) : _standard(standard) {}

    /// The result is the first error that ended the walk.
    [[nodiscard]] OSTResult<void> run(std::string_view path) {
        if (auto top = OSTOpenItem(AT_FDCWD, path, O_RDONLY | O_DIRECTORY))
            OSTWalkShared(*std::move(top), path, *this);
        else if (top.error() == ENOTDIR || top.error() == ELOOP)
            static_cast<void>(_changeItem(HeldItem::from(OSTOpenItem(AT_FDCWD, path, O_PATH)), std::string(path)));
        else
            static_cast<void>(_fail(std::string(path), top.error()));
        const platform::MutexLock lock(_mutex);
        for (const auto& other : _ownFiles.others())
            platform::logError("Could not chown %s: %s", other, platform::Errno(EMLINK));
        return _result;
    }

    [[nodiscard]] Next visitItem(const OSTTreeCursor& cursor) override {
        if (cursor.type() == DT_DIR)
            return Next::enter;
        // What is likely to be right is looked at without being held. Items follow others of their kind.
        if (_lastWasRight || cursor.type() == DT_UNKNOWN) {
            struct stat status{};
            if (::fstatat(cursor.directory(), cursor.name(), &status, AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT) != 0)
                return _fail(cursor.path(), errno);
            if (S_ISDIR(status.st_mode))
                return Next::enter;
            if (_isRight(status))
                return Next::goOn;
        }
        const auto item = _hold(cursor);
        if (!item && item.error() == EXDEV) // another file system's
            return Next::goOn;
        return _changeItem(item, cursor.path());
    }
    void visitDirectory(int directory, const std::string& path) override {
        struct stat status{};
        if (::fstat(directory, &status) != 0)
            platform::logError("Could not chown %s: %s", path, platform::Errno(errno));
        else if (!isMetadataFile(path) && !_standard.isMetBy(status))
            _standard.apply(directory, status, path);
    }
    [[nodiscard]] Next cannotOpen(const std::string& path, platform::Errno error) override {
        return _fail(path, error);
    }
    [[nodiscard]] Next cannotRead(const std::string& path, std::uint64_t /*number*/, platform::Errno error) override {
        return _fail(path, error);
    }

private:
    [[nodiscard]] std::expected<HeldItem, platform::Errno> _hold(const OSTTreeCursor& cursor) const {
        const int access = _standard.accessTo(cursor.type());
        auto opened = OSTOpenItem(cursor.directory(), cursor.name(), access, OSTMounts::stayOut);
        if (!opened && access != O_PATH) // as a lease can bring about
            opened = OSTOpenItem(cursor.directory(), cursor.name(), O_PATH, OSTMounts::stayOut);
        return HeldItem::from(std::move(opened));
    }

    [[nodiscard]] Next _changeItem(const std::expected<HeldItem, platform::Errno>& item, const std::string& path) {
        if (!item)
            return _fail(path, item.error());
        if (!_isRight(item->status) && !isMetadataFile(path) && _isOwn(item->status, path))
            _standard.apply(item->descriptor.get(), item->status, path);
        return Next::goOn;
    }

    [[nodiscard]] bool _isRight(const struct stat& status) {
        const bool isRight = _standard.isMetBy(status);
        if (isRight != _lastWasRight)
            _lastWasRight = isRight;
        return isRight;
    }

    [[nodiscard]] bool _isOwn(const struct stat& status, const std::string& path) {
        if (S_ISDIR(status.st_mode) || status.st_nlink <= 1)
            return true;
        const platform::MutexLock lock(_mutex);
        return _ownFiles.contains(status, path);
    }

    [[nodiscard]] Next _fail(const std::string& path, platform::Errno error) {
        const platform::MutexLock lock(_mutex);
        if (_result)
            _result = std::unexpected(OSTCreatePOSIXError(error, "Error for path %s: %s", path, error));
        return Next::stop;
    }

    const TreeStandard& _standard;
    std::atomic<bool> _lastWasRight = false;
    platform::Mutex _mutex;
    OSTOwnFiles _ownFiles OST_GUARDED_BY(_mutex);
    OSTResult<void> _result OST_GUARDED_BY(_mutex);
};

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
    auto topDirectory = OST_TRY(copyTopLevelSystemContainerACL());
    auto directory = OST_TRY(copySystemContainerACLWithNumACEs(1, ItemKind::directory));
    auto file = OST_TRY(copySystemContainerACLWithNumACEs(1, ItemKind::file));
    const SystemContainerStandard standard(path, std::move(topDirectory), std::move(directory), std::move(file));
    return TreeChange(standard).run(path);
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
    const OwnershipStandard standard(userId, groupId);
    auto walked = TreeChange(standard).run(path);
    const auto top = HeldItem::from(OSTOpenItem(AT_FDCWD, path, O_PATH));
    if (!top)
        return std::unexpected(OSTCreatePOSIXError(top.error(), "Could not stat %s: %s", path, top.error()));
    // Once more: what the whole tree hangs from counts most.
    const std::string topPath(path);
    if (!isMetadataFile(topPath) && !standard.isMetBy(top->status) && OSTOwnFiles().contains(top->status, topPath))
        standard.apply(top->descriptor.get(), top->status, topPath);
    return walked;
}

} // namespace ost
