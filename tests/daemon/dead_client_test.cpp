// Requests of a client that died while they waited are never served.

#include <gtest/gtest.h>

#include <condition_variable>
#include <mutex>
#include <thread>

#include "daemon/QMDServer.h"
#include "platform/log/SystemLog.h"
#include "support/FramePeer.h"
#include "support/LogCapture.h"
#include "support/ScopedEnvironment.h"
#include "support/TempDir.h"

namespace {

TEST(DeadClient, QueuedRequestsOfADeadClientGetNoHandlerAndNoReply) {
    qmtest::TempDir dir;
    qmtest::ScopedEnvironment ductDirectory("QM_DUCT_DIR", dir.file("duct"));
    qmtest::LogCapture log;
    auto server = QMDServer::initForService("dead.qmd", std::nullopt);
    ASSERT_TRUE(server) << server.error().text();
    (*server)->setVerbose(1);
    std::thread loop([s = *server] { s->run(); });

    // Hold mainQueue so the client's requests wait behind this job.
    std::mutex mutex;
    std::condition_variable changed;
    bool blocking = false;
    bool release = false;
    std::thread blocker([&] {
        (*server)->mainQueue().async([&] {
            std::unique_lock lock(mutex);
            blocking = true;
            changed.notify_all();
            changed.wait(lock, [&] { return release; });
        });
    });
    {
        std::unique_lock lock(mutex);
        changed.wait(lock, [&] { return blocking; });
    }
    std::string socketPath = dir.file("duct") + "/dead.qmd";
    {
        qmtest::FramePeer client(socketPath);
        ASSERT_TRUE(client.connected());
        for (int i = 0; i < 3; ++i) {
            client.send(qmtest::bulk());
        }
    }  // hangs up with three requests queued
    EXPECT_TRUE(log.waitFor("client " + std::to_string(::getpid()) + " is dead"));
    {
        std::lock_guard lock(mutex);
        release = true;
    }
    changed.notify_all();
    blocker.join();
    // Once the queue has drained, none of the three was handled.
    (*server)->mainQueue().sync([] {});
    EXPECT_EQ(log.text().find("bulk options"), std::string::npos) << log.text();
    EXPECT_EQ(log.text().find("request bulk"), std::string::npos) << log.text();

    // A live client is still served afterwards.
    qmtest::FramePeer live(socketPath);
    auto reply = live.roundTrip(qmtest::bulk());
    EXPECT_TRUE(reply);
    EXPECT_TRUE(log.waitFor("bulk options 0x0 not supported"));

    (*server)->eventLoop().stop();
    loop.join();
}

}  // namespace
