#include "platform/duct/PeerConnection.h"

#include <sys/socket.h>

#include <algorithm>
#include <cassert>
#include <cerrno>

#include "platform/duct/CborCodec.h"
#include "platform/duct/Frame.h"
#include "platform/text/Format.h"

namespace qm::duct {

namespace {

constexpr std::size_t kMaxReadPerTurn = 256 * 1024;  // then other connections get their turn
// Storage an idle connection keeps; what a bigger frame took is given back.
constexpr std::size_t kKeptBufferCapacity = 64 * 1024;
// A thread's reply buffer keeps no more than this between replies.
constexpr std::size_t kKeptReplyBufferCapacity = 64 * 1024;

ucred socketCredentials(int socket) {
    ucred credentials{};
    socklen_t length = sizeof credentials;
    if (::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0) {
        return ucred{};
    }
    return credentials;
}

}  // namespace

// ---- IncomingMessage

IncomingMessage::IncomingMessage(std::weak_ptr<PeerConnection> connection, std::uint64_t id, Value body,
                                 std::shared_ptr<ReceiveBudget> budget, std::size_t decodedBytes)
    : connection_(std::move(connection)), id_(id), body_(std::move(body)), budget_(std::move(budget)),
      decodedBytes_(decodedBytes) {}

IncomingMessage::IncomingMessage(IncomingMessage&& other) noexcept
    : connection_(std::move(other.connection_)), id_(other.id_), body_(std::move(other.body_)),
      budget_(std::move(other.budget_)), decodedBytes_(std::exchange(other.decodedBytes_, 0)),
      answered_(std::exchange(other.answered_, true)) {}

IncomingMessage::~IncomingMessage() {
    if (!answered_) {
        finish();
    }
}

ReplyResult IncomingMessage::reply(const Value& reply) {
    assert(!answered_ && "a message is answered once");
    auto connection = connection_.lock();
    if (!connection || !connection->isValid()) {
        finish();
        return ReplyResult::connectionGone;
    }
    // Replies are encoded into one buffer per thread: a reply the socket takes
    // whole costs no allocation; one that must wait takes the buffer along.
    thread_local Bytes frame;
    if (!encodeFrameInto(frame, FrameKind::reply, id_, reply)) {
        Bytes().swap(frame);
        return ReplyResult::tooLarge;  // still unanswered: the caller may send a smaller reply
    }
    ReplyResult result = connection->sendFrame(frame);
    if (frame.capacity() > kKeptReplyBufferCapacity) {
        Bytes().swap(frame);
    }
    finish();
    return result;
}

void IncomingMessage::finish() {
    answered_ = true;
    if (auto connection = connection_.lock()) {
        connection->releaseRequestSlot();
    }
    if (budget_) {
        budget_->releaseDecoded(std::exchange(decodedBytes_, 0));
    }
}

// ---- PeerConnection

std::shared_ptr<PeerConnection> PeerConnection::adopt(EventLoop& loop, UniqueFd socket,
                                                      std::optional<PeerIdentity> identity,
                                                      std::shared_ptr<ReceiveBudget> budget,
                                                      std::function<void()> onClosed) {
    assert(budget);
    return std::shared_ptr<PeerConnection>(
        new PeerConnection(loop, std::move(socket), std::move(identity), std::move(budget), std::move(onClosed)));
}

PeerConnection::PeerConnection(EventLoop& loop, UniqueFd socket, std::optional<PeerIdentity> identity,
                               std::shared_ptr<ReceiveBudget> budget, std::function<void()> onClosed)
    : loop_(loop), socket_(std::move(socket)), identity_(std::move(identity)),
      pid_(identity_ ? identity_->pid : socketCredentials(socket_.get()).pid),
      uid_(identity_ ? identity_->uid : socketCredentials(socket_.get()).uid), budget_(std::move(budget)),
      onClosed_(std::move(onClosed)) {}

PeerConnection::~PeerConnection() {
    // Closed connections hold nothing; this is for one its stopped loop dropped unclosed.
    if (!frames_.empty()) {
        budget_->forget(*this, frames_.size());
    }
}

std::optional<std::string> PeerConnection::peerExecutablePath() const {
    return identity_ ? identity_->executablePath : std::nullopt;
}

void PeerConnection::setEventHandler(EventHandler handler) {
    handler_ = std::move(handler);
}

void PeerConnection::setContext(std::shared_ptr<void> context) {
    context_ = std::move(context);
}

void PeerConnection::resume() {
    std::lock_guard lock(writeMutex_);
    if (closed_.load() || registered_) {
        return;
    }
    std::string failure;
    if (!identity_) {
        // Its frames, already buffered or not, are never read.
        failure = "peer hung up before its identity could be fixed";
    } else if (auto id = loop_.add(socket_.get(), EPOLLIN | EPOLLRDHUP, shared_from_this())) {
        registration_ = *id;
        registered_ = true;
        return;
    } else {
        failure = id.error().text();
    }
    ::shutdown(socket_.get(), SHUT_RDWR);
    loop_.post([weak = weak_from_this(), failure] {
        if (auto self = weak.lock()) {
            self->closeNow(failure);
        }
    });
}

void PeerConnection::invalidate(const std::string& reason) {
    std::lock_guard lock(writeMutex_);
    if (closed_.load()) {
        return;
    }
    if (pendingInvalidReason_.empty()) {
        pendingInvalidReason_ = reason;
    }
    // The loop sees the hang-up and closes; one place does all the cleanup.
    ::shutdown(socket_.get(), SHUT_RDWR);
}

std::string PeerConnection::description() const {
    return format("<connection pid=%d uid=%u%s>", pid_, uid_, closed_.load() ? " closed" : "");
}

void PeerConnection::handleEvents(std::uint32_t events) {
    if (closed_.load()) {
        return;
    }
    if (events & EPOLLOUT) {
        flushBacklog();
    }
    bool hungUp = (events & (EPOLLHUP | EPOLLERR)) != 0;
    // While it waits, only a hang-up or room in the backlog brings it here.
    if ((events & (EPOLLIN | EPOLLRDHUP | EPOLLHUP)) && waitingFor_.load() == Wait::none) {
        waitFor(receive(hungUp));
    }
    if (closed_.load()) {
        return;
    }
    if (hungUp || (events & EPOLLRDHUP)) {
        std::string reason;
        {
            std::lock_guard lock(writeMutex_);
            reason = pendingInvalidReason_.empty() ? "peer hung up" : pendingInvalidReason_;
        }
        closeNow(reason);
    }
}

// Delivers what is complete and reads what the budget allows, until the
// socket is drained, this turn's share is read, or the connection must wait.
PeerConnection::Wait PeerConnection::receive(bool& hungUp) {
    std::size_t readThisTurn = 0;
    while (true) {
        Wait wait = deliverFrames();
        if (closed_.load() || wait != Wait::none || readThisTurn >= kMaxReadPerTurn) {
            return wait;
        }
        std::size_t allowance = budget_->receiveAllowance(frames_.size());
        if (allowance == 0) {
            return Wait::partialBudget;
        }
        auto room = frames_.room();
        assert(!room.empty() && "a complete frame is delivered or waited for before reading on");
        bufferCapacity_.store(frames_.capacity());
        std::size_t wanted = std::min({room.size(), allowance, kMaxReadPerTurn - readThisTurn});
        ssize_t n = ::recv(socket_.get(), room.data(), wanted, MSG_DONTWAIT);
        if (n > 0) {
            auto count = static_cast<std::size_t>(n);
            frames_.commit(count);
            budget_->chargePartial(shared_from_this(), count);
            bufferedBytes_.store(frames_.size());
            readThisTurn += count;
            if (count < wanted) {
                return deliverFrames();  // drained for now; level-triggered epoll calls again if more comes
            }
            continue;
        }
        if (n == 0 || (errno != EAGAIN && errno != EWOULDBLOCK && errno != EINTR)) {
            hungUp = true;
        }
        return Wait::none;
    }
}

PeerConnection::Wait PeerConnection::deliverFrames() {
    while (!closed_.load()) {
        IncomingFrames::Front frame = frames_.front();
        if (frame.state == IncomingFrames::Front::State::invalid) {
            closeNow(frame.problem);
            return Wait::none;
        }
        if (frame.state == IncomingFrames::Front::State::incomplete) {
            return Wait::none;
        }
        int inFlight = unanswered_.load();
        if (inFlight >= kMaxUnansweredRequests) {
            return Wait::unanswered;
        }
        if (!budget_->mayDecode(frame.header.payloadLength, inFlight == 0)) {
            return Wait::decodedBudget;
        }
        auto decoded = cbor::decodeMeasured(frame.payload);
        if (!decoded) {
            closeNow("invalid payload: " + decoded.error().text());
            return Wait::none;
        }
        consumeBuffered(frame.frameSize(), true);
        budget_->chargeDecoded(decoded->allocatedBytes);
        unanswered_.fetch_add(1);
        IncomingMessage message(weak_from_this(), frame.header.messageId, std::move(decoded->value), budget_,
                                decoded->allocatedBytes);
        if (handler_) {
            handler_(ConnectionEvent{ConnectionEvent::Kind::message, std::move(message), {}});
        }
    }
    return Wait::none;
}

void PeerConnection::consumeBuffered(std::size_t count, bool frameCompleted) {
    frames_.consume(count);
    budget_->releasePartial(count, frameCompleted);
    if (frames_.empty() && frames_.capacity() > kKeptBufferCapacity) {
        frames_.release();
    }
    bufferedBytes_.store(frames_.size());
    bufferCapacity_.store(frames_.capacity());
}

void PeerConnection::waitFor(Wait wait) {
    if (closed_.load()) {
        return;
    }
    waitingFor_.store(wait);
    {
        std::lock_guard lock(writeMutex_);
        if (readingPaused_ != (wait != Wait::none)) {
            readingPaused_ = wait != Wait::none;
            updateInterestLocked();
        }
    }
    switch (wait) {
        case Wait::none: return;
        case Wait::unanswered:
            // An answer between the check and now found nobody waiting.
            if (unanswered_.load() < kMaxUnansweredRequests) {
                postResumeAfterAnswer();
            }
            return;
        case Wait::partialBudget: budget_->wait(ReceiveBudget::Pool::partial, shared_from_this()); return;
        case Wait::decodedBudget: budget_->wait(ReceiveBudget::Pool::decoded, shared_from_this()); return;
    }
}

void PeerConnection::resumeReceiving() {
    if (closed_.load()) {
        return;
    }
    bool hungUp = false;
    waitFor(receive(hungUp));
    if (hungUp && !closed_.load()) {
        std::string reason;
        {
            std::lock_guard lock(writeMutex_);
            reason = pendingInvalidReason_.empty() ? "peer hung up" : pendingInvalidReason_;
        }
        closeNow(reason);
    }
}

ReplyResult PeerConnection::sendFrame(Bytes& frame) {
    std::lock_guard lock(writeMutex_);
    if (closed_.load()) {
        return ReplyResult::connectionGone;
    }
    if (!backlog_.empty()) {
        if (backlogBytes_ + frame.size() > kMaxReplyBacklog) {
            pendingInvalidReason_ = "reply backlog over 4 MiB: the client does not read";
            ::shutdown(socket_.get(), SHUT_RDWR);
            return ReplyResult::connectionGone;
        }
        backlogBytes_ += frame.size();
        backlog_.push_back(std::move(frame));
        return ReplyResult::sent;
    }
    ssize_t n = ::send(socket_.get(), frame.data(), frame.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
    if (n < 0 && errno != EAGAIN && errno != EWOULDBLOCK && errno != EINTR) {
        ::shutdown(socket_.get(), SHUT_RDWR);  // the peer is gone; the loop reports it
        return ReplyResult::connectionGone;
    }
    if (n < 0 || static_cast<std::size_t>(n) < frame.size()) {
        frontWritten_ = n < 0 ? 0 : static_cast<std::size_t>(n);
        backlog_.push_back(std::move(frame));
        connectionsWithUnsentReplies_.fetch_add(1);
        updateInterestLocked();
    }
    return ReplyResult::sent;
}

std::atomic<std::size_t> PeerConnection::connectionsWithUnsentReplies_{0};

std::size_t PeerConnection::connectionsWithUnsentReplies() noexcept {
    return connectionsWithUnsentReplies_.load();
}

void PeerConnection::flushBacklog() {
    std::lock_guard lock(writeMutex_);
    while (!backlog_.empty() && !closed_.load()) {
        Bytes& front = backlog_.front();
        ssize_t n = ::send(socket_.get(), front.data() + frontWritten_, front.size() - frontWritten_,
                           MSG_DONTWAIT | MSG_NOSIGNAL);
        if (n < 0) {
            if (errno != EAGAIN && errno != EWOULDBLOCK && errno != EINTR) {
                ::shutdown(socket_.get(), SHUT_RDWR);
            }
            break;
        }
        frontWritten_ += static_cast<std::size_t>(n);
        if (frontWritten_ < front.size()) {
            break;
        }
        backlog_.pop_front();
        frontWritten_ = 0;
        if (!backlog_.empty()) {
            backlogBytes_ -= backlog_.front().size();
        } else {
            connectionsWithUnsentReplies_.fetch_sub(1);
        }
    }
    updateInterestLocked();
}

void PeerConnection::releaseRequestSlot() {
    // Sequentially consistent with waitFor(): either this sees the wait, or
    // the waiter sees this answer.
    if (unanswered_.fetch_sub(1) == kMaxUnansweredRequests && waitingFor_.load() == Wait::unanswered) {
        postResumeAfterAnswer();
    }
}

void PeerConnection::postResumeAfterAnswer() {
    loop_.post([weak = weak_from_this()] {
        auto self = weak.lock();
        if (self && self->waitingFor_.load() == Wait::unanswered) {
            self->resumeReceiving();
        }
    });
}

void PeerConnection::updateInterestLocked() {
    if (!registered_ || closed_.load()) {
        return;
    }
    std::uint32_t events = EPOLLRDHUP;  // always: hang-ups are seen even while reading waits
    if (!readingPaused_) {
        events |= EPOLLIN;
    }
    if (!backlog_.empty()) {
        events |= EPOLLOUT;
    }
    if (auto error = loop_.modify(registration_, socket_.get(), events)) {
        // Without the events it asked for, the connection could wait forever.
        if (pendingInvalidReason_.empty()) {
            pendingInvalidReason_ = "cannot change the connection's events: " + error->text();
        }
        ::shutdown(socket_.get(), SHUT_RDWR);
        loop_.post([weak = weak_from_this(), reason = pendingInvalidReason_] {
            if (auto self = weak.lock()) {
                self->closeNow(reason);
            }
        });
    }
}

void PeerConnection::closeNow(const std::string& reason) {
    {
        std::lock_guard lock(writeMutex_);
        if (closed_.exchange(true)) {
            return;
        }
        if (registered_) {
            loop_.remove(registration_, socket_.get());
            registered_ = false;
        }
        socket_.reset();
        if (!backlog_.empty()) {
            connectionsWithUnsentReplies_.fetch_sub(1);
            backlog_.clear();
        }
    }
    EventHandler handler = std::move(handler_);
    handler_ = nullptr;
    if (handler) {
        handler(ConnectionEvent{ConnectionEvent::Kind::invalid, std::nullopt, reason});
    }
    context_.reset();
    if (!frames_.empty()) {
        consumeBuffered(frames_.size(), false);
    }
    budget_->leave(*this);
    frames_.release();
    bufferCapacity_.store(0);
    if (onClosed_) {
        onClosed_();
    }
}

}  // namespace qm::duct
