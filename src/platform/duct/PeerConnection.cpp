#include "platform/duct/PeerConnection.h"

#include <sys/socket.h>

#include <cerrno>
#include <cstring>

#include "platform/duct/CborCodec.h"
#include "platform/duct/Frame.h"
#include "platform/process/ProcessInfo.h"
#include "platform/text/Format.h"

namespace qm::duct {

namespace {

// Debian 12's headers lack it; kernels from 6.5 answer it.
constexpr int kSoPeerPidfd = 77;

constexpr std::size_t kInitialReadBuffer = 64 * 1024;
constexpr std::size_t kMaxReadPerTurn = 256 * 1024;  // then other connections get their turn

UniqueFd peerPidfd(int socket, pid_t pid) {
    int pidfd = -1;
    socklen_t length = sizeof pidfd;
    if (::getsockopt(socket, SOL_SOCKET, kSoPeerPidfd, &pidfd, &length) == 0 && pidfd >= 0) {
        return UniqueFd(pidfd);
    }
    return openPidfd(pid);
}

}  // namespace

// ---- IncomingMessage

IncomingMessage::IncomingMessage(std::weak_ptr<PeerConnection> connection, std::uint64_t id, Value body)
    : connection_(std::move(connection)), id_(id), body_(std::move(body)) {}

IncomingMessage::IncomingMessage(IncomingMessage&& other) noexcept
    : connection_(std::move(other.connection_)), id_(other.id_), body_(std::move(other.body_)),
      answered_(std::exchange(other.answered_, true)) {}

IncomingMessage::~IncomingMessage() {
    if (answered_) {
        return;
    }
    if (auto connection = connection_.lock()) {
        connection->releaseRequestSlot();
    }
}

bool IncomingMessage::reply(const Value& reply) {
    if (answered_) {
        return false;
    }
    answered_ = true;
    auto connection = connection_.lock();
    return connection && connection->sendReply(id_, reply);
}

// ---- PeerConnection

std::shared_ptr<PeerConnection> PeerConnection::adopt(EventLoop& loop, UniqueFd socket,
                                                      std::function<void()> onClosed) {
    return std::shared_ptr<PeerConnection>(new PeerConnection(loop, std::move(socket), std::move(onClosed)));
}

PeerConnection::PeerConnection(EventLoop& loop, UniqueFd socket, std::function<void()> onClosed)
    : loop_(loop), socket_(std::move(socket)), onClosed_(std::move(onClosed)) {
    ucred cred{};
    socklen_t length = sizeof cred;
    if (::getsockopt(socket_.get(), SOL_SOCKET, SO_PEERCRED, &cred, &length) == 0) {
        credentials_ = PeerCredentials{cred.pid, cred.uid, cred.gid};
    }
    pidfd_ = peerPidfd(socket_.get(), credentials_.pid);
}

PeerConnection::~PeerConnection() = default;

pid_t PeerConnection::pid() const noexcept {
    return credentials_.pid;
}

std::optional<std::string> PeerConnection::peerExecutablePath() const {
    auto path = executablePathOfProcess(credentials_.pid);
    // Read the path first, then check that the process we accepted still
    // lives: otherwise the pid may already name somebody else.
    if (!path || (pidfd_.valid() && !pidfdProcessAlive(pidfd_.get()))) {
        return std::nullopt;
    }
    return path;
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
    readBuffer_.resize(kInitialReadBuffer);
    auto id = loop_.add(socket_.get(), EPOLLIN | EPOLLRDHUP, shared_from_this());
    if (!id) {
        ::shutdown(socket_.get(), SHUT_RDWR);
        loop_.post([weak = weak_from_this(), reason = id.error().text()] {
            if (auto self = weak.lock()) {
                self->closeNow(reason);
            }
        });
        return;
    }
    registration_ = *id;
    registered_ = true;
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
    return format("<connection pid=%d uid=%u%s>", credentials_.pid, credentials_.uid,
                  closed_.load() ? " closed" : "");
}

void PeerConnection::handleEvents(std::uint32_t events) {
    if (closed_.load()) {
        return;
    }
    if (events & EPOLLOUT) {
        flushBacklog();
    }
    bool hungUp = (events & (EPOLLHUP | EPOLLERR)) != 0;
    if (events & (EPOLLIN | EPOLLRDHUP | EPOLLHUP)) {
        readAvailable(hungUp);
    }
    deliverFrames();
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

void PeerConnection::readAvailable(bool& hungUp) {
    {
        std::lock_guard lock(writeMutex_);
        if (readingPaused_) {
            return;
        }
    }
    std::size_t readThisTurn = 0;
    while (readThisTurn < kMaxReadPerTurn) {
        if (readStart_ == readEnd_) {
            readStart_ = readEnd_ = 0;
        }
        if (readEnd_ == readBuffer_.size()) {
            if (readStart_ > 0) {
                std::memmove(readBuffer_.data(), readBuffer_.data() + readStart_, readEnd_ - readStart_);
                readEnd_ -= readStart_;
                readStart_ = 0;
            } else {
                break;  // full of one partial frame: deliverFrames() grows it to the frame's size
            }
        }
        ssize_t n = ::recv(socket_.get(), readBuffer_.data() + readEnd_, readBuffer_.size() - readEnd_, MSG_DONTWAIT);
        if (n > 0) {
            std::size_t room = readBuffer_.size() - readEnd_;
            readEnd_ += static_cast<std::size_t>(n);
            readThisTurn += static_cast<std::size_t>(n);
            if (static_cast<std::size_t>(n) < room) {
                break;  // drained for now; level-triggered epoll calls again if more comes
            }
            continue;
        }
        if (n == 0) {
            hungUp = true;
        } else if (errno != EAGAIN && errno != EWOULDBLOCK && errno != EINTR) {
            hungUp = true;
        }
        break;
    }
}

void PeerConnection::deliverFrames() {
    while (!closed_.load()) {
        std::size_t available = readEnd_ - readStart_;
        if (available < kFrameHeaderSize) {
            break;
        }
        FrameHeader header = readFrameHeader(readBuffer_.data() + readStart_);
        if (header.payloadLength > kMaxPayloadSize) {
            closeNow(format("frame announces %u bytes, over the 16 MiB limit", header.payloadLength));
            return;
        }
        if (header.kind != static_cast<std::uint32_t>(FrameKind::message)) {
            closeNow(format("frame of kind %u from a client", header.kind));
            return;
        }
        std::size_t frameSize = kFrameHeaderSize + header.payloadLength;
        if (available < frameSize) {
            if (readBuffer_.size() - readStart_ < frameSize) {
                std::memmove(readBuffer_.data(), readBuffer_.data() + readStart_, available);
                readStart_ = 0;
                readEnd_ = available;
                if (readBuffer_.size() < frameSize) {
                    readBuffer_.resize(frameSize);
                }
            }
            break;
        }
        if (unanswered_.load() >= kMaxUnansweredRequests) {
            std::lock_guard lock(writeMutex_);
            readingPaused_ = true;
            updateInterestLocked();
            break;
        }
        auto decoded = cbor::decode({readBuffer_.data() + readStart_ + kFrameHeaderSize, header.payloadLength});
        if (!decoded) {
            closeNow("invalid payload: " + decoded.error().text());
            return;
        }
        readStart_ += frameSize;
        unanswered_.fetch_add(1);
        if (handler_) {
            handler_(ConnectionEvent{ConnectionEvent::Kind::message,
                                     IncomingMessage(weak_from_this(), header.messageId, std::move(decoded).value()),
                                     {}});
        }
    }
    if (readStart_ == readEnd_) {
        readStart_ = readEnd_ = 0;
        if (readBuffer_.size() > 4 * kInitialReadBuffer) {
            Bytes(kInitialReadBuffer).swap(readBuffer_);  // give back what a big frame took
        }
    }
}

bool PeerConnection::sendReply(std::uint64_t id, const Value& reply) {
    auto frame = encodeFrame(FrameKind::reply, id, reply);
    bool sent = false;
    {
        std::lock_guard lock(writeMutex_);
        if (!frame) {
            if (!closed_.load()) {
                pendingInvalidReason_ = "reply over the 16 MiB limit";
                ::shutdown(socket_.get(), SHUT_RDWR);
            }
        } else if (!closed_.load()) {
            sent = true;
            if (backlog_.empty()) {
                ssize_t n = ::send(socket_.get(), frame->data(), frame->size(), MSG_DONTWAIT | MSG_NOSIGNAL);
                if (n < 0 && errno != EAGAIN && errno != EWOULDBLOCK && errno != EINTR) {
                    ::shutdown(socket_.get(), SHUT_RDWR);  // the peer is gone; the loop reports it
                } else if (n < 0 || static_cast<std::size_t>(n) < frame->size()) {
                    frontWritten_ = n < 0 ? 0 : static_cast<std::size_t>(n);
                    backlog_.push_back(std::move(*frame));
                    updateInterestLocked();
                }
            } else if (backlogBytes_ + frame->size() > kMaxReplyBacklog) {
                pendingInvalidReason_ = "reply backlog over 4 MiB: the client does not read";
                ::shutdown(socket_.get(), SHUT_RDWR);
                sent = false;
            } else {
                backlogBytes_ += frame->size();
                backlog_.push_back(std::move(*frame));
            }
        }
    }
    releaseRequestSlot();
    return sent;
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
        }
    }
    updateInterestLocked();
}

void PeerConnection::releaseRequestSlot() {
    if (unanswered_.fetch_sub(1) != kMaxUnansweredRequests) {
        return;
    }
    loop_.post([weak = weak_from_this()] {
        auto self = weak.lock();
        if (!self || self->closed_.load()) {
            return;
        }
        self->deliverFrames();
        if (self->closed_.load() || self->unanswered_.load() >= kMaxUnansweredRequests) {
            return;
        }
        std::lock_guard lock(self->writeMutex_);
        self->readingPaused_ = false;
        self->updateInterestLocked();
    });
}

void PeerConnection::updateInterestLocked() {
    if (!registered_ || closed_.load()) {
        return;
    }
    std::uint32_t events = EPOLLRDHUP;
    if (!readingPaused_) {
        events |= EPOLLIN;
    }
    if (!backlog_.empty()) {
        events |= EPOLLOUT;
    }
    (void)loop_.modify(registration_, socket_.get(), events);
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
        backlog_.clear();
    }
    EventHandler handler = std::move(handler_);
    handler_ = nullptr;
    if (handler) {
        handler(ConnectionEvent{ConnectionEvent::Kind::invalid, std::nullopt, reason});
    }
    context_.reset();
    Bytes().swap(readBuffer_);
    readStart_ = readEnd_ = 0;
    if (onClosed_) {
        onClosed_();
    }
}

}  // namespace qm::duct
