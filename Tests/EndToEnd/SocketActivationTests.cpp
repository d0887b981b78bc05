#include "Device/DeviceImage.h"
#include "Support/BootedDevice.h"
#include "Support/ScratchDirectory.h"
#include "support/DeviceTest.h"
#include "support/Sanitized.h"

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

using namespace ost::test;

namespace {

TEST(SocketActivation, TheDaemonServesWhatSystemdHandsOver) {
    if (isSanitized)
        GTEST_SKIP() << "the daemon needs files of the host";
    if (geteuid() != 0 || ::access("/usr/bin/systemd-socket-activate", X_OK) != 0)
        GTEST_SKIP() << "needs root and systemd-socket-activate";
    const auto scratch = makeScratchDirectory(), image = scratch / "device";
    ASSERT_TRUE(ost::device::DeviceImage::openOrMake(image));
    const auto daemon = image / "ostrandd", client = scratch / "ostrandctl", errors = scratch / "errors";
    std::filesystem::copy_file(builtProgram("ostrandd"), daemon);
    std::filesystem::copy_file(builtProgram("ostrandctl"), client);
    const auto socket = image / "private/var/run/com.tamarok.ostrandd";

    // As the unit's RootDirectory= and BindPaths= do; what is mounted goes with the process.
    const std::string script = "mount --types tmpfs shm '" + image.string() + "/dev/shm' && mount --rbind /proc '" +
                               image.string() + "/proc' && exec systemd-socket-activate --listen='" + socket.string() +
                               "' --fdname=com.tamarok.ostrandd /usr/sbin/chroot '" + image.string() +
                               "' /ostrandd 2>&1";
    ChildProcess launcher({"/usr/bin/unshare", "--mount", "/bin/sh", "-c", script});
    const auto listening = launcher.readLine();
    ASSERT_TRUE(listening.starts_with("Listening on ")) << listening;
    struct stat before{}, after{};
    ASSERT_EQ(::stat(socket.c_str(), &before), 0);

    ChildProcess sign({builtProgram("ostrandctl"), "sign", client, "--identifier", "com.example.a"});
    ASSERT_EQ(sign.wait(), 0);
    ChildProcess create({client, "--device", image, "system", "path", "--identifier", "com.example.a"}, errors);
    EXPECT_EQ(create.wait(), 1);
    EXPECT_NE(readFile(errors).find("refused"), std::string::npos) << "it was answered: no entitlements, no service";
    ASSERT_EQ(::stat(socket.c_str(), &after), 0);
    EXPECT_EQ(before.st_ino, after.st_ino) << "the socket is the one that was handed over, not one of the daemon's";
    launcher.signal(SIGTERM);
    EXPECT_EQ(launcher.wait(), 0);
}

} // namespace
