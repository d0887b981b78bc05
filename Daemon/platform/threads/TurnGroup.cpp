#include "platform/threads/TurnGroup.h"

#include <utility>

namespace ost::platform {

bool TurnGroup::take(const std::shared_ptr<EventSource>& source) {
    const MutexLock lock(_mutex);
    if (_free <= 0) {
        _waiting.push_back(source);
        return false;
    }
    --_free;
    return true;
}

void TurnGroup::takeAnyway() {
    const MutexLock lock(_mutex);
    --_free;
}

std::shared_ptr<EventSource> TurnGroup::giveBack() {
    const MutexLock lock(_mutex);
    if (++_free <= 0 || _waiting.empty())
        return nullptr;
    --_free;
    auto next = std::move(_waiting.front());
    _waiting.pop_front();
    return next;
}

void TurnGroup::clear() {
    std::deque<std::shared_ptr<EventSource>> waiting; // goes without the lock
    const MutexLock lock(_mutex);
    waiting.swap(_waiting);
}

} // namespace ost::platform
