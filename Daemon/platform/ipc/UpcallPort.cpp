#include "platform/ipc/UpcallPort.h"

#include "platform/base/Log.h"
#include "platform/base/Mutex.h"
#include "platform/base/Try.h"
#include "platform/threads/ThreadName.h"

#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <future>
#include <set>
#include <system_error>
#include <thread>
#include <utility>

namespace ost::platform {

namespace {

constexpr std::size_t rootsConnectionLimit = 64;
/// Others are refused anyway, and do not keep root out.
constexpr std::size_t othersConnectionLimit = 32;
/// Connections beyond that limit are closed, by threads too, because that may last. Accepting pauses at this many.
constexpr std::size_t othersThreadLimit = 256;
constexpr itimerspec acceptPause{.it_interval = {}, .it_value = {.tv_sec = 0, .tv_nsec = 250'000'000}};

bool isOutOfResources(int error) { return error == EMFILE || error == ENFILE || error == ENOBUFS || error == ENOMEM; }

bool isNothingYet(int error) { return error == EAGAIN || error == EINTR; }

/// That a sender has gone is no failure, and must not let it fill the log.
void logFailureToReply(Errno error) {
    if (error != EPIPE && error != ECONNRESET)
        logError("Closing an upcall connection: Failed to reply: %s", error);
}

} // namespace

/// The connections that have a thread of their own, and their way to the loop for as long as there is a port.
class UpcallPort::Aside : public std::enable_shared_from_this<Aside> {
public:
    explicit Aside(UpcallPort& port) : _port(&port), _loop(port._loop) {}

    [[nodiscard]] std::uint32_t nextSequenceNumber() { return _sequenceNumber++; }

    struct Count {
        std::size_t roots = 0;
        std::size_t others = 0; ///< those that root has not made, until they are closed
    };
    [[nodiscard]] Count count() {
        const MutexLock lock(_mutex);
        return _count;
    }

    /// Starts the connection's thread, which only closes the socket unless it `isServed`. Throws when there is none.
    void start(FileDescriptor socket, bool isRoots, bool isServed, std::optional<UpcallPacket> first) {
        auto member = std::make_unique<Member>(shared_from_this(), std::move(socket), isRoots);
        std::thread([member = std::move(member), isServed, first = std::move(first)]() mutable {
            setCurrentThreadName("com.tamarok.ostrandd.upcall");
            if (isServed)
                member->aside->_serve(member->socket.get(), std::move(first));
        }).detach();
    }

    /// Called on the loop's thread when the port goes: no message reaches it any more.
    void end() {
        const MutexLock lock(_mutex);
        _port = nullptr;
        for (const int socket : _sockets)
            ::shutdown(socket, SHUT_RDWR);
    }

private:
    /// A connection that counts until it is closed.
    struct Member {
        Member(std::shared_ptr<Aside> owner, FileDescriptor descriptor, bool madeByRoot)
            : aside(std::move(owner)), socket(std::move(descriptor)), isRoots(madeByRoot) {
            const MutexLock lock(aside->_mutex);
            aside->_sockets.insert(socket.get());
            aside->_countOne(isRoots, 1);
        }
        Member(const Member&) = delete;
        Member& operator=(const Member&) = delete;
        ~Member() {
            {
                const MutexLock lock(aside->_mutex);
                aside->_sockets.erase(socket.get());
            }
            socket.reset(); // May wait for what lies in it unread.
            const MutexLock lock(aside->_mutex);
            aside->_countOne(isRoots, -1);
        }

        const std::shared_ptr<Aside> aside;
        FileDescriptor socket;
        const bool isRoots;
    };

    void _countOne(bool isRoots, int difference) OST_REQUIRES(_mutex) {
        (isRoots ? _count.roots : _count.others) += static_cast<std::size_t>(difference);
    }

    void _serve(int socket, std::optional<UpcallPacket> packet) {
        while (packet || (packet = _receive(socket))) {
            takeUpcallRegion(*packet);
            const auto reply = _answerOnLoop(std::move(packet->message));
            packet.reset();
            if (!reply)
                return;
            if (!*reply)
                continue;
            if (const auto sent = sendUpcallReply(socket, **reply, 0); !sent)
                return logFailureToReply(sent.error());
        }
    }

    std::optional<UpcallPacket> _receive(int socket) {
        auto packet = receiveUpcallPacket(socket, nextSequenceNumber(), 0);
        return packet ? std::optional(*std::move(packet)) : std::nullopt;
    }

    /// Waits for the loop to handle the message. Nothing when there is no port any more.
    std::optional<std::optional<UpcallReply>> _answerOnLoop(UpcallMessage message) {
        std::promise<std::optional<UpcallReply>> promise;
        auto reply = promise.get_future();
        {
            const MutexLock lock(_mutex);
            if (!_port)
                return std::nullopt;
            _loop.async(
                [self = shared_from_this(), message = std::move(message), promise = std::move(promise)]() mutable {
                    if (auto* const port = self->_port)
                        promise.set_value(port->_handler(message));
                });
        }
        try {
            return reply.get();
        } catch (const std::future_error&) { // The port has gone meanwhile.
            return std::nullopt;
        }
    }

    UpcallPort* _port; ///< written on the loop's thread under the mutex
    RunLoop& _loop;    ///< there as long as the port is
    std::atomic<std::uint32_t> _sequenceNumber{0};

    Mutex _mutex;
    std::set<int> _sockets OST_GUARDED_BY(_mutex); ///< open ones
    Count _count OST_GUARDED_BY(_mutex);
};

UpcallPort::UpcallPort(RunLoop& loop, FileDescriptor listener, FileDescriptor pauseTimer, Handler handler)
    : _loop(loop), _listener(std::move(listener)), _pauseTimer(std::move(pauseTimer)), _handler(std::move(handler)),
      _aside(std::make_shared<Aside>(*this)) {}

UpcallPort::~UpcallPort() { _aside->end(); }

std::expected<std::unique_ptr<UpcallPort>, Errno> UpcallPort::open(RunLoop& loop, FileDescriptor listener,
                                                                   Handler handler) {
    // Connections inherit it, so that no packet comes without its sender's credentials. Since Linux 6.16 they do so
    // when they are made: what waits here already has it only if whoever made the listener had set it.
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
    const auto aside = _aside->count();
    if (aside.others >= othersThreadLimit)
        return _pauseAccepting("too many connections are being closed");
    FileDescriptor socket(::accept4(_listener.get(), nullptr, nullptr, SOCK_CLOEXEC));
    if (!socket) {
        if (isOutOfResources(errno))
            _pauseAccepting(Errno(errno).description());
        return;
    }
    _hasComplained = false;
    ucred peer{};
    socklen_t size = sizeof peer;
    const bool isRoots = ::getsockopt(socket.get(), SOL_SOCKET, SO_PEERCRED, &peer, &size) == 0 && peer.uid == 0;
    if (!isRoots)
        _serveAside(std::move(socket), isRoots, aside.others < othersConnectionLimit, std::nullopt);
    else if (_connections.size() + aside.roots < rootsConnectionLimit)
        _serveOnLoop(std::move(socket));
}

void UpcallPort::_pauseAccepting(const std::string& reason) {
    if (!std::exchange(_hasComplained, true))
        logError("Failed to accept a connection of the upcall port: %s", reason);
    _listenerSource.setEvents(0);
    ::timerfd_settime(_pauseTimer.get(), 0, &acceptPause, nullptr);
}

void UpcallPort::_resumeAccepting() {
    std::uint64_t expirations = 0;
    [[maybe_unused]] const auto read = ::read(_pauseTimer.get(), &expirations, sizeof expirations);
    _listenerSource.setEvents(EPOLLIN);
}

void UpcallPort::_serveOnLoop(FileDescriptor socket) {
    const int descriptor = socket.get();
    const auto connection = _connections.insert(_connections.end(), {.socket = std::move(socket), .unsent = {}});
    auto source = _loop.addSource(descriptor, EPOLLIN, [this, connection](std::uint32_t) { _serve(connection); });
    if (source)
        connection->source = *std::move(source);
    else
        _connections.erase(connection);
}

void UpcallPort::_serveAside(FileDescriptor socket, bool isRoots, bool isServed, std::optional<UpcallPacket> first) {
    try {
        _aside->start(std::move(socket), isRoots, isServed, std::move(first));
    } catch (const std::system_error& error) {
        logError("Closing an upcall connection: no thread for it: %s", error.what());
    }
}

void UpcallPort::_serve(Connections::iterator connection) {
    const bool goesOn = connection->unsent ? _sendUnsent(*connection) : _receive(*connection);
    if (!goesOn)
        _connections.erase(connection);
}

bool UpcallPort::_receive(Connection& connection) {
    auto packet = receiveUpcallPacket(connection.socket.get(), _aside->nextSequenceNumber(), MSG_DONTWAIT);
    if (!packet)
        return isNothingYet(packet.error());
    if (!upcallRegionLiesInMemory(*packet)) {
        connection.source.remove();
        _serveAside(std::move(connection.socket), true, true, *std::move(packet));
        return false;
    }
    takeUpcallRegion(*packet);
    connection.unsent = _handler(packet->message);
    return !connection.unsent || _sendUnsent(connection);
}

bool UpcallPort::_sendUnsent(Connection& connection) {
    const auto sent = sendUpcallReply(connection.socket.get(), *connection.unsent, MSG_DONTWAIT);
    if (!sent && !isNothingYet(sent.error())) {
        logFailureToReply(sent.error());
        return false;
    }
    if (connection.isWaiting == sent.has_value()) {
        connection.isWaiting = !sent;
        connection.source.setEvents(sent ? EPOLLIN : EPOLLOUT);
    }
    if (sent)
        connection.unsent.reset();
    return true;
}

} // namespace ost::platform
