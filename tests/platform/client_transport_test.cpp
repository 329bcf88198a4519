// The client side of the Duct transport, driven against a peer socket that
// the test controls byte for byte.

#include <sys/socket.h>

#include <gtest/gtest.h>

#include <cerrno>
#include <functional>
#include <set>
#include <thread>

#include "platform/duct/CborCodec.h"
#include "platform/duct/ClientConnection.h"
#include "platform/duct/Frame.h"
#include "support/FramePeer.h"
#include "support/ReplyCollector.h"
#include "support/ScopedEnvironment.h"
#include "support/TempDir.h"

using qm::Value;
using qm::duct::ClientConnection;
using qmtest::FramePeer;

namespace {

using namespace std::chrono_literals;

Value message(int n) {
    return qmtest::request({{"request", "test"}, {"n", n}});
}

// A client connection over a socketpair whose other end is the test's daemon.
struct Pair {
    Pair() {
        int fds[2];
        EXPECT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
        client = ClientConnection::adopt(qm::UniqueFd(fds[0]), queue, outcomes.eventHandler());
        peer.emplace(qm::UniqueFd(fds[1]));
    }
    // Sends the message and returns the frame the daemon's end read.
    qmtest::Frame sendAndRead(int tag) {
        client->send(message(tag), outcomes.handler(tag, &queue));
        auto frame = peer->receive();
        EXPECT_TRUE(frame);
        return frame.value_or(qmtest::Frame{});
    }

    qmtest::ReplyCollector outcomes;
    qm::SerialQueue queue{"client.test"};
    std::unique_ptr<ClientConnection> client;
    std::optional<FramePeer> peer;
};

// Most tests need one pair.
class ClientTransport : public ::testing::Test, protected Pair {};

void expectInvalidity(const qm::Result<Value>& reply, const std::string& fragment) {
    ASSERT_FALSE(reply.ok());
    EXPECT_EQ(reply.error().domain, "duct");
    EXPECT_TRUE(reply.error().text().starts_with("connection invalid: ")) << reply.error().text();
    EXPECT_NE(reply.error().text().find(fragment), std::string::npos) << reply.error().text();
}

// Messages that cannot be sent are refused, and nothing of them reaches the
// peer; replies then reach their own handlers on the queue.
TEST_F(ClientTransport, RepliesReachTheirOwnHandlersOnTheQueueWhateverTheirOrder) {
    client->send(Value("not a dictionary"), outcomes.handler(-1));
    client->send(Value(qm::Dictionary{{"d", Value(qm::Bytes(qm::duct::kMaxPayloadSize, 0))}}), outcomes.handler(-2));
    ASSERT_TRUE(outcomes.waitForReplies(2));
    for (const auto& [tag, code, text] : {std::tuple{-1, EINVAL, "not a dictionary"}, std::tuple{-2, EMSGSIZE, "16 MiB"}}) {
        auto refused = outcomes.reply(tag);
        ASSERT_FALSE(refused.ok());
        EXPECT_EQ(refused.error().domain, "duct");
        EXPECT_EQ(refused.error().code, code);
        EXPECT_NE(refused.error().text().find(text), std::string::npos) << refused.error().text();
    }
    qmtest::Frame first = sendAndRead(1);
    qmtest::Frame second = sendAndRead(2);
    EXPECT_EQ(first.kind, 1u);
    EXPECT_EQ(first.body, message(1));
    EXPECT_EQ(second.body, message(2));
    EXPECT_EQ(client->pendingCount(), 2u);
    peer->reply(second.id, Value(qm::Dictionary{{"answer", 2}}));
    peer->reply(first.id, Value(qm::Array{Value(1), Value("one")}));  // not a dictionary: delivered as it is
    ASSERT_TRUE(outcomes.waitForReplies(4));
    EXPECT_EQ(outcomes.order(), (std::vector<int>{-1, -2, 2, 1}));
    EXPECT_EQ(*outcomes.reply(1), Value(qm::Array{Value(1), Value("one")}));
    EXPECT_EQ(*outcomes.reply(2), Value(qm::Dictionary{{"answer", 2}}));
    EXPECT_TRUE(outcomes.ranOnTheirQueues());
    EXPECT_TRUE(client->isValid());
    EXPECT_EQ(client->pendingCount(), 0u);
    EXPECT_TRUE(outcomes.events().empty());
}

TEST_F(ClientTransport, ConcurrentSendersGetUniqueIdsAndTheirOwnReplies) {
    constexpr int kThreads = 4, kPerThread = 50;
    std::set<std::uint64_t> ids;
    {
        std::jthread echo([&] {
            for (int i = 0; i < kThreads * kPerThread; ++i) {
                auto frame = peer->receive();
                ASSERT_TRUE(frame);
                ids.insert(frame->id);
                peer->reply(frame->id, frame->body);  // echoes the message as its reply
            }
        });
        std::vector<std::jthread> senders;
        for (int t = 0; t < kThreads; ++t) {
            senders.emplace_back([&, t] {
                for (int n = t * kPerThread; n < (t + 1) * kPerThread; ++n) {
                    client->send(message(n), outcomes.handler(n));
                }
            });
        }
    }
    ASSERT_TRUE(outcomes.waitForReplies(kThreads * kPerThread));
    EXPECT_EQ(ids.size(), static_cast<std::size_t>(kThreads * kPerThread));
    for (int n = 0; n < kThreads * kPerThread; ++n) {
        EXPECT_EQ(outcomes.value(n), message(n));
    }
}

// Whatever ends the connection fails every pending request and every later
// send with its reason, and tells the event handler once.
TEST_F(ClientTransport, WhatEndsTheConnectionFailsEveryRequestWithItsReason) {
    using Ending = std::function<void(Pair&, std::uint64_t lastId)>;
    const std::pair<Ending, const char*> cases[] = {
        {[](Pair& p, std::uint64_t) { p.peer->close(); }, "daemon closed the connection"},
        {[](Pair& p, std::uint64_t id) { p.peer->sendBytes(qmtest::rawFrame("\xa0", 1, id)); }, "kind 1"},
        // Only the header: the client must not wait for 16 MiB + 1 that never come.
        {[](Pair& p, std::uint64_t id) { p.peer->sendBytes(qmtest::frameHeader(qm::duct::kMaxPayloadSize + 1, 2, id)); },
         "exceeds the 16 MiB limit"},
        {[](Pair& p, std::uint64_t id) { p.peer->sendBytes(qmtest::rawFrame("\xde\xad\xbe\xef", 2, id)); }, "undecodable reply"},
        {[](Pair& p, std::uint64_t id) { p.peer->reply(id + 1000, Value(qm::Dictionary{})); }, "unknown message"},
        {[](Pair& p, std::uint64_t) { p.client->invalidate("tired of waiting"); }, "tired of waiting"},
    };
    for (const auto& [end, reason] : cases) {
        SCOPED_TRACE(reason);
        Pair pair;  // one of its own for each ending
        pair.sendAndRead(1);
        end(pair, pair.sendAndRead(2).id);
        ASSERT_TRUE(pair.outcomes.waitForReplies(2));
        expectInvalidity(pair.outcomes.reply(1), reason);
        expectInvalidity(pair.outcomes.reply(2), reason);
        ASSERT_TRUE(pair.outcomes.waitForEvents(1));
        EXPECT_EQ(pair.outcomes.events()[0].text(), pair.outcomes.reply(1).error().text());
        EXPECT_FALSE(pair.client->isValid());
        pair.client->send(message(9), pair.outcomes.handler(9));
        ASSERT_TRUE(pair.outcomes.waitForReplies(3));
        expectInvalidity(pair.outcomes.reply(9), reason);
        std::this_thread::sleep_for(20ms);
        EXPECT_EQ(pair.outcomes.events().size(), 1u) << "one event per connection";
    }
}

TEST_F(ClientTransport, AReplyOfExactlyTheLimitIsAccepted) {
    qmtest::Frame frame = sendAndRead(1);
    // {"d": h'...'}: map head 1, key 2, byte-string head 5 bytes, then the data.
    Value big(qm::Dictionary{{"d", Value(qm::Bytes(qm::duct::kMaxPayloadSize - 8, 0x5a))}});
    ASSERT_EQ(qm::cbor::encode(big).size(), qm::duct::kMaxPayloadSize);
    std::thread writer([&] { peer->reply(frame.id, big); });
    ASSERT_TRUE(outcomes.waitForReplies(1, 30s));
    writer.join();
    EXPECT_EQ(outcomes.value(1), big);
    EXPECT_TRUE(client->isValid());
}

TEST_F(ClientTransport, DestructionFailsPendingRequestsWithoutAnEvent) {
    client->send(message(1), outcomes.handler(1));
    client->send(message(2), outcomes.handler(2));
    client.reset();  // the peer is still open: the reader must be woken
    ASSERT_TRUE(outcomes.waitForReplies(2));
    expectInvalidity(outcomes.reply(1), "connection closed by the client");
    expectInvalidity(outcomes.reply(2), "connection closed by the client");
    std::this_thread::sleep_for(50ms);
    EXPECT_TRUE(outcomes.events().empty());
}

TEST_F(ClientTransport, ServicesAreFoundByNameInTheRuntimeDirectory) {
    qmtest::TempDir scratch;
    qmtest::ScopedEnvironment ductDirectory("QM_DUCT_DIR", scratch.path());
    qm::UniqueFd listener = FramePeer::listenAt(scratch.file("test.service"));
    auto named = ClientConnection::connect("test.service", queue, outcomes.eventHandler(), ClientConnection::Options{2000ms});
    ASSERT_TRUE(named.ok()) << named.error().text();
    FramePeer accepted = FramePeer::accept(listener);
    (*named)->send(message(7), outcomes.handler(7));
    auto frame = accepted.receive();
    ASSERT_TRUE(frame);
    EXPECT_EQ(frame->body, message(7));

    auto missing = ClientConnection::connect("nobody.here", queue, nullptr);
    ASSERT_FALSE(missing.ok());
    EXPECT_EQ(missing.error().domain, "duct");
    EXPECT_EQ(missing.error().code, ENOENT);
    EXPECT_NE(missing.error().text().find(scratch.file("nobody.here")), std::string::npos) << missing.error().text();
    auto badName = ClientConnection::connect("a/b", queue, nullptr);
    ASSERT_FALSE(badName.ok());
    EXPECT_NE(badName.error().text().find("invalid service name"), std::string::npos);
}

}  // namespace
