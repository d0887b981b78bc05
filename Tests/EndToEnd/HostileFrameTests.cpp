#include "EndToEnd/DeviceLog.h"
#include "EndToEnd/Wire.h"
#include "support/BootedDevice.h"

#include <gtest/gtest.h>

#include <sys/resource.h>
#include <unistd.h>

namespace ost::test::wire {

using testing::PrintToString;
using Lines = std::vector<std::string>;

namespace {

/// A frame that whoever sends it loses its connection for.
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

/// A frame of request number 9 whose map has one entry, "X".
HostileFrame value(const char* what, std::string_view encoded) {
    return {what, frame(9, map({{"X", std::string(encoded)}}))};
}

std::vector<HostileFrame> hostileFrames() {
    using namespace std::string_view_literals;
    return {
        {"no payload", header(0, 9)},
        {"a claim of 4 GB", header(0xffffffff, 9) + "\xa0"},
        {"a byte more than there may be", header((16 << 20) + 1, 9)},
        {"text for a header", "GET / HTTP/1.0\r\n\r\n"},
        {"a number", frame(9, number(1))},
        {"an array", frame(9, "\x80"sv)},
        {"a null", frame(9, null())},
        {"a map cut short", frame(9, "\xa1\x61"sv)},
        {"a byte behind the map", frame(9, map({}) + null())},
        {"two maps", frame(9, map({}) + map({}))},
        {"a map of 2^64 entries", frame(9, "\xbb\xff\xff\xff\xff\xff\xff\xff\xff"sv)},
        {"a key that is a number", frame(9, "\xa1\x01\x01"sv)},
        {"a repeated key", request(9, {{"Command", number(0)}, {"Command", number(1)}})},
        {"a repeated key, further down", frame(9, map({{"X", map({{"a", null()}, {"b", null()}, {"a", null()}})}}))},
        {"a map of indefinite length", frame(9, "\xbf\xff"sv)},
        {"a byte of NUL in a key", frame(9, "\xa1\x62X\0\x01"sv)},
        value("an array of indefinite length", "\x9f\xff"sv),
        value("a text of indefinite length", "\x7f\x61"
                                             "a\xff"sv),
        value("10,000 nested arrays", repeated("\x81", 9999) + "\x80"),
        value("64 nested arrays", repeated("\x81", 63) + "\x80"),
        value("a text that is no UTF-8", "\x62\xc3\x28"sv),
        value("an overlong text", "\x62\xc0\xaf"sv),
        value("a surrogate", "\x63\xed\xa0\x80"sv),
        value("a text with NUL", "\x63"
                                 "a\0b"sv),
        value("a text of 2^63 bytes", "\x7b\x7f\xff\xff\xff\xff\xff\xff\xff"sv),
        value("an unknown tag", "\xc2\x41\x01"sv),
        value("a tag around nothing", "\xd8\x25"sv),
        value("a UUID of 15 bytes", "\xd8\x25\x4f"
                                    "0123456789abcde"sv),
        value("a UUID in words", "\xd8\x25\x61"
                                 "a"sv),
        value("a date in words", "\xc1\x61"
                                 "a"sv),
        value("undefined", "\xf7"sv),
        value("a break", "\xff"sv),
        value("a reserved form of length", "\x1c"sv),
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

TEST_F(HostileFrameTest, AFrameMayComeByteByByte) {
    auto connection = connect();
    for (const char byte : creation(3, "com.example.slow"))
        connection.send({&byte, 1});
    const auto reply = connection.receive();
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->requestNumber(), 3U);
    EXPECT_EQ(reply->error(), 1U);
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

TEST_F(HostileFrameTest, WhoLeavesTooManyRepliesUnreadLosesItsConnection) {
    // A long identifier makes a short request for a long list.
    ASSERT_EQ(connect().call(creation(1, std::string(900'000, 'i'))).error(), 1U);
    DeviceLog log(device());
    auto connection = connect();
    connection.send(
        repeated(request(1, {{"Command", number(1)}, {"ContainerClass", number(2)}, {"UserID", number(501)}}), 80));
    Lines errors;
    EXPECT_TRUE(comesTrue([&] {
        errors = log.takeErrors();
        return !errors.empty();
    }));
    ASSERT_EQ(errors.size(), 1U);
    EXPECT_NE(errors[0].find("connection of pid " + pid() + " closed: "), std::string::npos) << errors[0];
    expectService("while it still does not read");
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
