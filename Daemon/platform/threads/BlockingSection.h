#pragma once

namespace ost::platform {

/// Stands around a wait that may last: for a lock that somebody holds, for a disk. While a thread of a `WorkerPool` is
/// inside one, the pool lets another thread take its place, so that waiting requests never keep other connections from
/// being served. On any other thread it does nothing. May be nested; only the outermost one counts.
///
/// Entering and leaving cost a mutex, and entering may wake a thread: try a lock first, and enter only if it is taken.
class BlockingSection {
public:
    /// Whether others of the same `TurnGroup` are served meanwhile: not while waiting for a lock that everybody needs,
    /// because each of them would come to stand before other users' requests.
    enum class Turn : bool { giveAway, keep };

    explicit BlockingSection(Turn turn = Turn::giveAway);
    ~BlockingSection();
    BlockingSection(const BlockingSection&) = delete;
    BlockingSection& operator=(const BlockingSection&) = delete;

private:
    bool _gaveTurnAway = false;
};

} // namespace ost::platform
