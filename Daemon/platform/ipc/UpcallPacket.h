#pragma once

#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"

#include <sys/socket.h>
#include <sys/types.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <expected>
#include <optional>
#include <span>
#include <vector>

namespace ost::platform {

inline constexpr std::size_t upcallMessageSize = 52;
inline constexpr std::size_t upcallTrailerSize = 52;

/// One received message and what the port knows of it.
struct UpcallMessage {
    /// The message as it was sent, then the trailer: type 0, size, sequence number, security token (user and group id),
    /// audit token of eight words of which the sixth is the sender's process id, 0 for the kernel. A packet of another
    /// length is cut or filled up with zeros, and its true length stands in the size field.
    std::array<std::byte, upcallMessageSize + upcallTrailerSize> bytes;

    /// The out-of-line region, whose index (0) then stands in the address field: exactly as many bytes as its size
    /// field says. Absent when it cannot be had whole. Empty, whatever the size field says, when the sender is not the
    /// kernel: nobody may look at what such a sender passes.
    std::optional<std::vector<std::byte>> region;
};

struct UpcallReply {
    std::vector<std::byte> bytes;
    FileDescriptor region = FileDescriptor(); ///< sent along, if any
};

/// A message on its way in, with what its sender passed.
struct UpcallPacket {
    UpcallMessage message;
    ucred sender;
    std::vector<FileDescriptor> descriptors;
};

/// Receives the next packet. Fails with the errno of the socket; ENOTCONN says that the sender has closed it.
[[nodiscard]] std::expected<UpcallPacket, Errno> receiveUpcallPacket(int socket, std::uint32_t sequenceNumber,
                                                                     int flags);

/// Whether everything that was passed is shared memory or a file of a tmpfs: neither reading nor closing it waits.
[[nodiscard]] bool upcallRegionLiesInMemory(const UpcallPacket& packet);

/// Copies the region out of what was passed, and closes that. A file of somebody else's file system may keep its reader
/// waiting for ever.
void takeUpcallRegion(UpcallPacket& packet);

/// Fails with the errno of the socket.
[[nodiscard]] std::expected<void, Errno> sendUpcallReply(int socket, const UpcallReply& reply, int flags);

/// A copy of `bytes` to be sent along with a reply, sealed. Fails with the errno of making it.
[[nodiscard]] std::expected<FileDescriptor, Errno> makeUpcallRegion(std::span<const std::byte> bytes);

} // namespace ost::platform
