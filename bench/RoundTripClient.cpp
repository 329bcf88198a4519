#include "RoundTripClient.h"

#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>

#include "platform/duct/Frame.h"

std::optional<RoundTripClient> RoundTripClient::connect(const std::string& socketPath) {
    qm::UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (!socket || socketPath.size() >= sizeof address.sun_path) {
        return std::nullopt;
    }
    std::memcpy(address.sun_path, socketPath.c_str(), socketPath.size() + 1);
    if (::connect(socket.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
        return std::nullopt;
    }
    return RoundTripClient(std::move(socket));
}

const qm::Bytes* RoundTripClient::roundTrip(qm::Bytes& frame) {
    auto header = qm::duct::readFrameHeader(frame.data());
    header.messageId = nextId_++;
    qm::duct::writeFrameHeader(frame.data(), header);
    std::size_t sent = 0;
    while (sent < frame.size()) {
        ssize_t n = ::send(socket_.get(), frame.data() + sent, frame.size() - sent, MSG_NOSIGNAL);
        if (n <= 0 && errno != EINTR) {
            return nullptr;
        }
        sent += n > 0 ? static_cast<std::size_t>(n) : 0;
    }
    if (in_.size() < 65536) {
        in_.resize(65536);
    }
    std::size_t have = 0;
    std::size_t need = qm::duct::kFrameHeaderSize;
    while (have < need) {
        ssize_t n = ::recv(socket_.get(), in_.data() + have, in_.size() - have, 0);
        if (n <= 0) {
            if (n < 0 && errno == EINTR) {
                continue;
            }
            return nullptr;
        }
        have += static_cast<std::size_t>(n);
        if (have >= qm::duct::kFrameHeaderSize) {
            need = qm::duct::kFrameHeaderSize + qm::duct::readFrameHeader(in_.data()).payloadLength;
            if (in_.size() < need) {
                in_.resize(need);
            }
        }
    }
    payload_.assign(in_.begin() + qm::duct::kFrameHeaderSize, in_.begin() + static_cast<long>(need));
    return &payload_;
}
