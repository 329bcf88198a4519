// Serial queues: order, affinity, and running on an idle queue inline.

#include <gtest/gtest.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <future>
#include <thread>
#include <vector>

#include "platform/queue/SerialQueue.h"

using qm::SerialQueue;

namespace {

// Holds the queue a job runs on until released.
struct Gate {
    std::promise<void> entered, released;
    std::future<void> in = entered.get_future();
    std::shared_future<void> open = released.get_future().share();
    void enterAndWait() {
        entered.set_value();
        open.wait();
    }
};

TEST(SerialQueue, JobsFromManyThreadsRunOneAtATimeInEachThreadsOrder) {
    SerialQueue queue("order");
    std::vector<std::pair<int, int>> ran;  // touched only on the queue
    std::atomic<int> concurrent{0};
    std::atomic<bool> overlapped{false};
    {
        std::vector<std::jthread> submitters;
        for (int t = 0; t < 4; ++t) {
            submitters.emplace_back([&, t] {
                for (int i = 0; i < 500; ++i) {
                    queue.async([&, t, i] {
                        overlapped = overlapped || concurrent.fetch_add(1) != 0;
                        ran.emplace_back(t, i);
                        concurrent.fetch_sub(1);
                    });
                }
            });
        }
    }
    queue.sync([] {});
    EXPECT_FALSE(overlapped);
    ASSERT_EQ(ran.size(), 2000u);
    int next[4] = {0, 0, 0, 0};
    for (auto [t, i] : ran) {
        EXPECT_EQ(i, next[t]++) << "thread " << t;
    }
}

// Every nesting the daemon's lock order allows finishes, whichever queues
// run inline: X stands for mainQueue, Y and Z for the registry queue and
// syncQueue. A deadlock would hang the test; a watchdog turns it into a failure.
TEST(SerialQueue, NestingsTheLockOrderAllowsNeverDeadlock) {
    struct Queues {
        SerialQueue x{"x", qm::QualityOfService::userInitiated, /*runsInlineWhenIdle=*/true};
        SerialQueue y{"y", qm::QualityOfService::standard, /*runsInlineWhenIdle=*/true};
        SerialQueue z{"z", qm::QualityOfService::standard, /*runsInlineWhenIdle=*/true};
    };
    using Finish = std::function<void()>;
    const std::pair<const char*, std::function<void(Queues&, Finish)>> nestings[] = {
        {"X.sync -> Y.async -> X.sync",
         [](Queues& q, Finish finish) { q.x.sync([&q, finish] { q.y.async([&q, finish] { q.x.sync(finish); }); }); }},
        {"X.async -> Y.async -> X.sync",
         [](Queues& q, Finish finish) { q.x.async([&q, finish] { q.y.async([&q, finish] { q.x.sync(finish); }); }); }},
        {"X.async -> Y.sync, then Z.sync",
         [](Queues& q, Finish finish) {
             q.x.async([&q, finish] {
                 q.y.sync([] {});
                 q.z.sync(finish);
             });
         }},
        {"X.sync -> Y.sync -> Z.async -> Y.sync",
         [](Queues& q, Finish finish) {
             q.x.sync([&q, finish] { q.y.sync([&q, finish] { q.z.async([&q, finish] { q.y.sync(finish); }); }); });
         }},
        {"X.async -> Y.sync -> X.async",
         [](Queues& q, Finish finish) { q.x.async([&q, finish] { q.y.sync([&q, finish] { q.x.async(finish); }); }); }},
    };
    for (const auto& [name, run] : nestings) {
        SCOPED_TRACE(name);
        Queues queues;
        // The queues go only once the nesting has returned: the thread that
        // ran it inline still touches them after the innermost job.
        std::promise<void> finished, returned;
        std::future<void> waits[] = {finished.get_future(), returned.get_future()};
        std::thread runner([&, &run = run] {
            run(queues, [&] { finished.set_value(); });
            returned.set_value();
        });
        for (auto& wait : waits) {
            if (wait.wait_for(std::chrono::seconds(10)) != std::future_status::ready) {
                std::fprintf(stderr, "deadlock: %s\n", name);
                std::_Exit(1);
            }
        }
        runner.join();
        for (SerialQueue* queue : {&queues.x, &queues.y, &queues.z}) {
            queue->sync([] {});
        }
    }
}

TEST(SerialQueue, AJobOnAQueueNeverRunsAnotherQueuesAsyncJobInline) {
    SerialQueue outer("outer");
    SerialQueue inner("inner", qm::QualityOfService::userInitiated, /*runsInlineWhenIdle=*/true);
    std::promise<std::thread::id> innerRanOn;
    std::thread::id outerRanOn;
    bool outerCurrentInsideSync = true;
    outer.sync([&] {
        outerRanOn = std::this_thread::get_id();
        inner.async([&] { innerRanOn.set_value(std::this_thread::get_id()); });
        inner.sync([&] { outerCurrentInsideSync = outer.isCurrent() || !inner.isCurrent(); });
        EXPECT_TRUE(outer.isCurrent());
    });
    EXPECT_NE(innerRanOn.get_future().get(), outerRanOn);
    EXPECT_FALSE(outerCurrentInsideSync);
}

// A sync() call waits behind the work already queued.
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
    gate.in.wait();
    EXPECT_TRUE(queue.busy());
    std::thread::id secondRanOn;
    queue.async([&] {
        secondRanOn = std::this_thread::get_id();
        order.push_back(2);
    });
    std::jthread releaser([&] {
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
        gate.released.set_value();
    });
    queue.sync([&] { order.push_back(3); });
    holder.join();
    EXPECT_EQ(order, (std::vector<int>{1, 2, 3}));
    EXPECT_NE(secondRanOn, std::this_thread::get_id());
    EXPECT_NE(secondRanOn, std::thread::id());
}

TEST(SerialQueue, PendingJobsRunBeforeTheQueueGoes) {
    std::atomic<int> count{0};
    {
        Gate gate;  // outlives the queue, whose worker waits on it
        SerialQueue queue("drain");
        queue.async([&] { gate.enterAndWait(); });
        gate.in.wait();
        for (int i = 0; i < 100; ++i) {
            queue.async([&] { count.fetch_add(1); });
        }
        gate.released.set_value();
    }
    EXPECT_EQ(count.load(), 100);
}

using SerialQueueDeathTest = ::testing::Test;

TEST_F(SerialQueueDeathTest, CodeThatMustRunOnAQueueAssertsElsewhere) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    SerialQueue queue("affinity");
    EXPECT_DEATH(queue.assertCurrent(), "must run on this queue");
    EXPECT_DEATH(queue.sync([&] { queue.sync([] {}); }), "deadlock");
    SerialQueue other("other");
    EXPECT_DEATH(queue.sync([&] { other.sync([&] { queue.sync([] {}); }); }), "deadlock");
}

}  // namespace
