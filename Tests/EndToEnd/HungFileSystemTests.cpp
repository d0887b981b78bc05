#include "EndToEnd/DeviceLog.h"
#include "EndToEnd/Wire.h"
#include "Support/ScratchDirectory.h"
#include "support/BootedDeviceTest.h"
#include "support/ServedFileSystem.h"

#include <gtest/gtest.h>

#include <sched.h>
#include <sys/mount.h>
#include <unistd.h>

#include <filesystem>
#include <optional>
#include <vector>

namespace ost::test::wire {

namespace {

/// More than the daemon has threads for at first.
constexpr std::size_t connectionsOfTheHung = 16;

class HungFileSystemTest : public BootedDeviceTest {
protected:
    void SetUp() override {
        BootedDeviceTest::SetUp();
        if (!IsSkipped() && ::access("/dev/fuse", R_OK | W_OK) != 0)
            GTEST_SKIP() << "this host has no FUSE";
    }

    /// Connections of a client whose program lies there.
    std::vector<Connection> connect(const ServedFileSystem& fileSystem) { return connect(fileSystem.program()); }
    std::vector<Connection> connect(const std::filesystem::path& program) {
        _client.emplace(device().socket(), Identity{.user = 501, .program = program});
        std::vector<Connection> connections;
        for (std::size_t i = 0; i < connectionsOfTheHung; ++i)
            connections.push_back(_client->connect());
        return connections;
    }

    /// Each asks for something once their program's file system has stopped answering.
    static void hang(ServedFileSystem& fileSystem, std::vector<Connection>& connections) {
        fileSystem.stopAnswering();
        for (auto& connection : connections)
            connection.send(creation(1, "com.example.hung"));
    }

    void expectServiceOfOthers() {
        const Client other(device().socket(), allowed());
        EXPECT_EQ(other.connect().call(creation(1, "com.example.other")).error(), 1U);
    }

private:
    std::optional<Client> _client;
};

} // namespace

TEST_F(HungFileSystemTest, TheServerOfAUsersFileSystemIsNotAsked) {
    for (const bool inTheTree : {true, false}) {
        ServedFileSystem fileSystem(builtProgram("wire-client"), true);
        auto connections = connect(fileSystem);
        fileSystem.stopAnswering();
        if (!inTheTree)
            fileSystem.detach();
        for (auto& connection : connections)
            connection.send(creation(1, "com.example.hung"));
        expectServiceOfOthers();
        for (auto& connection : connections)
            EXPECT_TRUE(connection.isClosed()) << "in the tree: " << inTheTree;
    }
}

TEST_F(HungFileSystemTest, ItsMakerDoesNotHaveToForbidSetUserIdInAMountTableOfHisOwn) {
    ASSERT_EQ(::unshare(CLONE_NEWNS), 0);
    ServedFileSystem fileSystem(builtProgram("wire-client"), false);
    auto connections = connect(fileSystem);
    hang(fileSystem, connections);
    for (auto& connection : connections)
        EXPECT_TRUE(connection.isClosed());
}

TEST_F(HungFileSystemTest, AUserWhoLaysOneOverAnotherWaitsAlone) {
    ASSERT_EQ(::unshare(CLONE_NEWNS), 0);
    const auto place = makeScratchDirectory(0755);
    std::vector<Connection> connections;
    {
        ServedFileSystem fileSystem(builtProgram("wire-client"), false);
        const auto layers = "lowerdir=" + place.string() + ":" + fileSystem.program().parent_path().string();
        if (::mount("test", place.c_str(), "overlay", MS_NOSUID | MS_NODEV, layers.c_str()) != 0)
            GTEST_SKIP() << "this host has no overlays: errno " << errno;
        connections = connect(place / "program");
        hang(fileSystem, connections);
        expectServiceOfOthers();
    }
    for (auto& connection : connections)
        EXPECT_TRUE(connection.isClosed());
    ::umount2(place.c_str(), MNT_DETACH);
}

TEST_F(HungFileSystemTest, AnAdministratorsThatHangsKeepsItsOwnClientsWaiting) {
    std::vector<Connection> connections;
    {
        ServedFileSystem fileSystem(builtProgram("wire-client"), false);
        connections = connect(fileSystem);
        hang(fileSystem, connections);
        expectServiceOfOthers();
    }
    for (auto& connection : connections)
        EXPECT_TRUE(connection.isClosed());
}

} // namespace ost::test::wire
