#include "platform/ipc/IPCConnectionRegistry.h"

#include <algorithm>

namespace ost::platform {

namespace {

/// Socket, process and program.
constexpr std::size_t descriptorsOfAConnection = 3;
/// For what the daemon keeps open, and for the requests that are handled at a time.
constexpr std::size_t descriptorsForWork = 256;

} // namespace

IPCLimits IPCLimits::withDescriptors(std::size_t descriptors) const {
    const auto work = std::min(descriptorsForWork, descriptors / 2);
    const auto most = (descriptors - work) / descriptorsOfAConnection;
    IPCLimits limits = *this;
    if (most < connections) {
        limits.connections = most;
        limits.connectionsKeptForRoot = std::min(connectionsKeptForRoot, most / 4);
        limits.connectionsOfOneUser = std::min(connectionsOfOneUser, most / 4);
    }
    return limits;
}

std::expected<std::shared_ptr<TurnGroup>, const char*>
IPCConnectionRegistry::add(const std::shared_ptr<IPCConnection>& connection, uid_t user) {
    const MutexLock lock(_mutex);
    if (_connections.size() >= _limits.connections)
        return std::unexpected("too many connections");
    if (user > 0 && _connections.size() - _countOf(0) + _limits.connectionsKeptForRoot >= _limits.connections)
        return std::unexpected("too many connections of users");
    if (user > 0 && _countOf(user) >= _limits.connectionsOfOneUser)
        return std::unexpected("too many connections of its user");
    _connections.emplace(connection.get(), connection);
    auto& ofUser = _users[user];
    if (++ofUser.connections == 1 && user > 0)
        ofUser.turns = std::make_shared<TurnGroup>(_limits.turnsOfOneUser);
    return ofUser.turns;
}

std::size_t IPCConnectionRegistry::_countOf(uid_t user) const {
    const auto found = _users.find(user);
    return found == _users.end() ? 0 : found->second.connections;
}

void IPCConnectionRegistry::remove(IPCConnection& connection, uid_t user) {
    std::shared_ptr<TurnGroup> unusedTurns;
    {
        const MutexLock lock(_mutex);
        if (_connections.erase(&connection) == 0)
            return;
        const auto ofUser = _users.find(user);
        if (--ofUser->second.connections == 0) {
            unusedTurns = std::move(ofUser->second.turns);
            _users.erase(ofUser);
        }
    }
    if (unusedTurns)
        unusedTurns->clear();
    if (_removalHandler)
        _removalHandler();
}

std::vector<std::shared_ptr<IPCConnection>> IPCConnectionRegistry::all() const {
    const MutexLock lock(_mutex);
    std::vector<std::shared_ptr<IPCConnection>> connections;
    connections.reserve(_connections.size());
    for (const auto& [key, connection] : _connections)
        connections.push_back(connection);
    return connections;
}

} // namespace ost::platform
