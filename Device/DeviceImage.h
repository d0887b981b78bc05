#pragma once

#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"

#include <expected>
#include <filesystem>
#include <string>
#include <string_view>

namespace ost::device {

/// What could not be done to an image: a path or step, and why.
struct Failure {
    std::string what;
    int error; ///< errno

    [[nodiscard]] std::string description() const;
};

template<typename T>
using Result = std::expected<T, Failure>;

/// A directory of the host that holds the whole file system of a device: accounts, home directories, run-time state.
///
/// Threads: one. Ownership: keeps the directory open; move-only.
/// Invariant: its path is absolute. Links inside the image are never followed on the way to its directories, because
/// they would be read as paths of the host.
class DeviceImage {
public:
    /// Opens the image at `path`. A directory without accounts (etc/passwd) is made an image first, keeping what it
    /// already holds, and a missing one is created; an image that exists is left as it is.
    static Result<DeviceImage> openOrMake(const std::filesystem::path& path);

    [[nodiscard]] const std::filesystem::path& path() const { return _path; }

    /// Takes the image for one boot, until the calling process ends. Fails with EBUSY while another one has it.
    [[nodiscard]] Result<void> reserve();

    /// Moves the calling thread, and what it starts from then on, into a mount namespace where the image has a new,
    /// empty /dev/shm and a /proc. Nobody else sees these mounts, and they end with the last process of the namespace.
    [[nodiscard]] Result<void> mountDeviceFileSystems();

    /// Mounts the host's /usr and /lib* read-only into the image, for programs that are linked dynamically. Requires
    /// `mountDeviceFileSystems`.
    [[nodiscard]] Result<void> mountHostLibraries() const;

    /// Removes whatever an earlier boot left in /private/var/run and opens that directory.
    [[nodiscard]] Result<platform::FileDescriptor> openEmptiedRunDirectory() const;

    /// Makes the image the calling process's root and working directory. Errors: errno, and nothing of it needs memory,
    /// so that it may follow a fork.
    [[nodiscard]] std::expected<void, platform::Errno> changeRoot() const noexcept;

private:
    explicit DeviceImage(std::filesystem::path path) : _path(std::move(path)) {}

    [[nodiscard]] Result<void> _openRoot();
    [[nodiscard]] Result<void> _makeMissingParts() const;
    [[nodiscard]] Result<void> _makeDirectory(const char* name, unsigned mode, unsigned owner) const;
    [[nodiscard]] Result<void> _makeFile(const char* name, std::string_view content) const;
    [[nodiscard]] Result<platform::FileDescriptor> _openDirectory(const char* name) const;
    [[nodiscard]] Result<void> _mount(const char* source, const char* target, const char* type, unsigned long flags,
                                      const char* options) const;
    [[nodiscard]] Failure _failure(std::string_view doing, std::string_view name) const;

    std::filesystem::path _path;
    platform::FileDescriptor _root;        ///< in the mount namespace of the calling thread
    platform::FileDescriptor _reservation; ///< locked
};

} // namespace ost::device
