// The daemon side of a connection against raw socket clients: fairness,
// reply backlogs, hang-ups, broken frames and the frame limit.

#include <gtest/gtest.h>

#include "platform/duct/Frame.h"
#include "support/TransportServer.h"

namespace {

using qm::duct::ReplyResult;
using qmtest::FramePeer;

qm::Value numbered(int i) {
    return qmtest::request({{"n", i}});
}

class DuctTransport : public ::testing::Test {
protected:
    qmtest::TransportServer server;
    qmtest::TransportServer::Peer& peer = server.connect();  // connection 0
    FramePeer& client = peer.end;
};

TEST_F(DuctTransport, AtMostSixtyFourRequestsAreReadBeforeRepliesGoOut) {
    for (int i = 0; i < 100; ++i) {
        client.send(numbered(i));
    }
    auto stays = [&](std::size_t count) {
        EXPECT_TRUE(server.waitForMessages(count));
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
        EXPECT_EQ(server.messageCount(), count);
    };
    stays(64);
    // Each answer, from another thread, lets exactly one more in.
    std::thread([m = server.takeMessage()]() mutable { EXPECT_EQ(m.reply(qm::Value(qm::Dictionary{})), ReplyResult::sent); }).join();
    stays(64);
    auto first = client.receive();
    ASSERT_TRUE(first);
    EXPECT_EQ(first->kind, 2u);
    EXPECT_EQ(first->id, 1u);
    // Dropping a request unanswered frees its place too.
    for (int i = 0; i < 36; ++i) {
        server.takeMessage();
    }
    stays(63);  // 28 left + the last 35 read
}

TEST_F(DuctTransport, ALargeReplyReachesASlowReaderWhole) {
    client.send(numbered(1));
    ASSERT_TRUE(server.waitForMessages(1));
    qm::Bytes blob(3 * 1024 * 1024);
    for (std::size_t i = 0; i < blob.size(); ++i) {
        blob[i] = static_cast<std::uint8_t>(i * 7);
    }
    qm::Value big(qm::Dictionary{{"blob", qm::Value(blob)}});
    EXPECT_EQ(server.takeMessage().reply(big), ReplyResult::sent);  // returns at once: the rest waits in the backlog
    auto reply = client.receive(std::chrono::seconds(20));
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->body, big);
}

TEST_F(DuctTransport, ABacklogBeyondFourMebibytesClosesTheConnection) {
    for (int i = 0; i < 10; ++i) {
        client.send(numbered(i));
    }
    ASSERT_TRUE(server.waitForMessages(10));
    qm::Value megabyte(qm::Dictionary{{"blob", qm::Value(qm::Bytes(1024 * 1024))}});
    int accepted = 0;
    for (int i = 0; i < 10; ++i) {
        accepted += server.takeMessage().reply(megabyte) == ReplyResult::sent ? 1 : 0;
    }
    EXPECT_LT(accepted, 10);
    auto reason = server.invalidReason(0);
    ASSERT_TRUE(reason);
    EXPECT_NE(reason->find("backlog"), std::string::npos) << *reason;
    EXPECT_FALSE(peer.connection->isValid());
}

TEST_F(DuctTransport, AHangUpIsReportedOnceAndRepliesAfterItAreDropped) {
    client.send(numbered(1));
    ASSERT_TRUE(server.waitForMessages(1));
    auto pending = server.takeMessage();
    client.close();
    EXPECT_EQ(server.invalidReason(0), "peer hung up");
    EXPECT_EQ(pending.reply(numbered(2)), ReplyResult::connectionGone);
    EXPECT_EQ(server.invalidCount(), 1u);
}

// Framing and payload errors close the connection at once, with the reason,
// and touch no other connection. What the codec refuses is listed in its own
// tests; one refusal here shows the path.
TEST_F(DuctTransport, BrokenFramesCloseOnlyTheirOwnConnection) {
    const std::pair<qm::Bytes, const char*> cases[] = {
        // Only the header: the payload is not waited for.
        {qmtest::frameHeader(16 * 1024 * 1024 + 1, 1, 1), "frame announces 16777217 bytes, over the 16 MiB limit"},
        {qmtest::rawFrame("\xa0", 2), "frame of kind 2 from a client"},
        {qmtest::rawFrame("\xa0", 7), "frame of kind 7 from a client"},
        {qmtest::rawFrame("\xa1\x61k"), "invalid payload: truncated item"},
        {qmtest::rawFrame(std::string(100000, '\x81') + "\x80"), "invalid payload: nesting deeper than 512 levels"},
    };
    int number = 0;
    for (const auto& [bytes, reason] : cases) {
        SCOPED_TRACE(reason);
        FramePeer& attacker = server.connect().end;
        ASSERT_TRUE(attacker.sendBytes(bytes));
        EXPECT_TRUE(attacker.waitForClose());
        EXPECT_EQ(server.invalidReason(++number), reason);
        client.send(numbered(number));
        ASSERT_TRUE(server.waitForMessages(static_cast<std::size_t>(number)));
    }
    EXPECT_TRUE(peer.connection->isValid());
}

TEST_F(DuctTransport, FramesArePiecedTogetherUpToExactlyTheLimit) {
    auto small = qm::duct::encodeFrame(qm::duct::FrameKind::message, 42, numbered(1));
    ASSERT_TRUE(small);
    for (std::uint8_t byte : *small) {
        ASSERT_TRUE(client.sendBytes(qm::Bytes{byte}));
        std::this_thread::sleep_for(std::chrono::microseconds(200));
    }
    ASSERT_TRUE(server.waitForMessages(1));
    {
        // Answered (here: dropped) first: a frame this large is decoded only
        // while its connection has no request in flight.
        auto first = server.takeMessage();
        EXPECT_EQ(first.id(), 42u);
        EXPECT_EQ(first.body(), numbered(1));
    }
    // {"x": h'...'}: map head 1, key 2, byte-string head 5 bytes, then the data.
    qm::Value big(qm::Dictionary{{"x", qm::Value(qm::Bytes(qm::duct::kMaxPayloadSize - 8, 0x7a))}});
    auto limit = qm::duct::encodeFrame(qm::duct::FrameKind::message, 43, big);
    ASSERT_TRUE(limit);
    ASSERT_EQ(limit->size(), qm::duct::kFrameHeaderSize + qm::duct::kMaxPayloadSize);
    ASSERT_TRUE(client.sendBytes(*limit));
    ASSERT_TRUE(server.waitForMessages(1, std::chrono::seconds(20)));
    EXPECT_EQ(server.takeMessage().body(), big);
}

}  // namespace
