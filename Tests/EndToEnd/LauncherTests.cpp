#include "Support/ScratchDirectory.h"
#include "support/BootedDeviceTest.h"
#include "support/DeviceTest.h"

#include <fcntl.h>
#include <sched.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstdint>

using namespace ost::test;
using ost::platform::FileDescriptor;

namespace {

constexpr const char* clientSocket = "private/var/run/com.tamarok.ostrandd";
constexpr const char* upcallSocket = "private/var/run/com.tamarok.ostrandd.upcall";

/// A connection, empty when nobody takes it.
FileDescriptor connectionTo(const std::filesystem::path& path, int type) {
    FileDescriptor connection(::socket(AF_UNIX, type | SOCK_CLOEXEC, 0));
    sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
    path.string().copy(address.sun_path, sizeof address.sun_path - 1);
    if (::connect(connection.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
        connection.reset();
    return connection;
}

bool connects(const std::filesystem::path& path) { return static_cast<bool>(connectionTo(path, SOCK_STREAM)); }

/// The first connection that the socket takes.
FileDescriptor firstConnectionTo(const std::filesystem::path& socket, int type) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    auto connection = connectionTo(socket, type);
    while (!connection && std::chrono::steady_clock::now() < deadline) {
        ::sched_yield();
        connection = connectionTo(socket, type);
    }
    return connection;
}

/// Whether the socket becomes one that takes connections.
bool comesUp(const std::filesystem::path& socket) { return static_cast<bool>(firstConnectionTo(socket, SOCK_STREAM)); }

class LauncherTest : public testing::Test {
protected:
    void SetUp() override {
        if (::geteuid() != 0)
            GTEST_SKIP() << "A device can be booted by root only";
        _scratch = makeScratchDirectory();
    }

    [[nodiscard]] std::filesystem::path image() const { return _scratch / "device"; }

    ChildProcess start(std::vector<std::string> arguments) const {
        arguments.insert(arguments.begin(), builtProgram("ostrand-device"));
        return ChildProcess(std::move(arguments), _scratch / "complaints");
    }

    [[nodiscard]] ChildProcess boot(std::vector<std::string> further = {}) const {
        further.insert(further.begin(), {"boot", "--image", image()});
        return start(std::move(further));
    }

    /// The exit status of a boot with a shell command.
    [[nodiscard]] int bootWith(const std::string& command) const { return boot({"--", "sh", "-c", command}).wait(); }

    [[nodiscard]] std::string complaints() const { return readFile(_scratch / "complaints"); }

private:
    std::filesystem::path _scratch;
};

using LauncherRestartTest = BootedDeviceTest;

} // namespace

TEST_F(LauncherTest, MakesAnImageOnceAndBootsItAgain) {
    writeFile(image() / "etc/device-capabilities", "InternalBuild=true\n");
    ASSERT_EQ(bootWith("true"), 0) << complaints();
    for (const char* line :
         {"drwxr-xr-x 0:0 dev/shm\n", "-rw-r--r-- 0:0 etc/group\n", "-rw-r--r-- 0:0 etc/os-release\n",
          "-rw-r--r-- 0:0 etc/passwd\n", "drwxr-xr-x 0:0 private/var/db\n", "drwxr-xr-x 501:501 private/var/mobile\n",
          "drwx------ 0:0 private/var/root\n", "drwxr-xr-x 0:0 private/var/run\n",
          "drwxr-xr-x 33:33 private/var/tessalyd\n", "dr-xr-xr-x 0:0 proc\n", "drwxrwxrwt 0:0 tmp\n"})
        EXPECT_NE(tree(image()).find(line), std::string::npos) << line << "is not in\n" << tree(image());
    EXPECT_EQ(readFile(image() / "etc/device-capabilities"), "InternalBuild=true\n");

    writeFile(image() / "etc/passwd", readFile(image() / "etc/passwd") + "guest:x:502:502::/private/var/guest:\n");
    writeFile(image() / "private/var/run/assertions/old/1", "from the boot before");
    std::filesystem::create_directory_symlink(image() / "etc", image() / "private/var/run/link");
    const std::string passwd = readFile(image() / "etc/passwd");
    ASSERT_EQ(bootWith("test ! -e $OSTRAND_DEVICE/private/var/run/assertions"), 0) << complaints();
    EXPECT_EQ(readFile(image() / "etc/passwd"), passwd);
    EXPECT_FALSE(std::filesystem::is_symlink(image() / "private/var/run/link"));
}

TEST_F(LauncherTest, RunsTheCommandOnTheHostAndExitsWithItsStatus) {
    EXPECT_EQ(bootWith("exit 7"), 7);
    EXPECT_EQ(bootWith("kill -KILL $$"), 137);
    EXPECT_EQ(boot({"--", "/no/such/program"}).wait(), 127);
    auto launcher = boot({"--", "sh", "-c", "pwd; echo $OSTRAND_DEVICE; ls $OSTRAND_DEVICE/proc; cat"});
    EXPECT_EQ(launcher.readLine(), std::filesystem::current_path());
    EXPECT_EQ(launcher.readLine(), image());
    launcher.closeInput();
    EXPECT_EQ(launcher.readAll(), "") << "The host sees what is mounted for the device";
    EXPECT_EQ(launcher.wait(), 0);
}

TEST_F(LauncherTest, GivesUpOnADaemonThatDoesNotServe) {
    EXPECT_EQ(boot({"--daemon", "/bin/false", "--", "touch", image() / "ran"}).wait(), 1);
    EXPECT_FALSE(std::filesystem::exists(image() / "ran"));
    EXPECT_EQ(boot({"--daemon", "/no/such/daemon"}).wait(), 1);
}

TEST_F(LauncherTest, EndsTheDaemonInOrderWhenItIsAskedTo) {
    for (const int number : {SIGTERM, SIGINT}) {
        auto launcher = boot();
        ASSERT_TRUE(comesUp(image() / clientSocket)) << complaints();
        launcher.signal(number);
        EXPECT_EQ(launcher.wait(), 0) << complaints();
        EXPECT_FALSE(connects(image() / clientSocket)) << "Somebody still has the socket";
    }
    auto launcher = boot({"--", "sh", "-c", "echo serving; exec sleep 1000"});
    ASSERT_EQ(launcher.readLine(), "serving");
    launcher.signal(SIGTERM);
    EXPECT_EQ(launcher.wait(), 128 + SIGTERM) << complaints();
}

TEST_F(LauncherTest, AnUpcallThatComesBeforeTheDaemonIsAnswered) {
    auto launcher = boot();
    const auto connection = firstConnectionTo(image() / upcallSocket, SOCK_SEQPACKET);
    const std::array<std::uint32_t, 6> refusedMessage{0, sizeof refusedMessage, 0, 0, 0, 322514901};
    ASSERT_EQ(::send(connection.get(), refusedMessage.data(), sizeof refusedMessage, MSG_NOSIGNAL), 24) << complaints();
    std::array<char, 64> reply{};
    EXPECT_EQ(::recv(connection.get(), reply.data(), reply.size(), 0), 36);
    launcher.signal(SIGTERM);
    EXPECT_EQ(launcher.wait(), 0) << complaints();
}

TEST_F(LauncherTest, OneBootOfAnImageAtATime) {
    auto launcher = boot({"--", "sh", "-c", "echo serving; exec cat"});
    ASSERT_EQ(launcher.readLine(), "serving") << complaints();
    EXPECT_EQ(bootWith("true"), 1);
    EXPECT_TRUE(connects(image() / clientSocket)) << "The refused boot harmed the running one";

    launcher.signal(SIGKILL);
    EXPECT_EQ(launcher.wait(), 128 + SIGKILL);
    launcher.closeInput();
    EXPECT_EQ(launcher.readAll(), "") << "The daemon outlives its launcher"; // It would keep the pipe open.
    EXPECT_EQ(bootWith("true"), 0) << complaints();
}

TEST_F(LauncherTest, RefusesArgumentsThatMakeNoSense) {
    const std::string directory = image();
    const std::vector<std::vector<std::string>> refused{{},
                                                        {"start"},
                                                        {"boot"},
                                                        {"boot", "--image"},
                                                        {"boot", "--image", directory, "--fast"},
                                                        {"boot", "--image", directory, "true"},
                                                        {"boot", "--image", directory, "--"}};
    for (const auto& arguments : refused)
        EXPECT_EQ(start(arguments).wait(), 2) << testing::PrintToString(arguments);
    EXPECT_FALSE(std::filesystem::exists(image()));
    for (const auto& arguments : {std::vector<std::string>{"--help"}, {"boot", "--help"}}) {
        auto launcher = start(arguments);
        EXPECT_TRUE(launcher.readLine().starts_with("Usage: ostrand-device boot --image DIR"));
        EXPECT_EQ(launcher.wait(), 0);
    }
}

TEST_F(LauncherRestartTest, KeepsTheSocketsWhileTheDaemonRestarts) {
    const auto inodeOf = [&](const char* socket) {
        struct stat status{};
        EXPECT_EQ(::stat((device().image() / socket).c_str(), &status), 0);
        EXPECT_EQ(status.st_mode, S_IFSOCK | 0666U) << socket;
        return status.st_ino;
    };
    const auto client = inodeOf(clientSocket);
    const auto upcall = inodeOf(upcallSocket);
    const std::vector<std::string> create{"create", "--class",      "Data/Application",    "--user",
                                          "mobile", "--identifier", "com.example.Sketches"};
    EXPECT_EQ(device().ostrandctl(create).status, 0) << device().complaints();
    const std::string existing = device().ostrandctl(create).output;
    for (int kill = 0; kill < 3; ++kill) {
        device().killDaemon();
        // No daemon, or one that is starting: the client waits for it.
        EXPECT_EQ(device().ostrandctl(create).output, existing) << device().complaints();
    }
    EXPECT_EQ(inodeOf(clientSocket), client);
    EXPECT_EQ(inodeOf(upcallSocket), upcall);
}
