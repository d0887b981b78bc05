#pragma once

#include "Client/Connection.h"
#include "support/ChildProcess.h"

#include <sys/types.h>

#include <cstdint>
#include <filesystem>
#include <string>

namespace ost::benchmarks {

/// The program of this build with that name.
[[nodiscard]] std::string builtProgram(const std::string& name);

/// A device image with the daemon running in it, from construction to destruction. The image stays, and may be booted
/// again.
class BootedDevice {
public:
    /// Boots the image at `image`, which is made when it is missing, and waits until the daemon serves.
    explicit BootedDevice(const std::filesystem::path& image);

    [[nodiscard]] ostrand::Connection connect() const;
    /// As the installer does: an upcall for an identifier that nobody knows leaves lines in the log.
    void registerApplication(const std::string& identifier) const;
    [[nodiscard]] std::string socketPath() const;
    /// The path by which the host finds what a reply names.
    [[nodiscard]] std::filesystem::path hostPath(const std::string& devicePath) const;

    /// The daemon's resident memory that is its own.
    [[nodiscard]] std::uint64_t residentBytes() const;

private:
    [[nodiscard]] pid_t _daemonId() const;

    std::filesystem::path _image;
    ChildProcess _launcher;
};

} // namespace ost::benchmarks
