#include "Client/Attributes.h"
#include "EndToEnd/DeviceLog.h"
#include "EndToEnd/Wire.h"
#include "platform/device/DeviceLockState.h"
#include "support/BootedDeviceTest.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <limits>

namespace ost::test::wire {

namespace {

class AttributeCommandTest : public BootedDeviceTest {
protected:
    void SetUp() override {
        BootedDeviceTest::SetUp();
        if (IsSkipped())
            return;
        _caller.emplace(device().socket(), allowed());
        const auto made = connect().call(creation(1, identifier));
        _uuid = made.uuid("ReplyUUID");
        path = made.text("ReplyPath");
    }

    [[nodiscard]] Connection connect() const { return _caller->connect(); }
    /// A request about the container, with further entries.
    [[nodiscard]] std::string about(std::uint64_t command, Entries entries = {},
                                    std::uint32_t requestNumber = 1) const {
        entries.insert(entries.begin(), {{"Command", number(command)},
                                         {"ContainerClass", number(2)},
                                         {"UserID", number(501)},
                                         {"UUID", uuid(_uuid)},
                                         {"Identifier", text(identifier)}});
        return request(requestNumber, entries);
    }
    [[nodiscard]] std::string protection(std::int64_t protectionClass, std::uint32_t requestNumber) const {
        return about(21, {{"DataProtectionClass", signedNumber(protectionClass)}, {"RetryIfLocked", truth(true)}},
                     requestNumber);
    }
    [[nodiscard]] std::uint64_t protectionCode() const {
        return connect().call(about(6, {{"Key", text(ostrand::protectionClassKey)}})).error();
    }
    void lock(bool locked) {
        ASSERT_TRUE(platform::writeDeviceLockState(locked ? platform::deviceLocked : platform::deviceUnlocked,
                                                   device().image()));
    }

    static constexpr std::string_view identifier = "com.example.a";
    std::string path;

private:
    std::optional<Client> _caller;
    platform::UUID _uuid;
};

} // namespace

TEST_F(AttributeCommandTest, InfoValuesOfEveryTypeGoThereAndBack) {
    const auto wireValue = map({{"array", "\x82\x01\x20"}, // [1, -1]
                                {"real", real(0.5)},
                                {"true", truth(true)},
                                {"data", "\x41\xff"},
                                {"date", std::string("\xc1\xfb\x41\xd9\x00\x00\x00\x00\x00\x00", 10)},
                                {"large", number(std::numeric_limits<std::uint64_t>::max())},
                                {"small", signedNumber(std::numeric_limits<std::int64_t>::min())},
                                {"text", text("\xc3\xa4")}});
    auto connection = connect();
    EXPECT_EQ(connection.call(about(6, {{"Key", text("k")}})).error(), 24U);
    const auto set = connection.call(about(5, {{"Key", text("k")}, {"Value", wireValue}}));
    EXPECT_EQ(set.keys(), "ReplyError");
    EXPECT_EQ(set.error(), 1U);
    const auto got = connection.call(about(6, {{"Key", text("k")}}));
    EXPECT_EQ(got.keys(), "ReplyError ReplyInfoValue");
    device().killDaemon();
    const auto again = connect().call(about(6, {{"Key", text("k")}}));
    EXPECT_EQ(again.value("ReplyInfoValue"), got.value("ReplyInfoValue"));
    EXPECT_EQ(again.value("ReplyInfoValue")->description(),
              "{array = (1, -1); data = <ff>; date = 2023-03-02T01:46:40Z; large = 18446744073709551615; real = 0.5; "
              "small = -9223372036854775808; text = \xc3\xa4; true = 1; }");

    auto third = connect();
    EXPECT_EQ(third.call(about(5, {{"Key", text("k")}, {"Value", uuid(platform::UUID::generate())}})).error(), 38U);
    EXPECT_EQ(third.call(about(5, {{"Key", number(1)}, {"Value", number(1)}})).error(), 38U);
    EXPECT_EQ(third.call(about(7)).keys(), "ReplyError ReplyPath ReplyTransient");
    EXPECT_EQ(third.call(about(7, {{"InfoDictRequested", truth(true)}})).keys(),
              "ReplyError ReplyInfoDictionary ReplyPath ReplyTransient");
    EXPECT_EQ(third.call(about(5, {{"Key", text("k")}})).error(), 1U);
    const auto deepest = std::string(63, '\x81') + number(1);
    EXPECT_EQ(third.call(about(5, {{"Key", text("d")}, {"Value", deepest}})).error(), 1U);
    EXPECT_EQ(third.call(about(6, {{"Key", text("d")}})).error(), 1U);
    EXPECT_EQ(third.call(about(7, {{"InfoDictRequested", truth(true)}})).error(), std::uint64_t{EMSGSIZE});
    EXPECT_EQ(third.call(about(5, {{"Key", text("d")}})).error(), 1U);
    EXPECT_EQ(third.call(about(7, {{"InfoDictRequested", truth(true)}})).keys(), "ReplyError ReplyPath ReplyTransient");
}

TEST_F(AttributeCommandTest, StructureAndNameChangeOverTheWire) {
    auto connection = connect();
    for (const std::uint64_t command : {8U, 22U}) {
        std::filesystem::remove_all(device().onHost(path) / "tmp");
        EXPECT_EQ(connection.call(about(command)).error(), 1U);
        EXPECT_TRUE(std::filesystem::is_directory(device().onHost(path) / "tmp"));
    }
    EXPECT_EQ(connection.call(about(9)).error(), 1U);
    const auto now = connection.call(about(7)).text("ReplyPath");
    EXPECT_NE(now, path);
    EXPECT_TRUE(std::filesystem::is_directory(device().onHost(now)));
    EXPECT_EQ(connection.call(creation(1, identifier, false)).text("ReplyPath"), now);
}

TEST_F(AttributeCommandTest, AParkedChangeIsAnsweredAfterTheUnlockAndOthersMeanwhile) {
    lock(true);
    auto connection = connect();
    connection.send(protection(1, 7) + creation(8, identifier, false));
    EXPECT_EQ(connection.receive().value().requestNumber(), 8U);
    lock(false);
    const auto reply = connection.receive().value();
    EXPECT_EQ(reply.requestNumber(), 7U);
    EXPECT_EQ(reply.error(), 1U);
    EXPECT_EQ(protectionCode(), 1U);
}

TEST_F(AttributeCommandTest, AParkedChangeHappensWithoutItsClientButNotWithoutTheDaemon) {
    lock(true);
    auto connection = connect();
    connection.send(protection(1, 7) + creation(8, identifier, false));
    EXPECT_EQ(connection.receive().value().requestNumber(), 8U);
    device().killDaemon(SIGTERM);
    EXPECT_TRUE(connection.isClosed());
    lock(false);
    EXPECT_EQ(protectionCode(), 24U) << "it was given up";

    lock(true);
    {
        auto leaving = connect();
        leaving.send(protection(1, 7) + creation(8, identifier, false));
        EXPECT_EQ(leaving.receive().value().requestNumber(), 8U);
    }
    lock(false);
    EXPECT_TRUE(comesTrue([&] { return protectionCode() == 1U; }));
}

} // namespace ost::test::wire
