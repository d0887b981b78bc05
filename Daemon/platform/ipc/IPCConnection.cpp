#include "platform/ipc/IPCConnection.h"

#include "platform/base/Assert.h"
#include "platform/base/Log.h"

#include <poll.h>
#include <sys/epoll.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <exception>
#include <utility>

namespace ost::platform {

namespace {

using Clock = std::chrono::steady_clock;

/// Requests handled, and receptions done, before a client that goes on and on lets others have their turn.
constexpr unsigned stepsInARow = 16;
/// How long a connection that shares its user's turns goes on with one of them.
constexpr std::chrono::microseconds longEnough{100};

constexpr std::uint32_t receptionEvents = EPOLLIN | EPOLLRDHUP;
constexpr std::uint32_t hangUpEvents = EPOLLHUP | EPOLLERR;

/// Throws away what the client has sent and nobody will handle: closing a socket with bytes in it would make the
/// client's next read fail with ECONNRESET instead of finding the end.
void discardReceived(int socket) {
    ::shutdown(socket, SHUT_RD); // from here on nothing is added
    std::array<char, 16 * 1024> bytes;
    while (::recv(socket, bytes.data(), bytes.size(), MSG_DONTWAIT) > 0) {
    }
}

} // namespace

IPCConnection::IPCConnection(FileDescriptor socket, PeerIdentity peer, const Surroundings& surroundings)
    : _surroundings(surroundings), _peer(std::move(peer)), _reader(surroundings.limits.payloadWithoutEntitlements),
      _socket(std::move(socket)) {
    _noteUse();
}

void IPCConnection::resume() {
    {
        // A request may be handled before `add` returns. What closes the socket waits here and finds the watch.
        const MutexLock lock(_mutex);
        OST_ASSERT(_watch == WorkerPool::Watch::none && _messageHandler);
        const auto watch = _surroundings.pool.add(shared_from_this(), _socket.get(), receptionEvents);
        if (watch) {
            _watch = *watch;
            return;
        }
        logError("connection of pid %d cannot be watched: errno %d", _peer.processId(), watch.error());
    }
    _close();
}

std::optional<IPCReply> IPCConnection::createReply(IPCRequest& request) {
    if (_end.load() >= End::cancelled || std::exchange(request._hasReply, true))
        return std::nullopt;
    _openReplies.fetch_add(1, std::memory_order_relaxed);
    return IPCReply(std::static_pointer_cast<IPCConnection>(shared_from_this()), request._frame.requestNumber(),
                    request._sequence);
}

void IPCConnection::cancel() {
    const MutexLock lock(_mutex);
    _endWith(End::cancelled);
}

// Receiving

void IPCConnection::serve(std::uint32_t events, std::span<char> scratch) {
    const LogOrigin origin(_peer.effectiveUserId());
    try {
        _serveEvents(events, scratch);
    } catch (const std::exception& exception) {
        logError("connection of pid %d closed: %s", _peer.processId(), exception.what());
        _close();
    }
}

void IPCConnection::_serveEvents(std::uint32_t events, std::span<char> scratch) {
    if (_servedSocket() < 0)
        return;
    if ((events & EPOLLOUT) != 0) {
        const MutexLock lock(_mutex);
        _sendKept();
    }
    _readUntilEnd |= (events & (EPOLLRDHUP | hangUpEvents)) != 0;
    _hungUp |= (events & hangUpEvents) != 0;
    if ((events & memoryEvent) != 0) {
        logError("connection of pid %d closed: its user's requests and replies take too much memory",
                 _peer.processId());
        return _close();
    }
    if ((events & (receptionEvents | EPOLLOUT)) != 0)
        _noteUse();
    else if ((events & placeEvent) != 0) {
        logError("connection of pid %d closed: others need its place", _peer.processId());
        return _close();
    }
    if (_end.load() == End::none)
        _receive(scratch);
    _reader.settle();
    _countReceived(0);
    // After receiving, so that what came in time counts even if it is seen late.
    if ((events & deadlineEvent) != 0)
        _checkDeadlines();
    if (_end.load() != End::none)
        _closeIfFinished();
}

void IPCConnection::_receive(std::span<char> scratch) {
    bool drained = false;
    const auto begin = takesTurns() ? Clock::now() : Time{};
    for (unsigned step = 0; step < stepsInARow; ++step) {
        if (_end.load() != End::none || _surroundings.pool.isStopping())
            return;
        if (auto frame = _reader.next()) {
            _handle(*std::move(frame));
            if (takesTurns() && Clock::now() - begin > longEnough)
                break;
        } else if (frame.error() == IPCFrameReader::Result::malformed) {
            if (!_allowsLongFrame())
                return;
        } else if (drained)
            return _watchForFrame(true);
        else
            drained = _receiveSome(scratch);
    }
    _watchForFrame(false);
    _surroundings.pool.post(shared_from_this(), EPOLLIN);
}

/// Gives whether nothing is left to receive. A stream socket that fills less than the space has nothing left; the event
/// of anything further is yet to come. An end that was announced already has to be read, though.
bool IPCConnection::_receiveSome(std::span<char> scratch) {
    const auto space = _reader.space(scratch);
    const auto count = ::recv(_servedSocket(), space.data(), space.size(), MSG_DONTWAIT);
    if (count > 0) {
        const auto size = static_cast<std::size_t>(count);
        _reader.received(size);
        _countReceived(0);
        return size < space.size() && !_readUntilEnd;
    }
    if (count < 0 && (errno == EAGAIN || errno == EINTR))
        return errno == EAGAIN;
    const MutexLock lock(_mutex);
    _endWith(End::noMoreRequests);
    return true;
}

void IPCConnection::_noteUse() { _use.lastServed = Clock::now().time_since_epoch().count(); }

/// A frame that is longer than others may be is taken from a program that has entitlements; else it is refused. The
/// program is asked for at each, because it may be another one by then.
bool IPCConnection::_allowsLongFrame() {
    const auto claimed = _reader.claimedPayload().value_or(0);
    if (claimed == 0 || claimed > _surroundings.limits.payload) {
        _refuse("a frame of no valid length");
        return false;
    }
    const auto identity = _peer.codeSigningIdentity();
    if (!identity || !(*identity)->entitlements) {
        _refuse("a frame too long for a program without entitlements");
        return false;
    }
    _reader.setMaximumPayload(_surroundings.limits.payload);
    return true;
}

/// Small change is not counted, so that ordinary requests touch nothing that all connections share.
void IPCConnection::_countReceived(std::size_t atHand) {
    constexpr std::size_t smallChange = 4096;
    auto bytes = _reader.memory() + atHand;
    if (bytes < smallChange)
        bytes = 0;
    if (bytes != _receivedBytes)
        _surroundings.memory.change(*this, _peer.effectiveUserId(), std::exchange(_receivedBytes, bytes), bytes);
}

void IPCConnection::_handle(IPCFrame frame) {
    _reader.setMaximumPayload(_surroundings.limits.payloadWithoutEntitlements);
    _countReceived(frame.memory());
    if (const auto root = validateCBOR(frame.payload()); !root)
        return _refuse(formatMessage("malformed message, %@", root.error()));
    const auto sequence = _sequence++;
    _messageHandler(std::static_pointer_cast<IPCConnection>(shared_from_this()),
                    IPCRequest(std::move(frame), sequence));
    _firstUnhandled.store(_sequence);
    _use.hasEntitlements = _peer.hasEntitlements();
}

/// Keeps the deadline of a frame that has arrived in part. While more is there to be received, none begins.
void IPCConnection::_watchForFrame(bool drained) {
    const bool watched = _waitsForFrame && _awaitedFrame == _sequence;
    const bool waits = !_reader.empty() && (drained || watched);
    if (waits == _waitsForFrame && (!waits || watched))
        return;
    _waitsForFrame = waits;
    _awaitedFrame = _sequence;
    const MutexLock lock(_mutex);
    _frameDeadline = waits ? std::optional(Clock::now() + _surroundings.limits.completeFrame) : std::nullopt;
    _updateDeadline();
}

void IPCConnection::_checkDeadlines() {
    const auto now = Clock::now();
    const auto passed = [&](const std::optional<Time>& deadline) { return deadline && *deadline <= now; };
    bool frame = false;
    {
        const MutexLock lock(_mutex);
        frame = passed(_frameDeadline);
        if (passed(_replyDeadline)) {
            logError("connection of pid %d closed: it does not take its replies", _peer.processId());
            _endWith(End::broken);
        }
    }
    if (frame)
        _refuse("a frame that does not arrive");
}

void IPCConnection::_refuse(std::string_view reason) {
    logError("connection of pid %d closed: %@", _peer.processId(), reason);
    cancel();
}

void IPCConnection::_closeIfFinished() {
    {
        const MutexLock lock(_mutex);
        const bool nothingToDeliver = _unsent.empty() && _openReplies.load() == 0;
        if (_end.load() != End::broken && !_hungUp && !nothingToDeliver)
            return;
    }
    _close();
}

// Sending

void IPCConnection::sendReply(std::string frame, std::uint64_t sequence) {
    const MutexLock lock(_mutex);
    if (_socket && sequence < _repliesEnd) {
        if (frame.size() - IPCFrameHeader::size <= _surroundings.limits.payload) {
            _sendOrKeep(std::move(frame));
        } else {
            logError("connection of pid %d closed: a reply of %llu bytes", _peer.processId(), frame.size());
            _endWith(End::cancelled);
        }
    }
    _replyIsDone();
}

void IPCConnection::abandonReply() {
    const MutexLock lock(_mutex);
    _replyIsDone();
}

void IPCConnection::_replyIsDone() {
    _openReplies.fetch_sub(1);
    if (_end.load() != End::none && _socket)
        _surroundings.pool.post(shared_from_this(), attentionEvent);
}

/// Sends what the socket takes; absent when nobody will ever take anything.
std::optional<std::size_t> IPCConnection::_trySending(std::string_view bytes) {
    const auto count = ::send(_socket.get(), bytes.data(), bytes.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
    if (count >= 0)
        return static_cast<std::size_t>(count);
    // For want of memory it is tried again when the socket is next reported writable.
    if (errno == EAGAIN || errno == EINTR || errno == ENOBUFS || errno == ENOMEM)
        return 0;
    // Requests that have arrived are still handled, as they would be had the client gone a moment later.
    _repliesEnd = 0;
    return std::nullopt;
}

void IPCConnection::_sendOrKeep(std::string frame) {
    if (_unsent.empty()) {
        const auto sent = _trySending(frame);
        if (!sent || *sent == frame.size())
            return;
        _sentOfFirst = *sent;
        _replyDeadline = Clock::now() + _surroundings.limits.takeReply;
        _updateDeadline();
        _surroundings.pool.change(_watch, _socket.get(), receptionEvents | EPOLLOUT);
    }
    frame.shrink_to_fit(); // The encoder has reserved several times as much, which nobody counts.
    const auto size = frame.size();
    _unsent.push_back(std::move(frame));
    _countUnsent(_unsentBytes + size);
    if (_unsentBytes - _sentOfFirst > _surroundings.limits.unreadReplies) {
        logError("connection of pid %d closed: it leaves too many replies unread", _peer.processId());
        _endWith(End::broken);
    }
}

void IPCConnection::_sendKept() {
    if (_unsent.empty())
        return;
    while (!_unsent.empty()) {
        const auto rest = std::string_view(_unsent.front()).substr(_sentOfFirst);
        const auto sent = _trySending(rest);
        if (sent && *sent < rest.size()) {
            _sentOfFirst += *sent;
            return _updateDeadline();
        }
        _sentOfFirst = 0;
        _replyDeadline = Clock::now() + _surroundings.limits.takeReply;
        if (!sent) {
            _unsent.clear();
            _countUnsent(0);
        } else {
            const auto size = _unsent.front().size();
            _unsent.pop_front();
            _countUnsent(_unsentBytes - size);
        }
    }
    _replyDeadline.reset();
    _updateDeadline();
    _surroundings.pool.change(_watch, _socket.get(), receptionEvents);
}

void IPCConnection::_countUnsent(std::size_t bytes) {
    _surroundings.memory.change(*this, _peer.effectiveUserId(), std::exchange(_unsentBytes, bytes), bytes);
}

/// Sends what is kept, for a listener whose threads have ended.
void IPCConnection::_flushUntil(Time deadline) {
    for (;;) {
        pollfd writable{.fd = -1, .events = POLLOUT, .revents = 0};
        {
            const MutexLock lock(_mutex);
            if (!_socket)
                return;
            _sendKept();
            if (_unsent.empty())
                return;
            writable.fd = _socket.get();
        }
        const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
        if (left <= 0 || ::poll(&writable, 1, static_cast<int>(left)) == 0)
            return;
    }
}

// The end

void IPCConnection::_endWith(End end) {
    if (_end.load() >= end || !_socket)
        return;
    _end.store(end);
    _frameDeadline.reset();
    if (end >= End::cancelled)
        _repliesEnd = std::min(_repliesEnd, _firstUnhandled.load());
    _updateDeadline();
    _surroundings.pool.post(shared_from_this(), attentionEvent);
}

void IPCConnection::_updateDeadline() {
    std::optional<Time> earliest;
    for (const auto& deadline : {_frameDeadline, _replyDeadline})
        if (deadline && (!earliest || *deadline < *earliest))
            earliest = deadline;
    if (earliest == _deadline)
        return;
    _surroundings.timer.change(shared_from_this(), _deadline, earliest);
    _deadline = earliest;
}

/// By the thread that serves; or by the listener, when nobody serves.
void IPCConnection::_close() {
    const auto self = std::static_pointer_cast<IPCConnection>(shared_from_this());
    FileDescriptor socket;
    {
        const MutexLock lock(_mutex);
        if (!_socket)
            return;
        if (_watch != WorkerPool::Watch::none)
            _surroundings.pool.remove(_watch, _socket.get());
        _frameDeadline = _replyDeadline = std::nullopt;
        _updateDeadline();
        _unsent.clear();
        _countUnsent(0);
        _end.store(End::broken);
        socket = std::move(_socket);
    }
    _reader.discard();
    _countReceived(0);
    _surroundings.memory.forget(*this, _peer.effectiveUserId());
    if (!_hungUp)
        discardReceived(socket.get());
    // The registry tells the listener that descriptors are free, so they are freed first.
    socket.reset();
    _peer.unpin();
    _surroundings.registry.remove(*this, _peer.effectiveUserId());

    _messageHandler = nullptr;
    if (const auto handler = std::exchange(_invalidationHandler, nullptr))
        handler(self);
}

void IPCConnection::_closeUnlessResumed() {
    {
        const MutexLock lock(_mutex);
        if (_watch != WorkerPool::Watch::none)
            return;
    }
    _close();
}

} // namespace ost::platform
