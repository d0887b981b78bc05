#include "Client/Containers.h"
#include "EndToEnd/GatedDevice.h"
#include "EndToEnd/StoreView.h"
#include "Support/ScratchDirectory.h"
#include "files/OSTFileManager.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <sys/mount.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <iterator>
#include <set>
#include <string>

namespace ost::test {
namespace {

namespace fs = std::filesystem;

/// A container on one file system, to be moved to another.
class MoveFaultTest : public testing::Test {
protected:
    void SetUp() override {
        if (::geteuid() != 0)
            GTEST_SKIP() << "A file system can be mounted by root only";
        fs::create_directories(_other);
        ASSERT_EQ(::mount("tmpfs", _other.c_str(), "tmpfs", 0, nullptr), 0);
    }
    void TearDown() override { ::umount2(_other.c_str(), MNT_DETACH); }

    /// Moves a fresh container in a process of its own, where the fault befalls it. Gives the process's course.
    GatedProcess::Course move(const Fault& fault) {
        fs::remove_all(source);
        fs::remove_all(destination);
        for (const char* file : {"Documents/a", "Documents/b", "Library/Caches/c"})
            writeFile(source / file, file);
        whole = tree(source);
        GatedProcess process(
            [this] {
                return OSTFileManager::defaultManager().moveItemAtURL(source.native(), destination.native()) ? 0 : 1;
            },
            fault);
        status = process.wait();
        return process.conclude();
    }

    [[nodiscard]] bool isWhole(const fs::path& item) const { return fs::exists(item) && tree(item) == whole; }

private:
    const fs::path _scratch = makeScratchDirectory();
    const fs::path _other = _scratch / "other";

protected:
    const fs::path source = _scratch / "one/container";
    const fs::path destination = _other / "container";
    std::string whole;
    int status = 0; ///< of the process that moved last
};

TEST_F(MoveFaultTest, AKillAtAnyMomentLeavesAWholeContainerAndNoPartOfOne) {
    std::set<std::pair<bool, bool>> outcomes;
    for (unsigned call = 1;; ++call) {
        const auto course = move({.kind = Fault::Kind::kill, .call = call});
        SCOPED_TRACE("killed at call " + std::to_string(call) + ", " + course.faultedCall);
        const bool stays = isWhole(source), arrived = isWhole(destination);
        EXPECT_TRUE(stays || arrived);
        EXPECT_EQ(fs::exists(source), stays) << "a part is left behind";
        EXPECT_EQ(fs::exists(destination), arrived) << "a part has arrived";
        outcomes.emplace(stays, arrived);
        if (HasFailure() || course.faultedCall.empty())
            break;
    }
    EXPECT_EQ((std::set<std::pair<bool, bool>>{{true, false}, {true, true}, {false, true}}), outcomes);
}

TEST_F(MoveFaultTest, ACallThatFailsMovesAllOrNothing) {
    for (unsigned call = 1;; ++call) {
        const auto course = move({.kind = Fault::Kind::fail, .call = call, .error = EIO});
        SCOPED_TRACE("fails at call " + std::to_string(call) + ", " + course.faultedCall);
        EXPECT_TRUE(isWhole(status == 0 ? destination : source));
        EXPECT_FALSE(status != 0 && fs::exists(destination));
        if (HasFailure() || course.faultedCall.empty())
            break;
    }
    EXPECT_EQ(status, 0);
    EXPECT_FALSE(fs::exists(source));
}

/// A device whose bundles lie on a file system of their own.
class MoveLeftoversTest : public GatedDeviceTest {
protected:
    void SetUp() override {
        GatedDeviceTest::SetUp();
        if (IsSkipped())
            return;
        _other = device().onHost("/private/var/containers");
        fs::create_directories(_other);
        ASSERT_EQ(::mount("tmpfs", _other.c_str(), "tmpfs", 0, "mode=755"), 0);
    }
    void TearDown() override { ::umount2(_other.c_str(), MNT_DETACH); }

    /// What lies where only containers belong, beside whole ones.
    [[nodiscard]] std::vector<std::string> strays() {
        auto names = namesIn(_other / "Bundle/Application");
        std::erase_if(names, [](const std::string& name) { return !name.starts_with('.'); });
        std::ranges::copy(leftovers(device().image()), std::back_inserter(names));
        return names;
    }

private:
    fs::path _other;
};

TEST_F(MoveLeftoversTest, TheNextStartRemovesWhatAKillLeft) {
    const ostrand::ContainerRequest bundle{
        .containerClass = ostrand::ContainerClass::bundleApplication, .user = 33, .identifier = "com.example.bundle"};
    bool strayed = false;
    for (unsigned call = 1;; ++call) {
        auto connection = device().connect();
        device().daemon().prepare({.kind = Fault::Kind::kill, .call = call});
        if (ostrand::createOrLookup(connection, bundle, ostrand::WhenMissing::create))
            (void)ostrand::deleteContainer(connection, bundle);
        const auto course = device().daemon().conclude();
        SCOPED_TRACE("killed at call " + std::to_string(call) + ", " + course.faultedCall);
        strayed = strayed || !strays().empty();
        if (course.faultedCall.empty())
            break;
        device().startDaemon();
        ASSERT_TRUE(device().waitForFirstPass());
        ASSERT_EQ(std::vector<std::string>(), strays());
    }
    EXPECT_TRUE(strayed);
}

} // namespace
} // namespace ost::test
