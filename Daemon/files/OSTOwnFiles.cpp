#include "files/OSTOwnFiles.h"

namespace ost {

bool OSTOwnFiles::contains(const struct stat& status, const std::string& path) {
    if (S_ISDIR(status.st_mode) || status.st_nlink <= 1)
        return true;
    auto& names = _incomplete.try_emplace(status.st_ino, Names{.seen = 0, .first = path}).first->second;
    if (++names.seen < status.st_nlink)
        return false;
    _incomplete.erase(status.st_ino);
    return true;
}

std::vector<std::string> OSTOwnFiles::others() const {
    std::vector<std::string> paths;
    for (const auto& [inode, names] : _incomplete)
        paths.push_back(names.first);
    return paths;
}

} // namespace ost
