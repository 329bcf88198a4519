#pragma once
// The frames a client sends, reassembled from the bytes of its connection as
// they arrive: the receive buffer, how far it may grow, and the header rules
// (a message, at most kMaxPayloadSize of payload). Decoding a payload is the
// caller's, who weighs its cost first. Not thread-safe: one owner.

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>

#include "platform/duct/Frame.h"
#include "platform/duct/ReceiveBuffer.h"

namespace qm::duct {

class IncomingFrames {
public:
    struct Front {
        enum class State { incomplete, complete, invalid };
        State state = State::incomplete;
        FrameHeader header;                  // complete: the frame's header
        std::span<const std::uint8_t> payload;  // complete: its payload, valid until the next call that changes the bytes
        std::string problem;                 // invalid: why the framing is broken
        std::size_t frameSize() const noexcept { return kFrameHeaderSize + payload.size(); }
    };

    // Room to receive into: storage grows only up to the frame being received
    // (its header once read), and only as its bytes arrive. Empty only while a
    // complete frame waits at the front.
    std::span<std::uint8_t> room();
    // `count` bytes were written at the start of room().
    void commit(std::size_t count) noexcept { buffer_.commit(count); }

    // The frame at the front: complete once all its bytes are here, invalid as
    // soon as its header breaks the rules (nothing after it can be framed).
    Front front() const;
    // The first `count` held bytes are done with (a complete frame, or all of them).
    void consume(std::size_t count) noexcept { buffer_.consume(count); }

    std::size_t size() const noexcept { return buffer_.size(); }  // bytes held, not yet consumed
    bool empty() const noexcept { return buffer_.empty(); }
    std::size_t capacity() const noexcept { return buffer_.capacity(); }
    // Gives the storage back; only when nothing is held.
    void release() noexcept { buffer_.release(); }

private:
    ReceiveBuffer buffer_;
};

}  // namespace qm::duct
