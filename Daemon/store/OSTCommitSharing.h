#pragma once

#include <atomic>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <mutex>

namespace ost {

/// Lets creations that follow each other share commits of the file system's journal.
///
/// A creation waits for the disk twice: for its metadata, under the all-identifiers lock, and for its place, when the
/// lock is free again. A file system commits everything that has happened so far at once. If the second wait began as
/// soon as the lock is free, the next creation would find its own changes in the commit after that one and wait for
/// both. So the second wait first lets the next creation wait for its metadata: then its own work is done already.
///
/// Only how long something takes depends on this, never what is on disk. Threads: any. One shared instance.
class OSTCommitSharing {
public:
    static OSTCommitSharing& sharedInstance();

    /// Stands around what may become a creation, from before it takes the lock to when it has given it back.
    class Creation {
    public:
        Creation() { ++sharedInstance()._underWay; }
        Creation(const Creation&) = delete;
        Creation& operator=(const Creation&) = delete;
        ~Creation();
    };

    /// A creation under the lock has waited for the disk.
    void didCommit();

    /// Waits until another creation has waited for the disk, or none is under way, for a short time at the longest.
    void letOthersCommit();

private:
    OSTCommitSharing() = default;
    void _tellWaiters(std::uint64_t commits);

    std::atomic<std::size_t> _underWay{0};
    std::atomic<std::size_t> _waiting{0}; ///< written under _mutex

    std::mutex _mutex;
    // Guarded by _mutex.
    std::condition_variable _changed;
    std::uint64_t _commits = 0; ///< counted while somebody waits
};

} // namespace ost
