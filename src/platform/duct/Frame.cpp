#include "platform/duct/Frame.h"

#include "platform/duct/CborCodec.h"

namespace qm::duct {

namespace {

std::uint32_t readBigEndian32(const std::uint8_t* p) {
    return (std::uint32_t{p[0]} << 24) | (std::uint32_t{p[1]} << 16) | (std::uint32_t{p[2]} << 8) | std::uint32_t{p[3]};
}

void writeBigEndian32(std::uint8_t* p, std::uint32_t v) {
    p[0] = static_cast<std::uint8_t>(v >> 24);
    p[1] = static_cast<std::uint8_t>(v >> 16);
    p[2] = static_cast<std::uint8_t>(v >> 8);
    p[3] = static_cast<std::uint8_t>(v);
}

}  // namespace

FrameHeader readFrameHeader(const std::uint8_t* sixteenBytes) {
    FrameHeader header;
    header.payloadLength = readBigEndian32(sixteenBytes);
    header.kind = readBigEndian32(sixteenBytes + 4);
    header.messageId = (std::uint64_t{readBigEndian32(sixteenBytes + 8)} << 32) | readBigEndian32(sixteenBytes + 12);
    return header;
}

void writeFrameHeader(std::uint8_t* sixteenBytes, const FrameHeader& header) {
    writeBigEndian32(sixteenBytes, header.payloadLength);
    writeBigEndian32(sixteenBytes + 4, header.kind);
    writeBigEndian32(sixteenBytes + 8, static_cast<std::uint32_t>(header.messageId >> 32));
    writeBigEndian32(sixteenBytes + 12, static_cast<std::uint32_t>(header.messageId));
}

bool encodeFrameInto(Bytes& frame, FrameKind kind, std::uint64_t messageId, const Value& payload) {
    frame.clear();
    frame.reserve(kFrameHeaderSize + 256);  // the encoder's first claim fits: one allocation
    frame.resize(kFrameHeaderSize);
    cbor::encode(payload, frame);
    std::size_t payloadLength = frame.size() - kFrameHeaderSize;
    if (payloadLength > kMaxPayloadSize) {
        return false;
    }
    writeFrameHeader(frame.data(), FrameHeader{static_cast<std::uint32_t>(payloadLength),
                                               static_cast<std::uint32_t>(kind), messageId});
    return true;
}

std::optional<Bytes> encodeFrame(FrameKind kind, std::uint64_t messageId, const Value& payload) {
    Bytes frame;
    if (!encodeFrameInto(frame, kind, messageId, payload)) {
        return std::nullopt;
    }
    return frame;
}

}  // namespace qm::duct
