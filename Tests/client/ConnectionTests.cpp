#include "Client/Connection.h"

#include "Support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <filesystem>
#include <sys/socket.h>
#include <sys/un.h>
#include <thread>

using namespace ostrand;
using namespace std::chrono_literals;
using ost::platform::CBOREncoder;
using ost::platform::CBORItem;
using ost::platform::FileDescriptor;
using ost::platform::IPCFrameHeader;

namespace {

std::string frame(std::uint32_t number, const std::string& payload) {
    std::string bytes(IPCFrameHeader::size, '\0');
    IPCFrameHeader{static_cast<std::uint32_t>(payload.size()), number}.write(bytes.data());
    return bytes + payload;
}

/// A reply with an error code and up to one further number.
std::string reply(std::uint32_t number, std::uint64_t code, std::optional<std::uint64_t> echo = {}) {
    std::string payload;
    CBOREncoder encoder(payload);
    encoder.beginMap(echo ? 2 : 1);
    encoder.key("ReplyError");
    encoder.unsignedNumber(code);
    if (echo) {
        encoder.key("Echo");
        encoder.unsignedNumber(*echo);
    }
    return frame(number, payload);
}

/// The daemon's end of a connection, played by the test.
class Daemon {
public:
    Daemon() {
        int ends[2];
        EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
        _client.reset(ends[0]);
        _socket.reset(ends[1]);
    }
    Connection client(Connection::Timeout timeout = {}) { return Connection(std::move(_client), timeout); }

    /// Sends bytes; the client may take its time.
    void says(std::string_view bytes) {
        while (!bytes.empty()) {
            const auto sent = send(_socket.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
            ASSERT_GT(sent, 0);
            bytes.remove_prefix(static_cast<std::size_t>(sent));
        }
    }
    void saysNoMore() { shutdown(_socket.get(), SHUT_WR); }
    void hangsUp() { _socket.reset(); }

    /// The next request's number and payload; number 0 when the client has gone.
    std::pair<std::uint32_t, std::string> hears() {
        const auto head = _bytes(IPCFrameHeader::size);
        if (head.empty())
            return {};
        const auto header = IPCFrameHeader::read(head.data());
        return {header.requestNumber, _bytes(header.payloadLength)};
    }

private:
    std::string _bytes(std::size_t count) {
        std::string bytes(count, '\0');
        const auto received = recv(_socket.get(), bytes.data(), count, MSG_WAITALL);
        bytes.resize(received > 0 ? static_cast<std::size_t>(received) : 0);
        return bytes;
    }

    FileDescriptor _client, _socket;
};

TEST(Connection, TellsHowARequestEnded) {
    const auto good = reply(1, 1);
    const struct {
        const char* what;
        std::string bytes;
        std::optional<Error> error;
    } rows[] = {
        {"success", good, {}},
        {"failure", reply(1, 21), Error::failed(21)},
        {"closed without a reply", "", Error::refused()},
        {"closed within the header", good.substr(0, 3), Error::transport(ECONNRESET)},
        {"closed within the payload", good.substr(0, good.size() - 1), Error::transport(ECONNRESET)},
        {"a reply to another request", reply(7, 1), Error::transport(EBADMSG)},
        {"a second reply", good + good, Error::transport(EBADMSG)},
        {"no payload", frame(1, ""), Error::transport(EBADMSG)},
        {"a payload that is no map", frame(1, "\x01"), Error::transport(EBADMSG)},
        {"a reply without a code", frame(1, "\xa0"), Error::transport(EBADMSG)},
    };
    for (const auto& [what, bytes, error] : rows) {
        Daemon daemon;
        auto connection = daemon.client();
        daemon.says(bytes);
        daemon.saysNoMore();
        const auto result = connection.call(Request(ost::OSTCommand{0}));
        EXPECT_EQ(result ? std::nullopt : std::optional(result.error()), error) << what;
    }
}

TEST(Connection, StillDeliversTheRepliesBeforeARefusal) {
    Daemon daemon;
    auto connection = daemon.client();
    const auto first = connection.send(Request(ost::OSTCommand{0})),
               second = connection.send(Request(ost::OSTCommand{99}));
    ASSERT_TRUE(first && second);
    daemon.says(reply(*first, 1, 5));
    daemon.hangsUp(); // with both requests unread
    const auto third = connection.send(Request(ost::OSTCommand{0}));
    ASSERT_FALSE(third);
    EXPECT_EQ(third.error(), Error::refused());
    EXPECT_TRUE(connection.receive(*first));
    for (int attempt = 0; attempt < 2; ++attempt) {
        const auto refused = connection.receive(*second);
        ASSERT_FALSE(refused);
        EXPECT_EQ(refused.error(), Error::refused());
    }
}

TEST(Connection, WaitsNoLongerThanItsTimeoutAndCanWaitAgain) {
    Daemon daemon;
    auto connection = daemon.client(1ms);
    const auto number = connection.send(Request(ost::OSTCommand{0}));
    ASSERT_TRUE(number);
    daemon.says(reply(*number, 1).substr(0, 5));
    const auto silence = connection.receive(*number);
    ASSERT_FALSE(silence);
    EXPECT_EQ(silence.error(), Error::transport(ETIMEDOUT));
    daemon.says(reply(*number, 1).substr(5));
    auto moved = std::move(connection);
    EXPECT_TRUE(moved.receive(*number));

    std::size_t sent = 0;
    auto stuck = moved.send(Request(ost::OSTCommand{0}));
    for (; stuck && sent < 1'000'000; ++sent)
        stuck = moved.send(Request(ost::OSTCommand{0}));
    ASSERT_FALSE(stuck);
    EXPECT_EQ(stuck.error(), Error::transport(ETIMEDOUT));
}

TEST(Connection, SendsAnyNumberOfRequestsBeforeItReceivesAnyReply) {
    Daemon daemon;
    // Neither side's requests or replies fit into the socket: a client that only sent would wait for ever.
    constexpr std::uint64_t count = 3000;
    const std::string filling(1000, 'x');
    std::jthread serving([&] {
        for (auto [number, payload] = daemon.hears(); number != 0; std::tie(number, payload) = daemon.hears()) {
            const auto request = ost::platform::validateCBOR(payload);
            ASSERT_TRUE(request);
            EXPECT_EQ(request->find("Text")->asText(), filling);
            std::string answer;
            CBOREncoder encoder(answer);
            encoder.beginMap(3);
            encoder.key("ReplyError");
            encoder.unsignedNumber(1);
            encoder.key("Echo");
            encoder.item(*request->find("Command"));
            encoder.key("Text");
            encoder.text(filling);
            daemon.says(frame(number, answer));
        }
    });
    auto connection = daemon.client(); // goes before the thread, which ends with it
    std::vector<std::uint32_t> numbers;
    for (std::uint64_t i = 0; i < count; ++i) {
        Request request(ost::OSTCommand{i});
        request.key("Text").text(filling);
        const auto number = connection.send(request);
        ASSERT_TRUE(number);
        numbers.push_back(*number);
    }
    for (std::uint64_t i = count; i-- > 0;) {
        const auto result = connection.receive(numbers[i]);
        ASSERT_TRUE(result);
        EXPECT_EQ(result->promised("Echo", &CBORItem::asUnsigned), Result<std::uint64_t>(i));
    }
}

TEST(Connection, ReachesADeviceWhosePathIsTooLongForASocketAddress) {
    const auto device = ost::test::makeScratchDirectory() / std::string(120, 'd');
    const auto run = device / "private/var/run";
    std::filesystem::create_directories(run);
    const auto missing = Connection::open(device);
    ASSERT_FALSE(missing);
    EXPECT_EQ(missing.error(), Error::transport(ENOENT));

    const FileDescriptor directory(open(run.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    const FileDescriptor listener(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    ("/proc/self/fd/" + std::to_string(directory.get()) + "/com.tamarok.ostrandd")
        .copy(address.sun_path, sizeof address.sun_path - 1);
    ASSERT_EQ(bind(listener.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    const auto unserved = Connection::open(device);
    ASSERT_FALSE(unserved);
    EXPECT_EQ(unserved.error(), Error::transport(ECONNREFUSED));

    ASSERT_EQ(listen(listener.get(), 0), 0);
    EXPECT_TRUE(Connection::open(device, 10s));
    const auto full = Connection::open(device, 1ms);
    ASSERT_FALSE(full);
    EXPECT_EQ(full.error(), Error::transport(ETIMEDOUT));
}

} // namespace
