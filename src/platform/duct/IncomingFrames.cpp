#include "platform/duct/IncomingFrames.h"

#include <algorithm>
#include <cassert>

#include "platform/text/Format.h"

namespace qm::duct {

namespace {

constexpr std::size_t kMaxFrameSize = kFrameHeaderSize + kMaxPayloadSize;

}  // namespace

std::span<std::uint8_t> IncomingFrames::room() {
    std::size_t ceiling = ReceiveBuffer::kInitialCapacity;
    if (buffer_.size() >= kFrameHeaderSize) {
        std::size_t frameSize = kFrameHeaderSize + readFrameHeader(buffer_.data()).payloadLength;
        assert(frameSize <= kMaxFrameSize && "headers are checked before their payload is read");
        ceiling = std::min(frameSize, kMaxFrameSize);
    }
    return buffer_.room(ceiling);
}

IncomingFrames::Front IncomingFrames::front() const {
    Front front;
    if (buffer_.size() < kFrameHeaderSize) {
        return front;
    }
    front.header = readFrameHeader(buffer_.data());
    if (front.header.payloadLength > kMaxPayloadSize) {
        front.state = Front::State::invalid;
        front.problem = format("frame announces %u bytes, over the 16 MiB limit", front.header.payloadLength);
        return front;
    }
    if (front.header.kind != static_cast<std::uint32_t>(FrameKind::message)) {
        front.state = Front::State::invalid;
        front.problem = format("frame of kind %u from a client", front.header.kind);
        return front;
    }
    if (buffer_.size() - kFrameHeaderSize < front.header.payloadLength) {
        return front;
    }
    front.state = Front::State::complete;
    front.payload = {buffer_.data() + kFrameHeaderSize, front.header.payloadLength};
    return front;
}

}  // namespace qm::duct
