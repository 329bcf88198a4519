// The daemon's side of a connection over socketpairs, with small budgets:
// memory follows the bytes that arrived, waiting connections resume in
// order, a stalled budget sheds its largest holder, replies too large to
// send leave the request answerable, and a peer without a fixed identity is
// never served.

#include <gtest/gtest.h>

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

TEST(PeerTransport, IdentityIsFixedAtAcceptOrNotAtAll) {
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
}

TEST(PeerTransport, AConnectionWithoutIdentityDeliversOnlyItsInvalidity) {
    Server server;
    auto& peer = server.connect(request(1, 10), /*hangUpFirst=*/true);
    EXPECT_FALSE(peer.connection->identity());
    ASSERT_TRUE(server.invalidReason(0));
    std::this_thread::sleep_for(50ms);  // nothing else may follow
    EXPECT_EQ(server.messageCount(), 0u);
    EXPECT_EQ(server.invalidCount(), 1u);
    EXPECT_EQ(peer.connection->pid(), ::getpid());
}

}  // namespace
