#include "platform/duct/Listener.h"

#include <sys/socket.h>
#include <sys/un.h>

#include <fcntl.h>

#include <cerrno>
#include <cstddef>
#include <cstring>
#include <vector>

#include "platform/env/Environment.h"
#include "platform/log/SystemLog.h"

namespace qm::duct {

namespace {

constexpr int kMaxAcceptsPerTurn = 64;

bool socketOption(int fd, int option, int& value) {
    socklen_t length = sizeof value;
    return ::getsockopt(fd, SOL_SOCKET, option, &value, &length) == 0;
}

// What the daemon can serve on: a Unix-domain stream socket already listening.
bool isListeningUnixStreamSocket(int fd) {
    int accepting = 0;
    int domain = 0;
    int type = 0;
    return socketOption(fd, SO_ACCEPTCONN, accepting) && accepting != 0 && socketOption(fd, SO_DOMAIN, domain) &&
           domain == AF_UNIX && socketOption(fd, SO_TYPE, type) && type == SOCK_STREAM;
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

// Takes the first socket passed by the service manager and closes the rest:
// one service, one socket. The runtime directory is checked as when binding,
// since the service manager made it; no "already running" probe, since the
// service manager owns the socket and starts one daemon on it.
Result<UniqueFd> adoptPassedSocket(std::vector<int> passed) {
    UniqueFd socket(passed.front());
    for (std::size_t i = 1; i < passed.size(); ++i) {
        systemLogf(kLogNotice, "ignoring descriptor %d passed by the service manager: one socket is served", passed[i]);
        ::close(passed[i]);
    }
    if (auto directory = prepareRuntimeDirectory(); !directory) {
        return directory.error();
    }
    if (!isListeningUnixStreamSocket(socket.get())) {
        return Error{kDuctErrorDomain, ENOTSOCK,
                     "descriptor " + std::to_string(socket.get()) +
                         " passed by the service manager (LISTEN_FDS) is not a listening Unix-domain stream socket"};
    }
    int flags = ::fcntl(socket.get(), F_GETFL);
    if (flags < 0 || ::fcntl(socket.get(), F_SETFL, flags | O_NONBLOCK) != 0 ||
        ::fcntl(socket.get(), F_SETFD, FD_CLOEXEC) != 0) {
        return posixError(errno, "cannot make the passed socket non-blocking and close-on-exec");
    }
    return socket;
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
        auto socket = adoptPassedSocket(std::move(activated));
        if (!socket) {
            return socket.error();
        }
        std::string path = boundPath(socket->get());
        return std::shared_ptr<Listener>(new Listener(loop, serviceName, eventQueue, std::move(socket).value(),
                                                      UniqueFd(), std::move(path), false, std::move(budget)));
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
