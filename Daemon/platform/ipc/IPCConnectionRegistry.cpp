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
IPCConnectionRegistry::add(const std::shared_ptr<IPCConnection>& connection, uid_t user, const IPCUse& use) {
    const MutexLock lock(_mutex);
    if (_isFull())
        return std::unexpected("too many connections");
    if (user > 0 && _isFullForUsers())
        return std::unexpected("too many connections of users");
    if (user > 0 && _countOf(user) >= _limits.connectionsOfOneUser)
        return std::unexpected("too many connections of its user");
    _connections.emplace(connection.get(), Entry{connection, user, &use});
    auto& ofUser = _users[user];
    if (++ofUser.connections == 1 && user > 0)
        ofUser.turns = std::make_shared<TurnGroup>(_limits.turnsOfOneUser);
    return ofUser.turns;
}

std::shared_ptr<IPCConnection> IPCConnectionRegistry::whoLeavesFor(uid_t user) const {
    const MutexLock lock(_mutex);
    const bool amongUsers = user > 0 && _isFullForUsers();
    if ((!amongUsers && !_isFull()) || (user > 0 && _countOf(user) >= _limits.connectionsOfOneUser))
        return nullptr;
    const Entry* leaves = nullptr;
    const auto goesBefore = [&](const Entry& one, const Entry& other) OST_REQUIRES(_mutex) {
        const auto ofOne = _countOf(one.user), ofOther = _countOf(other.user);
        return ofOne != ofOther ? ofOne > ofOther : one.use->lastServed.load() < other.use->lastServed.load();
    };
    for (const auto& [key, entry] : _connections) {
        if (entry.use->hasEntitlements.load() || (amongUsers && entry.user == 0))
            continue;
        if (!leaves || goesBefore(entry, *leaves))
            leaves = &entry;
    }
    return leaves ? leaves->connection : nullptr;
}

bool IPCConnectionRegistry::_isFull() const { return _connections.size() >= _limits.connections; }

bool IPCConnectionRegistry::_isFullForUsers() const {
    return _connections.size() - _countOf(0) + _limits.connectionsKeptForRoot >= _limits.connections;
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
    for (const auto& [key, entry] : _connections)
        connections.push_back(entry.connection);
    return connections;
}

} // namespace ost::platform
