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

std::optional<sockaddr_un> addressOf(const std::string& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path) {
        return std::nullopt;
    }
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    return address;
}

qm::UniqueFd connectTo(const std::string& path) {
    qm::UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    auto address = addressOf(path);
    if (!address || ::connect(fd.get(), reinterpret_cast<sockaddr*>(&*address), sizeof *address) != 0) {
        return {};
    }
    return fd;
}

std::chrono::milliseconds left(Clock::time_point deadline) {
    return std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now());
}

}  // namespace

FramePeer::FramePeer(const std::string& socketPath) : socket_(connectTo(socketPath)) {}

bool FramePeer::canConnect(const std::string& socketPath) {
    return connectTo(socketPath).valid();
}

qm::UniqueFd FramePeer::listenAt(const std::string& socketPath) {
    qm::UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    auto address = addressOf(socketPath);
    EXPECT_TRUE(address) << socketPath;
    EXPECT_EQ(::bind(fd.get(), reinterpret_cast<sockaddr*>(&*address), sizeof *address), 0) << std::strerror(errno);
    EXPECT_EQ(::listen(fd.get(), 16), 0);
    return fd;
}

FramePeer FramePeer::accept(const qm::UniqueFd& listener) {
    pollfd p{listener.get(), POLLIN, 0};
    EXPECT_EQ(::poll(&p, 1, 5000), 1) << "nobody connected";
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
    std::size_t sent = 0;
    while (sent < bytes.size()) {
        ssize_t n = ::send(socket_.get(), bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            return false;
        }
        sent += static_cast<std::size_t>(n);
    }
    return true;
}

bool FramePeer::readExactly(std::uint8_t* into, std::size_t size, Clock::time_point deadline) {
    std::size_t got = 0;
    while (got < size) {
        pollfd p{socket_.get(), POLLIN, 0};
        if (left(deadline).count() <= 0) {
            return false;
        }
        if (::poll(&p, 1, static_cast<int>(left(deadline).count())) <= 0) {
            continue;
        }
        ssize_t n = ::recv(socket_.get(), into + got, size - got, 0);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            return false;
        }
        got += static_cast<std::size_t>(n);
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
    if (!body) {
        return std::nullopt;
    }
    return Frame{h.kind, h.messageId, std::move(body).value()};
}

std::optional<qm::Value> FramePeer::roundTrip(const qm::Value& message, std::chrono::milliseconds timeout) {
    std::uint64_t id = send(message);
    auto deadline = Clock::now() + timeout;
    while (auto frame = receive(std::max(left(deadline), std::chrono::milliseconds(0)))) {
        if (frame->id == id) {
            return frame->body;
        }
    }
    return std::nullopt;
}

bool FramePeer::waitForClose(std::chrono::milliseconds timeout) {
    auto deadline = Clock::now() + timeout;
    std::uint8_t buffer[65536];
    while (Clock::now() < deadline) {
        pollfd p{socket_.get(), POLLIN, 0};
        if (::poll(&p, 1, 20) <= 0) {
            continue;
        }
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
