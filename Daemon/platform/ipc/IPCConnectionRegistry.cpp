#include "platform/ipc/IPCConnectionRegistry.h"

namespace ost::platform {

std::expected<void, const char*> IPCConnectionRegistry::add(const std::shared_ptr<IPCConnection>& connection,
                                                            uid_t user) {
    const MutexLock lock(_mutex);
    if (_connections.size() >= _limits.connections)
        return std::unexpected("too many connections");
    auto& ofUser = _connectionsOfUser[user];
    if (user > 0 && ofUser >= _limits.connectionsOfOneUser)
        return std::unexpected("too many connections of its user");
    _connections.emplace(connection.get(), connection);
    ++ofUser;
    return {};
}

void IPCConnectionRegistry::remove(IPCConnection& connection, uid_t user) {
    {
        const MutexLock lock(_mutex);
        if (_connections.erase(&connection) == 0)
            return;
        const auto ofUser = _connectionsOfUser.find(user);
        if (--ofUser->second == 0)
            _connectionsOfUser.erase(ofUser);
    }
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
