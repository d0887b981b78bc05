#pragma once

#include <sys/stat.h>

#include <map>
#include <string>
#include <vector>

namespace ost {

/// Tells which files of a tree are the tree's own. A user can give any file a second name inside his container; such a
/// file is changed only when all its names have been seen in the tree, at the last of them.
///
/// Threads: one at a time. For one walk, on one file system.
class OSTOwnFiles {
public:
    /// To be asked once at each name of an item.
    [[nodiscard]] bool contains(const struct stat& status, const std::string& path);

    /// The files that have names elsewhere, each by the first of its names in the tree.
    [[nodiscard]] std::vector<std::string> others() const;

private:
    struct Names {
        nlink_t seen;
        std::string first;
    };
    std::map<ino_t, Names> _incomplete;
};

} // namespace ost
