#pragma once

#include "Client/Connection.h"
#include "Device/DeviceImage.h"
#include "EndToEnd/GatedProcess.h"
#include "EndToEnd/Wire.h"
#include "platform/base/FileDescriptor.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <optional>
#include <string>
#include <vector>

namespace ost::test {

/// A scratch device in one boot, whose daemon runs behind a gate and is started and killed at will. The socket is kept
/// meanwhile, as the service launcher does it, so a client waits for a daemon that is starting. Requires root.
class GatedDevice {
public:
    /// The device in the directory, or a new one in a scratch directory.
    explicit GatedDevice(const std::filesystem::path& directory = {});
    GatedDevice(const GatedDevice&) = delete;
    GatedDevice& operator=(const GatedDevice&) = delete;
    /// The test fails when a daemon of this device reported a broken invariant or a sanitizer's finding.
    ~GatedDevice();

    /// Returns before the daemon serves. The fault may befall its start-up.
    void startDaemon(const Fault& fault = {}, GatedCallWatcher watcher = {});
    void killDaemon();
    /// Waits until the daemon has done what a start has to do, the first death-row pass included. False when it ends
    /// before, or does not say so.
    [[nodiscard]] bool waitForFirstPass() const;
    [[nodiscard]] GatedProcess& daemon() { return *_daemon; }
    [[nodiscard]] bool daemonIsUp() const;
    /// The files and directories in which the device keeps things and which the daemon has open, sorted.
    [[nodiscard]] std::vector<std::string> openFilesOfDaemon() const;

    /// A new connection of a client that may use every command. It gives up on a daemon that does not answer.
    [[nodiscard]] ostrand::Connection connect() const;

    /// The device's root directory on the host.
    [[nodiscard]] const std::filesystem::path& image() const { return _image.path(); }
    /// The device's path as the host names it.
    [[nodiscard]] std::filesystem::path onHost(const std::filesystem::path& devicePath) const;
    /// Makes the device the root directory of the calling process: for the body of another gated process.
    void enter() const;

private:
    [[nodiscard]] std::filesystem::path _socket() const;
    [[nodiscard]] platform::FileDescriptor _listen() const;
    [[nodiscard]] int _becomeDaemon() const;

    std::filesystem::path _scratch;
    device::DeviceImage _image;
    platform::FileDescriptor _program, _complaints, _listener;
    wire::Client _client;
    std::optional<GatedProcess> _daemon;
};

/// A test with such a device, whose daemon has done what a start has to do.
class GatedDeviceTest : public testing::Test {
protected:
    void SetUp() override;
    [[nodiscard]] GatedDevice& device() { return *_device; }

private:
    std::optional<GatedDevice> _device;
};

} // namespace ost::test
