#pragma once

#include "platform/base/Mutex.h"
#include "platform/ipc/IPCLimits.h"
#include "platform/threads/EventSource.h"
#include "platform/threads/WorkerPool.h"

#include <sys/types.h>

#include <atomic>
#include <cstddef>
#include <memory>
#include <unordered_map>

namespace ost::platform {

/// The memory that unfinished frames, queued requests and unread replies take, counted for each user above 0 and for
/// all of them. When a limit is passed, the largest consumer of the user, or of the largest user, has to leave: it is
/// served a `memoryEvent`. Root is not counted: what users take is never at its expense.
///
/// Threads: any. Ownership: the connections' listener owns it; a connection is forgotten before it goes.
class IPCMemoryBudget {
public:
    /// Sets how the process's allocator treats large pieces, too.
    IPCMemoryBudget(WorkerPool& pool, const IPCLimits& limits);

    /// What `connection` took is now another number of bytes. It or another one may be told to leave. Much that has
    /// been given back is given back to the system, so that is to be told after it was freed.
    void change(EventSource& connection, uid_t user, std::size_t before, std::size_t after);

    /// Forgets a connection that takes nothing any more.
    void forget(EventSource& connection, uid_t user);

private:
    struct Share {
        std::size_t bytes = 0;
        bool leaves = false; ///< told to leave, and no longer counted
    };
    struct User {
        std::size_t bytes = 0;
        std::unordered_map<EventSource*, Share> shares;
    };

    [[nodiscard]] std::shared_ptr<EventSource> _takeOneOver(User& changed) OST_REQUIRES(_mutex);
    void _noteReleased(std::size_t before, std::size_t after, std::size_t worthReleasingNow);

    WorkerPool& _pool;
    const IPCLimits& _limits;
    std::atomic<std::size_t> _unreleased{0}; ///< given back since the system last got what is free

    Mutex _mutex;
    std::unordered_map<uid_t, User> _users OST_GUARDED_BY(_mutex);
    std::size_t _bytes OST_GUARDED_BY(_mutex) = 0; ///< of all users
};

} // namespace ost::platform
