// The daemon side of the transport, in process: a listener with a handler
// of the test's own, driven by a raw socket client.

#include <gtest/gtest.h>

#include <condition_variable>
#include <deque>
#include <mutex>
#include <thread>

#include "platform/duct/Frame.h"
#include "platform/duct/Listener.h"
#include "support/FramePeer.h"
#include "support/ScopedEnvironment.h"
#include "support/TempDir.h"

namespace {

using qm::duct::ConnectionEvent;
using qm::duct::IncomingMessage;
using qm::duct::PeerConnection;
using qm::duct::ReplyResult;
using qmtest::FramePeer;

// A listener on its own loop thread; every message is kept for the test to
// answer, every invalid event recorded.
class Harness {
public:
    Harness() {
        loop_ = std::move(qm::EventLoop::create()).value();
        auto listener = qm::duct::Listener::create(*loop_, "transport.test", queue_);
        EXPECT_TRUE(listener) << (listener ? "" : listener.error().text());
        listener_ = std::move(listener).value();
        listener_->setConnectionHandler([this](std::shared_ptr<PeerConnection> connection) {
            {
                std::lock_guard lock(mutex_);
                connections_.push_back(connection);
            }
            connection->setEventHandler([this](ConnectionEvent&& event) {
                std::lock_guard lock(mutex_);
                if (event.kind == ConnectionEvent::Kind::message) {
                    messages_.push_back(std::move(*event.message));
                } else {
                    invalidReasons_.push_back(event.reason);
                }
                changed_.notify_all();
            });
            connection->resume();
        });
        EXPECT_FALSE(listener_->resume());
        thread_ = std::thread([this] { loop_->run(); });
    }
    ~Harness() {
        loop_->stop();
        thread_.join();
    }

    std::string socketPath() const { return dir_.file("duct") + "/transport.test"; }

    // Waits for `count` unanswered messages in total.
    bool waitForMessages(std::size_t count, std::chrono::milliseconds timeout = std::chrono::seconds(5)) {
        std::unique_lock lock(mutex_);
        return changed_.wait_for(lock, timeout, [&] { return messages_.size() >= count; });
    }
    std::size_t messageCount() {
        std::lock_guard lock(mutex_);
        return messages_.size();
    }
    IncomingMessage takeMessage() {
        std::lock_guard lock(mutex_);
        IncomingMessage m = std::move(messages_.front());
        messages_.pop_front();
        return m;
    }
    // The reason of the n-th connection's end, in the order they ended.
    std::optional<std::string> waitForInvalid(std::size_t n = 0) {
        std::unique_lock lock(mutex_);
        if (!changed_.wait_for(lock, std::chrono::seconds(5), [&] { return invalidReasons_.size() > n; })) {
            return std::nullopt;
        }
        return invalidReasons_[n];
    }
    std::shared_ptr<PeerConnection> connection(std::size_t i) {
        std::lock_guard lock(mutex_);
        return connections_.at(i);
    }

private:
    qmtest::TempDir dir_;
    qmtest::ScopedEnvironment ductDirectory_{"QM_DUCT_DIR", dir_.file("duct")};
    std::unique_ptr<qm::EventLoop> loop_;
    qm::SerialQueue queue_{"duct.test"};
    std::shared_ptr<qm::duct::Listener> listener_;
    std::thread thread_;
    std::mutex mutex_;
    std::condition_variable changed_;
    std::deque<IncomingMessage> messages_;
    std::vector<std::string> invalidReasons_;
    std::vector<std::shared_ptr<PeerConnection>> connections_;
};

qm::Value numbered(int i) {
    return qmtest::request({{"n", i}});
}

TEST(DuctTransport, PeersAreIdentifiedByTheirCredentials) {
    Harness harness;
    FramePeer client(harness.socketPath());
    client.send(numbered(1));
    ASSERT_TRUE(harness.waitForMessages(1));
    auto connection = harness.connection(0);
    EXPECT_EQ(connection->pid(), ::getpid());
    ASSERT_TRUE(connection->identity());
    EXPECT_EQ(connection->identity()->uid, ::getuid());
    auto exe = connection->peerExecutablePath();
    ASSERT_TRUE(exe);
    EXPECT_NE(exe->find("platform_duct_transport"), std::string::npos) << *exe;
}

TEST(DuctTransport, AtMostSixtyFourRequestsAreReadBeforeRepliesGoOut) {
    Harness harness;
    FramePeer client(harness.socketPath());
    for (int i = 0; i < 100; ++i) {
        client.send(numbered(i));
    }
    ASSERT_TRUE(harness.waitForMessages(64));
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    EXPECT_EQ(harness.messageCount(), 64u);
    // Each answer, from another thread, lets exactly one more in.
    std::thread([m = harness.takeMessage()]() mutable { EXPECT_EQ(m.reply(qm::Value(qm::Dictionary{})), ReplyResult::sent); }).join();
    ASSERT_TRUE(harness.waitForMessages(64));
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    EXPECT_EQ(harness.messageCount(), 64u);
    auto first = client.receive();
    ASSERT_TRUE(first);
    EXPECT_EQ(first->kind, 2u);
    EXPECT_EQ(first->id, 1u);
    // Dropping a request unanswered frees its place too.
    for (int i = 0; i < 36; ++i) {
        harness.takeMessage();
    }
    ASSERT_TRUE(harness.waitForMessages(63));
    EXPECT_EQ(harness.messageCount(), 63u);  // 28 left + the last 35 read
}

TEST(DuctTransport, ALargeReplyReachesASlowReaderWhole) {
    Harness harness;
    FramePeer client(harness.socketPath());
    client.send(numbered(1));
    ASSERT_TRUE(harness.waitForMessages(1));
    qm::Bytes blob(3 * 1024 * 1024);
    for (std::size_t i = 0; i < blob.size(); ++i) {
        blob[i] = static_cast<std::uint8_t>(i * 7);
    }
    qm::Value big(qm::Dictionary{{"blob", qm::Value(blob)}});
    EXPECT_EQ(harness.takeMessage().reply(big), ReplyResult::sent);  // returns at once: the rest waits in the backlog
    auto reply = client.receive(std::chrono::seconds(20));
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->body, big);
}

TEST(DuctTransport, ABacklogBeyondFourMebibytesClosesTheConnection) {
    Harness harness;
    FramePeer client(harness.socketPath());
    for (int i = 0; i < 10; ++i) {
        client.send(numbered(i));
    }
    ASSERT_TRUE(harness.waitForMessages(10));
    qm::Value megabyte(qm::Dictionary{{"blob", qm::Value(qm::Bytes(1024 * 1024))}});
    int accepted = 0;
    for (int i = 0; i < 10; ++i) {
        accepted += harness.takeMessage().reply(megabyte) == ReplyResult::sent ? 1 : 0;
    }
    EXPECT_LT(accepted, 10);
    auto reason = harness.waitForInvalid();
    ASSERT_TRUE(reason);
    EXPECT_NE(reason->find("backlog"), std::string::npos) << *reason;
    EXPECT_FALSE(harness.connection(0)->isValid());
}

TEST(DuctTransport, AHangUpIsReportedOnceAndRepliesAfterItAreDropped) {
    Harness harness;
    std::optional<IncomingMessage> pending;
    {
        FramePeer client(harness.socketPath());
        client.send(numbered(1));
        ASSERT_TRUE(harness.waitForMessages(1));
        pending.emplace(harness.takeMessage());
    }
    auto reason = harness.waitForInvalid();
    ASSERT_TRUE(reason);
    EXPECT_EQ(*reason, "peer hung up");
    EXPECT_EQ(pending->reply(numbered(2)), ReplyResult::connectionGone);
}

// Framing and payload errors close the connection at once, with the reason,
// and touch no other connection. What the codec refuses is listed in its own
// tests; one refusal here shows the path.
TEST(DuctTransport, BrokenFramesCloseOnlyTheirOwnConnection) {
    Harness harness;
    FramePeer bystander(harness.socketPath());
    struct Case {
        const char* what;
        qm::Bytes bytes;
        const char* reason;
    };
    const Case cases[] = {
        // Only the header: the payload is not waited for.
        {"header over 16 MiB", qmtest::frameHeader(16 * 1024 * 1024 + 1, 1, 1),
         "frame announces 16777217 bytes, over the 16 MiB limit"},
        {"reply kind from a client", qmtest::rawFrame("\xa0", 2), "frame of kind 2 from a client"},
        {"unknown kind", qmtest::rawFrame("\xa0", 7), "frame of kind 7 from a client"},
        {"undecodable payload", qmtest::rawFrame("\xa1\x61k"), "invalid payload: truncated item"},
        {"hostile nesting", qmtest::rawFrame(std::string(100000, '\x81') + "\x80"),
         "invalid payload: nesting deeper than 512 levels"},
    };
    for (std::size_t i = 0; i < std::size(cases); ++i) {
        SCOPED_TRACE(cases[i].what);
        FramePeer attacker(harness.socketPath());
        ASSERT_TRUE(attacker.sendBytes(cases[i].bytes));
        EXPECT_TRUE(attacker.waitForClose());
        EXPECT_EQ(harness.waitForInvalid(i), cases[i].reason);
        bystander.send(numbered(static_cast<int>(i)));
        ASSERT_TRUE(harness.waitForMessages(i + 1));
    }
    EXPECT_TRUE(harness.connection(0)->isValid());
}

TEST(DuctTransport, FramesArePiecedTogetherUpToExactlyTheLimit) {
    Harness harness;
    FramePeer client(harness.socketPath());
    auto small = qm::duct::encodeFrame(qm::duct::FrameKind::message, 42, numbered(1));
    ASSERT_TRUE(small);
    for (std::uint8_t byte : *small) {
        ASSERT_TRUE(client.sendBytes(qm::Bytes{byte}));
        std::this_thread::sleep_for(std::chrono::microseconds(200));
    }
    ASSERT_TRUE(harness.waitForMessages(1));
    {
        // Answered (here: dropped) first: a frame this large is decoded only
        // while its connection has no request in flight.
        IncomingMessage first = harness.takeMessage();
        EXPECT_EQ(first.id(), 42u);
        EXPECT_EQ(first.body(), numbered(1));
    }
    // {"x": h'...'}: map head 1, key 2, byte-string head 5 bytes, then the data.
    qm::Value big(qm::Dictionary{{"x", qm::Value(qm::Bytes(qm::duct::kMaxPayloadSize - 8, 0x7a))}});
    auto limit = qm::duct::encodeFrame(qm::duct::FrameKind::message, 43, big);
    ASSERT_TRUE(limit);
    ASSERT_EQ(limit->size(), qm::duct::kFrameHeaderSize + qm::duct::kMaxPayloadSize);
    ASSERT_TRUE(client.sendBytes(*limit));
    ASSERT_TRUE(harness.waitForMessages(1, std::chrono::seconds(20)));
    EXPECT_EQ(harness.takeMessage().body(), big);
}

}  // namespace
