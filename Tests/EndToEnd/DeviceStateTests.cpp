#include "EndToEnd/DeviceLog.h"
#include "EndToEnd/StoreView.h"
#include "EndToEnd/Wire.h"
#include "support/BootedDeviceTest.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <sys/stat.h>

#include <algorithm>
#include <map>

namespace ost::test::wire {

namespace {

class DeviceStateTest : public BootedDeviceTest {
protected:
    void SetUp() override {
        BootedDeviceTest::SetUp();
        if (!IsSkipped())
            _caller.emplace(device().socket(), allowed());
    }

    [[nodiscard]] Connection connect() const { return _caller->connect(); }

private:
    std::optional<Client> _caller;
};

} // namespace

TEST_F(DeviceStateTest, TheLockStateDoesNotDisturbService) {
    const auto stateFile = device().onHost("/private/var/run/device-lock-state");
    const auto newFile = device().onHost("/private/var/run/device-lock-state.new");
    DeviceLog log(device());
    int count = 0;
    for (const char* state : {"1\n", "1", "0\n", "0", "2\n", "", "-1", "1 0", "99999999999999999999", "locked", "1\n"})
        for (const bool replaced : {false, true}) {
            writeFile(replaced ? newFile : stateFile, state);
            if (replaced)
                std::filesystem::rename(newFile, stateFile);
            const auto made = connect().call(creation(1, "com.example." + std::to_string(count++)));
            EXPECT_EQ(made.error(), 1U) << state;
        }
    std::filesystem::remove(stateFile);
    ASSERT_EQ(::mkfifo(stateFile.c_str(), 0600), 0); // Nobody ever writes into it.
    EXPECT_EQ(connect().call(creation(1, "com.example.pipe")).error(), 1U);
    std::filesystem::remove(stateFile);
    EXPECT_EQ(connect().call(creation(1, "com.example.last")).error(), 1U);
    EXPECT_EQ(log.takeErrors(), std::vector<std::string>());
    EXPECT_EQ(containersOnDisk(device().onHost("/private/var/mobile/Containers/Data/Application")).size(),
              static_cast<std::size_t>(count + 2));
}

TEST_F(DeviceStateTest, FirstBootWorkIsDoneOncePerBoot) {
    const auto expectFirstBoots = [&](std::size_t boots) {
        EXPECT_EQ(connect().call(creation(1, "com.example.a")).error(), 1U);
        EXPECT_EQ(linesInLogFile(device(), "<Notice>"), linesInLogFile(device(), "] main: ostrandd ") +
                                                            linesInLogFile(device(), "No code signing info file"));
        EXPECT_EQ(linesInLogFile(device(), "main: ostrandd performing first boot initialization"), boots);
        EXPECT_EQ(linesInLogFile(device(), "main: ostrandd first boot cleanup complete"), boots);
    };
    expectFirstBoots(1);
    device().killDaemon(SIGKILL);
    expectFirstBoots(1);
    device().killDaemon(SIGTERM);
    expectFirstBoots(1);
    device().reboot();
    expectFirstBoots(2);
}

TEST_F(DeviceStateTest, AnOrderlyEndFinishesWhatIsUnderWay) {
    const auto deathRow = device().image() / "private/var/root/Library/Caches/com.tamarok.ostrandd/Dead";
    const auto heap = device().image() / "heap";
    for (int directory = 0; directory < 50; ++directory)
        for (int file = 0; file < 100; ++file)
            writeFile(heap / std::to_string(directory) / std::to_string(file), "");
    auto connection = connect();
    const auto destroy = request(1, {{"Command", number(4)}});
    EXPECT_EQ(connection.call(destroy).error(), 1U) << "the first pass is over";
    std::filesystem::rename(heap, deathRow / "heap");
    connection.send(destroy + creation(2, "com.example.a"));
    std::map<std::uint32_t, std::uint64_t> replies;
    const auto take = [&] {
        const auto reply = connection.receive();
        return reply && replies.emplace(reply->requestNumber(), reply->error()).second;
    };
    while (!replies.contains(2)) // By then the destruction has been ordered.
        ASSERT_TRUE(take());
    const auto daemon = device().daemonId();
    device().killDaemon(SIGTERM);
    while (take())
        continue;
    EXPECT_EQ(replies, (std::map<std::uint32_t, std::uint64_t>{{1, 1}, {2, 1}}));
    EXPECT_EQ(namesIn(deathRow), std::vector<std::string>());
    EXPECT_EQ(connect().call(creation(3, "com.example.a", false)).error(), 1U);
    EXPECT_NE(device().daemonId(), daemon);
    EXPECT_NE(device().complaints().find("The daemon ended with status 0, starting it again"), std::string::npos);
}

TEST_F(DeviceStateTest, AnOrderlyEndAnswersEveryRequestThatHasBegun) {
    constexpr std::uint32_t requestsInARound = 100; // whose replies a socket holds, however late they are read
    for (int round = 0; round < 5; ++round) {
        auto connection = connect();
        const auto identifier = [&](std::uint32_t i) {
            return "com.example." + std::to_string(round) + "." + std::to_string(i);
        };
        EXPECT_EQ(connection.call(creation(0, identifier(0))).error(), 1U);
        const auto daemon = device().daemonId();
        std::string requests;
        for (std::uint32_t i = 1; i < requestsInARound; ++i)
            requests += creation(i, identifier(i));
        connection.send(requests);
        ASSERT_TRUE(connection.receive());
        ASSERT_EQ(::kill(daemon, SIGTERM), 0);
        std::uint32_t answered = 2;
        while (const auto reply = connection.receive()) {
            EXPECT_EQ(reply->requestNumber(), answered++);
            EXPECT_EQ(reply->error(), 1U);
        }
        const auto made = containersOnDisk(device().onHost("/private/var/mobile/Containers/Data/Application"));
        const auto ofThisRound = std::ranges::count_if(made, [&](const auto& entry) {
            return entry.first.starts_with("com.example." + std::to_string(round) + ".");
        });
        EXPECT_EQ(ofThisRound, answered) << "a container was made for a request without reply";
    }
}

} // namespace ost::test::wire
