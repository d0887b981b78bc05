#include "files/OSTTreeCursor.h"

#include "files/OSTPathResolution.h"
#include "platform/base/Assert.h"
#include "platform/base/Try.h"

#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace ost {

using platform::FileDescriptor;

namespace {

/// As much as the C library reads at a time.
constexpr std::size_t entriesSize = std::size_t{32} << 10U;

bool isSelfOrParent(const char* name) {
    return name[0] == '.' && (name[1] == '\0' || (name[1] == '.' && name[2] == '\0'));
}

} // namespace

OSTTreeCursor::OSTTreeCursor(FileDescriptor top, std::string path) : _path(std::move(path)) {
    while (_path.ends_with('/'))
        _path.pop_back();
    _levels.push_back({.pathLength = _path.size()});
    _open[0].restart(std::move(top), 0);
}

void OSTTreeCursor::OpenDirectory::restart(FileDescriptor opened, off_t from) {
    descriptor = std::move(opened);
    consumed = filled = 0;
    position = from;
}

std::expected<bool, platform::Errno> OSTTreeCursor::next() {
    OpenDirectory& current = _open[depth() % maximumOpenDirectories];
    for (;;) {
        if (current.consumed == current.filled) {
            if (!current.entries)
                current.entries = std::make_unique_for_overwrite<std::byte[]>(entriesSize);
            const ssize_t read = ::getdents64(current.descriptor.get(), current.entries.get(), entriesSize);
            if (read < 0)
                return std::unexpected(errno);
            if (read == 0)
                return false;
            current.consumed = 0;
            current.filled = static_cast<std::size_t>(read);
        }
        const auto* const entry = reinterpret_cast<const dirent64*>(current.entries.get() + current.consumed);
        current.consumed += entry->d_reclen;
        current.position = entry->d_off;
        if (isSelfOrParent(entry->d_name))
            continue;
        _setItem(entry->d_name);
        _type = entry->d_type;
        ++_levels.back().items;
        return true;
    }
}

std::expected<void, platform::Errno> OSTTreeCursor::enter() {
    FileDescriptor opened = OST_TRY(OSTOpenSubdirectory(directory(), name()));
    const std::size_t depthOfItem = _levels.size();
    if (depthOfItem >= maximumOpenDirectories)
        OST_TRY(_closeForNow(depthOfItem - maximumOpenDirectories));
    _levels.push_back({.pathLength = _path.size()});
    _open[depthOfItem % maximumOpenDirectories].restart(std::move(opened), 0);
    return {};
}

std::expected<void, platform::Errno> OSTTreeCursor::enter(const char* name) {
    _setItem(name);
    return enter();
}

std::expected<void, platform::Errno> OSTTreeCursor::leave() {
    OST_ASSERT(depth() > 0);
    const std::size_t above = depth() - 1;
    const FileDescriptor left = std::move(_open[depth() % maximumOpenDirectories].descriptor);
    _path.resize(_levels.back().pathLength);
    _levels.pop_back();
    _type = DT_DIR;
    if (!_open[above % maximumOpenDirectories].descriptor)
        OST_TRY(_reopen(above, left.get()));
    return {};
}

void OSTTreeCursor::_setItem(const char* name) {
    _path.resize(_levels.back().pathLength);
    _path.append(1, '/').append(name);
}

std::expected<void, platform::Errno> OSTTreeCursor::_closeForNow(std::size_t depth) {
    OpenDirectory& open = _open[depth % maximumOpenDirectories];
    if (!open.descriptor)
        return {}; // since an earlier way down
    struct stat status{};
    if (::fstat(open.descriptor.get(), &status) != 0)
        return std::unexpected(errno);
    Level& level = _levels[depth];
    level.position = open.position;
    level.device = status.st_dev;
    level.inode = status.st_ino;
    open.descriptor.reset();
    return {};
}

std::expected<void, platform::Errno> OSTTreeCursor::_reopen(std::size_t depth, int child) {
    FileDescriptor parent = OST_TRY(OSTOpenSubdirectory(child, ".."));
    const Level& level = _levels[depth];
    struct stat status{};
    if (::fstat(parent.get(), &status) != 0)
        return std::unexpected(errno);
    // Who owns the tree can move a directory while we are in it; what lies above it now is none of ours.
    if (status.st_dev != level.device || status.st_ino != level.inode)
        return std::unexpected(ESTALE);
    if (::lseek(parent.get(), level.position, SEEK_SET) < 0)
        return std::unexpected(errno);
    _open[depth % maximumOpenDirectories].restart(std::move(parent), level.position);
    return {};
}

} // namespace ost
