// Serial queues: order, affinity, and running on an idle queue inline.

#include <gtest/gtest.h>

#include <atomic>
#include <condition_variable>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/queue/SerialQueue.h"

using qm::SerialQueue;

namespace {

struct Gate {
    std::mutex mutex;
    std::condition_variable changed;
    bool open = false;
    bool entered = false;
    void enterAndWait() {
        std::unique_lock lock(mutex);
        entered = true;
        changed.notify_all();
        changed.wait(lock, [&] { return open; });
    }
    void waitEntered() {
        std::unique_lock lock(mutex);
        changed.wait(lock, [&] { return entered; });
    }
    void release() {
        std::lock_guard lock(mutex);
        open = true;
        changed.notify_all();
    }
};

TEST(SerialQueue, JobsFromManyThreadsRunOneAtATimeInEachThreadsOrder) {
    SerialQueue queue("order");
    std::vector<std::pair<int, int>> ran;  // touched only on the queue
    std::atomic<int> concurrent{0};
    std::atomic<bool> overlapped{false};
    std::vector<std::thread> submitters;
    for (int t = 0; t < 4; ++t) {
        submitters.emplace_back([&, t] {
            for (int i = 0; i < 500; ++i) {
                queue.async([&, t, i] {
                    if (concurrent.fetch_add(1) != 0) {
                        overlapped = true;
                    }
                    ran.emplace_back(t, i);
                    concurrent.fetch_sub(1);
                });
            }
        });
    }
    for (auto& s : submitters) {
        s.join();
    }
    queue.sync([] {});
    EXPECT_FALSE(overlapped);
    ASSERT_EQ(ran.size(), 2000u);
    int next[4] = {0, 0, 0, 0};
    for (auto [t, i] : ran) {
        EXPECT_EQ(i, next[t]++) << "thread " << t;
    }
}

TEST(SerialQueue, SyncFromAnotherQueueRunsOnTheTargetAndReturnsAfterIt) {
    SerialQueue outer("outer");
    SerialQueue inner("inner");
    bool innerWasCurrent = false;
    bool outerWasCurrentInside = true;
    bool outerCurrentAfter = false;
    int value = 0;
    outer.sync([&] {
        inner.sync([&] {
            innerWasCurrent = inner.isCurrent();
            outerWasCurrentInside = outer.isCurrent();
            value = 42;
        });
        outerCurrentAfter = outer.isCurrent();
    });
    EXPECT_TRUE(innerWasCurrent);
    EXPECT_FALSE(outerWasCurrentInside);
    EXPECT_TRUE(outerCurrentAfter);
    EXPECT_EQ(value, 42);
    EXPECT_FALSE(inner.isCurrent());
}

TEST(SerialQueue, SyncWaitsBehindQueuedWork) {
    SerialQueue queue("behind");
    Gate gate;
    std::vector<int> order;
    queue.async([&] {
        gate.enterAndWait();
        order.push_back(1);
    });
    gate.waitEntered();
    queue.async([&] { order.push_back(2); });
    std::thread releaser([&] {
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
        gate.release();
    });
    queue.sync([&] { order.push_back(3); });
    releaser.join();
    EXPECT_EQ(order, (std::vector<int>{1, 2, 3}));
}

TEST(SerialQueue, AnIdleInlineQueueRunsOnTheCallerAndABusyOneOnItsWorker) {
    SerialQueue queue("inline", qm::QualityOfService::userInitiated, /*runsInlineWhenIdle=*/true);
    std::thread::id ranOn;
    queue.async([&] { ranOn = std::this_thread::get_id(); });
    EXPECT_EQ(ranOn, std::this_thread::get_id());

    Gate gate;
    std::vector<int> order;
    std::thread holder([&] {
        queue.async([&] {
            EXPECT_TRUE(queue.isCurrent());
            gate.enterAndWait();
            order.push_back(1);
        });
    });
    gate.waitEntered();
    EXPECT_TRUE(queue.busy());
    std::thread::id secondRanOn;
    queue.async([&] {
        secondRanOn = std::this_thread::get_id();
        order.push_back(2);
    });
    queue.async([&] { order.push_back(3); });
    gate.release();
    holder.join();
    queue.sync([] {});
    EXPECT_EQ(order, (std::vector<int>{1, 2, 3}));
    EXPECT_NE(secondRanOn, std::this_thread::get_id());
    EXPECT_NE(secondRanOn, std::thread::id());
}

TEST(SerialQueue, PendingJobsRunBeforeTheQueueGoes) {
    std::atomic<int> count{0};
    {
        SerialQueue queue("drain");
        Gate gate;
        queue.async([&] { gate.enterAndWait(); });
        gate.waitEntered();
        for (int i = 0; i < 100; ++i) {
            queue.async([&] { count.fetch_add(1); });
        }
        gate.release();
    }
    EXPECT_EQ(count.load(), 100);
}

using SerialQueueDeathTest = ::testing::Test;

TEST_F(SerialQueueDeathTest, CodeThatMustRunOnAQueueAssertsElsewhere) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    SerialQueue queue("affinity");
    EXPECT_DEATH(queue.assertCurrent(), "must run on this queue");
    EXPECT_DEATH(queue.sync([&] { queue.sync([] {}); }), "deadlock");
}

}  // namespace
