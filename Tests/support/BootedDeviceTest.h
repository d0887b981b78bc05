#pragma once

#include "Support/BootedDevice.h"

#include <gtest/gtest.h>

#include <optional>

namespace ost::test {

/// A new device that is up. Its faults fail the test.
class ScratchDevice : public BootedDevice {
public:
    ScratchDevice();
};

/// A test with a device that is up. Skipped without root.
class BootedDeviceTest : public testing::Test {
protected:
    void SetUp() override;

    [[nodiscard]] BootedDevice& device() { return *_device; }

private:
    std::optional<ScratchDevice> _device;
};

} // namespace ost::test
