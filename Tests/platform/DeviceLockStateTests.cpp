#include "platform/device/DeviceLockState.h"

#include "support/DeviceTest.h"

#include <sys/stat.h>

namespace ost::platform {
namespace {

class DeviceLockStateTest : public test::DeviceTest {};

TEST_F(DeviceLockStateTest, IsTheNumberInItsFile) {
    EXPECT_EQ(deviceLockState(), deviceUnlocked) << "nobody has written one";
    const struct {
        const char* content;
        int state;
    } cases[] = {{"0", 0},
                 {"1", 1},
                 {"1\n", 1},
                 {"2\n", 2},
                 {"", -1},
                 {"-1", -1},
                 {"1x", -1},
                 {"1\n\n", -1},
                 {"locked", -1},
                 {"99999999999", -1},
                 {" 1", -1},
                 {"+1", -1},
                 {"00000000000000000001", -1}};
    for (const auto& [content, state] : cases) {
        test::writeFile(deviceLockStateFile, content);
        EXPECT_EQ(deviceLockState(), state) << content;
    }
    for (const auto& place : {"symlink", "fifo", "directory"}) {
        std::filesystem::remove(deviceLockStateFile);
        test::writeFile("/elsewhere", "1");
        if (place == std::string("symlink"))
            std::filesystem::create_symlink("/elsewhere", deviceLockStateFile);
        else if (place == std::string("fifo"))
            ::mkfifo(deviceLockStateFile, 0666);
        else
            std::filesystem::create_directory(deviceLockStateFile);
        EXPECT_EQ(deviceLockState(), deviceLockStateUnknown) << place;
    }
}

TEST_F(DeviceLockStateTest, IsWrittenIntoAnImage) {
    std::filesystem::create_directories("/image/private/var/run");
    ASSERT_TRUE(writeDeviceLockState(deviceLocked, "/image"));
    EXPECT_EQ(test::readFile("/image/private/var/run/device-lock-state"), "1\n");
    EXPECT_EQ(test::tree("/image/private/var/run"), "-rw-r--r-- 0:0 device-lock-state\n");
    EXPECT_EQ(writeDeviceLockState(deviceLocked, "/no-image").error(), ENOENT);
}

TEST_F(DeviceLockStateTest, NotifiesOnceAboutChangesThatComeTogether) {
    auto loop = RunLoop::create().value();
    int calls = 0;
    const auto registration = DeviceLockStateNotification::registerHandler(*loop, [&] { return ++calls > 0; }).value();
    const auto callsAfter = [&](auto change) {
        calls = 0;
        change();
        loop->async([&] { loop->stop(); });
        loop->run();
        return calls;
    };
    EXPECT_EQ(callsAfter([] { test::writeFile("/private/var/run/device-lock-state.old", "1"); }), 0);
    EXPECT_EQ(callsAfter([] {
                  EXPECT_TRUE(writeDeviceLockState(1));
                  EXPECT_TRUE(writeDeviceLockState(0));
              }),
              1);
    EXPECT_EQ(callsAfter([] { test::writeFile(deviceLockStateFile, "1"); }), 1);
    EXPECT_EQ(callsAfter([] { std::filesystem::remove(deviceLockStateFile); }), 1);
    EXPECT_EQ(callsAfter([] { std::filesystem::create_hard_link("/etc/group", deviceLockStateFile); }), 1);
    EXPECT_EQ(callsAfter([] { std::filesystem::rename(deviceLockStateFile, "/private/var/run/away"); }), 1);
    EXPECT_EQ(callsAfter([] {}), 0);

    std::filesystem::remove_all("/private/var/run");
    EXPECT_EQ(DeviceLockStateNotification::registerHandler(*loop, [] { return true; }).error(), ENOENT);
}

} // namespace
} // namespace ost::platform
