#include "platform/ipc/IPCMemoryBudget.h"

#include <malloc.h>

#include <algorithm>

namespace ost::platform {

namespace {

/// So much has to come together, because looking for free pages takes as long as some ordinary requests.
constexpr std::size_t worthReleasing = std::size_t{4} << 20;
/// When nobody takes anything any more, whole pages are free that one piece has kept before.
constexpr std::size_t worthReleasingAtTheEnd = std::size_t{1} << 20;
/// The allocator begins with this size and would raise it with each large piece that is freed.
constexpr int largePiece = 128 << 10;

} // namespace

/// Large pieces are mapped one by one, so that freeing one gives it back to the system.
IPCMemoryBudget::IPCMemoryBudget(WorkerPool& pool, const IPCLimits& limits) : _pool(pool), _limits(limits) {
    ::mallopt(M_MMAP_THRESHOLD, largePiece);
}

void IPCMemoryBudget::change(EventSource& connection, uid_t user, std::size_t before, std::size_t after) {
    if (user == 0 || before == after)
        return _noteReleased(before, after, worthReleasing);
    std::shared_ptr<EventSource> over;
    bool isTheEnd = false;
    {
        const MutexLock lock(_mutex);
        auto& ofUser = _users[user];
        auto& share = ofUser.shares[&connection];
        share.bytes += after - before; // unsigned: less is a large number more
        if (!share.leaves) {
            ofUser.bytes += after - before;
            _bytes += after - before;
        }
        if (after > before)
            over = _takeOneOver(ofUser);
        isTheEnd = _bytes == 0;
    }
    if (over)
        _pool.post(over, EventSource::memoryEvent);
    _noteReleased(before, after, isTheEnd ? worthReleasingAtTheEnd : worthReleasing);
}

void IPCMemoryBudget::forget(EventSource& connection, uid_t user) {
    const MutexLock lock(_mutex);
    const auto ofUser = _users.find(user);
    if (ofUser == _users.end())
        return;
    ofUser->second.shares.erase(&connection);
    if (ofUser->second.shares.empty())
        _users.erase(ofUser);
}

/// The one that has to leave, if one has: its memory counts as given back already.
std::shared_ptr<EventSource> IPCMemoryBudget::_takeOneOver(User& changed) {
    User* user = changed.bytes > _limits.memoryOfOneUser ? &changed : nullptr;
    if (!user && _bytes > _limits.memoryOfUsers)
        user = &std::ranges::max_element(_users, {}, [](const auto& entry) { return entry.second.bytes; })->second;
    if (!user)
        return nullptr;
    const auto largest = std::ranges::max_element(
        user->shares, {}, [](const auto& entry) { return entry.second.leaves ? 0 : entry.second.bytes; });
    auto& [connection, share] = *largest;
    share.leaves = true;
    user->bytes -= share.bytes;
    _bytes -= share.bytes;
    return connection->shared_from_this();
}

void IPCMemoryBudget::_noteReleased(std::size_t before, std::size_t after, std::size_t worthReleasingNow) {
    if (after >= before || _unreleased.fetch_add(before - after) + (before - after) < worthReleasingNow)
        return;
    _unreleased = 0;
    ::malloc_trim(0);
}

} // namespace ost::platform
