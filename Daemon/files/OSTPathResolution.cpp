#include "files/OSTPathResolution.h"

#include "platform/base/Try.h"

#include <linux/openat2.h>

#include <cerrno>
#include <cstring>

namespace ost {

using platform::FileDescriptor;

namespace {

std::string_view withoutTrailingSlashes(std::string_view path) {
    while (path.size() > 1 && path.ends_with('/'))
        path.remove_suffix(1);
    return path;
}

} // namespace

std::expected<FileDescriptor, platform::Errno> OSTOpenItem(int base, std::string_view path, int flags,
                                                           OSTMounts mounts) {
    path = withoutTrailingSlashes(path);
    char terminated[PATH_MAX];
    if (path.size() >= sizeof terminated)
        return std::unexpected(ENAMETOOLONG);
    terminated[path.copy(terminated, path.size())] = '\0';

    // The kernel refuses non-blocking together with O_PATH, which never waits anyway.
    const int unblocked = (flags & O_PATH) != 0 ? 0 : O_NONBLOCK | O_NOCTTY;
    return platform::openWithoutLinks(base, terminated, flags | unblocked,
                                      mounts == OSTMounts::stayOut ? RESOLVE_NO_XDEV : 0);
}

std::expected<OSTItemPlace, platform::Errno> OSTItemPlace::find(std::string_view path, int access) {
    path = withoutTrailingSlashes(path);
    const auto slash = path.rfind('/');
    const std::string_view name = path.substr(slash + 1);
    // These name a directory's relatives, not an item that could be made, moved or removed.
    if (!path.starts_with('/') || name.empty() || name == "." || name == "..")
        return std::unexpected(EINVAL);
    if (name.size() > NAME_MAX)
        return std::unexpected(ENAMETOOLONG);

    OSTItemPlace place;
    place._name[name.copy(place._name, name.size())] = '\0';
    place._directory = OST_TRY(OSTOpenItem(AT_FDCWD, path.substr(0, slash == 0 ? 1 : slash), access | O_DIRECTORY));
    return place;
}

} // namespace ost
