#include "platform/ipc/UpcallPacket.h"

#include "platform/base/Log.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

namespace ost::platform {

namespace {

constexpr std::size_t sizeFieldOffset = 4;
constexpr std::size_t descriptorCountOffset = 24;
constexpr std::size_t regionAddressOffset = 28;
constexpr std::size_t regionSizeOffset = 32;
constexpr std::size_t regionLimit = 1 << 20;

using Bytes = std::span<std::byte>;

void putNumber(Bytes bytes, std::size_t offset, std::uint32_t number) {
    std::memcpy(bytes.subspan(offset).data(), &number, sizeof number);
}

std::uint32_t numberAt(std::span<const std::byte> bytes, std::size_t offset) {
    std::uint32_t number = 0;
    std::memcpy(&number, bytes.subspan(offset).data(), sizeof number);
    return number;
}

/// What came beside a packet's bytes.
struct Attachments {
    std::optional<ucred> sender;
    std::vector<FileDescriptor> descriptors;
};

void takeControlMessage(Attachments& attachments, const cmsghdr& control) {
    if (control.cmsg_level != SOL_SOCKET)
        return;
    const auto* data = CMSG_DATA(&control);
    const auto size = control.cmsg_len - CMSG_LEN(0);
    if (control.cmsg_type == SCM_CREDENTIALS && size == sizeof(ucred)) {
        std::memcpy(&attachments.sender.emplace(), data, sizeof(ucred));
    } else if (control.cmsg_type == SCM_RIGHTS) {
        for (std::size_t offset = 0; offset + sizeof(int) <= size; offset += sizeof(int)) {
            int descriptor = -1;
            std::memcpy(&descriptor, data + offset, sizeof descriptor);
            attachments.descriptors.emplace_back(descriptor);
        }
    }
}

/// Makes the fields say what came: the packet's length, and how many descriptors where there are too many.
void correctFields(Bytes bytes, std::size_t size, std::size_t descriptorCount) {
    if (size != upcallMessageSize)
        putNumber(bytes, sizeFieldOffset, static_cast<std::uint32_t>(size));
    if (descriptorCount > 1)
        putNumber(bytes, descriptorCountOffset, static_cast<std::uint32_t>(descriptorCount));
    else if (descriptorCount == 1)
        putNumber(bytes, regionAddressOffset, 0);
}

void appendTrailer(UpcallMessage& message, const ucred& sender, std::uint32_t sequenceNumber) {
    // A process that this one cannot see has the number 0, too, which must not make it the kernel.
    constexpr auto invisibleProcess = static_cast<std::uint32_t>(-1);
    const auto process = sender.uid == 0   ? 0
                         : sender.pid == 0 ? invisibleProcess
                                           : static_cast<std::uint32_t>(sender.pid);
    const std::array<std::uint32_t, upcallTrailerSize / sizeof(std::uint32_t)> trailer{
        0,          upcallTrailerSize, sequenceNumber, sender.uid, sender.gid, // security token
        sender.uid, sender.uid,        sender.gid,     sender.uid, sender.gid, process, 0, 0};
    std::memcpy(message.bytes.data() + upcallMessageSize, trailer.data(), upcallTrailerSize);
}

/// Copies `size` bytes out of a regular file, which has them only as long as its sender wants.
std::optional<std::vector<std::byte>> readRegion(int file, std::size_t size) {
    struct stat status{};
    if (::fstat(file, &status) != 0 || !S_ISREG(status.st_mode) || status.st_size < static_cast<off_t>(size))
        return std::nullopt;
    std::vector<std::byte> region(size);
    if (::pread(file, region.data(), size, 0) != static_cast<ssize_t>(size))
        return std::nullopt;
    return region;
}

} // namespace

std::expected<UpcallPacket, Errno> receiveUpcallPacket(int socket, std::uint32_t sequenceNumber, int flags) {
    UpcallPacket packet{};
    const Bytes bytes(packet.message.bytes);
    iovec data{.iov_base = bytes.data(), .iov_len = upcallMessageSize};
    // Two, so that one too many is seen; the kernel itself closes the others.
    alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(ucred)) + CMSG_SPACE(2 * sizeof(int))> control;
    msghdr header{};
    header.msg_iov = &data;
    header.msg_iovlen = 1;
    header.msg_control = control.data();
    header.msg_controllen = control.size();
    const auto size = ::recvmsg(socket, &header, flags | MSG_CMSG_CLOEXEC | MSG_TRUNC);
    if (size < 0)
        return std::unexpected(errno);
    Attachments attachments;
    for (auto* next = CMSG_FIRSTHDR(&header); next; next = CMSG_NXTHDR(&header, next))
        takeControlMessage(attachments, *next);
    if (!attachments.sender) // Every packet brings it, an empty one too.
        return std::unexpected(ENOTCONN);
    packet.sender = *attachments.sender;
    packet.descriptors = std::move(attachments.descriptors);
    if ((header.msg_flags & MSG_CTRUNC) != 0 && packet.descriptors.empty() && packet.sender.uid == 0)
        logError("Failed to receive the region of an upcall: no descriptor is left for it");
    correctFields(bytes, static_cast<std::size_t>(size), packet.descriptors.size());
    appendTrailer(packet.message, packet.sender, sequenceNumber);
    return packet;
}

bool upcallRegionLiesInMemory(const UpcallPacket& packet) {
    return std::ranges::all_of(packet.descriptors, [](const FileDescriptor& descriptor) {
        // Of all files only those have seals, and asking for them reaches no file system.
        return ::fcntl(descriptor.get(), F_GET_SEALS) >= 0;
    });
}

void takeUpcallRegion(UpcallPacket& packet) {
    const auto descriptors = std::move(packet.descriptors);
    const auto size = numberAt(packet.message.bytes, regionSizeOffset);
    if (descriptors.size() != 1 || size > regionLimit)
        packet.message.region = std::nullopt;
    else if (packet.sender.uid != 0)
        packet.message.region.emplace();
    else
        packet.message.region = readRegion(descriptors.front().get(), size);
}

std::expected<void, Errno> sendUpcallReply(int socket, const UpcallReply& reply, int flags) {
    iovec data{.iov_base = const_cast<std::byte*>(reply.bytes.data()), .iov_len = reply.bytes.size()};
    msghdr header{};
    header.msg_iov = &data;
    header.msg_iovlen = 1;
    alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int))> control{};
    if (reply.region) {
        header.msg_control = control.data();
        header.msg_controllen = control.size();
        auto* rights = CMSG_FIRSTHDR(&header);
        rights->cmsg_level = SOL_SOCKET;
        rights->cmsg_type = SCM_RIGHTS;
        rights->cmsg_len = CMSG_LEN(sizeof(int));
        const int descriptor = reply.region.get();
        std::memcpy(CMSG_DATA(rights), &descriptor, sizeof descriptor);
    }
    if (::sendmsg(socket, &header, flags | MSG_NOSIGNAL) < 0)
        return std::unexpected(errno);
    return {};
}

std::expected<FileDescriptor, Errno> makeUpcallRegion(std::span<const std::byte> bytes) {
    FileDescriptor memory(::memfd_create("upcall answer", MFD_CLOEXEC | MFD_ALLOW_SEALING));
    if (!memory)
        return std::unexpected(errno);
    // Leaves the offset at the start, for a receiver that reads on from it.
    const auto written = ::pwrite(memory.get(), bytes.data(), bytes.size(), 0);
    if (written != static_cast<ssize_t>(bytes.size()))
        return std::unexpected(written < 0 ? errno : ENOSPC);
    if (::fcntl(memory.get(), F_ADD_SEALS, F_SEAL_WRITE | F_SEAL_GROW | F_SEAL_SHRINK | F_SEAL_SEAL) != 0)
        return std::unexpected(errno);
    return memory;
}

} // namespace ost::platform
