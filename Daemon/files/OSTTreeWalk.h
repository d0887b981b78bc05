#pragma once

#include "platform/base/Errno.h"

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <string>
#include <string_view>

namespace ost {

/// One stop of a walk through a tree. Borrowed: valid during the visit.
struct OSTTreeEntry {
    enum class Visit : std::uint8_t {
        item,            ///< anything but a directory
        directoryBefore, ///< a directory, before what it holds
        directoryAfter,  ///< the same directory, after that, with the status that it had before
        failure,         ///< an item without readable status, or a directory that cannot be read; `error` says why
    };
    struct Status {
        mode_t mode = 0;
        uid_t uid = 0;
        gid_t gid = 0;
        nlink_t links = 0;
        ino_t inode = 0;
        std::uint64_t size = 0;   ///< bytes
        std::uint64_t blocks = 0; ///< allocated, 512 bytes each
    };

    Visit visit;
    platform::Errno error; ///< errno of a failure, else 0
    /// The directory that holds the item, open at least for the *at calls, and the item's name there.
    int directory;
    const char* name;
    const std::string& path;
    const Status& status; ///< all 0 where it could not be read
};

/// What is read of items that are no directories: all of the status, or no more than the directory tells, which is the
/// kind of an item, in its mode.
enum class OSTItemStatus : bool { whole, kindAlone };

/// Visits the item at `path` and everything below it, to any depth, in the order of the directories. Neither symbolic
/// links nor mount points are entered; a mount point is not visited either, but for a file of which the kind alone is
/// read. Returns whether the walk reached its end:
/// not when `visit` answered false, nor when the tree was moved about so that there was no way on, which is visited as
/// a failure.
bool OSTWalkTree(std::string_view path, const std::function<bool(const OSTTreeEntry&)>& visit,
                 OSTItemStatus itemStatus = OSTItemStatus::whole);

} // namespace ost
