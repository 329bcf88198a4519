// Hostile and greedy clients cost their own connection, never the daemon's
// service to others.

#include <sys/socket.h>

#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <thread>

#include "platform/duct/Frame.h"
#include "support/DaemonProcess.h"
#include "support/Eventually.h"
#include "support/FramePeer.h"

using qmtest::DaemonProcess;
using qmtest::FramePeer;
using qmtest::bulk;
using qmtest::errorCode;
using qmtest::request;

namespace {

// Each way a connection breaks is the transport's test; here one makes the
// whole trip: a flood that is never read goes on until its replies outgrow
// the backlog bound and the daemon cuts the flooder off rather than hold
// them, logs why and serves on; nobody else waits for it meanwhile.
TEST(Connections, AFloodingClientCostsOnlyItsOwnConnection) {
    DaemonProcess daemon;
    FramePeer bystander(daemon.socketPath());
    ASSERT_TRUE(bystander.roundTrip(bulk()));

    FramePeer flooder(daemon.socketPath());
    auto one = qm::duct::encodeFrame(qm::duct::FrameKind::message, 1, request({{"request", "nope"}, {"version", 3u}}));
    qm::Bytes batch;
    for (int i = 0; i < 1000; ++i) {
        batch.insert(batch.end(), one->begin(), one->end());
    }
    std::atomic<bool> cutOff{false};
    std::jthread flood([&](std::stop_token stop) {
        // Non-blocking, so the thread ends when asked even if the daemon
        // stops reading; a partial send goes on where it stopped.
        for (std::size_t offset = 0; !stop.stop_requested();) {
            ssize_t n = ::send(flooder.fd(), batch.data() + offset, batch.size() - offset, MSG_DONTWAIT | MSG_NOSIGNAL);
            if (n > 0) {
                offset = (offset + static_cast<std::size_t>(n)) % batch.size();
            } else if (errno == EPIPE || errno == ECONNRESET) {
                cutOff = true;
                return;
            } else {
                std::this_thread::sleep_for(std::chrono::milliseconds(1));
            }
        }
    });
    for (int i = 0; i < 20; ++i) {
        ASSERT_TRUE(FramePeer(daemon.socketPath()).roundTrip(bulk(), std::chrono::seconds(10))) << "round " << i;
    }
    EXPECT_TRUE(qmtest::eventually([&] { return cutOff.load(); }, std::chrono::seconds(30)));
    EXPECT_TRUE(daemon.waitForLog("connection closed: reply backlog over 4 MiB"));
    ASSERT_TRUE(daemon.running());
    EXPECT_TRUE(bystander.roundTrip(bulk()));
}

TEST(Connections, FiveHundredConcurrentClientsAreServedAndLeaveNoDescriptorBehind) {
    DaemonProcess daemon;
    ASSERT_TRUE(FramePeer(daemon.socketPath()).roundTrip(bulk()));  // warms up
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    std::size_t before = daemon.openDescriptorCount();
    std::vector<std::unique_ptr<FramePeer>> clients;
    for (int i = 0; i < 500; ++i) {
        clients.push_back(std::make_unique<FramePeer>(daemon.socketPath()));
        ASSERT_TRUE(clients.back()->connected()) << i;
        clients.back()->send(bulk());
    }
    for (std::size_t i = 0; i < clients.size(); ++i) {
        auto reply = clients[i]->receive(std::chrono::seconds(10));
        ASSERT_TRUE(reply) << i;
        EXPECT_FALSE(errorCode(reply->body).has_value());
    }
    EXPECT_GE(daemon.openDescriptorCount(), before + 500);
    clients.clear();
    EXPECT_TRUE(qmtest::eventually([&] { return daemon.openDescriptorCount() == before; })) << daemon.openDescriptorCount();
}

}  // namespace
