#include "platform/base/MountPoints.h"

#include <mntent.h>

#include <array>
#include <climits>
#include <cstdio>
#include <memory>

namespace ost::platform {

std::vector<std::string> mountPoints() {
    const std::unique_ptr<FILE, int (*)(FILE*)> mounts(::setmntent("/proc/self/mounts", "re"), ::endmntent);
    std::vector<std::string> paths;
    std::array<char, std::size_t{4} * PATH_MAX> buffer; // source, path and options of one
    mntent entry{};
    while (mounts && ::getmntent_r(mounts.get(), &entry, buffer.data(), static_cast<int>(buffer.size())))
        paths.emplace_back(entry.mnt_dir);
    return paths;
}

} // namespace ost::platform
