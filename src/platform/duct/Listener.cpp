#include "platform/duct/Listener.h"

#include <sys/socket.h>
#include <sys/un.h>

#include <fcntl.h>

#include <cerrno>
#include <cstddef>
#include <cstring>

#include "platform/env/Environment.h"
#include "platform/log/SystemLog.h"

namespace qm::duct {

namespace {

constexpr int kMaxAcceptsPerTurn = 64;

bool isListeningStreamSocket(int fd) {
    int accepting = 0;
    socklen_t length = sizeof accepting;
    int type = 0;
    socklen_t typeLength = sizeof type;
    return ::getsockopt(fd, SOL_SOCKET, SO_ACCEPTCONN, &accepting, &length) == 0 && accepting &&
           ::getsockopt(fd, SOL_SOCKET, SO_TYPE, &type, &typeLength) == 0 && type == SOCK_STREAM;
}

std::string boundPath(int fd) {
    sockaddr_un address{};
    socklen_t length = sizeof address;
    if (::getsockname(fd, reinterpret_cast<sockaddr*>(&address), &length) != 0 || address.sun_family != AF_UNIX ||
        length <= offsetof(sockaddr_un, sun_path)) {
        return {};
    }
    return std::string(address.sun_path, ::strnlen(address.sun_path, length - offsetof(sockaddr_un, sun_path)));
}

}  // namespace

Result<std::shared_ptr<Listener>> Listener::create(EventLoop& loop, const std::string& serviceName,
                                                   SerialQueue& eventQueue, std::shared_ptr<ReceiveBudget> budget) {
    if (auto path = serviceSocketPath(serviceName); !path) {
        return path.error();
    }
    if (!budget) {
        budget = std::make_shared<ReceiveBudget>(loop);
    }
    auto activated = takeSocketActivationDescriptors();
    if (!activated.empty()) {
        // The service manager made the folder; it must still be ours alone.
        if (auto directory = prepareRuntimeDirectory(); !directory) {
            for (int fd : activated) {
                ::close(fd);
            }
            return directory.error();
        }
        UniqueFd socket(activated.front());
        for (std::size_t i = 1; i < activated.size(); ++i) {
            ::close(activated[i]);  // one service, one socket
        }
        if (!isListeningStreamSocket(socket.get())) {
            return Error{kDuctErrorDomain, EBADF, "the socket passed by the service manager is not a listening stream socket"};
        }
        int flags = ::fcntl(socket.get(), F_GETFL);
        ::fcntl(socket.get(), F_SETFL, flags | O_NONBLOCK);
        ::fcntl(socket.get(), F_SETFD, FD_CLOEXEC);
        std::string path = boundPath(socket.get());
        return std::shared_ptr<Listener>(new Listener(loop, serviceName, eventQueue, std::move(socket), UniqueFd(),
                                                      std::move(path), false, std::move(budget)));
    }
    auto claimed = openServiceSocket(serviceName);
    if (!claimed) {
        return claimed.error();
    }
    return std::shared_ptr<Listener>(new Listener(loop, serviceName, eventQueue, std::move(claimed->listener),
                                                  std::move(claimed->lock), std::move(claimed->path), true,
                                                  std::move(budget)));
}

Listener::Listener(EventLoop& loop, std::string serviceName, SerialQueue& eventQueue, UniqueFd socket, UniqueFd lock,
                   std::string socketPath, bool boundHere, std::shared_ptr<ReceiveBudget> budget)
    : loop_(loop), serviceName_(std::move(serviceName)), eventQueue_(eventQueue), socket_(std::move(socket)),
      lock_(std::move(lock)), socketPath_(std::move(socketPath)), boundHere_(boundHere), budget_(std::move(budget)) {}

Listener::~Listener() = default;

void Listener::setConnectionHandler(ConnectionHandler handler) {
    handler_ = std::move(handler);
}

MaybeError Listener::resume() {
    if (registered_) {
        return std::nullopt;
    }
    auto id = loop_.add(socket_.get(), EPOLLIN, shared_from_this());
    if (!id) {
        return id.error();
    }
    registration_ = *id;
    registered_ = true;
    return std::nullopt;
}

void Listener::handleEvents(std::uint32_t events) {
    if (events & EPOLLIN) {
        acceptPending();
    }
}

void Listener::acceptPending() {
    for (int i = 0; i < kMaxAcceptsPerTurn && !paused_; ++i) {
        UniqueFd peer(::accept4(socket_.get(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
        if (!peer) {
            if (errno == EMFILE || errno == ENFILE || errno == ENOBUFS || errno == ENOMEM) {
                systemLogf(kLogNotice, "out of descriptors: not accepting connections for now (%s)", std::strerror(errno));
                pauseAccepting();
            }
            return;  // EAGAIN, or a peer that gave up before we took it
        }
        // Right after accept, before the peer can exit and its pid be reused.
        auto identity = capturePeerIdentity(peer.get());
        std::weak_ptr<Listener> weakSelf = weak_from_this();
        auto connection = PeerConnection::adopt(loop_, std::move(peer), std::move(identity), budget_, [weakSelf] {
            if (auto self = weakSelf.lock()) {
                self->resumeAccepting();
            }
        });
        eventQueue_.async([weakSelf, connection] {
            if (auto self = weakSelf.lock(); self && self->handler_) {
                self->handler_(connection);
            }
        });
    }
}

void Listener::pauseAccepting() {
    if (paused_ || !registered_) {
        return;
    }
    paused_ = true;
    if (auto error = loop_.modify(registration_, socket_.get(), 0)) {
        systemLogf(kLogNotice, "cannot pause accepting connections: %@", error->text());
    }
    // Retry after a while even if no connection closes (another process may free descriptors).
    loop_.postAfter(std::chrono::seconds(1), [weakSelf = weak_from_this()] {
        if (auto self = weakSelf.lock()) {
            self->resumeAccepting();
        }
    });
}

void Listener::resumeAccepting() {
    if (!paused_ || !registered_) {
        return;
    }
    if (auto error = loop_.modify(registration_, socket_.get(), EPOLLIN)) {
        // Still paused: the next closed connection, or this retry, tries again.
        systemLogf(kLogNotice, "cannot resume accepting connections, retrying in a second: %@", error->text());
        loop_.postAfter(std::chrono::seconds(1), [weakSelf = weak_from_this()] {
            if (auto self = weakSelf.lock()) {
                self->resumeAccepting();
            }
        });
        return;
    }
    paused_ = false;
}

void Listener::stop() {
    if (registered_) {
        loop_.remove(registration_, socket_.get());
        registered_ = false;
    }
    paused_ = true;
}

void Listener::unlinkOwnSocket() {
    if (boundHere_) {
        ::unlink(socketPath_.c_str());
    }
}

}  // namespace qm::duct
