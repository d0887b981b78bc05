#include "support/BootedDeviceTest.h"

#include "Support/ScratchDirectory.h"

#include <unistd.h>

namespace ost::test {

ScratchDevice::ScratchDevice()
    : BootedDevice(makeScratchDirectory(0755) / "device", [](const std::string& fault) { ADD_FAILURE() << fault; }) {}

void BootedDeviceTest::SetUp() {
    if (::geteuid() != 0)
        GTEST_SKIP() << "A device can be booted by root only";
    _device.emplace();
}

} // namespace ost::test
