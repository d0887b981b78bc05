#include "platform/ipc/UpcallPort.h"

#include "platform/base/Log.h"
#include "platform/base/Try.h"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <span>

namespace ost::platform {

namespace {

constexpr std::size_t headerSize = 24;
constexpr std::size_t sizeFieldOffset = 4;
constexpr std::size_t regionAddressOffset = 28;
constexpr std::size_t regionSizeOffset = 32;
constexpr std::size_t regionLimit = 1 << 20;

constexpr std::size_t connectionLimit = 64;
/// Whoever is not root is refused anyway, and must not keep root out.
constexpr std::size_t othersConnectionLimit = 32;
constexpr itimerspec acceptPause{.it_interval = {}, .it_value = {.tv_sec = 0, .tv_nsec = 250'000'000}};

using Bytes = std::span<std::byte>;

void putNumber(Bytes bytes, std::size_t offset, std::uint32_t number) {
    std::memcpy(bytes.subspan(offset).data(), &number, sizeof number);
}

std::uint32_t numberAt(Bytes bytes, std::size_t offset) {
    std::uint32_t number = 0;
    std::memcpy(&number, bytes.subspan(offset).data(), sizeof number);
    return number;
}

/// A received packet with what came along.
struct Packet {
    std::size_t size = 0;
    bool isComplete = false;
    std::optional<ucred> sender;
    std::vector<FileDescriptor> descriptors;
};

void takeControlMessage(Packet& packet, const cmsghdr& control) {
    if (control.cmsg_level != SOL_SOCKET)
        return;
    const auto* data = CMSG_DATA(&control);
    const auto size = control.cmsg_len - CMSG_LEN(0);
    if (control.cmsg_type == SCM_CREDENTIALS && size == sizeof(ucred)) {
        std::memcpy(&packet.sender.emplace(), data, sizeof(ucred));
    } else if (control.cmsg_type == SCM_RIGHTS) {
        for (std::size_t offset = 0; offset + sizeof(int) <= size; offset += sizeof(int)) {
            int descriptor = -1;
            std::memcpy(&descriptor, data + offset, sizeof descriptor);
            packet.descriptors.emplace_back(descriptor);
        }
    }
}

/// Fetches a packet into `bytes`. The kernel itself closes the descriptors that the control buffer has no room for.
std::expected<Packet, int> receivePacket(int socket, Bytes bytes) {
    iovec data{.iov_base = bytes.data(), .iov_len = bytes.size()};
    alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(ucred)) + CMSG_SPACE(sizeof(int))> control;
    msghdr header{};
    header.msg_iov = &data;
    header.msg_iovlen = 1;
    header.msg_control = control.data();
    header.msg_controllen = control.size();
    const auto size = ::recvmsg(socket, &header, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
    if (size < 0)
        return std::unexpected(errno);
    Packet packet{.size = static_cast<std::size_t>(size),
                  .isComplete = (header.msg_flags & (MSG_TRUNC | MSG_CTRUNC)) == 0,
                  .sender = {},
                  .descriptors = {}};
    for (auto* next = CMSG_FIRSTHDR(&header); next; next = CMSG_NXTHDR(&header, next))
        takeControlMessage(packet, *next);
    return packet;
}

/// Copies `size` bytes out of a regular file, which has them only as long as its sender wants.
std::optional<std::vector<std::byte>> readRegion(int file, std::size_t size) {
    struct stat status{};
    if (size > regionLimit || ::fstat(file, &status) != 0 || !S_ISREG(status.st_mode) ||
        static_cast<std::size_t>(status.st_size) < size)
        return std::nullopt;
    std::vector<std::byte> region(size);
    const auto count = ::pread(file, region.data(), size, 0);
    if (count != static_cast<ssize_t>(size))
        return std::nullopt;
    return region;
}

std::expected<FileDescriptor, int> makeSealedRegion(std::span<const std::byte> region) {
    FileDescriptor memory(::memfd_create("upcall answer", MFD_CLOEXEC | MFD_ALLOW_SEALING));
    if (!memory)
        return std::unexpected(errno);
    const auto written = ::write(memory.get(), region.data(), region.size());
    if (written != static_cast<ssize_t>(region.size()))
        return std::unexpected(written < 0 ? errno : ENOSPC);
    if (::fcntl(memory.get(), F_ADD_SEALS, F_SEAL_WRITE | F_SEAL_GROW | F_SEAL_SHRINK | F_SEAL_SEAL) != 0)
        return std::unexpected(errno);
    return memory;
}

std::expected<void, int> sendReply(int socket, UpcallReply& reply) {
    iovec data{.iov_base = reply.bytes.data(), .iov_len = reply.bytes.size()};
    msghdr header{};
    header.msg_iov = &data;
    header.msg_iovlen = 1;
    alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int))> control{};
    FileDescriptor region;
    if (reply.region) {
        region = OST_TRY(makeSealedRegion(*reply.region));
        header.msg_control = control.data();
        header.msg_controllen = control.size();
        auto* rights = CMSG_FIRSTHDR(&header);
        rights->cmsg_level = SOL_SOCKET;
        rights->cmsg_type = SCM_RIGHTS;
        rights->cmsg_len = CMSG_LEN(sizeof(int));
        const int descriptor = region.get();
        std::memcpy(CMSG_DATA(rights), &descriptor, sizeof descriptor);
    }
    // A peer that does not read must not stop the main thread.
    if (::sendmsg(socket, &header, MSG_DONTWAIT | MSG_NOSIGNAL) < 0)
        return std::unexpected(errno);
    return {};
}

bool isOutOfResources(int error) { return error == EMFILE || error == ENFILE || error == ENOBUFS || error == ENOMEM; }

} // namespace

std::expected<std::unique_ptr<UpcallPort>, int> UpcallPort::open(RunLoop& loop, FileDescriptor listener,
                                                                 Handler handler) {
    // Accepted sockets inherit it, so that no packet comes without its sender's credentials.
    const int on = 1;
    if (::setsockopt(listener.get(), SOL_SOCKET, SO_PASSCRED, &on, sizeof on) != 0)
        return std::unexpected(errno);
    FileDescriptor timer(::timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK));
    if (!timer)
        return std::unexpected(errno);
    std::unique_ptr<UpcallPort> port(new UpcallPort(loop, std::move(listener), std::move(timer), std::move(handler)));
    auto* self = port.get();
    self->_listenerSource =
        OST_TRY(loop.addSource(self->_listener.get(), EPOLLIN, [self](std::uint32_t) { self->_accept(); }));
    self->_pauseSource =
        OST_TRY(loop.addSource(self->_pauseTimer.get(), EPOLLIN, [self](std::uint32_t) { self->_resumeAccepting(); }));
    return port;
}

void UpcallPort::_accept() {
    FileDescriptor socket(::accept4(_listener.get(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK));
    if (!socket) {
        if (isOutOfResources(errno))
            _pauseAccepting(errno);
        return;
    }
    ucred peer{};
    socklen_t size = sizeof peer;
    if (::getsockopt(socket.get(), SOL_SOCKET, SO_PEERCRED, &peer, &size) != 0 || !_hasRoomFor(peer.uid == 0))
        return;
    const int descriptor = socket.get();
    const auto connection = _connections.insert(_connections.end(), {std::move(socket), peer.uid == 0, {}});
    auto source = _loop.addSource(descriptor, EPOLLIN, [this, connection](std::uint32_t) { _receive(connection); });
    if (source)
        connection->source = *std::move(source);
    else
        _connections.erase(connection);
}

void UpcallPort::_pauseAccepting(int error) {
    logError("Failed to accept a connection of the upcall port: %s", std::strerror(error));
    _listenerSource.setEvents(0);
    ::timerfd_settime(_pauseTimer.get(), 0, &acceptPause, nullptr);
}

void UpcallPort::_resumeAccepting() {
    std::uint64_t expirations = 0;
    [[maybe_unused]] const auto read = ::read(_pauseTimer.get(), &expirations, sizeof expirations);
    _listenerSource.setEvents(EPOLLIN);
}

bool UpcallPort::_hasRoomFor(bool root) const {
    return _connections.size() < connectionLimit &&
           (root || std::ranges::count(_connections, false, &Connection::isRoots) <
                        static_cast<std::ptrdiff_t>(othersConnectionLimit));
}

void UpcallPort::_receive(Connections::iterator connection) {
    if (!_serveMessage(connection->socket.get()))
        _connections.erase(connection);
}

/// Receives, handles and answers one message. False when the connection has ended or is to end.
bool UpcallPort::_serveMessage(int socket) {
    UpcallMessage message{};
    const Bytes bytes(message.bytes);
    const auto packet = receivePacket(socket, bytes.first(upcallMessageSize));
    if (!packet)
        return packet.error() == EAGAIN || packet.error() == EINTR;
    if (packet->size == 0)
        return false;
    if (!packet->isComplete || packet->size < headerSize || packet->descriptors.size() > 1 || !packet->sender) {
        logError("Closing an upcall connection of user %u: a packet of %lu bytes is no message",
                 packet->sender ? packet->sender->uid : uid_t(-1), packet->size);
        return false;
    }
    if (packet->size < upcallMessageSize)
        putNumber(bytes, sizeFieldOffset, static_cast<std::uint32_t>(packet->size));
    if (!packet->descriptors.empty()) {
        // A file of somebody else's file system may never answer, so only the kernel's is touched.
        message.region = packet->sender->uid == 0
                             ? readRegion(packet->descriptors.front().get(), numberAt(bytes, regionSizeOffset))
                             : std::optional(std::vector<std::byte>());
        putNumber(bytes, regionAddressOffset, 0);
    }
    _appendTrailer(message, *packet->sender);

    auto reply = _handler(message);
    if (!reply)
        return true;
    const auto sent = sendReply(socket, *reply);
    if (!sent)
        logError("Closing an upcall connection of user %u: Failed to reply: %s", packet->sender->uid,
                 std::strerror(sent.error()));
    return sent.has_value();
}

void UpcallPort::_appendTrailer(UpcallMessage& message, const ucred& sender) {
    // A process that this one cannot see has the number 0, too, which must not make it the kernel.
    constexpr auto invisibleProcess = static_cast<std::uint32_t>(-1);
    const auto process = sender.uid == 0   ? 0
                         : sender.pid == 0 ? invisibleProcess
                                           : static_cast<std::uint32_t>(sender.pid);
    const std::array<std::uint32_t, upcallTrailerSize / sizeof(std::uint32_t)> trailer{
        0,          upcallTrailerSize, _sequenceNumber++, sender.uid, sender.gid, // security token
        sender.uid, sender.uid,        sender.gid,        sender.uid, sender.gid, process, 0, 0};
    std::memcpy(message.bytes.data() + upcallMessageSize, trailer.data(), upcallTrailerSize);
}

} // namespace ost::platform
