#pragma once

#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"
#include "platform/ipc/IPCConnection.h"
#include "platform/ipc/IPCConnectionRegistry.h"
#include "platform/ipc/IPCMemoryBudget.h"
#include "platform/threads/DeadlineTimer.h"
#include "platform/threads/WorkerPool.h"

#include <chrono>
#include <expected>
#include <functional>
#include <memory>
#include <string>

namespace ost::platform {

/// A named service: accepts clients at a socket and serves them with a pool of threads, each of which serves what it
/// receives itself.
///
/// Threads: one, for all of the public functions; none of the pool. Ownership: owns its threads and connections.
/// Nothing is accepted before `resume`.
class IPCListener {
public:
    /// Told of each new connection, on a thread of the pool: sets the connection's handlers and resumes it.
    using EventHandler = std::function<void(const std::shared_ptr<IPCConnection>&)>;

    /// Takes a socket that listens already, and raises the process's limit of open descriptors as far as it may; where
    /// that is too low for the limits, fewer connections are accepted. `label` names the threads. Fails with an errno.
    [[nodiscard]] static std::expected<std::unique_ptr<IPCListener>, Errno>
    create(FileDescriptor listeningSocket, std::string label, EventHandler eventHandler, const IPCLimits& wanted = {});

    /// Finishes without a bound for the requests under way, closes all connections, and calls their invalidation
    /// handlers.
    ~IPCListener();
    IPCListener(const IPCListener&) = delete;
    IPCListener& operator=(const IPCListener&) = delete;

    /// Starts to accept and to serve. Fails with the errno of starting a thread or watching the socket.
    [[nodiscard]] std::expected<void, Errno> resume();

    /// Leaves further clients to whoever else has the socket; those that are there are still served.
    void stopAccepting();

    /// Stops accepting, lets no further request begin, and waits until those under way have ended and their replies are
    /// taken, at most until `deadline`. Gives whether no request is under way any more; if one is, the listener must
    /// not be destroyed: end the process. Connections stay open for replies that are still to come.
    [[nodiscard]] bool finish(std::chrono::steady_clock::time_point deadline);

private:
    class Acceptor;

    IPCListener(const IPCLimits& limits, std::unique_ptr<WorkerPool> pool, FileDescriptor socket,
                EventHandler eventHandler);
    void _flush(std::chrono::steady_clock::time_point deadline);

    const IPCLimits _limits;
    const std::unique_ptr<WorkerPool> _pool;
    const std::shared_ptr<DeadlineTimer> _timer;
    IPCConnectionRegistry _registry;
    IPCMemoryBudget _memory;
    const std::shared_ptr<Acceptor> _acceptor;
};

} // namespace ost::platform
