#include "platform/base/DirectoryNames.h"

#include "platform/base/Try.h"

#include <dirent.h>
#include <fcntl.h>

#include <cerrno>
#include <memory>

namespace ost::platform {

std::expected<std::vector<std::string>, Errno> plainNames(const FileDescriptor& directory) {
    // A descriptor of its own, because reading moves its position.
    FileDescriptor listed = OST_TRY(openWithoutLinks(directory.get(), ".", O_RDONLY | O_DIRECTORY));
    const std::unique_ptr<DIR, int (*)(DIR*)> stream(::fdopendir(listed.get()), &::closedir);
    if (!stream)
        return std::unexpected(errno);
    [[maybe_unused]] const int owned = listed.release();
    std::vector<std::string> names;
    for (errno = 0; const auto* const entry = ::readdir(stream.get()); errno = 0)
        if (*entry->d_name != '.')
            names.emplace_back(entry->d_name);
    if (errno != 0)
        return std::unexpected(errno);
    return names;
}

} // namespace ost::platform
