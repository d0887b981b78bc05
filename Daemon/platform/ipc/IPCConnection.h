#pragma once

#include "platform/base/FileDescriptor.h"
#include "platform/base/Mutex.h"
#include "platform/ipc/IPCConnectionRegistry.h"
#include "platform/ipc/IPCFrame.h"
#include "platform/ipc/IPCMemoryBudget.h"
#include "platform/ipc/IPCMessage.h"
#include "platform/ipc/PeerIdentity.h"
#include "platform/threads/DeadlineTimer.h"
#include "platform/threads/EventSource.h"
#include "platform/threads/WorkerPool.h"

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <limits>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>

namespace ost::platform {

/// One client: a connection that gives its requests, in order and one at a time, to the message handler.
///
/// Threads: the message handler runs on a thread of the listener's pool; requests of different connections run at the
/// same time. `cancel` and replies are safe from any thread; the setters and `resume` belong to the listener's event
/// handler, before any request; `peer` belongs to the message handler.
///
/// Ownership: shared by the listener, as long as the client stays, and by replies that are not yet sent. A connection
/// that outlives its listener is closed.
///
/// The end: the client goes away, or breaks a rule of the wire or a limit, or `cancel` is called. Replies to the
/// requests before that are still delivered where somebody is left to take them, then the socket is closed and the
/// invalidation handler is called.
class IPCConnection final : public EventSource, public IPCReplyReceiver {
public:
    using MessageHandler = std::function<void(const std::shared_ptr<IPCConnection>&, IPCRequest)>;
    using InvalidationHandler = std::function<void(const std::shared_ptr<IPCConnection>&)>;

    /// What a connection uses of its listener, all of which outlives the connection's socket.
    struct Surroundings {
        WorkerPool& pool;
        DeadlineTimer& timer;
        IPCConnectionRegistry& registry;
        IPCMemoryBudget& memory;
        const IPCLimits& limits;
    };

    IPCConnection(FileDescriptor socket, PeerIdentity peer, const Surroundings& surroundings);

    void setMessageHandler(MessageHandler handler) { _messageHandler = std::move(handler); }
    /// Called once, after the last message, when the connection has gone for whatever reason.
    void setInvalidationHandler(InvalidationHandler handler) { _invalidationHandler = std::move(handler); }

    /// Lets requests come in. A connection that is not resumed by the end of the listener's event handler is closed.
    void resume();

    /// The reply to `request`, which came in on this connection; absent when that has one already, or the connection is
    /// gone.
    [[nodiscard]] std::optional<IPCReply> createReply(IPCRequest& request);

    /// Ends the connection. From the message handler: the request at hand and those behind it get no reply. From
    /// elsewhere: no further request is handled.
    void cancel();

    [[nodiscard]] PeerIdentity& peer() { return _peer; }
    [[nodiscard]] const PeerIdentity& peer() const { return _peer; }

private:
    friend class IPCListener;
    using Time = std::chrono::steady_clock::time_point;

    /// Ordered: an end never becomes a milder one.
    enum class End : std::uint8_t {
        none,
        noMoreRequests, ///< the client has sent its last
        cancelled,      ///< so have we decided: replies to earlier requests are still delivered
        broken,         ///< nothing can be delivered any more
    };

    // Receiving: only while the pool serves this connection.
    void serve(std::uint32_t events, std::span<char> scratch) override;
    void _serveEvents(std::uint32_t events, std::span<char> scratch);
    void _receive(std::span<char> scratch);
    [[nodiscard]] bool _receiveSome(std::span<char> scratch);
    void _noteUse();
    [[nodiscard]] bool _allowsLongFrame();
    void _handle(IPCFrame frame);
    void _countReceived(std::size_t atHand);
    void _watchForFrame(bool drained);
    void _checkDeadlines();
    void _closeIfFinished();
    /// The socket, or -1 once it is closed. Only the thread that serves closes it, so that one needs no mutex.
    [[nodiscard]] int _servedSocket() const OST_NO_THREAD_ANALYSIS { return _socket.get(); }
    void _refuse(std::string_view reason);

    // Sending.
    void sendReply(std::string frame, std::uint64_t sequence) override;
    void abandonReply() override;
    void _flushUntil(Time deadline);

    void _close();
    void _closeUnlessResumed();

    void _sendOrKeep(std::string frame) OST_REQUIRES(_mutex);
    void _sendKept() OST_REQUIRES(_mutex);
    void _countUnsent(std::size_t bytes) OST_REQUIRES(_mutex);
    [[nodiscard]] std::optional<std::size_t> _trySending(std::string_view bytes) OST_REQUIRES(_mutex);
    void _replyIsDone() OST_REQUIRES(_mutex);
    void _endWith(End end) OST_REQUIRES(_mutex);
    void _updateDeadline() OST_REQUIRES(_mutex);

    Surroundings _surroundings;
    PeerIdentity _peer;
    MessageHandler _messageHandler;
    InvalidationHandler _invalidationHandler;

    // Of the thread that serves.
    IPCFrameReader _reader;
    std::uint64_t _sequence = 0;     ///< requests received
    std::size_t _receivedBytes = 0;  ///< as the budget knows them
    bool _readUntilEnd = false;      ///< the client sends no more than what is here already
    bool _hungUp = false;            ///< nor does it take replies
    bool _waitsForFrame = false;     ///< whether _frameDeadline is set
    std::uint64_t _awaitedFrame = 0; ///< then, for the frame after this many

    // Own locking.
    IPCUse _use;
    std::atomic<End> _end{End::none};              ///< written under _mutex
    std::atomic<std::size_t> _openReplies{0};      ///< made and neither sent nor abandoned
    std::atomic<std::uint64_t> _firstUnhandled{0}; ///< sequence of the request at hand, or else of the next

    Mutex _mutex;
    /// Empty once closed; the surroundings are used only while it is open.
    FileDescriptor _socket OST_GUARDED_BY(_mutex);
    WorkerPool::Watch _watch OST_GUARDED_BY(_mutex) = WorkerPool::Watch::none;
    /// Requests from here on get no reply.
    std::uint64_t _repliesEnd OST_GUARDED_BY(_mutex) = std::numeric_limits<std::uint64_t>::max();
    std::deque<std::string> _unsent OST_GUARDED_BY(_mutex);
    std::size_t _unsentBytes OST_GUARDED_BY(_mutex) = 0;
    /// Bytes of the first one that the socket has taken.
    std::size_t _sentOfFirst OST_GUARDED_BY(_mutex) = 0;
    std::optional<Time> _frameDeadline OST_GUARDED_BY(_mutex);
    std::optional<Time> _replyDeadline OST_GUARDED_BY(_mutex);
    /// The earliest, as the timer knows it.
    std::optional<Time> _deadline OST_GUARDED_BY(_mutex);
};

} // namespace ost::platform
