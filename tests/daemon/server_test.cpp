// The server in-process: it answers nothing before its registry is ready,
// drops the queued requests of a client that died, and keeps accepting and
// noticing hang-ups while a long handler holds mainQueue.

#include <gtest/gtest.h>

#include <unistd.h>

#include <condition_variable>
#include <mutex>
#include <thread>

#include "daemon/QMDServer.h"
#include "support/LogCapture.h"
#include "support/FramePeer.h"
#include "support/ScopedEnvironment.h"
#include "support/TempDir.h"
#include "support/TestRegistry.h"

namespace {

// A job that holds mainQueue, as a long handler would, until released.
class MainQueueBlocker {
public:
    explicit MainQueueBlocker(QMDServer& server) {
        server.mainQueue().asyncOnWorker([this] {
            std::unique_lock lock(mutex_);
            blocking_ = true;
            changed_.notify_all();
            changed_.wait(lock, [this] { return released_; });
        });
        std::unique_lock lock(mutex_);
        changed_.wait(lock, [this] { return blocking_; });
    }
    ~MainQueueBlocker() { release(); }
    void release() {
        std::lock_guard lock(mutex_);
        released_ = true;
        changed_.notify_all();
    }

private:
    std::mutex mutex_;
    std::condition_variable changed_;
    bool blocking_ = false;
    bool released_ = false;
};

class InProcessServer : public ::testing::Test {
protected:
    // The registry's catalog scans an empty root; until `scanned`, it has
    // not even begun.
    void start(bool scanned) {
        auto registry = qmtest::openTestRegistry(dir);
        ASSERT_TRUE(registry);
        auto created = QMDServer::initForService("inprocess.qmd", std::move(registry));
        ASSERT_TRUE(created) << created.error().text();
        server = *created;
        server->setVerbose(1);
        if (scanned) {
            server->registry().start();
        }
        loop = std::thread([this] { server->run(); });
    }
    void TearDown() override {
        if (server) {
            server->stop();
            loop.join();
        }
    }
    qmtest::TempDir dir;
    qmtest::ScopedEnvironment ductDirectory{"QM_DUCT_DIR", dir.file("duct")};
    qmtest::LogCapture log;
    QMDServer* server = nullptr;
    std::thread loop;
    std::string socketPath = dir.file("duct") + "/inprocess.qmd";
};

TEST_F(InProcessServer, NothingIsAnsweredBeforeTheRegistryIsReady) {
    start(/*scanned=*/false);
    qmtest::FramePeer early(socketPath);
    ASSERT_TRUE(early.connected()) << "connecting waits in the backlog";
    auto id = early.send(qmtest::bulk());
    EXPECT_FALSE(early.receive(std::chrono::milliseconds(300))) << "answered before the first scan";
    server->registry().start();
    auto reply = early.receive();
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->id, id);
    EXPECT_TRUE(log.waitFor("listening on " + socketPath));
}

TEST_F(InProcessServer, ALongHandlerNeitherDelaysAcceptsNorHangUpsNorServesTheDead) {
    start(/*scanned=*/true);
    std::string pid = std::to_string(::getpid());
    MainQueueBlocker longHandler(*server);
    {
        qmtest::FramePeer client(socketPath);
        ASSERT_TRUE(client.connected());
        EXPECT_TRUE(log.waitFor("client " + pid + " ")) << "accepted while mainQueue is busy";
        for (int i = 0; i < 3; ++i) {
            client.send(qmtest::bulk());
        }
    }  // hangs up with three requests queued
    EXPECT_TRUE(log.waitFor("client " + pid + " is dead")) << "hang-up seen while mainQueue is busy";
    longHandler.release();
    server->mainQueue().sync([] {});
    EXPECT_FALSE(log.contains("bulk options")) << "a dead client's queued requests ran:\n" << log.text();

    qmtest::FramePeer live(socketPath);
    EXPECT_TRUE(live.roundTrip(qmtest::bulk()));
}

TEST_F(InProcessServer, UnexpectedMessagesAreLoggedTenTimesThenCounted) {
    start(/*scanned=*/true);
    {
        qmtest::FramePeer client(socketPath);
        for (int i = 0; i < 12; ++i) {
            client.send(qm::Value(qm::Array{}));
        }
        EXPECT_TRUE(client.roundTrip(qmtest::bulk())) << "the connection stays open";
    }
    EXPECT_TRUE(log.waitFor("sent 12 unexpected messages, 2 of them not logged"));
    EXPECT_EQ(log.countContaining("unexpected message ()"), 10u) << log.text();
}

}  // namespace
