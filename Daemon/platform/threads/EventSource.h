#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <span>
#include <utility>

namespace ost::platform {

class TurnGroup;

/// Something that a `WorkerPool` serves: the object behind a watched descriptor.
///
/// Threads: the pool calls `serve` from any of its threads, but never twice at the same time for one source; what
/// happens meanwhile is remembered and served afterwards. Ownership: shared; the pool keeps a watched source until it
/// is removed.
class EventSource : public std::enable_shared_from_this<EventSource> {
public:
    virtual ~EventSource() = default;
    EventSource(const EventSource&) = delete;
    EventSource& operator=(const EventSource&) = delete;

    /// Beside the epoll events: a deadline has passed, the source asked to be served for a reason of its own, or it has
    /// to leave because of the memory that it takes, or of others who need its place.
    static constexpr std::uint32_t deadlineEvent = 1U << 24;
    static constexpr std::uint32_t attentionEvent = 1U << 25;
    static constexpr std::uint32_t memoryEvent = 1U << 26;
    static constexpr std::uint32_t placeEvent = 1U << 27;

protected:
    EventSource() = default;

    /// The group in which it takes turns; without one it is served whenever there is something to serve. To be set
    /// before it is watched or posted.
    void setTurns(std::shared_ptr<TurnGroup> turns) { _turns = std::move(turns); }
    [[nodiscard]] bool takesTurns() const { return _turns != nullptr; }

private:
    friend class WorkerPool;

    /// Serves `events` and returns soon: a source with much to do takes a share and posts itself the rest. `scratch` is
    /// the thread's own memory, free to use until the function returns.
    virtual void serve(std::uint32_t events, std::span<char> scratch) = 0;

    static constexpr std::uint32_t _running = 1U << 23;
    std::shared_ptr<TurnGroup> _turns;
    std::atomic<std::uint32_t> _state{0}; ///< events to be served, and _running while they are being served or queued
};

} // namespace ost::platform
