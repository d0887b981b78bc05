#include "platform/device/ProtectionClass.h"

#include "platform/base/FileDescriptor.h"
#include "platform/device/DeviceLockState.h"
#include "support/DeviceTest.h"

#include <fcntl.h>
#include <sys/xattr.h>

#include <cstring>

namespace ost::platform {
namespace {

class ProtectionClassTest : public test::DeviceTest {
protected:
    void SetUp() override {
        std::filesystem::create_directory("/directory");
        test::writeFile("/directory/file", "");
        _directory.reset(::open("/directory", O_RDONLY | O_CLOEXEC));
        _file.reset(::open("/directory/file", O_RDONLY | O_CLOEXEC));
    }

    [[nodiscard]] std::int32_t _classOfFile() const { return protectionClass(_file.get(), _directory.get()).value(); }
    static void _lock(bool locked) { ASSERT_TRUE(writeDeviceLockState(locked ? deviceLocked : deviceUnlocked)); }

    FileDescriptor _directory;
    FileDescriptor _file;
};

TEST_F(ProtectionClassTest, IsTheRecordedOneElseTheParentsElseTheDefault) {
    EXPECT_EQ(protectionClass(_directory.get(), -1), 0);
    EXPECT_EQ(_classOfFile(), 3);
    const struct {
        std::int32_t ofParent;
        std::int32_t ofFile;
    } cases[] = {{0, 3}, {1, 1}, {4, 4}, {5, 3}, {-1, 3}, {2, 2}};
    for (const auto& [ofParent, ofFile] : cases) {
        ASSERT_TRUE(setProtectionClass(_directory.get(), ofParent));
        EXPECT_EQ(protectionClass(_directory.get(), -1), ofParent);
        EXPECT_EQ(_classOfFile(), ofFile) << ofParent;
    }
    const FileDescriptor parent(::open("/directory", O_PATH | O_CLOEXEC));
    EXPECT_EQ(protectionClass(_file.get(), parent.get()), 2);
    ASSERT_TRUE(setProtectionClass(_file.get(), 0));
    EXPECT_EQ(_classOfFile(), 0);
    for (const char* nonsense : {"", "4 ", "four", "123456789012345678901234567890"}) {
        ASSERT_EQ(::fsetxattr(_file.get(), "trusted.ostrand.protection-class", nonsense, std::strlen(nonsense), 0), 0);
        EXPECT_EQ(_classOfFile(), 2) << nonsense;
    }
}

TEST_F(ProtectionClassTest, NeedsAnUnlockedDeviceForClassesWithKeys) {
    const struct {
        std::int32_t recorded; ///< -1: none
        std::int32_t wanted;
        int error;
    } cases[] = {{-1, 0, 0},    {-1, 4, 0},    {-1, 1, EPERM}, {-1, 3, EPERM}, {0, 4, 0},    {4, 0, 0},
                 {4, 2, EPERM}, {1, 0, EPERM}, {2, 4, EPERM},  {3, 0, EPERM},  {3, 3, EPERM}};
    for (const auto& [recorded, wanted, error] : cases) {
        ::fremovexattr(_file.get(), "trusted.ostrand.protection-class");
        _lock(false);
        if (recorded >= 0) {
            ASSERT_TRUE(setProtectionClass(_file.get(), recorded));
        }
        const auto before = _classOfFile();
        _lock(true);
        const auto set = setProtectionClass(_file.get(), wanted);
        EXPECT_EQ(set ? Errno(0) : set.error(), error) << recorded << " to " << wanted;
        EXPECT_EQ(_classOfFile(), error == 0 ? wanted : before);
        _lock(false);
        EXPECT_TRUE(setProtectionClass(_file.get(), wanted));
        EXPECT_EQ(_classOfFile(), wanted);
    }
}

TEST_F(ProtectionClassTest, FailsWhereItemsCannotCarryOne) {
    const FileDescriptor foreign(::open("/proc/version", O_RDONLY | O_CLOEXEC));
    EXPECT_EQ(protectionClass(foreign.get(), -1).error(), EBADF);
    for (const std::int32_t wanted : {0, 1, 4})
        EXPECT_EQ(setProtectionClass(foreign.get(), wanted).error(), EBADF);
}

} // namespace
} // namespace ost::platform
