// The daemon's side of a connection over socketpairs, with small budgets:
// memory follows the bytes that arrived, waiting connections resume in
// order, a stalled budget sheds its largest holder, replies too large to
// send leave the request answerable, and a peer without a fixed identity is
// never served.

#include <sys/socket.h>

#include <gtest/gtest.h>

#include <poll.h>

#include <algorithm>
#include <deque>
#include <functional>
#include <list>
#include <mutex>
#include <thread>

#include "platform/duct/CborCodec.h"
#include "platform/duct/Frame.h"
#include "platform/duct/PeerConnection.h"
#include "support/LogCapture.h"

namespace {

using namespace std::chrono_literals;
using qm::Bytes;
using qm::Value;
using qm::duct::ConnectionEvent;
using qm::duct::IncomingMessage;
using qm::duct::PeerConnection;
using qm::duct::PeerIdentity;
using qm::duct::PidfdSource;
using qm::duct::ReceiveBudget;
using qm::duct::ReceiveLimits;
using qm::duct::ReplyResult;
using Pool = ReceiveBudget::Pool;

bool eventually(const std::function<bool()>& condition, std::chrono::milliseconds timeout = 5s) {
    auto deadline = std::chrono::steady_clock::now() + timeout;
    while (!condition()) {
        if (std::chrono::steady_clock::now() > deadline) {
            return false;
        }
        std::this_thread::sleep_for(1ms);
    }
    return true;
}

Bytes header(std::uint32_t payloadLength, std::uint64_t id) {
    Bytes bytes(qm::duct::kFrameHeaderSize);
    qm::duct::writeFrameHeader(bytes.data(), {payloadLength, 1, id});
    return bytes;
}

// A request frame whose payload is about `padding` bytes long.
Bytes request(std::uint64_t id, std::size_t padding) {
    Value body(qm::Dictionary{{"n", Value(id)}, {"pad", Value(std::string(padding, 'p'))}});
    return *qm::duct::encodeFrame(qm::duct::FrameKind::message, id, body);
}

void send(int fd, const Bytes& bytes) {
    ASSERT_EQ(::send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL), static_cast<ssize_t>(bytes.size()));
}

// The next reply frame on the peer's end.
std::optional<std::pair<std::uint64_t, Value>> readReply(int fd) {
    Bytes head(qm::duct::kFrameHeaderSize);
    pollfd entry{fd, POLLIN, 0};
    if (::poll(&entry, 1, 5000) != 1 || ::recv(fd, head.data(), head.size(), MSG_WAITALL) != 16) {
        return std::nullopt;
    }
    auto frame = qm::duct::readFrameHeader(head.data());
    Bytes payload(frame.payloadLength);
    if (::recv(fd, payload.data(), payload.size(), MSG_WAITALL) != static_cast<ssize_t>(payload.size())) {
        return std::nullopt;
    }
    auto body = qm::cbor::decode(payload);
    if (!body) {
        return std::nullopt;
    }
    return std::make_pair(frame.messageId, std::move(body).value());
}

// An event loop on its own thread with one budget. Each peer is a socketpair:
// the connection owns one end, the test writes the other. Every event is
// recorded with the number of the peer it came from.
class Server {
public:
    struct Peer {
        int number;
        qm::UniqueFd end;
        std::shared_ptr<PeerConnection> connection;
    };

    explicit Server(ReceiveLimits limits = {})
        : loop_(std::move(qm::EventLoop::create()).value()),
          budget_(std::make_shared<ReceiveBudget>(*loop_, limits)),
          thread_([this] { loop_->run(); }) {}
    ~Server() {
        loop_->stop();
        thread_.join();
    }

    ReceiveBudget& budget() { return *budget_; }

    // `hangUpFirst`: the peer writes its bytes and closes before the
    // identity is taken (taken by pid, as where the kernel refuses it by socket).
    Peer& connect(const Bytes& written = {}, bool hangUpFirst = false) {
        int ends[2];
        EXPECT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
        qm::UniqueFd near(ends[0]);
        auto& peer = peers_.emplace_back(Peer{static_cast<int>(peers_.size()), qm::UniqueFd(ends[1]), nullptr});
        if (!written.empty()) {
            send(peer.end.get(), written);
        }
        if (hangUpFirst) {
            peer.end.reset();
        }
        auto identity = qm::duct::capturePeerIdentity(
            near.get(), hangUpFirst ? PidfdSource::pidfdOpen : PidfdSource::socketOption);
        peer.connection = PeerConnection::adopt(*loop_, std::move(near), std::move(identity), budget_, nullptr);
        peer.connection->setEventHandler([this, number = peer.number](ConnectionEvent&& event) {
            std::lock_guard lock(mutex_);
            if (event.kind == ConnectionEvent::Kind::message) {
                messages_.emplace_back(number, std::move(*event.message));
            } else {
                invalid_.emplace_back(number, event.reason);
            }
        });
        peer.connection->resume();
        return peer;
    }

    std::size_t messageCount() {
        std::lock_guard lock(mutex_);
        return messages_.size();
    }
    // The peer numbers of the messages so far, in the order they came.
    std::vector<int> messageSenders() {
        std::lock_guard lock(mutex_);
        std::vector<int> senders;
        for (const auto& [number, message] : messages_) {
            senders.push_back(number);
        }
        return senders;
    }
    // The first message from that peer (from any, by default).
    IncomingMessage takeMessage(int from = -1) {
        std::lock_guard lock(mutex_);
        auto it = std::find_if(messages_.begin(), messages_.end(),
                               [&](const auto& entry) { return from < 0 || entry.first == from; });
        EXPECT_NE(it, messages_.end());
        IncomingMessage message = std::move(it->second);
        messages_.erase(it);
        return message;
    }
    void dropMessages() {
        std::lock_guard lock(mutex_);
        messages_.clear();
    }
    std::optional<std::string> invalidReason(int number) {
        std::lock_guard lock(mutex_);
        for (const auto& [from, reason] : invalid_) {
            if (from == number) {
                return reason;
            }
        }
        return std::nullopt;
    }
    std::size_t invalidCount() {
        std::lock_guard lock(mutex_);
        return invalid_.size();
    }

private:
    std::unique_ptr<qm::EventLoop> loop_;
    std::shared_ptr<ReceiveBudget> budget_;
    std::thread thread_;
    std::deque<Peer> peers_;
    std::mutex mutex_;
    std::list<std::pair<int, IncomingMessage>> messages_;
    std::vector<std::pair<int, std::string>> invalid_;
};

TEST(PeerTransport, AFrameTakesMemoryAsItsBytesArriveNotAsItsHeaderAnnounces) {
    Server server;
    Bytes start = header(static_cast<std::uint32_t>(qm::duct::kMaxPayloadSize), 1);
    start.resize(start.size() + 20, 0x61);
    auto& peer = server.connect(start);
    ASSERT_TRUE(eventually([&] { return peer.connection->bufferedBytes() == 36; }));
    EXPECT_LE(peer.connection->bufferCapacity(), qm::duct::ReceiveBuffer::kInitialCapacity);
    EXPECT_EQ(server.budget().partialBytes(), 36u);
    std::size_t total = 36;
    for (std::size_t more : {4000, 60000, 150000}) {
        send(peer.end.get(), Bytes(more, 0x61));
        total += more;
        ASSERT_TRUE(eventually([&] { return peer.connection->bufferedBytes() == total; })) << total;
        EXPECT_LE(peer.connection->bufferCapacity(), 2 * total) << total;
        EXPECT_EQ(server.budget().partialBytes(), total);
    }
    peer.end.reset();
    ASSERT_TRUE(eventually([&] { return server.invalidReason(0).has_value(); }));
    EXPECT_EQ(server.budget().partialBytes(), 0u);
    EXPECT_EQ(peer.connection->bufferCapacity(), 0u);
}

TEST(PeerTransport, WaitingConnectionsResumeInOrderOnceTheStalledLargestHolderIsDropped) {
    qmtest::LogCapture log;
    Server server(ReceiveLimits{.partialBytes = 1000, .stallTimeout = 1s});
    // Holds 1116 bytes of a frame it never finishes: the pool is full.
    Bytes hoard = header(2000, 1);
    hoard.resize(hoard.size() + 1100, 0x61);
    auto& holder = server.connect(hoard);
    ASSERT_TRUE(eventually([&] { return server.budget().partialBytes() == 1116; }));

    // Each starts a frame (a connection holding nothing may always start
    // one), then must wait for the rest.
    Bytes frame = request(1, 80);
    Bytes first(frame.begin(), frame.begin() + 26);
    Bytes rest(frame.begin() + 26, frame.end());
    std::vector<Server::Peer*> waiting;
    for (int i = 0; i < 3; ++i) {
        waiting.push_back(&server.connect(first));
        ASSERT_TRUE(eventually([&] { return waiting.back()->connection->bufferedBytes() == 26; }));
    }
    const int order[] = {2, 0, 1};
    for (std::size_t k = 0; k < 3; ++k) {
        send(waiting[static_cast<std::size_t>(order[k])]->end.get(), rest);
        ASSERT_TRUE(eventually([&] { return server.budget().waiting(Pool::partial) == k + 1; }));
    }
    EXPECT_EQ(server.messageCount(), 0u);

    ASSERT_TRUE(eventually([&] { return server.messageCount() == 3; }));
    auto reason = server.invalidReason(holder.number);
    ASSERT_TRUE(reason);
    EXPECT_NE(reason->find("1116 unfinished bytes"), std::string::npos) << *reason;
    EXPECT_TRUE(log.contains("dropping <connection pid=")) << log.text();
    std::vector<int> expected;
    for (int i : order) {
        expected.push_back(waiting[static_cast<std::size_t>(i)]->number);
    }
    EXPECT_EQ(server.messageSenders(), expected);
    EXPECT_EQ(server.budget().waiting(Pool::partial), 0u);
}

// Two requests of 10 KiB: each may decode to 160 KiB, more than a 100 KiB
// pool, so the second waits until the first is answered.
Bytes twoRequests() {
    Bytes two = request(1, 10 * 1024);
    Bytes second = request(2, 10 * 1024);
    two.insert(two.end(), second.begin(), second.end());
    return two;
}

TEST(PeerTransport, ADecodedRequestWaitsUntilAnAnswerMakesRoom) {
    Server server(ReceiveLimits{.decodedBytes = 100 * 1024});
    server.connect(twoRequests());
    ASSERT_TRUE(eventually([&] { return server.messageCount() == 1 && server.budget().waiting(Pool::decoded) == 1; }));
    EXPECT_GT(server.budget().decodedBytes(), 10u * 1024);
    EXPECT_EQ(server.takeMessage().reply(Value(qm::Dictionary{})), ReplyResult::sent);
    ASSERT_TRUE(eventually([&] { return server.messageCount() == 1; }));
    EXPECT_EQ(server.budget().waiting(Pool::decoded), 0u);
    server.dropMessages();
    EXPECT_EQ(server.budget().decodedBytes(), 0u);
}

TEST(PeerTransport, WhileAConnectionWaitsOthersAreServedAndItsHangUpIsSeen) {
    struct Case {
        const char* what;
        ReceiveLimits limits;
        Pool pool;
        std::function<void(Server&)> fill;  // fills the pool
        Bytes victim;                        // makes its connection wait
    };
    Bytes hoard = header(2000, 1);
    hoard.resize(hoard.size() + 1100, 0x61);
    const Case cases[] = {
        {"partial pool", ReceiveLimits{.partialBytes = 1000, .stallTimeout = 60s}, Pool::partial,
         [&](Server& server) { server.connect(hoard); }, request(1, 5000)},
        {"decoded pool", ReceiveLimits{.decodedBytes = 100 * 1024}, Pool::decoded, [](Server&) {}, twoRequests()},
    };
    for (const auto& c : cases) {
        Server server(c.limits);
        c.fill(server);
        auto& victim = server.connect(c.victim);
        ASSERT_TRUE(eventually([&] { return server.budget().waiting(c.pool) == 1; })) << c.what;
        // A connection holding nothing and with nothing in flight is admitted.
        auto& bystander = server.connect(request(9, 10));
        ASSERT_TRUE(eventually([&] {
            auto senders = server.messageSenders();
            return std::find(senders.begin(), senders.end(), bystander.number) != senders.end();
        })) << c.what;
        EXPECT_EQ(server.takeMessage(bystander.number).reply(Value(qm::Dictionary{})), ReplyResult::sent);
        auto reply = readReply(bystander.end.get());
        ASSERT_TRUE(reply) << c.what;
        EXPECT_EQ(reply->first, 9u) << c.what;
        // Only half closed: nothing but EPOLLRDHUP tells.
        ::shutdown(victim.end.get(), SHUT_WR);
        ASSERT_TRUE(eventually([&] { return server.invalidReason(victim.number).has_value(); })) << c.what;
        EXPECT_EQ(*server.invalidReason(victim.number), "peer hung up") << c.what;
    }
}

TEST(PeerTransport, AReplyTooLargeToSendLeavesTheRequestForASmallerOne) {
    Server server;
    auto& peer = server.connect(request(7, 10));
    ASSERT_TRUE(eventually([&] { return server.messageCount() == 1; }));
    IncomingMessage message = server.takeMessage();
    Value huge(qm::Dictionary{{"blob", Value(Bytes(qm::duct::kMaxPayloadSize))}});
    EXPECT_EQ(message.reply(huge), ReplyResult::tooLarge);
    EXPECT_FALSE(message.replied());
    EXPECT_TRUE(peer.connection->isValid());
    EXPECT_EQ(message.reply(Value(qm::Dictionary{{"errorcode", 4}})), ReplyResult::sent);
    auto reply = readReply(peer.end.get());
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->first, 7u);
    EXPECT_EQ(reply->second, Value(qm::Dictionary{{"errorcode", 4}}));
}

TEST(PeerTransport, IdentityIsFixedAtAcceptOrNotAtAll) {
    struct Case {
        PidfdSource source;
        bool hungUp;
        bool identified;
    };
    const Case cases[] = {
        {PidfdSource::socketOption, false, true},
        {PidfdSource::socketOption, true, true},  // the kernel pinned the process when it connected
        {PidfdSource::pidfdOpen, false, true},
        {PidfdSource::pidfdOpen, true, false},  // its pid may name another process by now
    };
    for (const auto& c : cases) {
        int ends[2];
        ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
        qm::UniqueFd near(ends[0]);
        qm::UniqueFd far(ends[1]);
        if (c.hungUp) {
            far.reset();
        }
        auto identity = qm::duct::capturePeerIdentity(near.get(), c.source);
        SCOPED_TRACE(std::string(c.source == PidfdSource::pidfdOpen ? "pidfd_open" : "SO_PEERPIDFD") +
                     (c.hungUp ? ", hung up" : ""));
        ASSERT_EQ(identity.has_value(), c.identified);
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
    ASSERT_TRUE(eventually([&] { return server.invalidCount() == 1; }));
    std::this_thread::sleep_for(50ms);  // nothing else may follow
    EXPECT_EQ(server.messageCount(), 0u);
    EXPECT_EQ(server.invalidCount(), 1u);
    EXPECT_EQ(peer.connection->pid(), ::getpid());
}

}  // namespace
