// The server in-process: it answers nothing before its registry is ready,
// drops the queued requests of a client that died, and keeps accepting and
// noticing hang-ups while a long handler holds mainQueue.

#include <gtest/gtest.h>

#include <unistd.h>

#include <future>
#include <thread>

#include "daemon/QMDServer.h"
#include "support/LogCapture.h"
#include "support/FramePeer.h"
#include "support/ScopedEnvironment.h"
#include "support/TempDir.h"
#include "support/TestRegistry.h"

namespace {

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
    // Holds mainQueue, as a long handler would, until releaseMainQueue().
    void blockMainQueue() {
        server->mainQueue().asyncOnWorker([this, released = release.get_future().share()] {
            held.set_value();
            released.wait();
        });
        held.get_future().wait();
    }
    void releaseMainQueue() { release.set_value(); }
    void TearDown() override {
        if (server) {
            release = {};  // abandoned, should the test have failed before releasing it
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
    std::promise<void> held, release;
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
    blockMainQueue();
    {
        qmtest::FramePeer client(socketPath);
        ASSERT_TRUE(client.connected());
        EXPECT_TRUE(log.waitFor("client " + pid + " ")) << "accepted while mainQueue is busy";
        for (int i = 0; i < 3; ++i) {
            client.send(qmtest::bulk());
        }
    }  // hangs up with three requests queued
    EXPECT_TRUE(log.waitFor("client " + pid + " is dead")) << "hang-up seen while mainQueue is busy";
    releaseMainQueue();
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
