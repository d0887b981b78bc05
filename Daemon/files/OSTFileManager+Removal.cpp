#include "files/OSTFileManager.h"

#include "files/OSTPathResolution.h"
#include "files/OSTSharedWalk.h"
#include "files/OSTTreeCursor.h"
#include "platform/base/Log.h"

#include <dirent.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace ost {

using platform::FileDescriptor;
using platform::LogLevel;

namespace {

constexpr std::string_view errorCallback = "_sweeptree_error_callback";

/// An item that could not be removed.
struct Survivor {
    int directory;
    const char* name;
    const std::string& path;
    int unlinkFlags;
    bool liesInTree; ///< else it is the top, whose directory is not ours to change
};

bool isImmutable(const Survivor& item, const char* name, const std::string& path) {
    struct statx status{};
    if (::statx(item.directory, name, AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT, STATX_TYPE, &status) != 0) {
        platform::logAs(LogLevel::error, errorCallback, "Failed to stat %s before unsetting UF_IMMUTABLE: %s", path,
                        platform::Errno(errno));
        return false;
    }
    return (status.stx_attributes & STATX_ATTR_IMMUTABLE) != 0;
}

std::expected<void, platform::Errno> clearImmutableFlag(int directory, const char* name) {
    const FileDescriptor item = OST_TRY(OSTOpenItem(directory, name, O_RDONLY));
    int flags = 0;
    if (::ioctl(item.get(), FS_IOC_GETFLAGS, &flags) != 0)
        return std::unexpected(errno);
    flags &= ~FS_IMMUTABLE_FL;
    if (::ioctl(item.get(), FS_IOC_SETFLAGS, &flags) != 0)
        return std::unexpected(errno);
    return {};
}

/// Clears the flag of the item that `name` means next to `item`, when it is set. Answers whether it was cleared.
bool unsetImmutable(const Survivor& item, const char* name, const std::string& path) {
    if (!isImmutable(item, name, path))
        return false;
    if (const auto cleared = clearImmutableFlag(item.directory, name); !cleared) {
        platform::logAs(LogLevel::error, errorCallback, "Failed to lchflags %s: %s", path, cleared.error());
        return false;
    }
    platform::logAs(LogLevel::notice, errorCallback, "Unset UF_IMMUTABLE on %s", path);
    return true;
}

/// Removes what is no directory, as far as one call does it.
class FilesRemover final : public OSTTreeVisitor {
public:
    [[nodiscard]] Next visitItem(const OSTTreeCursor& cursor) override {
        if (cursor.type() == DT_DIR)
            return Next::enter;
        const bool isDirectory = ::unlinkat(cursor.directory(), cursor.name(), 0) != 0 && errno == EISDIR;
        return isDirectory ? Next::enter : Next::goOn;
    }
    [[nodiscard]] Next cannotOpen(const std::string&, platform::Errno) override { return Next::goOn; }
    [[nodiscard]] Next cannotRead(const std::string&, std::uint64_t, platform::Errno) override { return Next::goOn; }
};

/// The removal of one tree, which goes on after an item that cannot be removed.
class Removal {
public:
    Removal(const OSTItemPlace& place, const std::string& path) : _place(place), _path(path) {}

    /// Fails when nothing could be tried.
    [[nodiscard]] std::expected<void, platform::Errno> run() {
        auto top = _openTop();
        if (!top && !isNoDirectory(top.error()))
            return std::unexpected(top.error());
        const bool isDirectory = top.has_value();
        for (int fillings = 0; isDirectory; ++fillings) {
            if (!top)
                return std::unexpected(top.error());
            OST_TRY(_removeContent(*std::move(top)));
            if (_firstError != 0 || fillings == mostFillings)
                break;
            if (::unlinkat(_place.directory(), _place.name(), AT_REMOVEDIR) == 0)
                return {};
            if (errno != ENOTEMPTY)
                break;
            top = _openTop();
        }
        _unlink({.directory = _place.directory(),
                 .name = _place.name(),
                 .path = _path,
                 .unlinkFlags = isDirectory ? AT_REMOVEDIR : 0,
                 .liesInTree = false});
        return {};
    }

    /// The errno of the first item that was not removed, or 0.
    [[nodiscard]] platform::Errno firstError() const { return _firstError; }

private:
    /// How often something may come into a directory that has just been emptied: a new directory on death row gets its
    /// item.
    static constexpr int mostFillings = 4;

    /// From so many items on, a second reading of the tree costs less than a second thread saves.
    static constexpr std::uint64_t itemsOfLargeTree = 1024;

    static bool isNoDirectory(int error) { return error == ENOTDIR || error == ELOOP; }

    [[nodiscard]] std::expected<FileDescriptor, platform::Errno> _openTop() const {
        return OSTOpenSubdirectory(_place.directory(), _place.name());
    }

    [[nodiscard]] std::expected<void, platform::Errno> _removeContent(FileDescriptor top) {
        OSTTreeCursor cursor(std::move(top), _path);
        for (;;) {
            const auto found = cursor.next();
            if (found && *found) {
                _removeItem(cursor);
                continue;
            }
            if (!found)
                _record(found.error(), cursor.directoryPath());
            if (cursor.depth() == 0)
                return {};
            OST_TRY(cursor.leave());
            _unlinkItem(cursor, AT_REMOVEDIR);
        }
    }

    /// Enters the current item when it is a directory, else removes it.
    void _removeItem(OSTTreeCursor& cursor) {
        if (++_items == itemsOfLargeTree)
            _removeFilesByTwo();
        if (cursor.type() == DT_DIR || cursor.type() == DT_UNKNOWN) {
            const auto entered = cursor.enter();
            if (entered)
                return;
            if (!isNoDirectory(entered.error()))
                return _record(entered.error(), cursor.path());
        }
        _unlinkItem(cursor, 0);
    }

    /// The directories are left, and what needs more than one call.
    void _removeFilesByTwo() const {
        FilesRemover remover;
        if (auto top = _openTop())
            OSTWalkShared(*std::move(top), _path, remover);
    }

    void _unlinkItem(const OSTTreeCursor& cursor, int flags) {
        _unlink({.directory = cursor.directory(),
                 .name = cursor.name(),
                 .path = cursor.path(),
                 .unlinkFlags = flags,
                 .liesInTree = true});
    }

    void _unlink(const Survivor& item) {
        if (::unlinkat(item.directory, item.name, item.unlinkFlags) == 0)
            return;
        const int error = errno;
        if (error == EPERM)
            return _unlinkImmutable(item);
        _record(error, item.path);
    }

    /// An immutable item cannot be removed, nor can anything that an immutable directory holds.
    void _unlinkImmutable(const Survivor& item) {
        _log(EPERM, item.path);
        bool unset = unsetImmutable(item, item.name, item.path);
        if (item.liesInTree)
            unset |= unsetImmutable(item, ".", item.path.substr(0, item.path.rfind('/')));
        if (unset) {
            if (::unlinkat(item.directory, item.name, item.unlinkFlags) == 0)
                return;
            platform::logAs(LogLevel::error, errorCallback, "unlink of %s failed: %s", item.path,
                            platform::Errno(errno));
        }
        _keepFirst(EPERM);
    }

    void _record(platform::Errno error, const std::string& path) {
        if (error == ENOENT)
            return;
        _log(error, path);
        _keepFirst(error);
    }

    static void _log(platform::Errno error, const std::string& path) {
        platform::logAs(LogLevel::error, errorCallback, "sweeptree hit error for %s : %s", path, error);
    }

    void _keepFirst(platform::Errno error) {
        if (_firstError == 0)
            _firstError = error;
    }

    const OSTItemPlace& _place;
    const std::string& _path;
    std::uint64_t _items = 0;
    platform::Errno _firstError = 0;
};

/// Answers the errno of what could not be removed, or 0.
platform::Errno removeTree(const std::string& path) {
    const auto place = OSTItemPlace::find(path);
    if (!place)
        return place.error() == ENOENT ? platform::Errno(0) : place.error();
    Removal removal(*place, path);
    const auto removed = removal.run();
    return removed || removed.error() == ENOENT ? removal.firstError() : removed.error();
}

} // namespace

OSTResult<void> OSTFileManager::removeItemAtURL(std::string_view path) const {
    if (path.empty())
        return std::unexpected(OSTCreatePOSIXError(EFAULT, "nil url passed to -removeItemAtURL:error:"));
    if (const auto error = removeTree(std::string(path)); error != 0)
        return std::unexpected(OSTCreatePOSIXError(error, "sweeptree of %@ failed: %s", path, error));
    return {};
}

} // namespace ost
