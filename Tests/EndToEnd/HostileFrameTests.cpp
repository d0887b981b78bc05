#include "EndToEnd/DeviceLog.h"
#include "EndToEnd/Wire.h"
#include "platform/ipc/IPCFrame.h"
#include "support/BootedDeviceTest.h"
#include "support/Sanitized.h"

#include <gtest/gtest.h>

#include <sys/resource.h>
#include <unistd.h>

namespace ost::test::wire {

using testing::PrintToString;
using Lines = std::vector<std::string>;

namespace {

/// A frame that costs its sender the connection.
struct HostileFrame {
    const char* what;
    std::string bytes;
};

std::string repeated(std::string_view text, std::size_t times) {
    std::string bytes;
    for (std::size_t i = 0; i < times; ++i)
        bytes += text;
    return bytes;
}

std::vector<HostileFrame> hostileFrames() {
    using namespace std::string_view_literals;
    return {
        {"no payload", header(0, 9)},
        {"a claim of 4 GB", header(0xffffffff, 9) + "\xa0"},
        {"a byte more than there may be", header((16 << 20) + 1, 9)},
        {"text for a header", "GET / HTTP/1.0\r\n\r\n"},
        {"no map", frame(9, number(1))},
        {"a map cut short", frame(9, "\xa1\x61"sv)},
        {"a byte behind the map", frame(9, map({}) + null())},
        {"a map of 2^64 entries", frame(9, "\xbb\xff\xff\xff\xff\xff\xff\xff\xff"sv)},
        {"a repeated key", request(9, {{"Command", number(0)}, {"Command", number(1)}})},
        {"10,000 nested arrays", frame(9, map({{"X", repeated("\x81", 9999) + "\x80"}}))},
        {"a text that is no UTF-8", frame(9, map({{"X", "\x62\xc3\x28"}}))},
    };
}

/// What is sent and then not gone on with.
std::vector<HostileFrame> unfinishedFrames() {
    const auto whole = creation(1, "com.example.a");
    return {
        {"nothing", ""},
        {"one byte", whole.substr(0, 1)},
        {"a header", whole.substr(0, 8)},
        {"half a frame", whole.substr(0, whole.size() / 2)},
        {"all but a byte", whole.substr(0, whole.size() - 1)},
        {"the largest claim that is allowed", header(16 << 20, 1) + "\xa1"},
    };
}

class HostileFrameTest : public BootedDeviceTest {
protected:
    void SetUp() override {
        BootedDeviceTest::SetUp();
        if (IsSkipped())
            return;
        _caller.emplace(device().socket(), allowed());
    }

    /// A connection that may run every command.
    [[nodiscard]] Connection connect() const { return _caller->connect(); }

    void expectService(const std::string& context) const {
        const auto reply = connect().call(creation(1, "com.example.honest"));
        EXPECT_EQ(reply.error(), 1U) << context;
    }

    [[nodiscard]] std::string pid() const { return std::to_string(_caller->id()); }

private:
    std::optional<Client> _caller;
};

} // namespace

TEST_F(HostileFrameTest, AMalformedFrameCostsItsConnectionAndOneLine) {
    const auto bystander = connect();
    DeviceLog log(device());
    for (const auto& [what, bytes] : hostileFrames()) {
        auto connection = connect();
        connection.send(creation(7, "com.example.early") + bytes + creation(8, "com.example.late"));
        const auto early = connection.receive();
        ASSERT_TRUE(early) << what;
        EXPECT_EQ(early->requestNumber(), 7U) << what;
        EXPECT_EQ(early->error(), 1U) << what;
        EXPECT_TRUE(connection.isClosed()) << what;
        const auto errors = log.takeErrors();
        EXPECT_EQ(errors.size(), 1U) << what << ": " << PrintToString(errors);
        EXPECT_TRUE(!errors.empty() && errors[0].find("connection of pid " + pid() + " closed: ") != std::string::npos)
            << what << ": " << PrintToString(errors);
    }
    EXPECT_EQ(connect().call(creation(1, "com.example.late", false)).error(), 21U);
    expectService("after all of them");
}

TEST_F(HostileFrameTest, TheLongestAndTheDeepestThatIsAllowedIsServed) {
    Entries entries{{"ContainerClass", number(2)}, {"UserID", number(501)}, {"Identifier", text("com.example.a")}};
    const auto reply = [&](std::string extra) {
        auto extended = entries;
        extended.emplace_back("X", std::move(extra));
        return connect().call(request(1, extended));
    };
    const auto deepest = reply(repeated("\x81", 62) + "\x80"); // The message's own map is the first of 64.
    const auto longest = reply(text(std::string((16 << 20) - 128, 'x')));
    EXPECT_EQ(deepest.error(), 21U);
    EXPECT_EQ(longest.error(), 21U);
}

TEST_F(HostileFrameTest, AProgramWithoutEntitlementsMaySendShortFramesOnly) {
    const Client stranger(device().socket(), {.user = 501});
    DeviceLog log(device());
    for (const auto size : {std::size_t{65536}, std::size_t{65537}}) {
        const auto padded = [&](std::size_t padding) {
            return request(1, {{"ContainerClass", number(2)}, {"X", text(std::string(padding, 'x'))}});
        };
        constexpr std::size_t nearly = 60'000;
        const auto bytes = padded(nearly + size + platform::IPCFrameHeader::size - padded(nearly).size());
        ASSERT_EQ(bytes.size(), size + platform::IPCFrameHeader::size);
        EXPECT_TRUE(stranger.connect().isRefused(bytes)) << size;
        EXPECT_EQ(log.takeErrors().size(), size > 65536 ? 1U : 0U) << size;
    }
}

TEST_F(HostileFrameTest, WhatAUserTakesOfTheMemoryIsBoundedAndGivenBack) {
    if (isSanitized)
        GTEST_SKIP() << "sanitizers keep what is freed";
    const Client user(device().socket(), allowed("com.example.user", 501));
    const auto lookUp = creation(1, "com.example.unread");
    EXPECT_EQ(user.connect().call(lookUp).error(), 1U);
    const auto before = residentMemory(device().daemonId());
    const auto mostOf = [&](int count, const std::string& bytes) {
        std::vector<Connection> connections;
        std::size_t most = 0;
        while (std::ssize(connections) < count) {
            connections.push_back(user.connect());
            connections.back().send(bytes);
            most = std::max(most, residentMemory(device().daemonId()));
        }
        return most;
    };
    const struct {
        const char* what;
        int connections;
        std::string bytes;
        std::size_t megabytes;
    } kinds[] = {{"frames without an end", 60, header(16 << 20, 1) + std::string(4 << 20, 'x'), 128},
                 {"replies that nobody reads", 12, repeated(lookUp, 5000), 17}};
    for (const auto& [what, connections, bytes, megabytes] : kinds) {
        EXPECT_LT(mostOf(connections, bytes), before + (megabytes << 20)) << what;
        expectService("meanwhile");
        EXPECT_TRUE(comesTrue([&] { return residentMemory(device().daemonId()) < before + (std::size_t{16} << 20); }))
            << what << ": " << before << " bytes before, " << residentMemory(device().daemonId()) << " after";
    }
}

TEST_F(HostileFrameTest, AClientThatLeavesCostsNothing) {
    DeviceLog log(device());
    for (const auto& [what, bytes] : unfinishedFrames()) {
        connect().send(bytes); // and away
        auto connection = connect();
        connection.send(creation(1, "com.example.early") + bytes);
        connection.finish();
        EXPECT_TRUE(connection.receive()) << what;
        EXPECT_TRUE(connection.isClosed()) << what;
    }
    connect().send(repeated(creation(1, "com.example.unread"), 100));
    expectService("after they have left");
    EXPECT_EQ(log.takeErrors(), Lines());
}

TEST_F(HostileFrameTest, AThousandOfThemDoNotKeepTheNextOneOut) {
    const rlimit descriptors{4096, 4096};
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &descriptors), 0);
    const auto before = openDescriptors(device().daemonId());
    {
        const auto kinds = [&] {
            auto all = unfinishedFrames();
            for (auto& hostile : hostileFrames())
                all.push_back(std::move(hostile));
            all.push_back({"a client that does not read", repeated(creation(1, "com.example.unread"), 2000)});
            return all;
        }();
        std::vector<Connection> connections;
        for (std::size_t i = 0; i < 1000; ++i) {
            connections.push_back(connect());
            connections.back().sendSome(kinds[i % kinds.size()].bytes);
        }
        expectService("the thousand-and-first");
    }
    expectService("after they have left");
    EXPECT_TRUE(comesTrue([&] { return openDescriptors(device().daemonId()) <= before; }))
        << before << " descriptors before, " << openDescriptors(device().daemonId()) << " after";
}

TEST_F(HostileFrameTest, AUserCannotTakeAllConnections) {
    const Client user(device().socket(), allowed("com.example.user", 501));
    std::vector<Connection> connections;
    for (int i = 0; i < 300; ++i)
        connections.push_back(user.connect());
    std::size_t served = 0;
    for (auto& connection : connections) {
        served += connection.isRefused(creation(1, "com.example.user")) ? 0 : 1;
    }
    EXPECT_EQ(served, 256U);
    expectService("of another user");
    connections.clear();
    EXPECT_TRUE(comesTrue([&] { return !user.connect().isRefused(creation(1, "com.example.user")); }));
}

TEST_F(HostileFrameTest, NobodyForgesALogLine) {
    const std::string forged = "2026-01-01T00:00:00.000000Z <Error> [1:1] main: forged";
    DeviceLog log(device());
    for (const auto& [identifier, shown] : std::initializer_list<std::pair<std::string, std::string>>{
             {"a\n" + forged, "a\\n" + forged},
             {"a\r\n" + forged + "\n", "a\\r\\n" + forged + "\\n"},
             {"\x1b[2Ja\x7f\x01\tb", "\\x1b[2Ja\\x7f\\x01\\tb"},
             {"\xc2\x85\xe2\x80\xa8" + forged, "\\xc2\\x85\\xe2\\x80\\xa8"},
             {"%@ %s %n %%", "%@ %s %n %%"},
         }) {
        const auto reply = connect().call(
            request(1, {{"ContainerClass", number(99)}, {"UserID", number(1)}, {"Identifier", text(identifier)}}));
        EXPECT_EQ(reply.error(), 11U) << shown;
        auto errors = log.takeErrors();
        std::erase_if(errors,
                      [](const std::string& line) { return line.find("Current mobile user") != std::string::npos; });
        ASSERT_EQ(errors.size(), 1U) << PrintToString(errors);
        EXPECT_NE(errors[0].find(shown), std::string::npos) << errors[0];
    }
    const auto size = [&] {
        return std::filesystem::file_size(device().onHost("/private/var/root/Library/Logs/Ostrand/ostrandd.log"));
    };
    const auto before = size();
    const auto reply = connect().call(request(
        1,
        {{"ContainerClass", number(99)}, {"UserID", number(1)}, {"Identifier", text(std::string(1U << 20U, '\n'))}}));
    EXPECT_EQ(reply.error(), 11U);
    EXPECT_LT(size() - before, 10'000U) << "a long text does not push the others out";
    EXPECT_EQ(log.takeErrors().size(), 1U);

    const Client liar(device().socket(), {.identifier = "a\n" + forged + "\n"});
    EXPECT_TRUE(liar.connect().isRefused(request(1, {{"Command", number(1)}})));
    EXPECT_EQ(log.takeErrors().size(), 1U);
}

} // namespace ost::test::wire
