#include "files/OSTTreeWalk.h"

#include "files/OSTPathResolution.h"
#include "files/OSTTreeCursor.h"
#include "platform/base/Errno.h"

#include <dirent.h>
#include <sys/stat.h>

#include <cerrno>
#include <expected>
#include <vector>

namespace ost {

using Visit = OSTTreeEntry::Visit;
using Status = OSTTreeEntry::Status;

namespace {

struct ItemStatus {
    Status status;
    bool isMountPoint;
};

std::expected<ItemStatus, platform::Errno> statusOf(int directory, const char* name) {
    struct statx read{};
    if (::statx(directory, name, AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT, STATX_BASIC_STATS, &read) != 0)
        return std::unexpected(errno);
    return ItemStatus{.status = {.mode = read.stx_mode,
                                 .uid = read.stx_uid,
                                 .gid = read.stx_gid,
                                 .links = read.stx_nlink,
                                 .inode = read.stx_ino,
                                 .size = read.stx_size,
                                 .blocks = read.stx_blocks},
                      .isMountPoint = (read.stx_attributes & STATX_ATTR_MOUNT_ROOT) != 0};
}

class TreeWalk {
public:
    TreeWalk(OSTTreeCursor& cursor, const std::function<bool(const OSTTreeEntry&)>& visit, OSTItemStatus itemStatus)
        : _cursor(cursor), _visit(visit), _itemStatus(itemStatus) {}

    /// Visits everything below the top; false when the walk is to end.
    [[nodiscard]] bool run() {
        for (;;) {
            const auto found = _cursor.next();
            if (found && *found) {
                if (!_visitItem())
                    return false;
                continue;
            }
            const std::string directory = found ? std::string() : _cursor.directoryPath();
            if (!found && !_fail(_cursor.directory(), ".", directory, found.error()))
                return false;
            if (_cursor.depth() == 0)
                return true;
            if (!_leave())
                return false;
        }
    }

private:
    [[nodiscard]] bool _visitItem() {
        const auto type = _cursor.type();
        if (_itemStatus == OSTItemStatus::kindAlone && type != DT_UNKNOWN && type != DT_DIR)
            return _visitAs(Visit::item, {.mode = static_cast<mode_t>(DTTOIF(type))});
        const auto item = statusOf(_cursor.directory(), _cursor.name());
        if (!item)
            return _fail(_cursor.directory(), _cursor.name(), _cursor.path(), item.error());
        if (item->isMountPoint)
            return true;
        if (!S_ISDIR(item->status.mode))
            return _visitAs(Visit::item, item->status);
        if (!_visitAs(Visit::directoryBefore, item->status))
            return false;
        if (const auto entered = _cursor.enter(); !entered)
            return _fail(_cursor.directory(), _cursor.name(), _cursor.path(), entered.error());
        _ancestors.push_back(item->status);
        return true;
    }

    [[nodiscard]] bool _leave() {
        const Status status = _ancestors.back();
        _ancestors.pop_back();
        if (const auto left = _cursor.leave(); !left) {
            static_cast<void>(_fail(-1, _cursor.name(), _cursor.path(), left.error()));
            return false;
        }
        return _visitAs(Visit::directoryAfter, status);
    }

    [[nodiscard]] bool _visitAs(Visit visit, const Status& status) {
        return _visit({.visit = visit,
                       .error = 0,
                       .directory = _cursor.directory(),
                       .name = _cursor.name(),
                       .path = _cursor.path(),
                       .status = status});
    }

    [[nodiscard]] bool _fail(int directory, const char* name, const std::string& path, int error) {
        return _visit({.visit = Visit::failure,
                       .error = error,
                       .directory = directory,
                       .name = name,
                       .path = path,
                       .status = {}});
    }

    OSTTreeCursor& _cursor;
    const std::function<bool(const OSTTreeEntry&)>& _visit;
    const OSTItemStatus _itemStatus;
    std::vector<Status> _ancestors; // below the top
};

} // namespace

bool OSTWalkTree(std::string_view path, const std::function<bool(const OSTTreeEntry&)>& visit,
                 OSTItemStatus itemStatus) {
    const std::string top(path);
    const auto place = OSTItemPlace::find(path);
    const auto visitTop = [&](Visit as, const Status& status, int error = 0) {
        return visit({.visit = as,
                      .error = error,
                      .directory = place ? place->directory() : -1,
                      .name = place ? place->name() : "",
                      .path = top,
                      .status = status});
    };
    const auto item = place ? statusOf(place->directory(), place->name()) : std::unexpected(place.error());
    if (!item)
        return visitTop(Visit::failure, {}, item.error());
    if (item->isMountPoint)
        return true;
    if (!S_ISDIR(item->status.mode))
        return visitTop(Visit::item, item->status);
    if (!visitTop(Visit::directoryBefore, item->status))
        return false;
    auto opened = OSTOpenItem(place->directory(), place->name(), O_RDONLY | O_DIRECTORY);
    if (!opened)
        return visitTop(Visit::failure, {}, opened.error());
    OSTTreeCursor cursor(*std::move(opened), top);
    return TreeWalk(cursor, visit, itemStatus).run() && visitTop(Visit::directoryAfter, item->status);
}

} // namespace ost
