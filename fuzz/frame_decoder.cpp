// The daemon's side of a connection: bytes arrive in chunks of varying size,
// frames are reassembled from them and every complete payload is decoded,
// until the framing or a payload is refused, as the connection would close.
//
// Input: one byte that seeds the chunk sizes, then the bytes the peer sends.
// Checked beyond "no crash": a decoded tree stays within its allocation
// bound, and what it encodes to decodes to the same encoding.

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <span>

#include "platform/duct/CborCodec.h"
#include "platform/duct/IncomingFrames.h"

namespace {

void checkDecoded(const qm::cbor::Decoded& decoded, std::size_t payloadSize) {
    if (decoded.allocatedBytes > qm::cbor::decodedSizeBound(payloadSize)) {
        std::abort();
    }
    qm::Bytes encoded = qm::cbor::encode(decoded.value);
    auto again = qm::cbor::decode(encoded);
    if (!again || qm::cbor::encode(*again) != encoded) {
        std::abort();
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    if (size == 0) {
        return 0;
    }
    // Chunk sizes from a small generator: 1 to 256 bytes, or all the room there is.
    std::uint32_t chunkState = data[0] * 2654435761u + 1;
    std::span<const std::uint8_t> sent(data + 1, size - 1);

    qm::duct::IncomingFrames frames;
    while (true) {
        auto front = frames.front();
        if (front.state == qm::duct::IncomingFrames::Front::State::invalid) {
            return 0;
        }
        if (front.state == qm::duct::IncomingFrames::Front::State::complete) {
            auto decoded = qm::cbor::decodeMeasured(front.payload);
            if (!decoded) {
                return 0;
            }
            checkDecoded(*decoded, front.payload.size());
            frames.consume(front.frameSize());
            continue;
        }
        if (sent.empty()) {
            return 0;
        }
        auto room = frames.room();
        if (room.empty()) {
            std::abort();  // an incomplete frame always has room to grow into
        }
        chunkState = chunkState * 1103515245u + 12345u;
        std::size_t chunk = (chunkState >> 16) % 8 == 0 ? room.size() : 1 + (chunkState >> 20) % 256;
        chunk = std::min({chunk, room.size(), sent.size()});
        std::memcpy(room.data(), sent.data(), chunk);
        frames.commit(chunk);
        sent = sent.subspan(chunk);
    }
}
