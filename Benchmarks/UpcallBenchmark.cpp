// Upcalls for containers that exist, beside an echo of the same packets with the same descriptors, and beside clients
// that create.

#include "Client/Containers.h"
#include "Support/BootedDevice.h"
#include "Support/ChildProcess.h"
#include "Support/ScratchDirectory.h"
#include "platform/codec/OSTPackBuffer.h"
#include "platform/ipc/UpcallPacket.h"
#include "support/Comparison.h"
#include "support/DeviceClient.h"
#include "support/JournaledFileSystem.h"
#include "support/OneProcessor.h"
#include "support/Require.h"
#include "support/Socket.h"
#include "support/Stopwatch.h"

#include <sys/epoll.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cstring>
#include <future>
#include <stdexcept>
#include <string>
#include <vector>

namespace ost::benchmarks {

using test::BootedDevice;
using test::ChildProcess;
using test::makeScratchDirectory;

namespace {

using platform::FileDescriptor;

constexpr const char* identifier = "com.example.Sketches";
constexpr const char* group = "group.com.example.Sketches";
constexpr std::size_t failureSize = 36;

/// A packet of an upcall, and the descriptor beside it.
struct Packet {
    std::array<std::uint32_t, 13> words{};
    std::size_t size = 0;
    FileDescriptor region;

    /// False when the other side has gone.
    [[nodiscard]] bool receiveFrom(int socket) {
        alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int))> control;
        iovec data{.iov_base = words.data(), .iov_len = sizeof words};
        msghdr header{};
        header.msg_iov = &data;
        header.msg_iovlen = 1;
        header.msg_control = control.data();
        header.msg_controllen = control.size();
        const auto received = ::recvmsg(socket, &header, MSG_CMSG_CLOEXEC);
        require(received >= 0, "receive a packet");
        size = static_cast<std::size_t>(received);
        if (const auto* const rights = CMSG_FIRSTHDR(&header)) {
            int descriptor = -1;
            std::memcpy(&descriptor, CMSG_DATA(rights), sizeof descriptor);
            region.reset(descriptor);
        }
        return size > 0;
    }

    void sendTo(int socket) {
        alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int))> control{};
        iovec data{.iov_base = words.data(), .iov_len = size};
        msghdr header{};
        header.msg_iov = &data;
        header.msg_iovlen = 1;
        header.msg_control = control.data();
        header.msg_controllen = control.size();
        auto* const rights = CMSG_FIRSTHDR(&header);
        rights->cmsg_len = CMSG_LEN(sizeof(int));
        rights->cmsg_level = SOL_SOCKET;
        rights->cmsg_type = SCM_RIGHTS;
        const int descriptor = region.get();
        std::memcpy(CMSG_DATA(rights), &descriptor, sizeof descriptor);
        require(::sendmsg(socket, &header, MSG_NOSIGNAL) == static_cast<ssize_t>(size), "send a packet");
    }
};

Packet upcallRequest() {
    const auto buffer = sb_packbuff_new(4096);
    require(sb_packbuff_pack_uint32(*buffer, 3, 501) &&
                sb_packbuff_pack_string(*buffer, 1, identifier, std::strlen(identifier)) &&
                sb_packbuff_pack_string(*buffer, 4, group, std::strlen(group)),
            "pack a request");
    const auto size = static_cast<std::uint32_t>(sb_packbuff_get_size(*buffer));
    return {.words = {0x80001513, 52, 1, 0, 0, 322514900, 1, 0, size, 0x01000100, 0, 1, size},
            .size = platform::upcallMessageSize,
            .region = require(platform::makeUpcallRegion({sb_packbuff_get_bytes(*buffer), size}), "make a region")};
}

/// One sender that asks the same over and over.
class Upcalls {
public:
    explicit Upcalls(const std::string& socketPath) : _socket(connectTo(socketPath, SOCK_SEQPACKET)) {}

    void once() {
        _request.sendTo(_socket.get());
        Packet reply;
        if (!reply.receiveFrom(_socket.get()) || reply.size == failureSize)
            throw std::runtime_error("an upcall is not answered");
    }

    double secondsEach(unsigned count) {
        once();
        const auto start = Clock::now();
        for (unsigned done = 0; done < count; ++done)
            once();
        return secondsSince(start) / count;
    }

private:
    FileDescriptor _socket;
    Packet _request = upcallRequest();
};

/// The bare work of a port: an event loop that sends back every packet with its descriptor.
int echoPackets(int listener) {
    const FileDescriptor epoll(::epoll_create1(EPOLL_CLOEXEC));
    const auto watch = [&](int fd) {
        epoll_event event{.events = EPOLLIN, .data = {.fd = fd}};
        require(::epoll_ctl(epoll.get(), EPOLL_CTL_ADD, fd, &event) == 0, "epoll_ctl");
    };
    watch(listener);
    for (;;) {
        epoll_event event{};
        if (::epoll_wait(epoll.get(), &event, 1, -1) != 1)
            continue;
        if (event.data.fd == listener) {
            watch(::accept4(listener, nullptr, nullptr, SOCK_CLOEXEC));
            continue;
        }
        Packet packet;
        if (packet.receiveFrom(event.data.fd))
            packet.sendTo(event.data.fd);
        else
            ::close(event.data.fd);
    }
}

void oneSender(benchmark::State& state) {
    constexpr unsigned upcalls = 2000;
    const OneProcessor oneProcessor;
    const auto directory = makeScratchDirectory(0711);
    const BootedDevice device(directory / "device");
    registerApplication(device, identifier);
    const auto echoPath = (directory / "echo").string();
    const auto listener = listenOn(echoPath, SOCK_SEQPACKET);
    const ChildProcess server([&] { return echoPackets(listener.get()); });
    Upcalls daemon(device.socket().string() + ".upcall");
    Upcalls echo(echoPath);
    Comparison{.unit = Unit::seconds,
               .target = {Target::Kind::ratioAtMost, 2.0},
               .daemon = [&] { return daemon.secondsEach(upcalls); },
               .baseline = [&] { return echo.secondsEach(upcalls); }}
        .run(state);
}

/// Creates until it is told to end, and gives what the slowest creation took.
double slowestCreation(const BootedDevice& device, const std::atomic<bool>& end) {
    static std::atomic<unsigned> number{0};
    auto connection = connectTo(device);
    double slowest = 0;
    while (!end)
        slowest = std::max(
            slowest, secondsOf([&] { createContainer(connection, "com.example.Other." + std::to_string(++number)); }));
    return slowest;
}

void besideCreations(benchmark::State& state) {
    constexpr unsigned upcalls = 1000;
    constexpr unsigned clients = 8;
    const JournaledFileSystem disk;
    const BootedDevice device(disk.path() / "device");
    registerApplication(device, identifier);
    Upcalls daemon(device.socket().string() + ".upcall");
    daemon.once();
    double creation = 0;
    const auto slowestUpcall = [&] {
        std::atomic<bool> end = false;
        std::vector<std::future<double>> creators;
        for (unsigned started = 0; started < clients; ++started)
            creators.push_back(std::async(std::launch::async, [&] { return slowestCreation(device, end); }));
        double slowest = 0;
        for (unsigned done = 0; done < upcalls; ++done)
            slowest = std::max(slowest, secondsOf([&] { daemon.once(); }));
        end = true;
        creation = 0;
        for (auto& creator : creators)
            creation = std::max(creation, creator.get());
        return slowest;
    };
    Comparison{.unit = Unit::seconds,
               .target = {Target::Kind::ratioAtMost, 1.0},
               .daemon = slowestUpcall,
               .baseline = [&] { return creation; }}
        .run(state);
}

[[maybe_unused]] const int one = registerComparison("upcall, one sender", 51, oneSender);
[[maybe_unused]] const int beside =
    registerComparison("slowest of 1,000 upcalls, slowest creation", 11, besideCreations);

} // namespace

} // namespace ost::benchmarks
