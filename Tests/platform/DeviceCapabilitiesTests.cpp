#include "platform/device/DeviceCapabilities.h"

#include "support/DeviceTest.h"

namespace ost::platform {
namespace {

class DeviceCapabilitiesTest : public test::DeviceTest {};

TEST_F(DeviceCapabilitiesTest, AreThoseTheDeviceStates) {
    EXPECT_FALSE(deviceCapability("InternalBuild"));
    test::writeFile("/etc/device-capabilities",
                    "#InternalBuild=false\nInternalBuild=true\nOff=false\nOdd=yes\nLast=true");
    EXPECT_TRUE(deviceCapability("InternalBuild"));
    EXPECT_TRUE(deviceCapability("Last"));
    for (const char* name : {"Off", "Odd", "Internal", "nternalBuild", ""})
        EXPECT_FALSE(deviceCapability(name)) << name;
}

TEST_F(DeviceCapabilitiesTest, IncludeTheBuildVersion) {
    const std::pair<const char*, std::optional<std::string>> cases[] = {
        {"NAME=x\nBUILD_ID=24A335\n", "24A335"},
        {"BUILD_ID=\"24 \\\"A\\\"\"", "24 \"A\""},
        {"BUILD_ID='a\\b'\n", "a\\b"},
        {"BUILD_ID=\"\n", "\""},
        {"BUILD_ID=\n", ""},
        {"MY_BUILD_ID=1\n", std::nullopt},
    };
    for (const auto& [content, version] : cases) {
        test::writeFile("/etc/os-release", content);
        EXPECT_EQ(buildVersion(), version) << content;
    }
    std::filesystem::remove("/etc/os-release");
    EXPECT_EQ(buildVersion(), std::nullopt);
}

} // namespace
} // namespace ost::platform
