// The daemon's side of a connection over socketpairs. With small budgets:
// memory follows the bytes that arrived, waiting connections resume in
// order, a stalled budget sheds its largest holder, replies too large to
// send leave the request answerable, and a peer without a fixed identity is
// never served. Against raw socket clients: fairness, reply backlogs,
// hang-ups, broken frames and the frame limit.

#include <gtest/gtest.h>

#include <numeric>
#include <tuple>

#include "platform/duct/Frame.h"
#include "support/LogCapture.h"
#include "support/TransportServer.h"

namespace {

using namespace std::chrono_literals;
using qm::Bytes;
using qm::Value;
using qm::duct::PidfdSource;
using qm::duct::ReceiveLimits;
using qm::duct::ReplyResult;
using qmtest::eventually;
using qmtest::FramePeer;
using Pool = qm::duct::ReceiveBudget::Pool;
using Server = qmtest::TransportServer;

// A request frame whose payload is about `padding` bytes long.
Bytes request(std::uint64_t id, std::size_t padding) {
    Value body(qm::Dictionary{{"n", Value(id)}, {"pad", Value(std::string(padding, 'p'))}});
    return *qm::duct::encodeFrame(qm::duct::FrameKind::message, id, body);
}

// 1116 bytes of a 2000-byte frame never finished: more than a 1000-byte pool.
Bytes hoard() {
    Bytes bytes = qmtest::frameHeader(2000, 1, 1);
    bytes.resize(bytes.size() + 1100, 0x61);
    return bytes;
}

// Two requests of 10 KiB: each may decode to 160 KiB, more than a 100 KiB
// pool, so the second waits until the first is answered.
Bytes twoRequests() {
    Bytes two = request(1, 10 * 1024);
    Bytes second = request(2, 10 * 1024);
    two.insert(two.end(), second.begin(), second.end());
    return two;
}

TEST(PeerTransport, AFrameTakesMemoryAsItsBytesArriveNotAsItsHeaderAnnounces) {
    Server server;
    Bytes start = qmtest::frameHeader(static_cast<std::uint32_t>(qm::duct::kMaxPayloadSize), 1, 1);
    start.resize(start.size() + 20, 0x61);
    auto& peer = server.connect(start);
    ASSERT_TRUE(eventually([&] { return peer.connection->bufferedBytes() == 36; }));
    EXPECT_LE(peer.connection->bufferCapacity(), qm::duct::ReceiveBuffer::kInitialCapacity);
    EXPECT_EQ(server.budget().partialBytes(), 36u);
    std::size_t total = 36;
    for (std::size_t more : {4000, 60000, 150000}) {
        ASSERT_TRUE(peer.end.sendBytes(Bytes(more, 0x61)));
        total += more;
        ASSERT_TRUE(eventually([&] { return peer.connection->bufferedBytes() == total; })) << total;
        EXPECT_LE(peer.connection->bufferCapacity(), 2 * total) << total;
        EXPECT_EQ(server.budget().partialBytes(), total);
    }
    peer.end.close();
    ASSERT_TRUE(server.invalidReason(0));
    EXPECT_EQ(server.budget().partialBytes(), 0u);
    EXPECT_EQ(peer.connection->bufferCapacity(), 0u);
}

TEST(PeerTransport, WaitingConnectionsResumeInOrderOnceTheStalledLargestHolderIsDropped) {
    qmtest::LogCapture log;
    Server server(ReceiveLimits{.partialBytes = 1000, .stallTimeout = 1s});
    auto& holder = server.connect(hoard());
    ASSERT_TRUE(eventually([&] { return server.budget().partialBytes() == 1116; }));
    // Each starts a frame (a connection holding nothing may always start
    // one), then must wait for the rest.
    Bytes frame = request(1, 80);
    std::vector<Server::Peer*> waiting;
    for (int i = 0; i < 3; ++i) {
        waiting.push_back(&server.connect(Bytes(frame.begin(), frame.begin() + 26)));
        ASSERT_TRUE(eventually([&] { return waiting.back()->connection->bufferedBytes() == 26; }));
    }
    std::vector<int> order;
    for (std::size_t k : {2, 0, 1}) {
        ASSERT_TRUE(waiting[k]->end.sendBytes(Bytes(frame.begin() + 26, frame.end())));
        order.push_back(waiting[k]->number);
        ASSERT_TRUE(eventually([&] { return server.budget().waiting(Pool::partial) == order.size(); }));
    }
    EXPECT_EQ(server.messageCount(), 0u);
    ASSERT_TRUE(server.waitForMessages(3));
    auto reason = server.invalidReason(holder.number);
    ASSERT_TRUE(reason);
    EXPECT_NE(reason->find("1116 unfinished bytes"), std::string::npos) << *reason;
    EXPECT_TRUE(log.contains("dropping <connection pid=")) << log.text();
    EXPECT_EQ(server.messageSenders(), order);
    EXPECT_EQ(server.budget().waiting(Pool::partial), 0u);
}

TEST(PeerTransport, ADecodedRequestWaitsUntilAnAnswerMakesRoom) {
    Server server(ReceiveLimits{.decodedBytes = 100 * 1024});
    server.connect(twoRequests());
    ASSERT_TRUE(eventually([&] { return server.messageCount() == 1 && server.budget().waiting(Pool::decoded) == 1; }));
    EXPECT_GT(server.budget().decodedBytes(), 10u * 1024);
    EXPECT_EQ(server.takeMessage().reply(Value(qm::Dictionary{})), ReplyResult::sent);
    ASSERT_TRUE(server.waitForMessages(1));
    EXPECT_EQ(server.budget().waiting(Pool::decoded), 0u);
    server.takeMessage();  // dropped unanswered
    EXPECT_EQ(server.budget().decodedBytes(), 0u);
}

TEST(PeerTransport, WhileAConnectionWaitsOthersAreServedAndItsHangUpIsSeen) {
    // {what, limits, pool, what fills the pool from a connection of its own, what makes its connection wait}
    const std::tuple<const char*, ReceiveLimits, Pool, Bytes, Bytes> cases[] = {
        {"partial pool", ReceiveLimits{.partialBytes = 1000, .stallTimeout = 60s}, Pool::partial, hoard(), request(1, 5000)},
        {"decoded pool", ReceiveLimits{.decodedBytes = 100 * 1024}, Pool::decoded, {}, twoRequests()},
    };
    for (const auto& [what, limits, pool, filler, waiter] : cases) {
        SCOPED_TRACE(what);
        Server server(limits);
        if (!filler.empty()) {
            server.connect(filler);
        }
        auto& victim = server.connect(waiter);
        ASSERT_TRUE(eventually([&] { return server.budget().waiting(pool) == 1; }));
        // A connection holding nothing and with nothing in flight is admitted.
        auto& bystander = server.connect(request(9, 10));
        ASSERT_TRUE(eventually([&] {
            auto senders = server.messageSenders();
            return std::find(senders.begin(), senders.end(), bystander.number) != senders.end();
        }));
        EXPECT_EQ(server.takeMessage(bystander.number).reply(Value(qm::Dictionary{})), ReplyResult::sent);
        auto reply = bystander.end.receive();
        ASSERT_TRUE(reply);
        EXPECT_EQ(reply->id, 9u);
        ::shutdown(victim.end.fd(), SHUT_WR);  // only half closed: nothing but EPOLLRDHUP tells
        EXPECT_EQ(server.invalidReason(victim.number), "peer hung up");
    }
}

TEST(PeerTransport, AReplyTooLargeToSendLeavesTheRequestForASmallerOne) {
    Server server;
    auto& peer = server.connect(request(7, 10));
    ASSERT_TRUE(server.waitForMessages(1));
    auto message = server.takeMessage();
    EXPECT_EQ(message.reply(Value(qm::Dictionary{{"blob", Value(Bytes(qm::duct::kMaxPayloadSize))}})), ReplyResult::tooLarge);
    EXPECT_FALSE(message.replied());
    EXPECT_TRUE(peer.connection->isValid());
    EXPECT_EQ(message.reply(Value(qm::Dictionary{{"errorcode", 4}})), ReplyResult::sent);
    auto reply = peer.end.receive();
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->id, 7u);
    EXPECT_EQ(reply->body, Value(qm::Dictionary{{"errorcode", 4}}));
}

TEST(PeerTransport, IdentityIsFixedAtAcceptOrNotAtAllAndWithoutItNothingIsServed) {
    // {source, hung up before the identity is taken, identified}
    const std::tuple<PidfdSource, bool, bool> cases[] = {
        {PidfdSource::socketOption, false, true},
        {PidfdSource::socketOption, true, true},  // the kernel pinned the process when it connected
        {PidfdSource::pidfdOpen, false, true},
        {PidfdSource::pidfdOpen, true, false},  // its pid may name another process by now
    };
    for (const auto& [source, hungUp, identified] : cases) {
        SCOPED_TRACE(std::string(source == PidfdSource::pidfdOpen ? "pidfd_open" : "SO_PEERPIDFD") + (hungUp ? ", hung up" : ""));
        int ends[2];
        ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
        qm::UniqueFd near(ends[0]);
        qm::UniqueFd far(ends[1]);
        if (hungUp) {
            far.reset();
        }
        auto identity = qm::duct::capturePeerIdentity(near.get(), source);
        ASSERT_EQ(identity.has_value(), identified);
        if (identity) {
            EXPECT_EQ(identity->pid, ::getpid());
            EXPECT_EQ(identity->uid, ::getuid());
            ASSERT_TRUE(identity->pidfd && identity->pidfd->valid());
            ASSERT_TRUE(identity->executablePath);
            EXPECT_NE(identity->executablePath->find("platform_peer_transport"), std::string::npos);
        }
    }
    // A connection without one delivers nothing but its invalidity.
    Server server;
    auto& peer = server.connect(request(1, 10), /*hangUpFirst=*/true);
    EXPECT_FALSE(peer.connection->identity());
    ASSERT_TRUE(server.invalidReason(0));
    std::this_thread::sleep_for(50ms);  // nothing else may follow
    EXPECT_EQ(server.messageCount(), 0u);
    EXPECT_EQ(server.invalidCount(), 1u);
    EXPECT_EQ(peer.connection->pid(), ::getpid());
}


// --- against raw socket clients ----------------------------------------------

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
    std::iota(blob.begin(), blob.end(), std::uint8_t{0});  // not all one byte, so misplaced data shows
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
