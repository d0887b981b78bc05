#include "platform/threads/Transactions.h"

#include <gtest/gtest.h>

#include <chrono>
#include <latch>

namespace ost::platform {
namespace {

using namespace std::chrono_literals;

TEST(Transactions, AreNamedUntilTheyEnd) {
    auto& transactions = Transactions::shared();
    Transaction first("start-up");
    Transaction second("request");
    Transaction third("request");
    EXPECT_EQ(transactions.describeOpen(), "request (2), start-up");
    EXPECT_FALSE(transactions.waitUntilNone(std::chrono::steady_clock::now()));

    first = std::move(second); // ends what it held
    third.end();
    third.end();
    EXPECT_EQ(transactions.describeOpen(), "request");
    first.end();
    EXPECT_TRUE(transactions.waitUntilNone(std::chrono::steady_clock::now()));
}

TEST(Transactions, StayOpenUntilQueuedWorkHasRun) {
    WorkQueue queue("com.tamarok.tests.transactions");
    queue.suspend();
    bool ran = false;
    async_with_transaction(queue, [&] {
        EXPECT_EQ(Transactions::shared().describeOpen(), queue.label());
        ran = true;
    });
    EXPECT_EQ(Transactions::shared().describeOpen(), queue.label());
    queue.resume();
    ASSERT_TRUE(Transactions::shared().waitUntilNone(std::chrono::steady_clock::now() + 1min));
    EXPECT_TRUE(ran);
}

TEST(Transactions, EndWhenTheQueueDropsTheWork) {
    WorkQueue queue("com.tamarok.tests.transactions");
    queue.suspend();
    async_with_transaction(queue, [] { FAIL() << "dropped work ran"; });
    EXPECT_NE(Transactions::shared().describeOpen(), "");
    queue.stop();
    async_with_transaction(queue, [] { FAIL() << "dropped work ran"; });
    EXPECT_EQ(Transactions::shared().describeOpen(), "");
}

} // namespace
} // namespace ost::platform
