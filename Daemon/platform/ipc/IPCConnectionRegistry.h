#pragma once

#include "platform/base/Mutex.h"
#include "platform/ipc/IPCLimits.h"
#include "platform/threads/TurnGroup.h"

#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <cstddef>
#include <expected>
#include <functional>
#include <memory>
#include <unordered_map>
#include <vector>

namespace ost::platform {

class IPCConnection;

/// What the registry knows of how a connection is used. Written by the thread that serves it.
struct IPCUse {
    std::atomic<std::chrono::steady_clock::rep> lastServed{0};
    std::atomic<bool> hasEntitlements{false};
};

/// The open connections of a listener, counted for each user. Threads: any.
class IPCConnectionRegistry {
public:
    explicit IPCConnectionRegistry(const IPCLimits& limits) : _limits(limits) {}

    /// Called after each removal. To be set before the first connection is added.
    void setRemovalHandler(std::function<void()> handler) { _removalHandler = std::move(handler); }

    /// Takes a connection of `user` in and gives the turns that it shares with the user's others, null for root's; or
    /// says which limit refuses it.
    [[nodiscard]] std::expected<std::shared_ptr<TurnGroup>, const char*>
    add(const std::shared_ptr<IPCConnection>& connection, uid_t user, const IPCUse& use);
    /// Who has to leave first when there is no room for one more of `user`: of the users with the most connections, the
    /// one that nothing came from for the longest. Null when there is room, or everybody's program has entitlements.
    [[nodiscard]] std::shared_ptr<IPCConnection> whoLeavesFor(uid_t user) const;
    /// Lets a connection of `user` go; one that was not taken in changes nothing.
    void remove(IPCConnection& connection, uid_t user);

    [[nodiscard]] std::vector<std::shared_ptr<IPCConnection>> all() const;

private:
    struct Entry {
        std::shared_ptr<IPCConnection> connection;
        uid_t user;
        const IPCUse* use;
    };
    struct User {
        std::size_t connections = 0;
        std::shared_ptr<TurnGroup> turns;
    };

    [[nodiscard]] bool _isFull() const OST_REQUIRES(_mutex);
    [[nodiscard]] bool _isFullForUsers() const OST_REQUIRES(_mutex);
    [[nodiscard]] std::size_t _countOf(uid_t user) const OST_REQUIRES(_mutex);

    const IPCLimits& _limits;
    std::function<void()> _removalHandler;

    mutable Mutex _mutex;
    std::unordered_map<IPCConnection*, Entry> _connections OST_GUARDED_BY(_mutex);
    std::unordered_map<uid_t, User> _users OST_GUARDED_BY(_mutex);
};

} // namespace ost::platform
