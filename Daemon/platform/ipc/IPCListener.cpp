#include "platform/ipc/IPCListener.h"

#include "platform/base/Log.h"
#include "platform/base/Try.h"
#include "platform/ipc/PeerIdentity.h"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/resource.h>
#include <sys/socket.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstring>
#include <exception>
#include <limits>
#include <optional>
#include <span>
#include <utility>

namespace ost::platform {

namespace {

using Clock = std::chrono::steady_clock;

/// Connections accepted before the clients that are there get their turn.
constexpr unsigned acceptsInARow = 16;
/// How long a stopping listener waits for clients to take replies that are ready.
constexpr auto flushTime = std::chrono::seconds(1);
/// What the pool watches beside the connections: the listening socket and the timer.
constexpr std::size_t ownSources = 2;

/// Raises the process's limit of open descriptors as far as it may, and gives it.
std::size_t raiseDescriptorLimit() {
    rlimit limit{};
    if (::getrlimit(RLIMIT_NOFILE, &limit) != 0)
        return std::numeric_limits<std::size_t>::max();
    const rlimit raised{.rlim_cur = limit.rlim_max, .rlim_max = limit.rlim_max};
    return ::setrlimit(RLIMIT_NOFILE, &raised) == 0 ? raised.rlim_cur : limit.rlim_cur;
}

} // namespace

/// The side of the listener that accepts: served by the pool whenever clients are waiting.
class IPCListener::Acceptor final : public EventSource {
public:
    Acceptor(FileDescriptor socket, EventHandler eventHandler, const IPCConnection::Surroundings& surroundings)
        : _socket(std::move(socket)), _eventHandler(std::move(eventHandler)), _surroundings(surroundings) {}

    std::expected<void, Errno> start() {
        _accepting = true;
        _watch = OST_TRY(_surroundings.pool.add(shared_from_this(), _socket.get(), EPOLLIN));
        return {};
    }

    void stop() {
        _accepting = false;
        if (_watch != WorkerPool::Watch::none)
            _surroundings.pool.remove(std::exchange(_watch, WorkerPool::Watch::none), _socket.get());
    }

    /// A connection has gone, and with it its descriptors.
    void connectionGone() {
        ++_gone;
        if (_paused.exchange(false))
            _surroundings.pool.post(shared_from_this(), attentionEvent);
    }

private:
    void serve(std::uint32_t /*events*/, std::span<char> /*scratch*/) override {
        _surroundings.timer.change(shared_from_this(), std::exchange(_retry, std::nullopt), std::nullopt);
        _paused = false;
        const unsigned goneBefore = _gone;
        for (unsigned count = 0; count < acceptsInARow; ++count) {
            if (!_accepting)
                return;
            const int error = _acceptOne();
            if (error == EAGAIN)
                return;
            if (error != 0)
                return _pause(error, goneBefore);
            _complained = false;
        }
        _surroundings.pool.post(shared_from_this(), EPOLLIN);
    }

    /// Gives 0, EAGAIN when nobody waits, EUSERS when somebody leaves to make room, or the errno that forbids to go on
    /// for now.
    int _acceptOne() {
        if (!_arrived) {
            if (const int error = _makeConnection(); error != 0 || !_arrived)
                return error;
        }
        const auto user = _arrived->peer().effectiveUserId();
        const LogOrigin origin(user);
        const auto added = _surroundings.registry.add(_arrived, user, _arrived->_use);
        if (!added)
            if (const auto leaving = _surroundings.registry.whoLeavesFor(user)) {
                _surroundings.pool.post(leaving, placeEvent);
                return EUSERS;
            }
        const auto connection = std::exchange(_arrived, nullptr);
        if (added) {
            connection->setTurns(*added);
            _introduce(connection);
        } else {
            logError("connection of pid %d closed: %s", connection->peer().processId(), added.error());
            connection->_close();
        }
        return 0;
    }

    /// Gives 0 without a connection, too, when the one that waited has gone.
    int _makeConnection() {
        if (!_next)
            _next.reset(::accept4(_socket.get(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK));
        if (!_next)
            return errno == EINTR || errno == ECONNABORTED ? 0 : errno;
        auto peer = PeerIdentity::ofSocket(_next.get());
        if (!peer)
            return peer.error();
        _arrived = std::make_shared<IPCConnection>(std::exchange(_next, {}), *std::move(peer), _surroundings);
        return 0;
    }

    void _introduce(const std::shared_ptr<IPCConnection>& connection) {
        try {
            _eventHandler(connection);
        } catch (const std::exception& exception) {
            logError("connection of pid %d closed: %s", connection->peer().processId(), exception.what());
        }
        connection->_closeUnlessResumed();
    }

    /// A client that waits already causes no further event, so it is a descriptor that is given back, or the time, that
    /// makes us try again.
    void _pause(Errno error, unsigned goneBefore) {
        if (error != EUSERS && !std::exchange(_complained, true))
            logError("accepting pauses: %s", error);
        _retry = Clock::now() + _surroundings.limits.acceptAgain;
        _surroundings.timer.change(shared_from_this(), std::nullopt, _retry);
        _paused = true;
        // One may have gone since we tried, when nobody was to be told yet.
        if (_gone != goneBefore && _paused.exchange(false))
            _surroundings.pool.post(shared_from_this(), attentionEvent);
    }

    const FileDescriptor _socket;
    const EventHandler _eventHandler;
    const IPCConnection::Surroundings _surroundings;
    WorkerPool::Watch _watch = WorkerPool::Watch::none;
    std::atomic<bool> _accepting{false};
    std::atomic<bool> _paused{false};
    std::atomic<unsigned> _gone{0}; ///< connections that have gone, ever

    // Of the thread that serves.
    FileDescriptor _next;                    ///< accepted, but its peer is not known yet
    std::shared_ptr<IPCConnection> _arrived; ///< there is no room for it yet
    bool _complained = false;
    std::optional<Clock::time_point> _retry;
};

std::expected<std::unique_ptr<IPCListener>, Errno> IPCListener::create(FileDescriptor listeningSocket,
                                                                       std::string label, EventHandler eventHandler,
                                                                       const IPCLimits& wanted) {
    const auto limits = wanted.withDescriptors(raiseDescriptorLimit());
    const int flags = ::fcntl(listeningSocket.get(), F_GETFL);
    if (flags < 0 || ::fcntl(listeningSocket.get(), F_SETFL, flags | O_NONBLOCK) != 0)
        return std::unexpected(errno);
    auto pool = OST_TRY(WorkerPool::create(std::move(label), {.sources = limits.connections + ownSources}));
    std::unique_ptr<IPCListener> listener(
        new IPCListener(limits, std::move(pool), std::move(listeningSocket), std::move(eventHandler)));
    OST_TRY(listener->_timer->start());
    return listener;
}

IPCListener::IPCListener(const IPCLimits& limits, std::unique_ptr<WorkerPool> pool, FileDescriptor socket,
                         EventHandler eventHandler)
    : _limits(limits), _pool(std::move(pool)), _timer(std::make_shared<DeadlineTimer>(*_pool)), _registry(_limits),
      _memory(*_pool, _limits),
      _acceptor(std::make_shared<Acceptor>(
          std::move(socket), std::move(eventHandler),
          IPCConnection::Surroundings{
              .pool = *_pool, .timer = *_timer, .registry = _registry, .memory = _memory, .limits = _limits})) {
    _registry.setRemovalHandler([acceptor = std::weak_ptr(_acceptor)] {
        if (const auto present = acceptor.lock())
            present->connectionGone();
    });
}

IPCListener::~IPCListener() {
    stopAccepting();
    _pool->stop(std::nullopt);
    _flush(Clock::now() + flushTime);
    for (const auto& connection : _registry.all())
        connection->_close();
    _timer->stop();
}

std::expected<void, Errno> IPCListener::resume() {
    OST_TRY(_acceptor->start());
    return _pool->start();
}

void IPCListener::stopAccepting() { _acceptor->stop(); }

bool IPCListener::finish(Clock::time_point deadline) {
    stopAccepting();
    if (!_pool->stop(deadline))
        return false;
    _flush(std::min(deadline, Clock::now() + flushTime));
    return true;
}

void IPCListener::_flush(Clock::time_point deadline) {
    for (const auto& connection : _registry.all())
        connection->_flushUntil(deadline);
}

} // namespace ost::platform
