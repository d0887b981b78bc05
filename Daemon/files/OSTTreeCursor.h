#pragma once

#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"

#include <sys/types.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <expected>
#include <memory>
#include <string>
#include <vector>

namespace ost {

/// A position in a directory tree: a directory and an item in it. Everything is reached relative to descriptors, so a
/// tree may be deeper than a path can be long; at most `maximumOpenDirectories` are open at a time, so it may be deeper
/// than the descriptor limit too, at the cost of a few dozen bytes for each level.
///
/// Threads: one at a time. Invariant: the current directory is open. Never enters a symbolic link or a mount point.
class OSTTreeCursor {
public:
    static constexpr std::size_t maximumOpenDirectories = 32;

    /// Starts in the directory `top`, open for reading, before its first item. Paths begin with `path`.
    OSTTreeCursor(platform::FileDescriptor top, std::string path);

    /// Steps to the next item of the current directory, in the order of the directory; false when there is none left.
    [[nodiscard]] std::expected<bool, platform::Errno> next();

    /// Enters the current item, before its first item. Fails with ENOTDIR or ELOOP when it is no directory, with EXDEV
    /// at a mount point; the position is kept then.
    [[nodiscard]] std::expected<void, platform::Errno> enter();
    /// The same for the item `name` of the current directory, which becomes the current item.
    [[nodiscard]] std::expected<void, platform::Errno> enter(const char* name);

    /// Goes back to the directory above, where the one that was left becomes the current item. Requires a depth above
    /// 0. Fails with ESTALE when somebody has moved a directory in the meantime; the cursor is of no use then.
    [[nodiscard]] std::expected<void, platform::Errno> leave();

    /// How many directories lie between the top and the current directory, the latter counted.
    [[nodiscard]] std::size_t depth() const { return _levels.size() - 1; }
    /// Borrowed; valid until the cursor enters or leaves a directory.
    [[nodiscard]] int directory() const { return _open[depth() % maximumOpenDirectories].descriptor.get(); }
    [[nodiscard]] std::string directoryPath() const { return _path.substr(0, _levels.back().pathLength); }
    /// How many items of the current directory have been stepped to.
    [[nodiscard]] std::uint64_t number() const { return _levels.back().items; }

    // Of the current item; valid until the cursor moves.
    [[nodiscard]] const char* name() const { return _path.c_str() + _levels.back().pathLength + 1; }
    [[nodiscard]] const std::string& path() const { return _path; }
    /// DT_DIR, DT_REG, ..., or DT_UNKNOWN where the file system does not tell.
    [[nodiscard]] unsigned char type() const { return _type; }

private:
    /// What is kept of every directory on the way to the current one. The last three are set while it is not open.
    struct Level {
        std::size_t pathLength;
        std::uint64_t items = 0;
        off_t position = 0;
        dev_t device = 0;
        ino_t inode = 0;
    };
    struct OpenDirectory {
        platform::FileDescriptor descriptor;
        std::unique_ptr<std::byte[]> entries; // kept for the next directory that is opened in this place
        std::size_t consumed = 0;
        std::size_t filled = 0;
        off_t position = 0; // behind the last consumed entry

        void restart(platform::FileDescriptor opened, off_t from);
    };

    void _setItem(const char* name);
    [[nodiscard]] std::expected<void, platform::Errno> _closeForNow(std::size_t depth);
    [[nodiscard]] std::expected<void, platform::Errno> _reopen(std::size_t depth, int child);

    std::vector<Level> _levels;
    std::array<OpenDirectory, maximumOpenDirectories> _open; // level n, when open, has place n modulo the size
    std::string _path;                                       // of the current item
    unsigned char _type = 0;
};

} // namespace ost
