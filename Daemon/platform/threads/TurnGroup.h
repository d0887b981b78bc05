#pragma once

#include "platform/base/Mutex.h"
#include "platform/threads/EventSource.h"

#include <deque>
#include <memory>

namespace ost::platform {

/// Turns that the sources of one user share: a `WorkerPool` serves only some of them at a time, so that a user's,
/// however many they are, neither take all threads nor stand before everybody else at a lock.
///
/// Threads: any. Ownership: shared by its sources. It keeps those that wait, so `clear` it when nobody serves any more.
class TurnGroup {
public:
    explicit TurnGroup(unsigned turns) : _free(static_cast<int>(turns)) {}

    /// Takes a turn for `source`. When there is none left it is kept until one is, and false is given.
    [[nodiscard]] bool take(const std::shared_ptr<EventSource>& source);
    /// The same for a source whose wait has ended, which must not wait again.
    void takeAnyway();
    /// Gives a turn back. It goes to the source that has waited the longest; that one is given, if there is one.
    [[nodiscard]] std::shared_ptr<EventSource> giveBack();

    /// Forgets those that wait.
    void clear();

private:
    Mutex _mutex;
    int _free OST_GUARDED_BY(_mutex);
    std::deque<std::shared_ptr<EventSource>> _waiting OST_GUARDED_BY(_mutex);
};

} // namespace ost::platform
