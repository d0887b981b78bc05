#include "support/BootedDeviceTest.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <grp.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <cstring>
#include <sstream>
#include <thread>

using namespace std::string_literals;

namespace ost::test {

using platform::FileDescriptor;

namespace {

/// The blocks of bytes in the description of the protocol.
std::vector<std::string> documentedBytes() {
    std::istringstream text(readFile(OSTRAND_PROTOCOL_DOCUMENT));
    std::vector<std::string> blocks;
    bool inBlock = false;
    for (std::string line; std::getline(text, line);) {
        if (line == "```hex")
            blocks.emplace_back();
        inBlock = line == "```hex" || (inBlock && line != "```");
        std::istringstream bytes(line.substr(0, line.find(';')));
        for (std::string byte; inBlock && line != "```hex" && bytes >> byte;)
            blocks.back() += static_cast<char>(std::stoi(byte, nullptr, 16));
    }
    return blocks;
}

std::string withNumber(std::string bytes, std::size_t offset, std::uint32_t number) {
    std::memcpy(bytes.data() + offset, &number, sizeof number);
    return bytes;
}

std::int32_t numberAt(const std::string& bytes, std::size_t offset) {
    std::int32_t number = 0;
    std::memcpy(&number, bytes.substr(offset).data(), sizeof number);
    return number;
}

FileDescriptor memory(std::string_view content) {
    FileDescriptor file(::memfd_create("region", MFD_CLOEXEC));
    EXPECT_EQ(::write(file.get(), content.data(), content.size()), static_cast<ssize_t>(content.size()));
    return file;
}

struct Reply {
    std::string message; ///< empty when the connection has ended
    std::string answer;

    /// 0 for an answer, else the code of the failure.
    [[nodiscard]] std::int32_t code() const { return message.size() == 36 ? numberAt(message, 32) : 0; }
};

/// A connection to the upcall port.
class Sender {
public:
    explicit Sender(const BootedDevice& device) {
        sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
        device.socket().concat(".upcall").native().copy(address.sun_path, sizeof address.sun_path - 1);
        EXPECT_EQ(::connect(_socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    }

    [[nodiscard]] bool send(std::string message, int descriptor = -1) const {
        iovec data{message.data(), message.size()};
        alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int))> control{};
        msghdr header{};
        header.msg_iov = &data;
        header.msg_iovlen = 1;
        if (descriptor >= 0) {
            header.msg_control = control.data();
            header.msg_controllen = control.size();
            *CMSG_FIRSTHDR(&header) = {
                .cmsg_len = CMSG_LEN(sizeof(int)), .cmsg_level = SOL_SOCKET, .cmsg_type = SCM_RIGHTS};
            std::memcpy(CMSG_DATA(CMSG_FIRSTHDR(&header)), &descriptor, sizeof descriptor);
        }
        return ::sendmsg(_socket.get(), &header, MSG_NOSIGNAL) == static_cast<ssize_t>(message.size());
    }

    [[nodiscard]] Reply receive() const {
        std::array<char, 100> bytes;
        alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int))> control;
        iovec data{bytes.data(), bytes.size()};
        msghdr header{};
        header.msg_iov = &data;
        header.msg_iovlen = 1;
        header.msg_control = control.data();
        header.msg_controllen = control.size();
        const auto size = ::recvmsg(_socket.get(), &header, MSG_CMSG_CLOEXEC);
        Reply reply{.message = std::string(bytes.data(), size < 0 ? 0 : static_cast<std::size_t>(size)), .answer = {}};
        if (const auto* const rights = CMSG_FIRSTHDR(&header)) {
            int descriptor = -1;
            std::memcpy(&descriptor, CMSG_DATA(rights), sizeof descriptor);
            const FileDescriptor region(descriptor);
            struct stat status{};
            EXPECT_EQ(::fstat(region.get(), &status), 0);
            reply.answer.resize(static_cast<std::size_t>(status.st_size));
            EXPECT_EQ(::pread(region.get(), reply.answer.data(), reply.answer.size(), 0), status.st_size);
        }
        return reply;
    }

    [[nodiscard]] Reply call(const std::string& message, int descriptor = -1) const {
        return send(message, descriptor) ? receive() : Reply();
    }

private:
    FileDescriptor _socket{::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0)};
};

class UpcallTest : public BootedDeviceTest {
protected:
    /// Whether the answer to the documented question is the documented one.
    [[nodiscard]] bool answers() {
        const auto reply = Sender(device()).call(message, memory(items).get());
        return reply.message == documented.at(2) && reply.answer == documented.at(3);
    }

    [[nodiscard]] std::string systemContainers() {
        return tree(device().onHost("/private/var/containers/Data/System"));
    }

    const std::vector<std::string> documented = documentedBytes();
    const std::string message = documented.at(0);
    const std::string items = documented.at(1);
};

} // namespace

TEST_F(UpcallTest, TheDocumentedQuestionGetsTheDocumentedAnswerAlsoFromTheNextDaemon) {
    for (const int signal : {0, SIGKILL, SIGTERM}) {
        if (signal != 0)
            device().killDaemon(signal);
        const auto reply = Sender(device()).call(message, memory(items).get());
        EXPECT_EQ(reply.message, documented.at(2));
        EXPECT_EQ(reply.answer, documented.at(3));
    }
    EXPECT_NE(systemContainers().find("com.tamarok.pellord/tmp"), std::string::npos);
}

TEST_F(UpcallTest, WhateverIsSentGetsItsCodeAndLeavesTheConnectionUsable) {
    const auto scratch = device().image() / "region";
    const auto size = static_cast<std::uint32_t>(items.size());
    const auto sized = [&](std::uint32_t claimed) { return withNumber(withNumber(message, 32, claimed), 48, claimed); };
    const auto open = [](const std::filesystem::path& path, int flags) {
        return FileDescriptor(::open(path.c_str(), flags | O_CLOEXEC));
    };
    writeFile(scratch, items);
    ASSERT_EQ(::mkfifo((scratch.native() + ".fifo").c_str(), 0600), 0);
    const auto giant = memory(items);
    ASSERT_EQ(::ftruncate(giant.get(), 1L << 40), 0);
    const FileDescriptor socket(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));

    const Sender sender(device());
    EXPECT_EQ(sender.call(message).code(), -300) << "no region";
    EXPECT_EQ(sender.call(sized(size + 8), memory(items).get()).code(), -300) << "shorter than claimed";
    EXPECT_EQ(sender.call(sized((1 << 20) + 8), giant.get()).code(), -300) << "too large";
    EXPECT_EQ(sender.call(sized(1 << 20), giant.get()).code(), 0) << "what follows the end does not matter";
    EXPECT_EQ(sender.call(sized(size - 8), giant.get()).code(), 5) << "without its end";
    EXPECT_EQ(sender.call(sized(size - 4), giant.get()).code(), 9) << "no multiple of 8";
    EXPECT_EQ(sender.call(sized(0), giant.get()).code(), 9) << "nothing";
    for (const auto& [name, descriptor] :
         {std::pair("a FIFO", open(scratch.native() + ".fifo", O_RDWR)),
          std::pair("a device", open("/dev/zero", O_RDONLY)), std::pair("a directory", open("/", O_RDONLY)),
          std::pair("a path", open(scratch, O_PATH)), std::pair("unreadable", open(scratch, O_WRONLY)),
          std::pair("of no size", open("/proc/self/maps", O_RDONLY))})
        EXPECT_EQ(sender.call(message, descriptor.get()).code(), -300) << name;
    EXPECT_EQ(sender.call(message, socket.get()).code(), -300);
    EXPECT_EQ(sender.call(message, open(scratch, O_RDONLY).get()).answer, documented.at(3)) << "an ordinary file";

    EXPECT_EQ(sender.call(message.substr(0, 51), giant.get()).code(), -304);
    EXPECT_EQ(sender.call(message + "x", giant.get()).code(), -304);
    EXPECT_EQ(sender.call(withNumber(message, 20, 322514901)).code(), -303);
    for (const auto& unknown : {""s, "x"s, message.substr(0, 23), withNumber(message, 20, 322514902)})
        EXPECT_TRUE(sender.send(unknown)); // No reply comes.
    EXPECT_EQ(sender.call(message, giant.get()).answer, documented.at(3));
}

TEST_F(UpcallTest, ARegionThatChangesMeanwhileIsReadOrRefused) {
    const auto region = memory(items);
    std::atomic<bool> done = false;
    std::thread changer([&] {
        while (!done)
            if (::ftruncate(region.get(), 0) != 0 || ::pwrite(region.get(), items.data(), items.size(), 0) < 0)
                break;
    });
    const Sender sender(device());
    for (int round = 0; round < 500; ++round) {
        const auto reply = sender.call(message, region.get());
        EXPECT_TRUE(reply.code() == -300 || reply.code() == 5 || !reply.answer.empty()) << reply.code();
    }
    done = true;
    changer.join();
    EXPECT_TRUE(answers());
}

TEST_F(UpcallTest, OnlyWhatRootHasSentIsLookedAt) {
    ASSERT_TRUE(answers());
    const auto before = systemContainers();
    auto other = items;
    other.replace(other.find("pellord"), 7, "another");
    const auto region = memory(other);
    const Sender rootsConnection(device());
    const pid_t child = ::fork();
    if (child == 0) {
        if (::setgroups(0, nullptr) != 0 || ::setgid(501) != 0 || ::setuid(501) != 0)
            ::_exit(1);
        // Over a connection of its own, and over one that root has made.
        ::_exit(Sender(device()).call(message, region.get()).code() == 5 &&
                        rootsConnection.call(message, region.get()).code() == 5
                    ? 0
                    : 2);
    }
    int status = -1;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
    EXPECT_EQ(systemContainers(), before);
    EXPECT_EQ(rootsConnection.call(message, region.get()).code(), 0);
    EXPECT_NE(systemContainers(), before);
}

TEST_F(UpcallTest, ASenderThatDoesNotReadHoldsUpNobodyAndLosesNoReply) {
    const Sender slow(device());
    const auto region = memory(items);
    std::thread floods([&] {
        for (int sent = 0; sent < 1000; ++sent)
            EXPECT_TRUE(slow.send(message, region.get()));
    });
    for (int round = 0; round < 20; ++round)
        EXPECT_TRUE(answers());
    for (int received = 0; received < 1000; ++received)
        ASSERT_EQ(slow.receive().answer, documented.at(3));
    floods.join();
}

} // namespace ost::test
