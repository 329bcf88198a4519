#include "support/RawClient.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>

#include "platform/duct/CborCodec.h"
#include "platform/duct/Frame.h"

namespace qmtest {

namespace {

qm::UniqueFd connectTo(const std::string& path) {
    qm::UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path) {
        return {};
    }
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    if (::connect(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
        return {};
    }
    return fd;
}

}  // namespace

RawClient::RawClient(const std::string& socketPath) : socket_(connectTo(socketPath)) {}

bool RawClient::tryConnect(const std::string& socketPath) {
    return connectTo(socketPath).valid();
}

std::uint64_t RawClient::send(const qm::Value& message) {
    std::uint64_t id = nextId_++;
    sendWithId(id, message);
    return id;
}

void RawClient::sendWithId(std::uint64_t id, const qm::Value& message) {
    auto frame = qm::duct::encodeFrame(qm::duct::FrameKind::message, id, message);
    if (frame) {
        sendBytes(*frame);
    }
}

bool RawClient::sendBytes(const std::string& bytes) {
    return sendBytes(qm::Bytes(bytes.begin(), bytes.end()));
}

bool RawClient::sendBytes(const qm::Bytes& bytes) {
    std::size_t sent = 0;
    while (sent < bytes.size()) {
        ssize_t n = ::send(socket_.get(), bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL);
        if (n <= 0) {
            if (n < 0 && errno == EINTR) {
                continue;
            }
            return false;
        }
        sent += static_cast<std::size_t>(n);
    }
    return true;
}

bool RawClient::readExactly(std::uint8_t* into, std::size_t size, std::chrono::steady_clock::time_point deadline) {
    std::size_t got = 0;
    while (got < size) {
        auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
        if (left.count() <= 0) {
            return false;
        }
        pollfd p{socket_.get(), POLLIN, 0};
        if (::poll(&p, 1, static_cast<int>(left.count())) <= 0) {
            continue;
        }
        ssize_t n = ::recv(socket_.get(), into + got, size - got, 0);
        if (n <= 0) {
            if (n < 0 && errno == EINTR) {
                continue;
            }
            return false;
        }
        got += static_cast<std::size_t>(n);
    }
    return true;
}

std::optional<ReplyFrame> RawClient::receive(std::chrono::milliseconds timeout) {
    auto deadline = std::chrono::steady_clock::now() + timeout;
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
    return ReplyFrame{h.kind, h.messageId, std::move(body).value()};
}

std::optional<qm::Value> RawClient::roundTrip(const qm::Value& message, std::chrono::milliseconds timeout) {
    std::uint64_t id = send(message);
    auto deadline = std::chrono::steady_clock::now() + timeout;
    while (std::chrono::steady_clock::now() < deadline) {
        auto frame = receive(std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now()));
        if (!frame) {
            return std::nullopt;
        }
        if (frame->id == id) {
            return frame->body;
        }
    }
    return std::nullopt;
}

bool RawClient::waitForClose(std::chrono::milliseconds timeout) {
    auto deadline = std::chrono::steady_clock::now() + timeout;
    std::uint8_t buffer[65536];
    while (std::chrono::steady_clock::now() < deadline) {
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

qm::Value request(std::initializer_list<qm::Dictionary::Entry> entries) {
    return qm::Value(qm::Dictionary(entries));
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
