#include "platform/ipc/UpcallPort.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <grp.h>
#include <netinet/in.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <functional>
#include <string>

namespace ost::platform {
namespace {

using Words = std::vector<std::uint32_t>;

/// A request of the right size, whose region has `size` bytes.
Words request(std::uint32_t size = 0) {
    Words words(upcallMessageSize / sizeof(std::uint32_t));
    words[1] = upcallMessageSize;
    words[7] = 0xdead; // address
    words[8] = size;
    return words;
}

FileDescriptor memoryFile(std::string_view content) {
    FileDescriptor file(::memfd_create("region", MFD_CLOEXEC));
    EXPECT_EQ(::write(file.get(), content.data(), content.size()), static_cast<ssize_t>(content.size()));
    return file;
}

/// A port on an abstract address, and the messages it has handed on.
class UpcallPortTest : public testing::Test {
protected:
    void SetUp() override {
        FileDescriptor listener(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
        ASSERT_EQ(::bind(listener.get(), reinterpret_cast<const sockaddr*>(&_address), sizeof(sa_family_t)),
                  0); // autobind
        socklen_t size = sizeof _address;
        ASSERT_EQ(::getsockname(listener.get(), reinterpret_cast<sockaddr*>(&_address), &size), 0);
        _addressSize = size;
        ASSERT_EQ(::listen(listener.get(), 128), 0);
        _port = UpcallPort::open(*_loop, std::move(listener), [this](const UpcallMessage& message) {
                    _messages.push_back(message);
                    if (_messages.size() >= _stopAfter)
                        _loop->stop();
                    return _reply();
                }).value();
    }

    [[nodiscard]] FileDescriptor connect() const {
        FileDescriptor client(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
        EXPECT_EQ(::connect(client.get(), reinterpret_cast<const sockaddr*>(&_address), _addressSize), 0);
        return client;
    }

    static void send(const FileDescriptor& client, const Words& words, const std::vector<int>& descriptors = {},
                     std::size_t size = 0) {
        iovec data{const_cast<std::uint32_t*>(words.data()), size ? size : words.size() * sizeof words[0]};
        std::vector<char> control(descriptors.empty() ? 0 : CMSG_SPACE(descriptors.size() * sizeof(int)));
        msghdr header{};
        header.msg_iov = &data;
        header.msg_iovlen = 1;
        if (!descriptors.empty()) {
            header.msg_control = control.data();
            header.msg_controllen = control.size();
            auto* rights = CMSG_FIRSTHDR(&header);
            *rights = {.cmsg_len = CMSG_LEN(descriptors.size() * sizeof(int)),
                       .cmsg_level = SOL_SOCKET,
                       .cmsg_type = SCM_RIGHTS};
            std::memcpy(CMSG_DATA(rights), descriptors.data(), descriptors.size() * sizeof(int));
        }
        ASSERT_GT(::sendmsg(client.get(), &header, MSG_NOSIGNAL), 0);
    }

    /// Serves until so many messages have come, and forgets those of before.
    std::vector<UpcallMessage>& served(std::size_t count) {
        _messages.clear();
        _stopAfter = count;
        _loop->run();
        _stopAfter = SIZE_MAX;
        return _messages;
    }

    /// Serves everything that the loop has been sent, and forgets the messages of before.
    std::vector<UpcallMessage>& served() {
        _messages.clear();
        for (int round = 0; round < 200; ++round) {
            _loop->async([this] { _loop->stop(); });
            _loop->run();
        }
        return _messages;
    }

    static bool isClosed(const FileDescriptor& client) {
        char byte = 0;
        return ::recv(client.get(), &byte, 1, MSG_PEEK | MSG_DONTWAIT) == 0;
    }

    static std::uint32_t word(const UpcallMessage& message, std::size_t index) {
        std::uint32_t value = 0;
        std::memcpy(&value, message.bytes.data() + index * sizeof value, sizeof value);
        return value;
    }

    static std::string text(const std::optional<std::vector<std::byte>>& region) {
        return region ? std::string(reinterpret_cast<const char*>(region->data()), region->size()) : "(none)";
    }

    sockaddr_un _address{.sun_family = AF_UNIX, .sun_path = {}};
    socklen_t _addressSize = 0;
    std::unique_ptr<RunLoop> _loop = RunLoop::create().value();
    std::vector<UpcallMessage> _messages;
    std::function<std::optional<UpcallReply>()> _reply = [] { return std::nullopt; };
    std::size_t _stopAfter = SIZE_MAX;
    std::unique_ptr<UpcallPort> _port;
};

TEST_F(UpcallPortTest, HandsOnMessagesWithRegionAndTrailer) {
    const auto client = connect();
    const auto region = memoryFile("content and more");
    send(client, request(7), {region.get()}); // before it is accepted
    send(client, request(7));
    const auto& messages = served();
    ASSERT_EQ(messages.size(), 2U);
    EXPECT_EQ(text(messages[0].region), "content");
    EXPECT_EQ(word(messages[0], 7), 0U) << "the address is the region's index";
    EXPECT_EQ(text(messages[1].region), "(none)");
    const Words trailer{0, 52, 1, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0};
    EXPECT_EQ(std::memcmp(messages[1].bytes.data() + upcallMessageSize, trailer.data(), upcallTrailerSize), 0);
    EXPECT_FALSE(isClosed(client));
}

TEST_F(UpcallPortTest, TellsTheKernelFromOthersByThePacketsSender) {
    const auto client = connect(); // by root
    const auto region = memoryFile("secret");
    const pid_t child = ::fork();
    if (child == 0) {
        if (::setgroups(0, nullptr) == 0 && ::setgid(778) == 0 && ::setuid(777) == 0)
            send(client, request(6), {region.get()});
        ::_exit(0);
    }
    ASSERT_EQ(::waitpid(child, nullptr, 0), child);
    const auto& messages = served();
    ASSERT_EQ(messages.size(), 1U);
    EXPECT_EQ(word(messages[0], 16), 777U);
    EXPECT_EQ(word(messages[0], 17), 778U);
    EXPECT_EQ(word(messages[0], 23), static_cast<std::uint32_t>(child));
    EXPECT_EQ(text(messages[0].region), "") << "a region there is, but nobody looks into it";
}

TEST_F(UpcallPortTest, CopiesNoRegionThatIsNotOneOfItsSize) {
    const auto client = connect();
    int ends[2];
    ASSERT_EQ(::pipe2(ends, O_CLOEXEC), 0);
    const FileDescriptor pipeReading(ends[0]);
    const FileDescriptor pipeWriting(ends[1]);
    const FileDescriptor directory(::open("/", O_RDONLY | O_CLOEXEC));
    const FileDescriptor path(::open("/etc/passwd", O_PATH | O_CLOEXEC));
    const auto shorter = memoryFile("12");
    const auto giant = memoryFile("");
    ASSERT_EQ(::ftruncate(giant.get(), 1L << 40), 0);
    const std::pair<int, std::uint32_t> cases[] = {{pipeReading.get(), 1},
                                                   {directory.get(), 1},
                                                   {path.get(), 1},
                                                   {shorter.get(), 3},
                                                   {giant.get(), (1 << 20) + 1}};
    for (const auto& [descriptor, size] : cases)
        send(client, request(size), {descriptor});
    send(client, request(1 << 20), {giant.get()});
    const auto& messages = served(std::size(cases) + 1);
    for (std::size_t index = 0; index < std::size(cases); ++index)
        EXPECT_FALSE(messages[index].region) << index;
    EXPECT_EQ(messages.back().region.value().size(), 1U << 20);
}

TEST_F(UpcallPortTest, HandsOnPacketsOfEveryLengthWithTheTrueOne) {
    const auto client = connect();
    for (const std::uint32_t size : {23U, 24U, 51U, 53U, 65536U}) {
        send(client, Words(16384, 0x13392fd4), {}, size);
        const auto& messages = served(1);
        EXPECT_EQ(word(messages[0], 1), size);
        EXPECT_EQ(word(messages[0], 5), size < 24 ? 0x392fd4U : 0x13392fd4U);
        EXPECT_EQ(word(messages[0], 13), 0U) << "the trailer";
    }
    iovec nothing{nullptr, 0};
    msghdr header{};
    header.msg_iov = &nothing;
    header.msg_iovlen = 1;
    ASSERT_EQ(::sendmsg(client.get(), &header, 0), 0);
    EXPECT_EQ(word(served(1)[0], 1), 0U);
    EXPECT_FALSE(isClosed(client));
}

TEST_F(UpcallPortTest, CountsDescriptorsAndKeepsNone) {
    const auto open = [] {
        return std::distance(std::filesystem::directory_iterator("/proc/self/fd"),
                             std::filesystem::directory_iterator());
    };
    const auto client = connect();
    const auto region = memoryFile("x");
    served();
    const auto before = open();
    for (const std::size_t count : {2U, 3U, 200U}) {
        send(client, request(1), std::vector(count, region.get()));
        const auto& messages = served(1);
        EXPECT_EQ(word(messages[0], 6), 2U) << "more than one";
        EXPECT_FALSE(messages[0].region);
    }
    EXPECT_EQ(open(), before);
    EXPECT_FALSE(isClosed(client));
}

TEST_F(UpcallPortTest, KeepsServingWhileADescriptorOfAnotherUserDoesNotClose) {
    // A network connection with bytes that nobody takes: the last process to close it is to wait for that.
    const FileDescriptor silent(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_in address{.sin_family = AF_INET, .sin_port = 0, .sin_addr = {::htonl(INADDR_LOOPBACK)}, .sin_zero = {}};
    socklen_t size = sizeof address;
    ASSERT_EQ(::bind(silent.get(), reinterpret_cast<const sockaddr*>(&address), size), 0);
    ASSERT_EQ(::listen(silent.get(), 1), 0);
    ASSERT_EQ(::getsockname(silent.get(), reinterpret_cast<sockaddr*>(&address), &size), 0);
    const auto sendLingering = [&] {
        const FileDescriptor lingering(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
        if (::connect(lingering.get(), reinterpret_cast<const sockaddr*>(&address), size) != 0)
            return false;
        const std::vector<char> bytes(1 << 16);
        while (::send(lingering.get(), bytes.data(), bytes.size(), MSG_DONTWAIT) > 0)
            continue;
        const linger fiveMinutes{.l_onoff = 1, .l_linger = 300};
        if (::setsockopt(lingering.get(), SOL_SOCKET, SO_LINGER, &fiveMinutes, sizeof fiveMinutes) != 0 ||
            ::setgroups(0, nullptr) != 0 || ::setgid(778) != 0 || ::setuid(777) != 0)
            return false;
        // The kernel closes the third, for which there is no room, in the receiver's name.
        const auto region = memoryFile("x");
        send(connect(), request(1), {region.get(), region.get(), lingering.get()});
        return true;
    };
    const pid_t child = ::fork();
    if (child == 0)
        ::_exit(sendLingering() ? 0 : 1);
    int status = -1;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    ASSERT_EQ(status, 0);
    const auto client = connect();
    for (int round = 0; round < 3; ++round) {
        send(client, request());
        EXPECT_EQ(word(served(1)[0], 16), 0U);
    }
}

TEST_F(UpcallPortTest, RepliesWithASealedRegion) {
    const auto client = connect();
    _reply = [] {
        const std::vector region(5000, std::byte{8});
        return UpcallReply{std::vector(52, std::byte{7}), makeUpcallRegion(region).value()};
    };
    send(client, request());
    served();
    std::array<char, 100> bytes;
    alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int))> control;
    iovec data{bytes.data(), bytes.size()};
    msghdr header{};
    header.msg_iov = &data;
    header.msg_iovlen = 1;
    header.msg_control = control.data();
    header.msg_controllen = control.size();
    ASSERT_EQ(::recvmsg(client.get(), &header, MSG_CMSG_CLOEXEC), 52);
    ASSERT_NE(CMSG_FIRSTHDR(&header), nullptr);
    int descriptor = -1;
    std::memcpy(&descriptor, CMSG_DATA(CMSG_FIRSTHDR(&header)), sizeof descriptor);
    const FileDescriptor region(descriptor);
    struct stat status{};
    ASSERT_EQ(::fstat(region.get(), &status), 0);
    EXPECT_EQ(status.st_size, 5000);
    EXPECT_EQ(::read(region.get(), bytes.data(), bytes.size()), 100) << "from the start";
    EXPECT_EQ(::pwrite(region.get(), "x", 1, 0), -1);
    EXPECT_EQ(::ftruncate(region.get(), 0), -1);
}

TEST_F(UpcallPortTest, WaitsWithAPeerThatDoesNotTakeItsRepliesAndServesTheOthers) {
    const auto deaf = connect();
    const auto client = connect();
    _reply = [] { return UpcallReply{.bytes = std::vector(36, std::byte{1})}; };
    const auto words = request();
    std::size_t sent = 0;
    for (int idle = 0; idle < 10; ++idle) {
        for (; ::send(deaf.get(), words.data(), upcallMessageSize, MSG_NOSIGNAL) > 0; ++sent)
            idle = 0;
        served();
    }
    EXPECT_FALSE(isClosed(deaf));
    send(client, request());
    EXPECT_EQ(served(1).size(), 1U);

    std::size_t taken = 0;
    for (std::array<char, 36> reply; taken < sent; served())
        while (::recv(deaf.get(), reply.data(), reply.size(), 0) == 36)
            ++taken;
    EXPECT_EQ(taken, sent);
}

TEST_F(UpcallPortTest, TakesNoMoreConnectionsThanItsLimitAndPausesWithoutDescriptors) {
    std::vector<FileDescriptor> clients;
    for (int client = 0; client < 65; ++client)
        clients.push_back(connect());
    served();
    EXPECT_FALSE(isClosed(clients[63]));
    EXPECT_TRUE(isClosed(clients[64]));
    clients.clear();
    served();

    const auto client = connect();
    rlimit limit{};
    ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &limit), 0);
    const rlimit none{static_cast<rlim_t>(client.get()), limit.rlim_max};
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &none), 0);
    send(client, request());
    EXPECT_TRUE(served().empty());
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &limit), 0);
    EXPECT_EQ(served(1).size(), 1U);
}

} // namespace
} // namespace ost::platform
