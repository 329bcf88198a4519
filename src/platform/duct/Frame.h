#pragma once
// The frame of the Duct transport: a 16-byte header, then the payload.
// Header: payload length (u32 BE), kind (u32 BE: 1 message, 2 reply),
// message id (u64 BE). The payload is one CBOR data item.

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>

#include "platform/value/Value.h"

namespace qm::duct {

inline constexpr std::size_t kFrameHeaderSize = 16;
inline constexpr std::size_t kMaxPayloadSize = 16u * 1024 * 1024;  // exactly this much is accepted

enum class FrameKind : std::uint32_t { message = 1, reply = 2 };

struct FrameHeader {
    std::uint32_t payloadLength = 0;
    std::uint32_t kind = 0;
    std::uint64_t messageId = 0;
};

FrameHeader readFrameHeader(const std::uint8_t* sixteenBytes);
void writeFrameHeader(std::uint8_t* sixteenBytes, const FrameHeader& header);

// A whole frame for the value: header followed by its CBOR encoding, in one
// buffer ready to write. Nothing when the encoding exceeds kMaxPayloadSize.
std::optional<Bytes> encodeFrame(FrameKind kind, std::uint64_t messageId, const Value& payload);
// The same into a buffer the caller reuses (its content is replaced); false,
// with the buffer's content undefined, when the encoding is too large.
bool encodeFrameInto(Bytes& frame, FrameKind kind, std::uint64_t messageId, const Value& payload);

}  // namespace qm::duct
