#include "Client/PublicValues.h"
#include "Client/include/ostrand/ostrand.h"
#include "platform/codec/CBOR.h"
#include "platform/ipc/IPCFrame.h"

#include "Support/ScratchDirectory.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <sys/socket.h>
#include <sys/un.h>
#include <thread>

using namespace ostrand::v1;
using ost::platform::FileDescriptor;
using ost::platform::IPCFrameHeader;

namespace {

/// A daemon that answers some requests of each connection with success and nothing else, and then ends.
class MortalDaemon {
public:
    /// `answers` has, for each connection in turn, how many requests are answered; the one after them is only read.
    explicit MortalDaemon(const std::filesystem::path& device, std::vector<int> answers) {
        const auto directory = device / "private/var/run";
        std::filesystem::create_directories(directory);
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        const auto path = (directory / "com.tamarok.ostrandd").string();
        path.copy(address.sun_path, sizeof address.sun_path - 1);
        _listener.reset(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
        EXPECT_EQ(::bind(_listener.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
        EXPECT_EQ(::listen(_listener.get(), 8), 0);
        _thread = std::jthread([this, answers = std::move(answers)] {
            for (const int count : answers)
                _serve(count);
        });
    }

    MortalDaemon(const MortalDaemon&) = delete;
    MortalDaemon& operator=(const MortalDaemon&) = delete;
    ~MortalDaemon() { ::shutdown(_listener.get(), SHUT_RDWR); } // ends a wait for a connection that never came

private:
    void _serve(int count) const {
        const FileDescriptor connection(::accept4(_listener.get(), nullptr, nullptr, SOCK_CLOEXEC));
        for (char head[IPCFrameHeader::size]; ::recv(connection.get(), head, sizeof head, MSG_WAITALL) > 0; --count) {
            const auto header = IPCFrameHeader::read(head);
            std::string payload(header.payloadLength, '\0');
            ::recv(connection.get(), payload.data(), payload.size(), MSG_WAITALL);
            if (count == 0)
                return;
            const std::string success("\xa1\x6aReplyError\x01");
            std::string reply(sizeof head, '\0');
            IPCFrameHeader{static_cast<std::uint32_t>(success.size()), header.requestNumber}.write(reply.data());
            reply += success;
            ::send(connection.get(), reply.data(), reply.size(), MSG_NOSIGNAL);
        }
    }

    FileDescriptor _listener;
    std::jthread _thread;
};

constexpr Error refused{Error::Kind::refused, 0};

TEST(PublicClient, RepeatsWhatMayBeRepeatedWhenTheDaemonEndsBeforeItAnswers) {
    const auto device = ost::test::makeScratchDirectory();
    const MortalDaemon daemon(device, {1, 1, 1, 0});
    Client client({.device = device, .timeout = std::chrono::seconds(10)});
    EXPECT_TRUE(client.migrate());
    EXPECT_TRUE(client.migrate()) << "the second connection answers what the first has lost";
    EXPECT_EQ(client.remove({}).error(), refused) << "it may have been carried out";
    EXPECT_TRUE(client.migrate()) << "the third connection";
    EXPECT_EQ(client.migrate().error(), refused) << "the fourth refuses, too";
    std::filesystem::remove_all(device / "private");
    EXPECT_EQ(client.migrate().error(), (Error{Error::Kind::transport, ENOENT}));
}

TEST(PublicClient, TellsWhatCannotBeAskedWithoutException) {
    const auto device = ost::test::makeScratchDirectory();
    const MortalDaemon daemon(device, {1});
    Client client({.device = device, .timeout = {}});
    EXPECT_EQ(client.diskUsage({.identifier = "a", .uuid = "none"}).error(), (Error{Error::Kind::transport, EINVAL}));
    const auto moved = std::move(client);
    EXPECT_EQ(client.migrate().error(), (Error{Error::Kind::transport, ENOMEM})); // NOLINT(bugprone-use-after-move)
    EXPECT_EQ((Error{Error::Kind::failed, 21}).description(), "error 21: no such container");
}

TEST(PublicValue, HoldsWhateverPropertyListsHold) {
    const Dictionary all{{"a", {Value::Array{{true}, {std::int64_t{-1}}, {~std::uint64_t{0}}, {0.5}}}},
                         {"b", {Value::Data{std::string("\0\xff", 2)}}},
                         {"c", {Dictionary{{"d", {Value::Date{1.5}}}, {"e", {std::string("text")}}}}}};
    EXPECT_EQ(ostrand::publicDictionary(ostrand::privateDictionary(all)), all);
}

} // namespace
