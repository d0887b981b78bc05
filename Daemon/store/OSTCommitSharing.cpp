#include "store/OSTCommitSharing.h"

#include "platform/threads/BlockingSection.h"

#include <chrono>

namespace ost {

namespace {

/// What a commit takes on an ordinary disk. Those under way may all turn out to be look-ups, which commit nothing.
constexpr std::chrono::milliseconds patience{2};

} // namespace

OSTCommitSharing& OSTCommitSharing::sharedInstance() {
    // Never destroyed: workers may still create while the process ends.
    static OSTCommitSharing& sharing = *new OSTCommitSharing;
    return sharing;
}

OSTCommitSharing::Creation::~Creation() {
    auto& sharing = sharedInstance();
    // Whoever begins to wait announces that first and looks at the count then: one of the two sees the other.
    if (--sharing._underWay == 0)
        sharing._tellWaiters(0);
}

void OSTCommitSharing::didCommit() { _tellWaiters(1); }

void OSTCommitSharing::_tellWaiters(std::uint64_t commits) {
    if (_waiting == 0)
        return;
    const std::lock_guard lock(_mutex);
    _commits += commits;
    _changed.notify_all();
}

void OSTCommitSharing::letOthersCommit() {
    if (_underWay == 0)
        return;
    const platform::BlockingSection blocking;
    std::unique_lock lock(_mutex);
    ++_waiting;
    const auto before = _commits;
    _changed.wait_for(lock, patience, [&] { return _commits != before || _underWay == 0; });
    --_waiting;
}

} // namespace ost
