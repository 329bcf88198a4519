#pragma once
// The bytes of one connection that arrived but are not decoded yet.
//
// Memory follows the bytes received: beyond kInitialCapacity, storage grows
// only when it is full of received bytes, to at most twice as much and never
// past the ceiling the caller gives (the frame being received), whatever a
// header announces; room not yet received into is never zero-filled. Not
// thread-safe: one owner.

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>

namespace qm::duct {

class ReceiveBuffer {
public:
    // Storage taken when the first bytes arrive, and the first growth step.
    static constexpr std::size_t kInitialCapacity = 4 * 1024;

    std::size_t size() const noexcept { return end_ - start_; }  // bytes held
    bool empty() const noexcept { return start_ == end_; }
    std::size_t capacity() const noexcept { return capacity_; }
    const std::uint8_t* data() const noexcept { return storage_.get() + start_; }

    // Room to receive into, after the held bytes: takes storage, moves the
    // held bytes to the front, or grows geometrically up to `ceiling` bytes of
    // storage. Empty only when it is full and at or past the ceiling.
    std::span<std::uint8_t> room(std::size_t ceiling);
    // `count` bytes were written at the start of room().
    void commit(std::size_t count) noexcept;
    // The first `count` held bytes are done with.
    void consume(std::size_t count) noexcept;
    // Gives the storage back; only when nothing is held.
    void release() noexcept;

private:
    std::unique_ptr<std::uint8_t[]> storage_;
    std::size_t capacity_ = 0;
    std::size_t start_ = 0;
    std::size_t end_ = 0;
};

}  // namespace qm::duct
