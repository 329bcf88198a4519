// QMDaemonClient against a real qmd.

#include <signal.h>

#include <gtest/gtest.h>

#include <thread>

#include "client/QMDaemonClient.h"
#include "support/DaemonProcess.h"
#include "support/LogCapture.h"
#include "support/ReplyCollector.h"
#include "support/ScopedEnvironment.h"

using qm::Value;
using qmtest::DaemonProcess;

namespace {

using namespace std::chrono_literals;

class DaemonClientE2E : public ::testing::Test {
protected:
    void SetUp() override {
        auto client = QMDaemonClient::initWithServiceName(daemon_.serviceName().c_str(), 5000ms);
        ASSERT_TRUE(client.ok()) << client.error().text();
        client_ = std::move(client).value();
    }

    qm::Result<Value> wait(const std::function<void(QMDaemonClient::ReplyHandler)>& start) {
        return client_->waitForReply(start, 10000ms);
    }

    DaemonProcess daemon_;
    qmtest::ScopedEnvironment ductDirectory_{"QM_DUCT_DIR", daemon_.runtimeDirectory()};
    qmtest::LogCapture log_;
    qmtest::ReplyCollector replies_;  // outlives the client, which may still call its handlers
    std::unique_ptr<QMDaemonClient> client_;
};

// What each request sends is the unit tests' business; here one request of
// each outcome makes the whole trip.
TEST_F(DaemonClientE2E, RepliesAndRefusalsOfTheDaemonReachTheCaller) {
    auto reply = wait([&](auto h) { client_->bulkPlugins(0x2a, h); });
    ASSERT_TRUE(reply.ok()) << reply.error().text();
    EXPECT_EQ(*reply, Value(qm::Dictionary{}));
    EXPECT_FALSE(QMDaemonClient::errorInReply(reply).has_value());
    EXPECT_TRUE(daemon_.waitForLog("bulk options 0x2a not supported"));

    auto unknown = QMDaemonClient::errorInReply(client_->sendAndWait(client_->request("x-unknown"), 10000ms));
    ASSERT_TRUE(unknown.has_value());
    EXPECT_EQ(unknown->domain, "Quamber");
    EXPECT_EQ(unknown->code, 4);
    EXPECT_EQ(unknown->text(), "unrecognized request");

    client_->setProtocolVersion(2);
    EXPECT_FALSE(QMDaemonClient::errorInReply(wait([&](auto h) { client_->bulkPlugins(0, h); })).has_value());
    client_->setProtocolVersion(4);
    auto refused = QMDaemonClient::errorInReply(wait([&](auto h) { client_->matchPlugIns({}, 0, h); }));
    ASSERT_TRUE(refused.has_value());
    EXPECT_EQ(refused->code, 7);
    EXPECT_EQ(refused->text(), "unsupported protocol version 4 (current 3)");
}

TEST_F(DaemonClientE2E, ManyThreadsShareOneClient) {
    constexpr int kThreads = 4;
    constexpr int kEach = 25;
    std::atomic<int> good{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&] {
            for (int i = 0; i < kEach; ++i) {
                auto reply = client_->sendAndWait(client_->request(i % 2 ? "bulk" : "x-unknown"), 10000ms);
                auto error = QMDaemonClient::errorInReply(reply);
                bool expected = i % 2 ? !error : (error && error->text() == "unrecognized request");
                good += expected ? 1 : 0;
            }
        });
    }
    for (auto& t : threads) {
        t.join();
    }
    EXPECT_EQ(good.load(), kThreads * kEach);
}

TEST_F(DaemonClientE2E, ADaemonThatDiesMidRequestFailsEveryPendingRequest) {
    ASSERT_TRUE(wait([&](auto h) { client_->bulkPlugins(0, h); }).ok());
    ASSERT_EQ(::kill(daemon_.pid(), SIGSTOP), 0);  // the requests below stay unanswered
    for (int i = 0; i < 3; ++i) {
        client_->bulkPlugins(0, replies_.handler(i));
    }
    EXPECT_FALSE(replies_.waitForReplies(1, 100ms));
    ASSERT_EQ(::kill(daemon_.pid(), SIGKILL), 0);
    ASSERT_TRUE(replies_.waitForReplies(3, 10s));
    for (int i = 0; i < 3; ++i) {
        auto error = QMDaemonClient::errorInReply(replies_.reply(i));
        ASSERT_TRUE(error.has_value());
        EXPECT_EQ(error->domain, "Quamber");
        EXPECT_EQ(error->code, 4);
        EXPECT_EQ(error->text(), "connection invalid: daemon closed the connection");
    }
    EXPECT_TRUE(log_.waitFor("Communications error: connection invalid: daemon closed the connection"));
    auto after = wait([&](auto h) { client_->bulkPlugins(0, h); });
    ASSERT_FALSE(after.ok());
    EXPECT_EQ(after.error().text(), "connection invalid: daemon closed the connection");
}

}  // namespace
