#pragma once

#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"

#include <fcntl.h>

#include <climits>
#include <expected>
#include <string_view>

namespace ost {

/// Where an item lies: the directory that holds it and its name there. The item itself has not been looked at.
///
/// Owns the directory's descriptor.
class OSTItemPlace {
public:
    /// The place named by `path`. The directory is opened with `access`: O_PATH, or O_RDONLY where more than the *at
    /// calls is asked of it.
    /// Fails with ELOOP or ENOTDIR at a symbolic link on the way, with EINVAL when the path is not absolute or ends in
    /// no name of its own.
    [[nodiscard]] static std::expected<OSTItemPlace, platform::Errno> find(std::string_view path, int access = O_PATH);

    [[nodiscard]] int directory() const { return _directory.get(); }
    [[nodiscard]] const char* name() const { return _name; }
    /// Gives up the directory's descriptor.
    [[nodiscard]] platform::FileDescriptor takeDirectory() && { return std::move(_directory); }

private:
    OSTItemPlace() = default;

    platform::FileDescriptor _directory;
    char _name[NAME_MAX + 1];
};

/// Whether opening may end on another file system than the one it starts from.
enum class OSTMounts : bool { stayOut, cross };

/// Opens the item at `path`, relative to the directory `base` or absolute. Every path of the daemon is resolved here:
/// no symbolic link is followed, neither on the way (ELOOP) nor at its end. The descriptor is close-on-exec; an open
/// that could wait, such as one of a FIFO, does not.
[[nodiscard]] std::expected<platform::FileDescriptor, platform::Errno>
OSTOpenItem(int base, std::string_view path, int flags, OSTMounts mounts = OSTMounts::cross);

/// Opens the directory `name` of the directory `parent` for reading, unless another file system is mounted there
/// (EXDEV).
[[nodiscard]] inline std::expected<platform::FileDescriptor, platform::Errno>
OSTOpenSubdirectory(int parent, std::string_view name) {
    return OSTOpenItem(parent, name, O_RDONLY | O_DIRECTORY, OSTMounts::stayOut);
}

} // namespace ost
