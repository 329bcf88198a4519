// The list of holds: the index behind holdOnPlugIn, release by token and by
// client, and the seam that keeps a dying client from leaving a hold behind.

#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "platform/duct/OpenTransaction.h"
#include "registry/HoldList.h"
#include "support/LogCapture.h"

namespace {

struct StandInClient final : HoldOwner {
    std::atomic<bool> accepting{true};
    bool acceptWork() const noexcept override { return accepting.load(); }
};

qm::Uuid plugIn(std::uint8_t n) {
    qm::Uuid uuid;
    uuid.bytes[15] = n;
    return uuid;
}

std::shared_ptr<QMDPlugInHold> holdOf(std::vector<qm::Uuid> plugIns, const std::shared_ptr<StandInClient>& client) {
    return std::make_shared<QMDPlugInHold>(std::move(plugIns), client);
}

TEST(HoldList, PlugInsStayHeldWhileAnyHoldCoversThem) {
    std::atomic<int> changes{0};
    HoldList holds([&] { ++changes; });
    auto client = std::make_shared<StandInClient>();
    std::size_t openBefore = qm::duct::openTransactionCount();

    auto first = holdOf({plugIn(1), plugIn(2), plugIn(1)}, client);
    auto second = holdOf({plugIn(2)}, client);
    EXPECT_EQ(first->blocked().size(), 2u) << "duplicates collapse";
    ASSERT_TRUE(holds.addHold(first));
    ASSERT_TRUE(holds.addHold(second));
    EXPECT_EQ(qm::duct::openTransactionCount(), openBefore + 2) << "a hold keeps the process awake";

    holds.unholdToken(first->uuid());
    holds.unholdToken(first->uuid());  // an unknown token changes nothing
    EXPECT_FALSE(holds.holdOnPlugIn(plugIn(1)));
    EXPECT_TRUE(holds.holdOnPlugIn(plugIn(2))) << "still covered by the second hold";
    holds.unholdToken(second->uuid());
    EXPECT_FALSE(holds.holdOnPlugIn(plugIn(2)));
    EXPECT_EQ(changes.load(), 4) << "two added, two released";
    first.reset();
    second.reset();
    EXPECT_EQ(qm::duct::openTransactionCount(), openBefore);
}

TEST(HoldList, ADeadClientLosesEveryHoldAndCanGainNone) {
    qmtest::LogCapture log;
    std::atomic<int> changes{0};
    HoldList holds([&] { ++changes; });
    auto dying = std::make_shared<StandInClient>();
    auto other = std::make_shared<StandInClient>();
    ASSERT_TRUE(holds.addHold(holdOf({plugIn(1)}, dying)));
    ASSERT_TRUE(holds.addHold(holdOf({plugIn(2)}, dying)));
    ASSERT_TRUE(holds.addHold(holdOf({plugIn(3)}, other)));

    // In the daemon's order: stop accepting work, then release; the client
    // object may be gone before syncQueue gets to the release.
    dying->accepting = false;
    std::weak_ptr<const HoldOwner> weak = dying;
    holds.unholdClient(weak, 4242);
    dying.reset();
    holds.syncQueue().sync([] {});

    EXPECT_FALSE(holds.holdOnPlugIn(plugIn(1)));
    EXPECT_FALSE(holds.holdOnPlugIn(plugIn(2)));
    EXPECT_TRUE(holds.holdOnPlugIn(plugIn(3)));
    EXPECT_EQ(log.countContaining("for dead client pid 4242"), 2u) << log.text();

    auto late = std::make_shared<StandInClient>();
    late->accepting = false;
    int before = changes.load();
    EXPECT_FALSE(holds.addHold(holdOf({plugIn(4)}, late)));
    EXPECT_FALSE(holds.holdOnPlugIn(plugIn(4)));
    EXPECT_EQ(changes.load(), before) << "a refused hold posts nothing";
}

// A "lock" being served while its client dies: whichever comes first, no hold
// of the client survives the release.
TEST(HoldList, NoHoldSurvivesAClientDyingDuringItsLock) {
    for (int round = 0; round < 200; ++round) {
        HoldList holds(nullptr);
        auto client = std::make_shared<StandInClient>();
        std::thread locker([&] { (void)holds.addHold(holdOf({plugIn(1)}, client)); });
        std::thread killer([&] {
            client->accepting = false;
            holds.unholdClient(std::weak_ptr<const HoldOwner>(client), 1);
        });
        locker.join();
        killer.join();
        holds.syncQueue().sync([] {});
        ASSERT_FALSE(holds.holdOnPlugIn(plugIn(1))) << "round " << round;
    }
}

}  // namespace
