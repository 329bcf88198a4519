#include "support/FramePeer.h"

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>

#include "platform/duct/CborCodec.h"
#include "platform/duct/Frame.h"

namespace qmtest {

namespace {

using Clock = std::chrono::steady_clock;

// A stream socket, bound to the path or connected to it; invalid when that fails.
qm::UniqueFd socketAt(const std::string& path, bool bound) {
    qm::UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path) {
        return {};
    }
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    auto* generic = reinterpret_cast<sockaddr*>(&address);
    bool ok = bound ? ::bind(fd.get(), generic, sizeof address) == 0 && ::listen(fd.get(), 16) == 0
                    : ::connect(fd.get(), generic, sizeof address) == 0;
    return ok ? std::move(fd) : qm::UniqueFd();
}

// Whether the socket has something to read (or an end) before the deadline.
bool readable(int fd, Clock::time_point deadline) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
    pollfd p{fd, POLLIN, 0};
    return left > 0 && ::poll(&p, 1, static_cast<int>(left)) > 0;
}

}  // namespace

FramePeer::FramePeer(const std::string& socketPath) : socket_(socketAt(socketPath, false)) {}

bool FramePeer::canConnect(const std::string& socketPath) {
    return socketAt(socketPath, false).valid();
}

qm::UniqueFd FramePeer::listenAt(const std::string& socketPath) {
    qm::UniqueFd fd = socketAt(socketPath, true);
    EXPECT_TRUE(fd.valid()) << socketPath << ": " << std::strerror(errno);
    return fd;
}

FramePeer FramePeer::accept(const qm::UniqueFd& listener) {
    EXPECT_TRUE(readable(listener.get(), Clock::now() + std::chrono::seconds(5))) << "nobody connected";
    return FramePeer(qm::UniqueFd(::accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC)));
}

std::uint64_t FramePeer::send(const qm::Value& message) {
    std::uint64_t id = nextId_++;
    auto frame = qm::duct::encodeFrame(qm::duct::FrameKind::message, id, message);
    EXPECT_TRUE(frame && sendBytes(*frame)) << "message " << id << " not sent";
    return id;
}

bool FramePeer::reply(std::uint64_t id, const qm::Value& body) {
    auto frame = qm::duct::encodeFrame(qm::duct::FrameKind::reply, id, body);
    return frame && sendBytes(*frame);
}

bool FramePeer::sendBytes(const qm::Bytes& bytes) {
    for (std::size_t sent = 0; sent < bytes.size();) {
        ssize_t n = ::send(socket_.get(), bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL);
        if (n < 0 && errno != EINTR) {
            return false;
        }
        sent += n > 0 ? static_cast<std::size_t>(n) : 0;
    }
    return true;
}

bool FramePeer::readExactly(std::uint8_t* into, std::size_t size, Clock::time_point deadline) {
    for (std::size_t got = 0; got < size;) {
        if (!readable(socket_.get(), deadline)) {
            return false;
        }
        ssize_t n = ::recv(socket_.get(), into + got, size - got, 0);
        if (n == 0 || (n < 0 && errno != EINTR)) {
            return false;
        }
        got += n > 0 ? static_cast<std::size_t>(n) : 0;
    }
    return true;
}

std::optional<Frame> FramePeer::receive(std::chrono::milliseconds timeout) {
    auto deadline = Clock::now() + timeout;
    std::uint8_t header[qm::duct::kFrameHeaderSize];
    if (!readExactly(header, sizeof header, deadline)) {
        return std::nullopt;
    }
    auto h = qm::duct::readFrameHeader(header);
    qm::Bytes payload(h.payloadLength);
    if (!readExactly(payload.data(), payload.size(), deadline)) {
        return std::nullopt;
    }
    auto body = qm::cbor::decode(payload);
    return body ? std::optional(Frame{h.kind, h.messageId, std::move(body).value()}) : std::nullopt;
}

std::optional<qm::Value> FramePeer::roundTrip(const qm::Value& message, std::chrono::milliseconds timeout) {
    std::uint64_t id = send(message);
    auto deadline = Clock::now() + timeout;
    while (auto frame = receive(std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()))) {
        if (frame->id == id) {
            return frame->body;
        }
    }
    return std::nullopt;
}

qm::Value FramePeer::ask(qm::Dictionary request) {
    if (!request.contains("version")) {
        request.set("version", qm::Value(wire::kCurrentVersion));
    }
    auto reply = roundTrip(qm::Value(std::move(request)));
    EXPECT_TRUE(reply) << "no reply";
    return reply.value_or(qm::Value());
}

bool FramePeer::waitForClose(std::chrono::milliseconds timeout) {
    std::uint8_t buffer[65536];
    for (auto deadline = Clock::now() + timeout; readable(socket_.get(), deadline);) {
        ssize_t n = ::recv(socket_.get(), buffer, sizeof buffer, 0);
        if (n == 0 || (n < 0 && errno != EINTR && errno != EAGAIN)) {
            return true;
        }
    }
    return false;
}

qm::Bytes frameHeader(std::uint32_t payloadLength, std::uint32_t kind, std::uint64_t id) {
    qm::Bytes header(qm::duct::kFrameHeaderSize);
    qm::duct::writeFrameHeader(header.data(), {payloadLength, kind, id});
    return header;
}

qm::Bytes rawFrame(std::string_view payload, std::uint32_t kind, std::uint64_t id) {
    qm::Bytes frame = frameHeader(static_cast<std::uint32_t>(payload.size()), kind, id);
    frame.insert(frame.end(), payload.begin(), payload.end());
    return frame;
}

qm::Value request(std::initializer_list<qm::Dictionary::Entry> entries) {
    return qm::Value(qm::Dictionary(entries));
}

qm::Value bulk(std::uint64_t version) {
    return request({{"request", "bulk"}, {"version", version}});
}

std::optional<std::uint64_t> errorCode(const qm::Value& reply) {
    const qm::Value* code = reply.get("errorcode");
    return code ? code->asUnsigned() : std::nullopt;
}

std::string errorText(const qm::Value& reply) {
    const qm::Value* text = reply.get("error");
    return text && text->asString() ? *text->asString() : std::string();
}

}  // namespace qmtest
