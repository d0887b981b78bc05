#pragma once

#include "Support/ChildProcess.h"

#include <sys/types.h>

#include <csignal>
#include <filesystem>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

namespace ost::test {

/// A device that is up: the programs of this build, in processes of their own. The device is shut down in order when
/// the object goes, or when this process dies. Its image stays, and may be booted again. Requires root.
class BootedDevice {
public:
    /// Is told what went wrong in the device, after it was shut down. Must not throw.
    using FaultReport = std::function<void(const std::string& fault)>;

    /// Boots the image at `image`, which is made when it is missing; what else the object needs goes into files beside
    /// it. Returns when the daemon serves. Throws when it does not.
    explicit BootedDevice(std::filesystem::path image, FaultReport report = printFault);
    BootedDevice(const BootedDevice&) = delete;
    BootedDevice& operator=(const BootedDevice&) = delete;
    /// Shuts down; see there.
    ~BootedDevice();

    /// The device's root directory on the host.
    [[nodiscard]] const std::filesystem::path& image() const { return _image; }
    /// What a client connects to.
    [[nodiscard]] std::filesystem::path socket() const;
    /// The device's path as the host names it.
    [[nodiscard]] std::filesystem::path onHost(const std::filesystem::path& devicePath) const;

    struct Outcome {
        int status;
        std::string output;
    };

    /// Runs a copy of the client program that may use every command: `ostrandctl({"lookup", "--class", "2", ...})`.
    Outcome ostrandctl(std::vector<std::string> arguments);

    /// The process id of the daemon that runs now.
    [[nodiscard]] pid_t daemonId() const;

    /// Ends the daemon with a signal, SIGKILL as a crash would, and returns when it is gone. The launcher starts
    /// another one; clients that connect in the meantime wait.
    void killDaemon(int signal = SIGKILL);

    /// Ends the daemon in order and boots the same image again.
    void reboot();

    /// Ends the daemon in order. It is a fault when the launcher fails, or when a daemon of this device reported a
    /// broken invariant or a sanitizer's finding.
    void shutDown();

    /// What launcher and daemons wrote to standard error so far.
    [[nodiscard]] std::string complaints() const;

    /// Prints a fault to standard error.
    static void printFault(const std::string& fault);

private:
    void _boot();
    void _makeSignedClient() const;
    [[nodiscard]] std::filesystem::path _beside(const char* suffix) const;

    std::filesystem::path _image;
    FaultReport _report;
    std::once_flag _clientMade;
    std::optional<ChildProcess> _launcher;
};

/// The program of this build with that name, or, where the environment's OSTRAND_PROGRAMS names a directory, the one in
/// there.
[[nodiscard]] std::string builtProgram(const char* name);

} // namespace ost::test
