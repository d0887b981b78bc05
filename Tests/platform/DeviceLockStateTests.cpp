#include "platform/device/DeviceLockState.h"

#include "support/DeviceTest.h"

#include <sys/stat.h>

#include <chrono>
#include <filesystem>

namespace ost::platform {
namespace {

namespace fs = std::filesystem;

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
        fs::remove(deviceLockStateFile);
        test::writeFile("/elsewhere", "1");
        if (place == std::string("symlink"))
            fs::create_symlink("/elsewhere", deviceLockStateFile);
        else if (place == std::string("fifo"))
            ::mkfifo(deviceLockStateFile, 0666);
        else
            fs::create_directory(deviceLockStateFile);
        EXPECT_EQ(deviceLockState(), deviceLockStateUnknown) << place;
    }
}

TEST_F(DeviceLockStateTest, ALockIsSeenHoweverOftenThereWasNoFile) {
    const fs::path directory = fs::path(deviceLockStateFile).parent_path(), others = directory.parent_path() / "others";
    // Nothing is remembered of a directory that has changed in the last two seconds.
    const auto askWithoutFile = [] {
        const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(2100);
        while (std::chrono::steady_clock::now() < end)
            ASSERT_EQ(deviceLockState(), deviceUnlocked);
    };
    fs::create_directory(others);
    test::writeFile(others / "device-lock-state", "1");
    askWithoutFile();
    fs::rename(directory, directory.parent_path() / "former");
    fs::rename(others, directory);
    EXPECT_EQ(deviceLockState(), deviceLocked) << "of another directory";
    fs::remove(deviceLockStateFile);
    askWithoutFile();
    test::writeFile("/new", "1");
    fs::rename("/new", deviceLockStateFile);
    EXPECT_EQ(deviceLockState(), deviceLocked);
    fs::remove_all(directory);
    EXPECT_EQ(deviceLockState(), deviceUnlocked) << "nor a directory";
}

TEST_F(DeviceLockStateTest, IsWrittenIntoAnImage) {
    fs::create_directories("/image/private/var/run");
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
    EXPECT_EQ(callsAfter([] { fs::remove(deviceLockStateFile); }), 1);
    EXPECT_EQ(callsAfter([] { fs::create_hard_link("/etc/group", deviceLockStateFile); }), 1);
    EXPECT_EQ(callsAfter([] { fs::rename(deviceLockStateFile, "/private/var/run/away"); }), 1);
    EXPECT_EQ(callsAfter([] {}), 0);

    fs::remove_all("/private/var/run");
    EXPECT_EQ(DeviceLockStateNotification::registerHandler(*loop, [] { return true; }).error(), ENOENT);
}

} // namespace
} // namespace ost::platform
