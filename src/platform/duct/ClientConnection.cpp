#include "platform/duct/ClientConnection.h"

#include <pthread.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>

#include "platform/duct/CborCodec.h"
#include "platform/duct/Frame.h"
#include "platform/duct/ServiceSocket.h"
#include "platform/text/Format.h"

namespace qm::duct {

namespace {

Error transportError(int code, const std::string& text) {
    return Error{kDuctErrorDomain, code, text};
}

Error invalidity(int code, const std::string& reason) {
    return transportError(code, "connection invalid: " + reason);
}

bool peerHungUp(int errorNumber) {
    return errorNumber == ECONNRESET || errorNumber == EPIPE;
}

void setSendTimeout(int socket, std::chrono::milliseconds timeout) {
    auto micros = std::chrono::duration_cast<std::chrono::microseconds>(timeout).count();
    if (micros <= 0) {
        micros = 1;  // zero would mean "no timeout"
    }
    timeval value{};
    value.tv_sec = static_cast<time_t>(micros / 1000000);
    value.tv_usec = static_cast<suseconds_t>(micros % 1000000);
    ::setsockopt(socket, SOL_SOCKET, SO_SNDTIMEO, &value, sizeof value);
}

// On a Unix socket a send timeout also bounds connect(), which otherwise
// waits for room in a busy daemon's accept backlog.
Result<UniqueFd> connectToPath(const std::string& path, std::optional<std::chrono::milliseconds> timeout) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path) {
        return transportError(ENAMETOOLONG, "socket path too long: " + path);
    }
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!socket) {
        int error = errno;
        return transportError(error, format("cannot create a socket: %s", std::strerror(error)));
    }
    if (timeout) {
        setSendTimeout(socket.get(), *timeout);
    }
    int result = 0;
    do {
        result = ::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address);
    } while (result != 0 && errno == EINTR);
    if (result != 0) {
        int error = errno;
        const char* reason = error == EAGAIN ? "timed out" : std::strerror(error);
        return transportError(error, format("cannot connect to %s: %s", path, reason));
    }
    return socket;
}

}  // namespace

Result<std::unique_ptr<ClientConnection>> ClientConnection::connect(const std::string& serviceName,
                                                                    SerialQueue& queue, EventHandler eventHandler,
                                                                    Options options) {
    auto path = serviceSocketPath(serviceName);
    if (!path) {
        return path.error();
    }
    auto socket = connectToPath(*path, options.ioTimeout);
    if (!socket) {
        return socket.error();
    }
    return adopt(std::move(socket).value(), queue, std::move(eventHandler));
}

Result<std::unique_ptr<ClientConnection>> ClientConnection::connect(const std::string& serviceName,
                                                                    SerialQueue& queue, EventHandler eventHandler) {
    return connect(serviceName, queue, std::move(eventHandler), Options{});
}

std::unique_ptr<ClientConnection> ClientConnection::adopt(UniqueFd socket, SerialQueue& queue,
                                                          EventHandler eventHandler) {
    return std::unique_ptr<ClientConnection>(new ClientConnection(std::move(socket), queue, std::move(eventHandler)));
}

ClientConnection::ClientConnection(UniqueFd socket, SerialQueue& queue, EventHandler eventHandler)
    : socket_(std::move(socket)), queue_(queue), eventHandler_(std::move(eventHandler)) {
    reader_ = std::thread([this] {
        ::pthread_setname_np(::pthread_self(), "duct-client");
        readLoop();
    });
}

ClientConnection::~ClientConnection() {
    closing_ = true;
    fail(invalidity(ECANCELED, "connection closed by the client"), false);
    if (reader_.joinable()) {
        reader_.join();
    }
}

void ClientConnection::send(const Value& message, ReplyHandler handler) {
    assert(handler);
    if (!message.isDictionary()) {
        failOne(std::move(handler), transportError(EINVAL, format("cannot send a message that is not a dictionary (%s)",
                                                                  valueTypeName(message.type()))));
        return;
    }
    std::uint64_t id = nextId_.fetch_add(1);
    std::optional<Bytes> frame = encodeFrame(FrameKind::message, id, message);
    if (!frame) {
        failOne(std::move(handler), transportError(EMSGSIZE, "cannot send a message larger than 16 MiB"));
        return;
    }
    std::optional<Error> alreadyInvalid;
    {
        std::lock_guard lock(stateMutex_);
        if (invalidError_) {
            alreadyInvalid = invalidError_;
        } else {
            pending_.emplace(id, std::move(handler));
        }
    }
    if (alreadyInvalid) {
        failOne(std::move(handler), std::move(*alreadyInvalid));
        return;
    }
    std::optional<Error> writeFailure;
    {
        std::lock_guard lock(writeMutex_);
        std::size_t written = 0;
        while (written < frame->size()) {
            ssize_t n = ::send(socket_.get(), frame->data() + written, frame->size() - written, MSG_NOSIGNAL);
            if (n >= 0) {
                written += static_cast<std::size_t>(n);
                continue;
            }
            int error = errno;
            if (error == EINTR) {
                continue;
            }
            if (error == EAGAIN || error == EWOULDBLOCK) {
                writeFailure = invalidity(ETIMEDOUT, "write timed out: the daemon does not read");
            } else if (peerHungUp(error)) {
                writeFailure = invalidity(ECONNRESET, "daemon closed the connection");
            } else {
                writeFailure = invalidity(error, format("write failed: %s", std::strerror(error)));
            }
            break;
        }
    }
    if (writeFailure) {
        // The message's handler is still pending, so it hears of this too.
        fail(std::move(*writeFailure), true);
    }
}

void ClientConnection::invalidate(const std::string& reason) {
    fail(invalidity(ECANCELED, reason), true);
}

bool ClientConnection::isValid() const {
    std::lock_guard lock(stateMutex_);
    return !invalidError_.has_value();
}

std::size_t ClientConnection::pendingCount() const {
    std::lock_guard lock(stateMutex_);
    return pending_.size();
}

void ClientConnection::readLoop() {
    for (;;) {
        std::uint8_t headerBytes[kFrameHeaderSize];
        if (!readExactly(headerBytes, sizeof headerBytes)) {
            return;
        }
        FrameHeader header = readFrameHeader(headerBytes);
        if (header.kind != static_cast<std::uint32_t>(FrameKind::reply)) {
            fail(invalidity(EPROTO, format("received a frame of kind %u, not a reply", header.kind)), true);
            return;
        }
        if (header.payloadLength > kMaxPayloadSize) {
            fail(invalidity(EMSGSIZE, format("reply of %u bytes exceeds the 16 MiB limit", header.payloadLength)), true);
            return;
        }
        Bytes payload(header.payloadLength);
        if (!readExactly(payload.data(), payload.size())) {
            return;
        }
        Result<Value> body = cbor::decode(payload);
        if (!body) {
            fail(invalidity(EPROTO, "undecodable reply: " + body.error().text()), true);
            return;
        }
        deliverReply(header.messageId, std::move(body).value());
    }
}

// Reads exactly size bytes; on failure makes the connection invalid and
// returns false.
bool ClientConnection::readExactly(std::uint8_t* into, std::size_t size) {
    std::size_t got = 0;
    while (got < size) {
        ssize_t n = ::recv(socket_.get(), into + got, size - got, 0);
        if (n > 0) {
            got += static_cast<std::size_t>(n);
            continue;
        }
        int error = n == 0 ? 0 : errno;
        if (error == EINTR) {
            continue;
        }
        if (closing_) {
            return false;  // the destructor has failed everything already
        }
        if (error == 0 || peerHungUp(error)) {
            fail(invalidity(ECONNRESET, "daemon closed the connection"), true);
        } else {
            fail(invalidity(error, format("read failed: %s", std::strerror(error))), true);
        }
        return false;
    }
    return true;
}

void ClientConnection::deliverReply(std::uint64_t id, Result<Value> reply) {
    ReplyHandler handler;
    {
        std::lock_guard lock(stateMutex_);
        auto it = pending_.find(id);
        if (it != pending_.end()) {
            handler = std::move(it->second);
            pending_.erase(it);
        }
    }
    if (!handler) {
        fail(invalidity(EPROTO, format("received a reply to unknown message %llu",
                                       static_cast<unsigned long long>(id))),
             true);
        return;
    }
    queue_.async([handler = std::move(handler), reply = std::move(reply)]() mutable { handler(std::move(reply)); });
}

// The first failure wins: it fails every pending handler (in the order the
// messages were sent) and shuts the socket down, which wakes the reader and
// stops writers. Later failures change nothing.
void ClientConnection::fail(Error error, bool notifyEventHandler) {
    std::map<std::uint64_t, ReplyHandler> pending;
    {
        std::lock_guard lock(stateMutex_);
        if (invalidError_) {
            return;
        }
        invalidError_ = error;
        pending.swap(pending_);
    }
    ::shutdown(socket_.get(), SHUT_RDWR);
    for (auto& entry : pending) {
        failOne(std::move(entry.second), error);
    }
    if (notifyEventHandler && eventHandler_) {
        queue_.async([handler = eventHandler_, error] { handler(error); });
    }
}

void ClientConnection::failOne(ReplyHandler handler, Error error) {
    queue_.async([handler = std::move(handler), error = std::move(error)] { handler(Result<Value>(error)); });
}

}  // namespace qm::duct
