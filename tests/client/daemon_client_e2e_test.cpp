// QMDaemonClient against a real qmd.

#include <signal.h>

#include <gtest/gtest.h>

#include <condition_variable>
#include <cstdlib>
#include <mutex>
#include <thread>

#include "client/QMDaemonClient.h"
#include "platform/log/SystemLog.h"
#include "support/DaemonProcess.h"

using qm::Value;
using qmtest::DaemonProcess;

namespace {

using namespace std::chrono_literals;

class DaemonClientE2E : public ::testing::Test {
protected:
    void SetUp() override {
        ::setenv("QM_DUCT_DIR", daemon_.runtimeDirectory().c_str(), 1);
        qm::setLogObserver([this](int, std::string_view line) {
            std::lock_guard lock(logMutex_);
            logLines_.emplace_back(line);
        });
        auto client = QMDaemonClient::initWithServiceName(daemon_.serviceName().c_str(), 5000ms);
        ASSERT_TRUE(client.ok()) << client.error().text();
        client_ = std::move(client).value();
    }
    void TearDown() override {
        client_.reset();
        qm::setLogObserver(nullptr);
        ::unsetenv("QM_DUCT_DIR");
    }

    qm::Result<Value> wait(const std::function<void(QMDaemonClient::ReplyHandler)>& start) {
        return client_->waitForReply(start, 10000ms);
    }

    bool logged(const std::string& line) {
        for (int i = 0; i < 500; ++i) {
            {
                std::lock_guard lock(logMutex_);
                if (std::find(logLines_.begin(), logLines_.end(), line) != logLines_.end()) {
                    return true;
                }
            }
            std::this_thread::sleep_for(10ms);
        }
        return false;
    }

    DaemonProcess daemon_;
    std::unique_ptr<QMDaemonClient> client_;
    std::mutex logMutex_;
    std::vector<std::string> logLines_;
};

TEST_F(DaemonClientE2E, BulkSucceedsAtVersionsThreeAndTwo) {
    auto reply = wait([&](auto h) { client_->bulkPlugins(0x2a, h); });
    ASSERT_TRUE(reply.ok()) << reply.error().text();
    EXPECT_EQ(*reply, Value(qm::Dictionary{}));
    EXPECT_FALSE(QMDaemonClient::errorInReply(reply).has_value());
    EXPECT_TRUE(daemon_.waitForLog("bulk options 0x2a not supported"));

    client_->setProtocolVersion(2);
    auto old = wait([&](auto h) { client_->bulkPlugins(0, h); });
    EXPECT_FALSE(QMDaemonClient::errorInReply(old).has_value());
}

// Every operation reaches the daemon carrying the client's protocol version:
// at version 4 the daemon refuses each one with its version message.
TEST_F(DaemonClientE2E, EveryOperationCarriesTheClientsVersionToTheDaemon) {
    client_->setProtocolVersion(4);
    qm::Uuid uuid = qm::Uuid::random();
    std::vector<std::string> paths{"/nowhere/x.xbun"};
    auto& c = *client_;
    std::vector<std::function<void(QMDaemonClient::ReplyHandler)>> calls = {
        [&](auto h) { c.addPlugIns(paths, h); },
        [&](auto h) { c.removePlugIns(paths, h); },
        [&](auto h) { c.bulkPlugins(0, h); },
        [&](auto h) { c.readyPlugIns({uuid}, 0, h); },
        [&](auto h) { c.accessPlugIns({uuid}, 0, h); },
        [&](auto h) { c.matchPlugIns({}, 0, h); },
        [&](auto h) { c.setPluginAnnotations({uuid}, {}, h); },
        [&](auto h) { c.holdPlugins(paths, 1, h); },
        [&](auto h) { c.releaseHold(uuid, h); },
        [&](auto h) { c.send(c.request("x-unknown"), h); },
    };
    for (std::size_t i = 0; i < calls.size(); ++i) {
        auto error = QMDaemonClient::errorInReply(wait(calls[i]));
        ASSERT_TRUE(error.has_value()) << "call " << i;
        EXPECT_EQ(error->domain, "Quamber");
        EXPECT_EQ(error->code, 7) << "call " << i;
        EXPECT_EQ(error->text(), "unsupported protocol version 4 (current 3)") << "call " << i;
    }
}

TEST_F(DaemonClientE2E, AnUnknownRequestIsAQuamberErrorWithTheDaemonsMessage) {
    auto error = QMDaemonClient::errorInReply(client_->sendAndWait(client_->request("x-unknown"), 10000ms));
    ASSERT_TRUE(error.has_value());
    EXPECT_EQ(error->domain, "Quamber");
    EXPECT_EQ(error->code, 4);
    EXPECT_EQ(error->text(), "unrecognized request");
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
    std::mutex mutex;
    std::condition_variable done;
    std::vector<qm::Result<Value>> replies;
    for (int i = 0; i < 3; ++i) {
        client_->bulkPlugins(0, [&](qm::Result<Value> reply) {
            std::lock_guard lock(mutex);
            replies.push_back(std::move(reply));
            done.notify_all();
        });
    }
    std::this_thread::sleep_for(100ms);
    {
        std::lock_guard lock(mutex);
        EXPECT_TRUE(replies.empty());
    }
    ASSERT_EQ(::kill(daemon_.pid(), SIGKILL), 0);
    {
        std::unique_lock lock(mutex);
        ASSERT_TRUE(done.wait_for(lock, 10s, [&] { return replies.size() == 3; }));
    }
    for (const auto& reply : replies) {
        auto error = QMDaemonClient::errorInReply(reply);
        ASSERT_TRUE(error.has_value());
        EXPECT_EQ(error->domain, "Quamber");
        EXPECT_EQ(error->code, 4);
        EXPECT_EQ(error->text(), "connection invalid: daemon closed the connection");
    }
    EXPECT_TRUE(logged("Communications error: connection invalid: daemon closed the connection"));
    auto after = wait([&](auto h) { client_->bulkPlugins(0, h); });
    ASSERT_FALSE(after.ok());
    EXPECT_EQ(after.error().text(), "connection invalid: daemon closed the connection");
}

}  // namespace
