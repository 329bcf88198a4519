#pragma once
// The daemon's side of the transport in process, for the transport's tests:
// an event loop on its own thread with one receive budget, and connections
// adopted over socketpairs, whose other ends the test holds. Every event is
// recorded with the number of its connection, in the order they came.

#include <gtest/gtest.h>
#include <sys/socket.h>

#include <algorithm>
#include <deque>
#include <list>
#include <mutex>
#include <thread>

#include "platform/duct/PeerConnection.h"
#include "support/Eventually.h"
#include "support/FramePeer.h"

namespace qmtest {

class TransportServer {
public:
    struct Peer {
        int number;
        FramePeer end;  // the test's end
        std::shared_ptr<qm::duct::PeerConnection> connection;
    };

    explicit TransportServer(qm::duct::ReceiveLimits limits = {})
        : budget_(std::make_shared<qm::duct::ReceiveBudget>(*loop_, limits)), thread_([this] { loop_->run(); }) {}
    ~TransportServer() {
        loop_->stop();
        thread_.join();
    }

    qm::duct::ReceiveBudget& budget() { return *budget_; }

    // A connection whose peer has written `written` already; with
    // `hangUpFirst` the peer closes before its identity is taken (taken by
    // pid then, as where the kernel refuses it by socket).
    Peer& connect(const qm::Bytes& written = {}, bool hangUpFirst = false) {
        int ends[2];
        EXPECT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
        qm::UniqueFd near(ends[0]);
        FramePeer far(qm::UniqueFd{ends[1]});
        EXPECT_TRUE(written.empty() || far.sendBytes(written));
        if (hangUpFirst) {
            far.close();
        }
        auto identity = qm::duct::capturePeerIdentity(
            near.get(), hangUpFirst ? qm::duct::PidfdSource::pidfdOpen : qm::duct::PidfdSource::socketOption);
        auto connection = qm::duct::PeerConnection::adopt(*loop_, std::move(near), std::move(identity), budget_, nullptr);
        std::lock_guard held(mutex_);
        int number = static_cast<int>(peers_.size());
        connection->setEventHandler([this, number](qm::duct::ConnectionEvent&& event) {
            std::lock_guard lock(mutex_);
            if (event.kind == qm::duct::ConnectionEvent::Kind::message) {
                messages_.emplace_back(number, std::move(*event.message));
            } else {
                invalid_.emplace_back(number, event.reason);
            }
        });
        connection->resume();
        return peers_.emplace_back(Peer{number, std::move(far), connection});
    }

    std::size_t messageCount() {
        std::lock_guard lock(mutex_);
        return messages_.size();
    }
    bool waitForMessages(std::size_t count, std::chrono::milliseconds timeout = std::chrono::seconds(5)) {
        return eventually([&] { return messageCount() >= count; }, timeout);
    }
    // The connection numbers of the unanswered messages, in the order they came.
    std::vector<int> messageSenders() {
        std::lock_guard lock(mutex_);
        std::vector<int> senders;
        std::transform(messages_.begin(), messages_.end(), std::back_inserter(senders), [](auto& m) { return m.first; });
        return senders;
    }
    // The first message from that connection (from any, by default).
    qm::duct::IncomingMessage takeMessage(int from = -1) {
        std::lock_guard lock(mutex_);
        auto it = std::find_if(messages_.begin(), messages_.end(), [&](auto& m) { return from < 0 || m.first == from; });
        EXPECT_NE(it, messages_.end());
        qm::duct::IncomingMessage message = std::move(it->second);
        messages_.erase(it);
        return message;
    }
    std::size_t invalidCount() {
        std::lock_guard lock(mutex_);
        return invalid_.size();
    }
    // Why that connection ended, once it has (within five seconds).
    std::optional<std::string> invalidReason(int number) {
        std::optional<std::string> reason;
        eventually([&] {
            std::lock_guard lock(mutex_);
            auto it = std::find_if(invalid_.begin(), invalid_.end(), [&](auto& entry) { return entry.first == number; });
            reason = it == invalid_.end() ? std::nullopt : std::optional(it->second);
            return reason.has_value();
        });
        return reason;
    }

private:
    std::unique_ptr<qm::EventLoop> loop_ = std::move(qm::EventLoop::create()).value();
    std::shared_ptr<qm::duct::ReceiveBudget> budget_;
    std::mutex mutex_;
    std::deque<Peer> peers_;
    std::list<std::pair<int, qm::duct::IncomingMessage>> messages_;
    std::vector<std::pair<int, std::string>> invalid_;
    std::thread thread_;
};

}  // namespace qmtest
