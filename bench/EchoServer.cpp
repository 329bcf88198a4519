#include "EchoServer.h"

#include <poll.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <map>

#include "platform/duct/Frame.h"
#include "platform/fd/UniqueFd.h"

namespace {

struct Connection {
    qm::UniqueFd fd;
    qm::Bytes buffer;
};

void writeAll(int fd, const std::uint8_t* data, std::size_t size) {
    std::size_t sent = 0;
    while (sent < size) {
        ssize_t n = ::send(fd, data + sent, size - sent, MSG_NOSIGNAL);
        if (n > 0) {
            sent += static_cast<std::size_t>(n);
        } else if (n < 0 && (errno == EAGAIN || errno == EINTR)) {
            pollfd p{fd, POLLOUT, 0};
            ::poll(&p, 1, 100);
        } else {
            return;
        }
    }
}

// Answers every whole frame in the buffer; false when the peer has gone.
bool serveReadable(Connection& connection, qm::Bytes& reply) {
    std::uint8_t chunk[65536];
    for (;;) {
        ssize_t n = ::recv(connection.fd.get(), chunk, sizeof chunk, 0);
        if (n == 0) {
            return false;
        }
        if (n < 0) {
            return errno == EAGAIN || errno == EINTR;
        }
        connection.buffer.insert(connection.buffer.end(), chunk, chunk + n);
        std::size_t start = 0;
        while (connection.buffer.size() - start >= qm::duct::kFrameHeaderSize) {
            auto header = qm::duct::readFrameHeader(connection.buffer.data() + start);
            std::size_t frameSize = qm::duct::kFrameHeaderSize + header.payloadLength;
            if (connection.buffer.size() - start < frameSize) {
                break;
            }
            auto replyHeader = qm::duct::readFrameHeader(reply.data());
            replyHeader.messageId = header.messageId;
            qm::duct::writeFrameHeader(reply.data(), replyHeader);
            writeAll(connection.fd.get(), reply.data(), reply.size());
            start += frameSize;
        }
        connection.buffer.erase(connection.buffer.begin(), connection.buffer.begin() + static_cast<long>(start));
    }
}

[[noreturn]] void serve(int listener, qm::Bytes reply) {
    qm::UniqueFd epoll(::epoll_create1(EPOLL_CLOEXEC));
    epoll_event listenEvent{};
    listenEvent.events = EPOLLIN;
    listenEvent.data.fd = listener;
    ::epoll_ctl(epoll.get(), EPOLL_CTL_ADD, listener, &listenEvent);
    std::map<int, Connection> connections;
    epoll_event events[64];
    for (;;) {
        int count = ::epoll_wait(epoll.get(), events, 64, -1);
        for (int i = 0; i < count; ++i) {
            int fd = events[i].data.fd;
            if (fd == listener) {
                int accepted = ::accept4(listener, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
                if (accepted >= 0) {
                    epoll_event event{};
                    event.events = EPOLLIN | EPOLLRDHUP;
                    event.data.fd = accepted;
                    ::epoll_ctl(epoll.get(), EPOLL_CTL_ADD, accepted, &event);
                    connections[accepted].fd.reset(accepted);
                }
                continue;
            }
            auto it = connections.find(fd);
            if (it != connections.end() && !serveReadable(it->second, reply)) {
                ::epoll_ctl(epoll.get(), EPOLL_CTL_DEL, fd, nullptr);
                connections.erase(it);
            }
        }
    }
}

}  // namespace

ChildProcess startEchoServer(const std::string& socketPath, const qm::Bytes& replyPayload) {
    qm::UniqueFd listener(::socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, socketPath.c_str(), std::min(socketPath.size() + 1, sizeof address.sun_path - 1));
    ::unlink(socketPath.c_str());
    ::bind(listener.get(), reinterpret_cast<sockaddr*>(&address), sizeof address);
    ::listen(listener.get(), 64);
    // The reply frame is built once; only its id changes per answer.
    qm::Bytes reply(qm::duct::kFrameHeaderSize);
    qm::duct::writeFrameHeader(reply.data(), {static_cast<std::uint32_t>(replyPayload.size()),
                                              static_cast<std::uint32_t>(qm::duct::FrameKind::reply), 0});
    reply.insert(reply.end(), replyPayload.begin(), replyPayload.end());
    int listenFd = listener.get();
    return ChildProcess::fork([listenFd, &reply] { serve(listenFd, reply); });
}
