#pragma once

#include "platform/base/FileDescriptor.h"
#include "platform/threads/RunLoop.h"

#include <sys/socket.h>
#include <sys/types.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <expected>
#include <functional>
#include <list>
#include <memory>
#include <optional>
#include <vector>

namespace ost::platform {

inline constexpr std::size_t upcallMessageSize = 52;
inline constexpr std::size_t upcallTrailerSize = 52;

/// One received message and what the port knows of it.
struct UpcallMessage {
    /// The message as it was sent, then the trailer: type 0, size, sequence number, security token (user and group id),
    /// audit token of eight words of which the sixth is the sender's process id, 0 for the kernel. A message shorter
    /// than it should be is filled up with zeros and has its true length in the size field; none is shorter than 24
    /// bytes.
    std::array<std::byte, upcallMessageSize + upcallTrailerSize> bytes;

    /// The out-of-line region, whose index (0) then stands in the address field: exactly as many bytes as its size
    /// field says. Absent when none was passed, or none that could be read. Empty, whatever the size field says, when
    /// the sender is not the kernel: nobody may look at what such a sender passes.
    std::optional<std::vector<std::byte>> region;
};

struct UpcallReply {
    std::vector<std::byte> bytes;
    std::optional<std::vector<std::byte>> region; ///< sent along as a sealed memfd
};

/// The port on which the kernel, and whoever plays it, asks the daemon: a listening socket of packets, one message
/// each. A sender whose user id is 0 plays the kernel.
///
/// Threads: the run loop's, on which the handler is called, one message at a time. Ownership: must go before its loop.
/// Senders are hostile: one whose packet cannot be a message, or who does not take a reply, loses the connection, with
/// one error line.
class UpcallPort {
public:
    /// Makes of a message the reply, or nothing when it is not handled.
    using Handler = std::move_only_function<std::optional<UpcallReply>(const UpcallMessage& message)>;

    /// Serves `listener`, a listening SOCK_SEQPACKET socket, on `loop`. Fails with the errno of the missing source.
    [[nodiscard]] static std::expected<std::unique_ptr<UpcallPort>, int> open(RunLoop& loop, FileDescriptor listener,
                                                                              Handler handler);
    UpcallPort(const UpcallPort&) = delete;
    UpcallPort& operator=(const UpcallPort&) = delete;

private:
    struct Connection {
        FileDescriptor socket;
        bool isRoots;
        RunLoop::Source source; // declared last: goes before the socket it listens to
    };
    using Connections = std::list<Connection>;

    UpcallPort(RunLoop& loop, FileDescriptor listener, FileDescriptor pauseTimer, Handler handler)
        : _loop(loop), _listener(std::move(listener)), _pauseTimer(std::move(pauseTimer)),
          _handler(std::move(handler)) {}

    void _accept();
    void _pauseAccepting(int error);
    void _resumeAccepting();
    [[nodiscard]] bool _hasRoomFor(bool root) const;
    void _receive(Connections::iterator connection);
    [[nodiscard]] bool _serveMessage(int socket);
    void _appendTrailer(UpcallMessage& message, const ucred& sender);

    RunLoop& _loop;
    const FileDescriptor _listener;
    const FileDescriptor _pauseTimer; ///< made early, for the time when there are no descriptors
    Handler _handler;
    RunLoop::Source _listenerSource;
    RunLoop::Source _pauseSource;
    Connections _connections;
    std::uint32_t _sequenceNumber = 0;
};

} // namespace ost::platform
