#include "platform/threads/WorkQueue.h"

#include "platform/threads/ThreadName.h"

#include <gtest/gtest.h>

#include <sys/resource.h>
#include <unistd.h>

#include <atomic>
#include <future>
#include <latch>
#include <memory>
#include <stdexcept>
#include <vector>

namespace ost::platform {
namespace {

TEST(WorkQueue, RunsWorkInOrderSynchronousWorkInItsTurn) {
    WorkQueue queue("com.tamarok.tests.order");
    std::vector<int> order;
    std::latch mayGoOn(1);
    queue.async([&] {
        mayGoOn.wait();
        order.push_back(1);
    });
    queue.async([&] { order.push_back(2); });
    mayGoOn.count_down();
    const auto caller = std::this_thread::get_id();
    EXPECT_TRUE(queue.sync([&] {
        order.push_back(3);
        return std::this_thread::get_id() == caller && queue.isCurrent();
    }));
    queue.async([&] { order.push_back(4); });
    queue.sync([] {});
    EXPECT_EQ(order, (std::vector{1, 2, 3, 4}));
    EXPECT_FALSE(queue.isCurrent());
}

TEST(WorkQueue, ExcludesManyThreads) {
    WorkQueue queue("com.tamarok.tests.exclusion");
    constexpr int rounds = 2000;
    int counter = 0; // without protection of its own
    std::vector<std::jthread> threads;
    for (int thread = 0; thread < 4; ++thread)
        threads.emplace_back([&] {
            for (int round = 0; round < rounds; ++round) {
                queue.sync([&] { ++counter; });
                queue.async([&] { ++counter; });
            }
        });
    threads.clear();
    EXPECT_EQ(queue.sync([&] { return counter; }), 4 * 2 * rounds);
}

TEST(WorkQueue, ParksWorkWhileSuspended) {
    WorkQueue queue("com.tamarok.tests.suspension");
    std::atomic<bool> ran = false;
    queue.suspend();
    queue.suspend();
    queue.async([&] { ran = true; });
    queue.resume();
    EXPECT_FALSE(ran);
    queue.resume();
    queue.sync([] {});
    EXPECT_TRUE(ran);
}

TEST(WorkQueue, StopAbandonsWhatHasNotBegunAndKeepsExcluding) {
    WorkQueue queue("com.tamarok.tests.stop");
    auto parked = std::make_shared<int>();
    auto refused = std::make_shared<int>();
    std::latch begun(1);
    std::latch mayEnd(1);
    bool finished = false;
    queue.async([&] {
        begun.count_down();
        mayEnd.wait();
        finished = true;
    });
    begun.wait();
    queue.suspend();
    queue.async([parked] { FAIL() << "abandoned work ran"; });
    mayEnd.count_down();
    queue.stop();
    queue.async([refused] { FAIL() << "work ran after the stop"; });
    EXPECT_TRUE(finished);
    EXPECT_EQ(parked.use_count(), 1);
    EXPECT_EQ(refused.use_count(), 1);
    EXPECT_EQ(queue.sync([] { return 7; }), 7);
}

TEST(WorkQueue, NamesItsThreadAndLowersOnlyThatOne) {
    WorkQueue queue("com.tamarok.tests.background");
    queue.setTargetBackgroundPriority();
    const auto nice = [] { return ::getpriority(PRIO_PROCESS, static_cast<id_t>(::gettid())); };
    const int callersNice = nice();
    std::promise<std::pair<std::string, int>> seen;
    queue.async([&] { seen.set_value({currentThreadName(), nice()}); });
    EXPECT_EQ(seen.get_future().get(), std::pair(queue.label(), 19));
    EXPECT_EQ(nice(), callersNice);
    EXPECT_EQ(currentThreadName(), "");
}

TEST(WorkQueue, PassesExceptionsOnAndDiesOfMisuse) {
    WorkQueue queue("com.tamarok.tests.exceptions");
    EXPECT_THROW(queue.sync([] { throw std::runtime_error("refused"); }), std::runtime_error);
    EXPECT_TRUE(queue.sync([] { return true; }));
    EXPECT_DEATH(queue.resume(), "Assertion failed");
    EXPECT_DEATH(queue.sync([&] { queue.sync([] {}); }), "Assertion failed");
    EXPECT_DEATH(
        {
            queue.async([] { throw std::runtime_error("nobody catches"); });
            queue.sync([] {});
        },
        "nobody catches");
}

} // namespace
} // namespace ost::platform
