#pragma once

#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"
#include "platform/ipc/UpcallPacket.h"
#include "platform/threads/RunLoop.h"

#include <cstdint>
#include <expected>
#include <functional>
#include <list>
#include <memory>
#include <optional>
#include <string>

namespace ost::platform {

/// The port on which the kernel, and what plays it, asks the daemon: a listening socket of packets, one message each. A
/// sender whose user id is 0 plays the kernel.
///
/// Threads: the run loop's, on which the handler is called, one message at a time. Ownership: must go before its loop.
///
/// Senders are hostile. Reading or closing what one passes may last for ever: a file of a file system that does not
/// answer, a network connection that lingers. So the loop's thread receives only from connections that root has made,
/// and only what lies in memory; every other connection has a thread of its own, which waits in the loop's place. A
/// sender that does not take its replies is not read from meanwhile.
class UpcallPort {
public:
    /// Makes of a message the reply, or nothing when it is not handled.
    using Handler = std::move_only_function<std::optional<UpcallReply>(UpcallMessage& message)>;

    /// Serves `listener`, a listening SOCK_SEQPACKET socket, on `loop`. Fails with the errno of the missing source.
    [[nodiscard]] static std::expected<std::unique_ptr<UpcallPort>, Errno> open(RunLoop& loop, FileDescriptor listener,
                                                                                Handler handler);
    UpcallPort(const UpcallPort&) = delete;
    UpcallPort& operator=(const UpcallPort&) = delete;
    ~UpcallPort();

private:
    class Aside;
    struct Connection {
        FileDescriptor socket;
        std::optional<UpcallReply> unsent; ///< nothing is received until the sender has taken it
        bool isWaiting = false;            ///< for the sender to take it
        RunLoop::Source source = {};       // declared last: goes before the socket it listens to
    };
    using Connections = std::list<Connection>;

    UpcallPort(RunLoop& loop, FileDescriptor listener, FileDescriptor pauseTimer, Handler handler);

    void _accept();
    void _pauseAccepting(const std::string& reason);
    void _resumeAccepting();
    void _serveOnLoop(FileDescriptor socket);
    void _serveAside(FileDescriptor socket, bool isRoots, bool isServed, std::optional<UpcallPacket> first);
    void _serve(Connections::iterator connection);
    // False when the loop is to let go of the connection.
    [[nodiscard]] bool _receive(Connection& connection);
    [[nodiscard]] bool _sendUnsent(Connection& connection);

    RunLoop& _loop;
    const FileDescriptor _listener;
    const FileDescriptor _pauseTimer; ///< made early, for the time when there are no descriptors
    Handler _handler;
    RunLoop::Source _listenerSource;
    RunLoop::Source _pauseSource;
    bool _hasComplained = false; ///< that it cannot accept
    Connections _connections;    ///< those that the loop serves
    const std::shared_ptr<Aside> _aside;
};

} // namespace ost::platform
