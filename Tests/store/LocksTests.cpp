#include "store/OSTLocks.h"

#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <optional>
#include <thread>

namespace ost {
namespace {

using enum OSTLockKind;

/// A holder in a thread of its own: takes a lock, says so, and gives it back when told.
class Holder {
public:
    explicit Holder(std::function<void()> take, std::function<void()> give)
        : _thread([this, take = std::move(take), give = std::move(give)] {
              take();
              _taken.set_value();
              _release.get_future().wait();
              give();
          }) {}
    ~Holder() {
        release();
        _thread.join();
    }
    void waitUntilTaken() { _takenFuture.wait(); }
    bool taken() { return _takenFuture.wait_for(std::chrono::milliseconds(50)) == std::future_status::ready; }
    void release() {
        if (!std::exchange(_released, true))
            _release.set_value();
    }

private:
    std::promise<void> _taken;
    std::future<void> _takenFuture = _taken.get_future();
    std::promise<void> _release;
    bool _released = false;
    std::thread _thread;
};

struct LockName {
    const char* name;
    std::optional<std::string> identifier; ///< none: all identifiers
    OSTLockKind kind;

    [[nodiscard]] std::unique_ptr<Holder> hold() const {
        if (!identifier)
            return std::make_unique<Holder>([k = kind] { _lock_all_identifiers(k); }, [] { unlock_all_identifiers(); });
        return std::make_unique<Holder>([id = *identifier, k = kind] { take_one_lock(id, k); },
                                        [id = *identifier] { unlock_one_lock(id); });
    }
};

TEST(Locks, ExcludeEachOtherAsTheirKindsSay) {
    const LockName allWriting{"all, writing", {}, writing};
    const LockName allReading{"all, reading", {}, reading};
    const LockName aWriting{"a, writing", "a", writing};
    const LockName aReading{"a, reading", "a", reading};
    const LockName bWriting{"b, writing", "b", writing};
    struct Case {
        LockName held, wanted;
        bool proceeds;
    };
    const Case cases[] = {
        {allWriting, allWriting, false}, {allWriting, allReading, false}, {allWriting, aWriting, false},
        {allWriting, aReading, false},   {allReading, allWriting, false}, {allReading, allReading, true},
        {allReading, aWriting, false},   {allReading, aReading, true},    {aWriting, allWriting, false},
        {aWriting, allReading, false},   {aWriting, aWriting, false},     {aWriting, aReading, false},
        {aWriting, bWriting, true},      {aReading, allWriting, false},   {aReading, allReading, true},
        {aReading, aWriting, false},     {aReading, aReading, true},      {aReading, bWriting, true},
    };
    for (const auto& c : cases) {
        const auto holder = c.held.hold();
        holder->waitUntilTaken();
        const auto waiter = c.wanted.hold();
        if (c.proceeds)
            waiter->waitUntilTaken();
        else
            EXPECT_FALSE(waiter->taken()) << c.held.name << " / " << c.wanted.name;
        holder->release();
        waiter->waitUntilTaken();
    }
    EXPECT_EQ(0U, OSTLockRecordCount());
}

TEST(Locks, AWaitingWriterIsNotKeptWaitingByFurtherReaders) {
    const LockName allWriting{"all, writing", {}, writing};
    const LockName allReading{"all, reading", {}, reading};
    const auto reader = allReading.hold();
    reader->waitUntilTaken();
    const auto writer = allWriting.hold();
    auto further = allReading.hold();
    while (further->taken()) // the writer does not wait yet
        further = allReading.hold();
    // Either may be next once the lock is free.
    reader->release();
    further->release();
    writer->release();
    writer->waitUntilTaken();
    further->waitUntilTaken();
}

TEST(Locks, ManyIdentifiersAreTakenOnceAndLeaveNoRecord) {
    {
        const OSTIdentifierLock lock({"b", "a", "b"}, writing);
        EXPECT_EQ(2U, OSTLockRecordCount());
    }
    EXPECT_EQ(0U, OSTLockRecordCount());
}

TEST(Locks, WritersNeverMeetAnybody) {
    std::atomic<int> writers = 0;
    std::atomic<int> readers = 0;
    std::atomic<bool> met = false;
    const auto work = [&](int seed) {
        for (int i = 0; i < 3000; ++i) {
            switch ((i + seed) % 4) {
            case 0: {
                const OSTAllIdentifiersLock lock(writing);
                if (writers++ != 0 || readers != 0)
                    met = true;
                --writers;
                break;
            }
            case 1: {
                const OSTAllIdentifiersLock lock(reading);
                ++readers;
                if (writers != 0)
                    met = true;
                --readers;
                break;
            }
            default: {
                const OSTIdentifierLock lock({i % 3 == 0 ? "x" : "y", "z"}, i % 5 == 0 ? writing : reading);
                ++readers;
                if (writers != 0)
                    met = true;
                --readers;
            }
            }
        }
    };
    std::vector<std::thread> threads;
    for (int i = 0; i < 6; ++i)
        threads.emplace_back(work, i);
    for (auto& thread : threads)
        thread.join();
    EXPECT_FALSE(met);
    EXPECT_EQ(0U, OSTLockRecordCount());
}

TEST(LocksDeathTest, MisuseStopsTheProcess) {
    EXPECT_DEATH(unlock_one_lock("never taken"), "unlock_one_lock");
    EXPECT_DEATH(unlock_all_identifiers(), "unlock_all_identifiers");
    EXPECT_DEATH(
        {
            const OSTAllIdentifiersLock lock(writing);
            take_one_lock("a", reading);
        },
        "heldOfAllIdentifiers");
    const OSTNoFurtherLocks noFurtherLocks;
    EXPECT_DEATH(_lock_all_identifiers(reading), "furtherLocksForbidden");
    EXPECT_DEATH(take_one_lock("a", reading), "furtherLocksForbidden");
}

} // namespace
} // namespace ost
