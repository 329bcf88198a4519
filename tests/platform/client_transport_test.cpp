// The client side of the Duct transport, driven against a peer socket that
// the test controls byte for byte.

#include <sys/socket.h>
#include <sys/un.h>

#include <gtest/gtest.h>

#include <cerrno>
#include <condition_variable>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <set>
#include <thread>

#include "platform/duct/CborCodec.h"
#include "platform/duct/ClientConnection.h"
#include "platform/duct/Frame.h"
#include "support/TempDir.h"

using qm::Value;
using qm::duct::ClientConnection;

namespace {

using namespace std::chrono_literals;

struct ReceivedFrame {
    qm::duct::FrameHeader header;
    Value body;
};

// The daemon's end of a socketpair.
class Peer {
public:
    explicit Peer(qm::UniqueFd fd) : fd_(std::move(fd)) {}

    ReceivedFrame readFrame() {
        std::uint8_t header[qm::duct::kFrameHeaderSize];
        readExactly(header, sizeof header);
        ReceivedFrame frame{qm::duct::readFrameHeader(header), Value()};
        qm::Bytes payload(frame.header.payloadLength);
        readExactly(payload.data(), payload.size());
        auto body = qm::cbor::decode(payload);
        EXPECT_TRUE(body.ok());
        if (body) {
            frame.body = *body;
        }
        return frame;
    }

    void reply(std::uint64_t id, const Value& body) {
        auto frame = qm::duct::encodeFrame(qm::duct::FrameKind::reply, id, body);
        ASSERT_TRUE(frame.has_value());
        writeBytes(*frame);
    }

    void writeHeader(std::uint32_t length, std::uint32_t kind, std::uint64_t id) {
        qm::Bytes header(qm::duct::kFrameHeaderSize);
        qm::duct::writeFrameHeader(header.data(), {length, kind, id});
        writeBytes(header);
    }

    void writeBytes(const qm::Bytes& bytes) {
        std::size_t sent = 0;
        while (sent < bytes.size()) {
            ssize_t n = ::send(fd_.get(), bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL);
            ASSERT_GT(n, 0) << std::strerror(errno);
            sent += static_cast<std::size_t>(n);
        }
    }

    void close() { fd_.reset(); }

private:
    void readExactly(std::uint8_t* into, std::size_t size) {
        std::size_t got = 0;
        while (got < size) {
            ssize_t n = ::recv(fd_.get(), into + got, size - got, 0);
            ASSERT_GT(n, 0) << "the client closed the connection";
            got += static_cast<std::size_t>(n);
        }
    }

    qm::UniqueFd fd_;
};

// Collects what handlers and events deliver, on whatever thread.
class Outcomes {
public:
    ClientConnection::ReplyHandler handler(int tag, const qm::SerialQueue* expectedQueue = nullptr) {
        return [this, tag, expectedQueue](qm::Result<Value> reply) {
            std::lock_guard lock(mutex_);
            if (expectedQueue) {
                onQueue_ = onQueue_ && expectedQueue->isCurrent();
            }
            replies_.emplace(tag, std::move(reply));
            changed_.notify_all();
        };
    }
    ClientConnection::EventHandler eventHandler() {
        return [this](const qm::Error& error) {
            std::lock_guard lock(mutex_);
            events_.push_back(error);
            changed_.notify_all();
        };
    }

    bool waitForReplies(std::size_t count, std::chrono::milliseconds timeout = 5s) {
        std::unique_lock lock(mutex_);
        return changed_.wait_for(lock, timeout, [&] { return replies_.size() >= count; });
    }
    bool waitForEvents(std::size_t count, std::chrono::milliseconds timeout = 5s) {
        std::unique_lock lock(mutex_);
        return changed_.wait_for(lock, timeout, [&] { return events_.size() >= count; });
    }

    qm::Result<Value> reply(int tag) {
        std::lock_guard lock(mutex_);
        auto it = replies_.find(tag);
        if (it == replies_.end()) {
            ADD_FAILURE() << "no reply for " << tag;
            return qm::Error{"test", 0, "missing"};
        }
        return it->second;
    }
    std::size_t replyCount() {
        std::lock_guard lock(mutex_);
        return replies_.size();
    }
    std::vector<qm::Error> events() {
        std::lock_guard lock(mutex_);
        return events_;
    }
    bool handlersRanOnQueue() {
        std::lock_guard lock(mutex_);
        return onQueue_;
    }

private:
    std::mutex mutex_;
    std::condition_variable changed_;
    std::multimap<int, qm::Result<Value>> replies_;
    std::vector<qm::Error> events_;
    bool onQueue_ = true;
};

struct Pair {
    std::unique_ptr<ClientConnection> client;
    Peer peer;
};

Pair connectedPair(qm::SerialQueue& queue, Outcomes& outcomes) {
    int fds[2];
    EXPECT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
    return Pair{ClientConnection::adopt(qm::UniqueFd(fds[0]), queue, outcomes.eventHandler()),
                Peer(qm::UniqueFd(fds[1]))};
}

Value message(int n) {
    return Value(qm::Dictionary{{"request", "test"}, {"n", n}});
}

void expectInvalidity(const qm::Result<Value>& reply, const std::string& fragment) {
    ASSERT_FALSE(reply.ok());
    EXPECT_EQ(reply.error().domain, "duct");
    EXPECT_EQ(reply.error().text().rfind("connection invalid: ", 0), 0u) << reply.error().text();
    EXPECT_NE(reply.error().text().find(fragment), std::string::npos) << reply.error().text();
}

TEST(ClientTransport, RepliesReachTheirOwnHandlersOnTheQueueWhateverTheirOrder) {
    Outcomes outcomes;
    qm::SerialQueue queue("test-replies");
    auto [client, peer] = connectedPair(queue, outcomes);
    client->send(message(1), outcomes.handler(1, &queue));
    client->send(message(2), outcomes.handler(2, &queue));
    ReceivedFrame first = peer.readFrame();
    ReceivedFrame second = peer.readFrame();
    EXPECT_EQ(first.header.kind, 1u);
    EXPECT_EQ(first.body, message(1));
    EXPECT_EQ(second.body, message(2));
    EXPECT_NE(first.header.messageId, second.header.messageId);
    EXPECT_EQ(client->pendingCount(), 2u);

    peer.reply(second.header.messageId, Value(qm::Dictionary{{"answer", 2}}));
    peer.reply(first.header.messageId, Value(qm::Dictionary{{"answer", 1}}));
    ASSERT_TRUE(outcomes.waitForReplies(2));
    EXPECT_EQ(*outcomes.reply(1), Value(qm::Dictionary{{"answer", 1}}));
    EXPECT_EQ(*outcomes.reply(2), Value(qm::Dictionary{{"answer", 2}}));
    EXPECT_TRUE(outcomes.handlersRanOnQueue());
    EXPECT_TRUE(client->isValid());
    EXPECT_EQ(client->pendingCount(), 0u);
    EXPECT_TRUE(outcomes.events().empty());
}

TEST(ClientTransport, ConcurrentSendersGetUniqueIdsAndTheirOwnReplies) {
    Outcomes outcomes;
    qm::SerialQueue queue("test-concurrent");
    auto [client, peer] = connectedPair(queue, outcomes);
    constexpr int kThreads = 4;
    constexpr int kPerThread = 50;
    std::set<std::uint64_t> ids;
    std::thread echo([&peer = peer, &ids] {
        for (int i = 0; i < kThreads * kPerThread; ++i) {
            ReceivedFrame frame = peer.readFrame();
            ids.insert(frame.header.messageId);
            peer.reply(frame.header.messageId, frame.body);  // echoes the message as its reply
        }
    });
    std::vector<std::thread> senders;
    for (int t = 0; t < kThreads; ++t) {
        senders.emplace_back([&client = client, &outcomes, t] {
            for (int i = 0; i < kPerThread; ++i) {
                int n = t * kPerThread + i;
                client->send(message(n), outcomes.handler(n));
            }
        });
    }
    for (auto& s : senders) {
        s.join();
    }
    echo.join();
    ASSERT_TRUE(outcomes.waitForReplies(kThreads * kPerThread));
    EXPECT_EQ(ids.size(), static_cast<std::size_t>(kThreads * kPerThread));
    for (int n = 0; n < kThreads * kPerThread; ++n) {
        auto reply = outcomes.reply(n);
        ASSERT_TRUE(reply.ok());
        EXPECT_EQ(*reply, message(n));
    }
}

TEST(ClientTransport, HangUpFailsEveryPendingRequestAndEverySendAfterIt) {
    Outcomes outcomes;
    qm::SerialQueue queue("test-hangup");
    auto [client, peer] = connectedPair(queue, outcomes);
    for (int n = 0; n < 3; ++n) {
        client->send(message(n), outcomes.handler(n));
    }
    for (int n = 0; n < 3; ++n) {
        peer.readFrame();
    }
    peer.close();
    ASSERT_TRUE(outcomes.waitForReplies(3));
    for (int n = 0; n < 3; ++n) {
        expectInvalidity(outcomes.reply(n), "daemon closed the connection");
    }
    ASSERT_TRUE(outcomes.waitForEvents(1));
    EXPECT_EQ(outcomes.events()[0].text(), "connection invalid: daemon closed the connection");
    EXPECT_FALSE(client->isValid());

    client->send(message(9), outcomes.handler(9));
    ASSERT_TRUE(outcomes.waitForReplies(4));
    expectInvalidity(outcomes.reply(9), "daemon closed the connection");
    std::this_thread::sleep_for(50ms);
    EXPECT_EQ(outcomes.events().size(), 1u) << "one event per connection";
}

TEST(ClientTransport, AFrameThatIsNotAReplyMakesTheConnectionInvalid) {
    Outcomes outcomes;
    qm::SerialQueue queue("test-kind");
    auto [client, peer] = connectedPair(queue, outcomes);
    client->send(message(1), outcomes.handler(1));
    ReceivedFrame frame = peer.readFrame();
    auto bytes = qm::duct::encodeFrame(qm::duct::FrameKind::message, frame.header.messageId, Value(qm::Dictionary{}));
    peer.writeBytes(*bytes);
    ASSERT_TRUE(outcomes.waitForReplies(1));
    expectInvalidity(outcomes.reply(1), "kind 1");
    ASSERT_TRUE(outcomes.waitForEvents(1));
}

TEST(ClientTransport, AHeaderAnnouncingMoreThanTheLimitIsRefusedWithoutItsPayload) {
    Outcomes outcomes;
    qm::SerialQueue queue("test-oversize");
    auto [client, peer] = connectedPair(queue, outcomes);
    client->send(message(1), outcomes.handler(1));
    ReceivedFrame frame = peer.readFrame();
    // Only the header: the client must not wait for 16 MiB + 1 that never come.
    peer.writeHeader(static_cast<std::uint32_t>(qm::duct::kMaxPayloadSize + 1), 2, frame.header.messageId);
    ASSERT_TRUE(outcomes.waitForReplies(1));
    expectInvalidity(outcomes.reply(1), "exceeds the 16 MiB limit");
}

TEST(ClientTransport, AReplyOfExactlyTheLimitIsAccepted) {
    Outcomes outcomes;
    qm::SerialQueue queue("test-limit");
    auto [client, peer] = connectedPair(queue, outcomes);
    client->send(message(1), outcomes.handler(1));
    ReceivedFrame frame = peer.readFrame();
    // {"d": h'...'}: map head 1, key 2, byte-string head 5 bytes, then the data.
    qm::Bytes data(qm::duct::kMaxPayloadSize - 8, 0x5a);
    Value big(qm::Dictionary{{"d", Value(std::move(data))}});
    ASSERT_EQ(qm::cbor::encode(big).size(), qm::duct::kMaxPayloadSize);
    std::thread writer([&peer = peer, &frame, &big] { peer.reply(frame.header.messageId, big); });
    ASSERT_TRUE(outcomes.waitForReplies(1, 30s));
    writer.join();
    auto reply = outcomes.reply(1);
    ASSERT_TRUE(reply.ok()) << reply.error().text();
    EXPECT_EQ(*reply, big);
    EXPECT_TRUE(client->isValid());
}

TEST(ClientTransport, AnUndecodablePayloadMakesTheConnectionInvalid) {
    Outcomes outcomes;
    qm::SerialQueue queue("test-garbage");
    auto [client, peer] = connectedPair(queue, outcomes);
    client->send(message(1), outcomes.handler(1));
    ReceivedFrame frame = peer.readFrame();
    peer.writeHeader(3, 2, frame.header.messageId);
    peer.writeBytes({0xff, 0x00, 0x13});
    ASSERT_TRUE(outcomes.waitForReplies(1));
    expectInvalidity(outcomes.reply(1), "undecodable reply");
}

TEST(ClientTransport, AReplyToNoPendingMessageMakesTheConnectionInvalid) {
    Outcomes outcomes;
    qm::SerialQueue queue("test-unknown-id");
    auto [client, peer] = connectedPair(queue, outcomes);
    client->send(message(1), outcomes.handler(1));
    ReceivedFrame frame = peer.readFrame();
    peer.reply(frame.header.messageId + 1000, Value(qm::Dictionary{}));
    ASSERT_TRUE(outcomes.waitForReplies(1));
    expectInvalidity(outcomes.reply(1), "unknown message");
}

TEST(ClientTransport, AReplyThatIsNotADictionaryIsDeliveredAsItIs) {
    Outcomes outcomes;
    qm::SerialQueue queue("test-array");
    auto [client, peer] = connectedPair(queue, outcomes);
    client->send(message(1), outcomes.handler(1));
    ReceivedFrame frame = peer.readFrame();
    peer.reply(frame.header.messageId, Value(qm::Array{Value(1), Value("two")}));
    ASSERT_TRUE(outcomes.waitForReplies(1));
    auto reply = outcomes.reply(1);
    ASSERT_TRUE(reply.ok());
    EXPECT_EQ(*reply, Value(qm::Array{Value(1), Value("two")}));
    EXPECT_TRUE(client->isValid());
}

TEST(ClientTransport, MessagesThatCannotBeSentAreRefusedAndTheConnectionStaysUsable) {
    Outcomes outcomes;
    qm::SerialQueue queue("test-refused");
    auto [client, peer] = connectedPair(queue, outcomes);
    client->send(Value("not a dictionary"), outcomes.handler(1));
    client->send(Value(qm::Dictionary{{"d", Value(qm::Bytes(qm::duct::kMaxPayloadSize, 0))}}), outcomes.handler(2));
    ASSERT_TRUE(outcomes.waitForReplies(2));
    auto notDictionary = outcomes.reply(1);
    ASSERT_FALSE(notDictionary.ok());
    EXPECT_EQ(notDictionary.error().domain, "duct");
    EXPECT_EQ(notDictionary.error().code, EINVAL);
    EXPECT_NE(notDictionary.error().text().find("not a dictionary"), std::string::npos);
    auto tooLarge = outcomes.reply(2);
    ASSERT_FALSE(tooLarge.ok());
    EXPECT_EQ(tooLarge.error().code, EMSGSIZE);
    EXPECT_NE(tooLarge.error().text().find("16 MiB"), std::string::npos);

    EXPECT_TRUE(client->isValid());
    client->send(message(3), outcomes.handler(3));
    ReceivedFrame frame = peer.readFrame();
    EXPECT_EQ(frame.body, message(3)) << "nothing of the refused messages reached the peer";
    peer.reply(frame.header.messageId, Value(qm::Dictionary{}));
    ASSERT_TRUE(outcomes.waitForReplies(3));
    EXPECT_TRUE(outcomes.reply(3).ok());
}

TEST(ClientTransport, InvalidateFailsPendingRequestsWithTheReasonAndTellsTheEventHandler) {
    Outcomes outcomes;
    qm::SerialQueue queue("test-invalidate");
    auto [client, peer] = connectedPair(queue, outcomes);
    client->send(message(1), outcomes.handler(1));
    peer.readFrame();
    client->invalidate("tired of waiting");
    ASSERT_TRUE(outcomes.waitForReplies(1));
    expectInvalidity(outcomes.reply(1), "tired of waiting");
    ASSERT_TRUE(outcomes.waitForEvents(1));
    EXPECT_EQ(outcomes.events()[0].text(), "connection invalid: tired of waiting");
}

TEST(ClientTransport, DestructionFailsPendingRequestsWithoutAnEvent) {
    Outcomes outcomes;
    qm::SerialQueue queue("test-destroy");
    auto pair = connectedPair(queue, outcomes);
    pair.client->send(message(1), outcomes.handler(1));
    pair.client->send(message(2), outcomes.handler(2));
    pair.client.reset();  // the peer is still open: the reader must be woken
    ASSERT_TRUE(outcomes.waitForReplies(2));
    expectInvalidity(outcomes.reply(1), "connection closed by the client");
    expectInvalidity(outcomes.reply(2), "connection closed by the client");
    std::this_thread::sleep_for(50ms);
    EXPECT_TRUE(outcomes.events().empty());
}

class ClientTransportByName : public ::testing::Test {
protected:
    void SetUp() override { ::setenv("QM_DUCT_DIR", scratch_.path().c_str(), 1); }
    void TearDown() override { ::unsetenv("QM_DUCT_DIR"); }

    qm::UniqueFd listen(const std::string& name) {
        qm::UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        std::string path = scratch_.file(name);
        std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
        EXPECT_EQ(::bind(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
        EXPECT_EQ(::listen(fd.get(), 4), 0);
        return fd;
    }

    qmtest::TempDir scratch_;
};

TEST_F(ClientTransportByName, ConnectsToTheServiceSocketInTheRuntimeDirectory) {
    qm::UniqueFd listener = listen("test.service");
    Outcomes outcomes;
    qm::SerialQueue queue("test-by-name");
    auto client = ClientConnection::connect("test.service", queue, outcomes.eventHandler(),
                                            ClientConnection::Options{std::chrono::milliseconds(2000)});
    ASSERT_TRUE(client.ok()) << client.error().text();
    Peer peer{qm::UniqueFd(::accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC))};
    (*client)->send(message(7), outcomes.handler(7));
    ReceivedFrame frame = peer.readFrame();
    EXPECT_EQ(frame.body, message(7));
    peer.reply(frame.header.messageId, Value(qm::Dictionary{{"ok", true}}));
    ASSERT_TRUE(outcomes.waitForReplies(1));
    EXPECT_EQ(*outcomes.reply(7), Value(qm::Dictionary{{"ok", true}}));
}

TEST_F(ClientTransportByName, AMissingServiceIsAnErrorWithTheReason) {
    qm::SerialQueue queue("test-missing");
    auto client = ClientConnection::connect("nobody.here", queue, nullptr);
    ASSERT_FALSE(client.ok());
    EXPECT_EQ(client.error().domain, "duct");
    EXPECT_EQ(client.error().code, ENOENT);
    EXPECT_NE(client.error().text().find(scratch_.file("nobody.here")), std::string::npos) << client.error().text();

    auto badName = ClientConnection::connect("a/b", queue, nullptr);
    ASSERT_FALSE(badName.ok());
    EXPECT_NE(badName.error().text().find("invalid service name"), std::string::npos);
}

}  // namespace
