#include "platform/base/DirectoryNames.h"

#include "platform/base/Try.h"

#include <dirent.h>
#include <fcntl.h>

#include <cerrno>
#include <memory>
#include <string_view>

namespace ost::platform {

namespace {

std::expected<std::vector<std::string>, Errno> namesIn(const FileDescriptor& directory, bool hidden) {
    // A descriptor of its own, because reading moves its position.
    FileDescriptor listed = OST_TRY(openWithoutLinks(directory.get(), ".", O_RDONLY | O_DIRECTORY));
    const std::unique_ptr<DIR, int (*)(DIR*)> stream(::fdopendir(listed.get()), &::closedir);
    if (!stream)
        return std::unexpected(errno);
    [[maybe_unused]] const int owned = listed.release();
    std::vector<std::string> names;
    for (errno = 0; const auto* const entry = ::readdir(stream.get()); errno = 0)
        if (const std::string_view name = entry->d_name; name.starts_with('.') == hidden && name != "." && name != "..")
            names.emplace_back(name);
    if (errno != 0)
        return std::unexpected(errno);
    return names;
}

} // namespace

std::expected<std::vector<std::string>, Errno> plainNames(const FileDescriptor& directory) {
    return namesIn(directory, false);
}

std::expected<std::vector<std::string>, Errno> hiddenNames(const FileDescriptor& directory) {
    return namesIn(directory, true);
}

} // namespace ost::platform
