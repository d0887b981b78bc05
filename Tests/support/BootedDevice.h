#pragma once

#include "support/ChildProcess.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <optional>
#include <string>

namespace ost::test {

/// A scratch device that is up: the programs of this build, in processes of their own. The device is shut down in order
/// when the object goes, or when the test process dies. Requires root.
class BootedDevice {
public:
    /// Returns when the daemon serves. Throws when it does not.
    BootedDevice();
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

    /// Ends the daemon in order. The test fails when the launcher does, or when a daemon of this device reported a
    /// broken invariant or a sanitizer's finding.
    void shutDown();

    /// What launcher and daemons wrote to standard error so far.
    [[nodiscard]] std::string complaints() const;

private:
    void _boot();
    [[nodiscard]] std::filesystem::path _makeSignedClient() const;

    std::filesystem::path _scratch;
    std::filesystem::path _image;
    std::filesystem::path _client;
    std::optional<ChildProcess> _launcher;
};

/// A test with a device that is up. Skipped without root.
class BootedDeviceTest : public testing::Test {
protected:
    void SetUp() override;

    [[nodiscard]] BootedDevice& device() { return *_device; }

private:
    std::optional<BootedDevice> _device;
};

/// The program of this build with that name.
std::string builtProgram(const char* name);

} // namespace ost::test
