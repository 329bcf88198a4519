#include "platform/duct/ReceiveBuffer.h"

#include <algorithm>
#include <cassert>
#include <cstring>

namespace qm::duct {

std::span<std::uint8_t> ReceiveBuffer::room(std::size_t ceiling) {
    if (!storage_) {
        capacity_ = kInitialCapacity;
        storage_ = std::make_unique_for_overwrite<std::uint8_t[]>(capacity_);
    }
    // Move the held bytes to the front once they sit in the back half, or
    // when there is no room behind them.
    if (start_ > 0 && (end_ == capacity_ || start_ >= capacity_ / 2)) {
        std::memmove(storage_.get(), storage_.get() + start_, size());
        end_ -= start_;
        start_ = 0;
    }
    if (end_ == capacity_ && capacity_ < ceiling) {
        // Full of received bytes: at most double, so storage stays within
        // twice what arrived.
        std::size_t grown = std::min(2 * capacity_, ceiling);
        auto larger = std::make_unique_for_overwrite<std::uint8_t[]>(grown);
        std::memcpy(larger.get(), storage_.get(), end_);
        storage_ = std::move(larger);
        capacity_ = grown;
    }
    return {storage_.get() + end_, capacity_ - end_};
}

void ReceiveBuffer::commit(std::size_t count) noexcept {
    assert(count <= capacity_ - end_);
    end_ += count;
}

void ReceiveBuffer::consume(std::size_t count) noexcept {
    assert(count <= size());
    start_ += count;
    if (start_ == end_) {
        start_ = end_ = 0;
    }
}

void ReceiveBuffer::release() noexcept {
    assert(empty());
    storage_.reset();
    capacity_ = 0;
    start_ = end_ = 0;
}

}  // namespace qm::duct
