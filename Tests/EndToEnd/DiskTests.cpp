#include "EndToEnd/DeviceLog.h"
#include "EndToEnd/StoreView.h"
#include "EndToEnd/Wire.h"
#include "support/BootedDeviceTest.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <fstream>
#include <functional>

namespace ost::test::wire {

using testing::PrintToString;

namespace {

constexpr uid_t mobile = 501;
const std::filesystem::path var = "/private/var";
const std::filesystem::path home = var / "mobile";
const std::filesystem::path classDirectory = home / "Containers/Data/Application";
const std::filesystem::path staging = var / "root/Library/Caches/com.tamarok.ostrandd/Staging";
const std::filesystem::path logFile = var / "root/Library/Logs/Ostrand/ostrandd.log";

class DiskTest : public BootedDeviceTest {
protected:
    void SetUp() override {
        BootedDeviceTest::SetUp();
        if (!IsSkipped())
            _caller.emplace(device().socket(), allowed());
    }

    [[nodiscard]] Connection connect() const { return _caller->connect(); }
    [[nodiscard]] Reply create(std::string_view identifier) const { return connect().call(creation(1, identifier)); }

    /// A path of the device as its daemon sees it, mounts included.
    [[nodiscard]] std::filesystem::path inDevice(const std::filesystem::path& path) {
        return "/proc/" + std::to_string(device().daemonId()) + "/root/" + path.relative_path().native();
    }

    /// Mounts as the device's launcher would: nobody else sees it, and it ends with the device.
    void mountInDevice(const std::filesystem::path& directory, const char* type, unsigned long flags,
                       const char* options) {
        const auto space = "/proc/" + std::to_string(device().daemonId()) + "/ns/mnt";
        const auto target = device().onHost(directory);
        const pid_t child = ::fork();
        if (child == 0) {
            const platform::FileDescriptor mounts(::open(space.c_str(), O_RDONLY | O_CLOEXEC));
            ::_exit(::setns(mounts.get(), CLONE_NEWNS) == 0 &&
                            ::mount(target.c_str(), target.c_str(), type, flags, options) == 0
                        ? 0
                        : errno);
        }
        int status = 0;
        ASSERT_EQ(::waitpid(child, &status, 0), child);
        ASSERT_EQ(status, 0) << directory << ": " << std::strerror(WEXITSTATUS(status));
    }

    void mountMemory(const std::filesystem::path& directory) {
        mountInDevice(directory, "tmpfs", 0, "size=1m,nr_inodes=400,mode=755");
        if (directory == var)
            std::filesystem::create_directories(inDevice(var / "root"));
        std::filesystem::create_directories(inDevice(home));
        ASSERT_EQ(::chown(inDevice(home).c_str(), mobile, mobile), 0);
    }

    void setReadOnly(const std::filesystem::path& mountedDirectory, bool readOnly) {
        mountInDevice(mountedDirectory, nullptr, MS_REMOUNT | MS_BIND | (readOnly ? unsigned{MS_RDONLY} : 0U), nullptr);
    }

private:
    std::optional<Client> _caller;
};

/// Something that keeps a container from being made.
struct Obstacle {
    const char* name;
    enum class Kind : std::uint8_t { noBlocks, noInodes, readOnly } kind;
    std::filesystem::path directory; ///< where a file system of its own is mounted
    std::uint64_t error;             ///< what a creation is answered
    const char* message;             ///< and its error line
};

void PrintTo(const Obstacle& obstacle, std::ostream* out) { *out << obstacle.name; }

class ObstacleTest : public DiskTest, public testing::WithParamInterface<Obstacle> {
protected:
    void putUp(const Obstacle& obstacle) {
        if (obstacle.kind == Obstacle::Kind::readOnly)
            return setReadOnly(obstacle.directory, true);
        const auto filler = inDevice(obstacle.directory / "filler");
        std::filesystem::create_directory(filler);
        for (unsigned number = 0;; ++number) {
            std::ofstream file(filler / std::to_string(number));
            if (obstacle.kind == Obstacle::Kind::noBlocks && file)
                while (file << std::string(4096, 'x') << std::flush)
                    continue;
            if (!file)
                return;
        }
    }

    void takeAway(const Obstacle& obstacle) {
        if (obstacle.kind == Obstacle::Kind::readOnly)
            return setReadOnly(obstacle.directory, false);
        std::filesystem::remove_all(inDevice(obstacle.directory / "filler"));
    }
};

} // namespace

TEST_P(ObstacleTest, ACreationFailsWithItsCodeAndLeavesNothingHalfMade) {
    const auto& obstacle = GetParam();
    if (obstacle.directory == classDirectory) {
        ASSERT_EQ(create("com.example.below").error(), 1U);
        mountInDevice(classDirectory, nullptr, MS_BIND, nullptr);
    } else {
        mountMemory(obstacle.directory);
    }
    ASSERT_EQ(create("com.example.first").error(), 1U);
    const auto daemon = device().daemonId();
    const auto descriptors = openDescriptors(daemon);
    const auto before = namesIn(inDevice(classDirectory));

    putUp(obstacle);
    for (int attempt = 0; attempt < 10; ++attempt) {
        DeviceLog log(device());
        const auto refused = create("com.example.second");
        EXPECT_EQ(refused.error(), obstacle.error);
        EXPECT_EQ(refused.keys(), "ReplyError");
        const auto errors = log.takeErrors();
        EXPECT_TRUE(std::ranges::any_of(errors, [&](const auto& line) { return line.contains(obstacle.message); }))
            << PrintToString(errors);
        EXPECT_EQ(namesIn(inDevice(classDirectory)), before);
        EXPECT_EQ(namesIn(inDevice(staging)), std::vector<std::string>());
        EXPECT_EQ(create("com.example.first").error(), 1U) << "what is there is still found";
    }

    takeAway(obstacle);
    const auto made = create("com.example.second");
    EXPECT_EQ(made.error(), 1U);
    EXPECT_EQ(namesIn(inDevice(classDirectory)).size(), before.size() + 1);
    EXPECT_EQ(device().daemonId(), daemon) << "the daemon did not survive";
    EXPECT_TRUE(comesTrue([&] { return openDescriptors(daemon) <= descriptors; })) << openDescriptors(daemon);
}

using enum Obstacle::Kind;
INSTANTIATE_TEST_SUITE_P(
    Disk, ObstacleTest,
    testing::Values(Obstacle{"EverythingFull", noBlocks, var, 34, "Failed to write metadata dictionary to URL "},
                    Obstacle{"NoInodes", noInodes, var, 9, "Failed to remove staging dir: "},
                    Obstacle{"EverythingReadOnly", readOnly, var, 9, "Failed to remove staging dir: "},
                    Obstacle{"UserFull", noBlocks, home, 8, "Failed to move staging dir: "},
                    Obstacle{"UserHasNoInodes", noInodes, home, 8, "Failed to move staging dir: "},
                    Obstacle{"UserReadOnly", readOnly, home, 8, "Failed to move staging dir: "},
                    Obstacle{"ClassDirectoryReadOnly", readOnly, classDirectory, 8, "Failed to move staging dir: "}),
    [](const auto& test) { return test.param.name; });

TEST_F(DiskTest, AnUnwritableLogHarmsNobodyAndIsWrittenAgainWhenItCanBe) {
    const auto log = device().onHost(logFile);
    const auto refusedRequest = [&] {
        DeviceLog errors(device());
        EXPECT_EQ(create("com.example.a").error(), 1U);
        EXPECT_TRUE(connect().isRefused(request(1, {{"Command", number(26)}})));
        EXPECT_EQ(errors.takeErrors(), std::vector<std::string>{"OSTProcessVexelEvent: Invalid command index: 26"});
    };
    const struct {
        const char* what;
        std::function<void()> replaceLog;
    } rows[] = {
        {"a pipe", [&] { ASSERT_EQ(::mkfifo(log.c_str(), 0600), 0); }},
        {"a directory", [&] { std::filesystem::create_directory(log); }},
        {"a link to another file", [&] { std::filesystem::create_symlink(device().onHost("/etc/passwd"), log); }},
        {"a log on a full disk",
         [&] {
             mountInDevice(logFile.parent_path(), "tmpfs", 0, "size=4k");
             std::ofstream(inDevice(logFile.parent_path() / "filler")) << std::string(4096, 'x');
         }},
    };
    const auto passwd = readFile(device().onHost("/etc/passwd"));
    for (const auto& [what, replaceLog] : rows) {
        SCOPED_TRACE(what);
        std::filesystem::remove_all(log);
        replaceLog();
        device().killDaemon();
        refusedRequest();
    }
    EXPECT_EQ(readFile(device().onHost("/etc/passwd")), passwd);
    std::filesystem::remove(inDevice(logFile.parent_path() / "filler"));
    for (int removals = 0; removals < 2; ++removals) {
        refusedRequest();
        EXPECT_NE(readFile(inDevice(logFile)).find("Invalid command index: 26"), std::string::npos);
        std::filesystem::remove(inDevice(logFile)); // while the daemon has it open
    }
}

} // namespace ost::test::wire
