#include "platform/duct/ReceiveBudget.h"

#include <algorithm>
#include <cassert>

#include "platform/duct/CborCodec.h"
#include "platform/duct/ReceiveBuffer.h"
#include "platform/log/SystemLog.h"

namespace qm::duct {

using Clock = std::chrono::steady_clock;

ReceiveBudget::ReceiveBudget(EventLoop& loop, ReceiveLimits limits) : loop_(loop), limits_(limits) {}

std::size_t ReceiveBudget::receiveAllowance(std::size_t held) const noexcept {
    std::size_t used = partial_.load();
    // Partial pool: at most limits_.partialBytes received and not decoded...
    std::size_t room = used < limits_.partialBytes ? limits_.partialBytes - used : 0;
    // ...except that a connection holding nothing may always start a frame.
    return held == 0 ? std::max(room, ReceiveBuffer::kInitialCapacity) : room;
}

void ReceiveBudget::chargePartial(const std::shared_ptr<Member>& member, std::size_t bytes) {
    std::size_t before = partial_.load();
    partial_.store(before + bytes);
    // A member stays listed from its first bytes until it leaves, so a
    // request costs no map node.
    holders_.insert_or_assign(member.get(), member);
    if (before < limits_.partialBytes && before + bytes >= limits_.partialBytes) {
        noteFull();
    }
}

void ReceiveBudget::releasePartial(std::size_t bytes, bool frameCompleted) {
    assert(partial_.load() >= bytes);
    partial_.store(partial_.load() - bytes);
    if (frameCompleted) {
        lastCompletion_ = Clock::now();
    }
    if (waiting_[index(Pool::partial)].load() > 0 && partial_.load() < limits_.partialBytes) {
        scheduleResume();
    }
}

void ReceiveBudget::leave(Member& member) noexcept {
    holders_.erase(&member);
}

void ReceiveBudget::forget(Member& member, std::size_t bytes) noexcept {
    partial_.store(partial_.load() - bytes);
    holders_.erase(&member);
}

bool ReceiveBudget::mayDecode(std::size_t payloadSize, bool nothingInFlight) const noexcept {
    // Decoded pool: at most limits_.decodedBytes in requests not yet
    // answered, counting each frame at the most it may decode to.
    return nothingInFlight || decoded_.load() + cbor::decodedSizeBound(payloadSize) <= limits_.decodedBytes;
}

void ReceiveBudget::chargeDecoded(std::size_t bytes) noexcept {
    decoded_.fetch_add(bytes);
}

void ReceiveBudget::releaseDecoded(std::size_t bytes) {
    decoded_.fetch_sub(bytes);
    // Sequentially consistent with wait(): either this sees the waiter, or
    // the waiter's own wake-up sees this release.
    if (waiting_[index(Pool::decoded)].load() > 0) {
        scheduleResume();
    }
}

void ReceiveBudget::wait(Pool pool, const std::shared_ptr<Member>& member) {
    auto& queue = waiters_[index(pool)];
    if (member.get() == resuming_ && pool == resumingPool_) {
        queue.push_front(member);  // still no room: it keeps its place
        requeued_ = true;
        return;
    }
    queue.push_back(member);
    waiting_[index(pool)].fetch_add(1);
    if (pool == Pool::decoded) {
        scheduleResume();  // a release on another thread may have come just before
    }
}

void ReceiveBudget::scheduleResume() {
    if (resumeScheduled_.exchange(true)) {
        return;
    }
    loop_.post([weak = weak_from_this()] {
        if (auto self = weak.lock()) {
            self->resumeWaiters();
        }
    });
}

void ReceiveBudget::resumeWaiters() {
    resumeScheduled_.store(false);
    resumeWaiters(Pool::partial);
    resumeWaiters(Pool::decoded);
}

// In the order they started waiting; the first that must wait again stays
// first, and the rest wait behind it.
void ReceiveBudget::resumeWaiters(Pool pool) {
    auto& queue = waiters_[index(pool)];
    while (!queue.empty()) {
        if (pool == Pool::partial && partial_.load() >= limits_.partialBytes) {
            return;
        }
        auto member = queue.front().lock();
        queue.pop_front();
        if (member) {
            resuming_ = member.get();
            resumingPool_ = pool;
            requeued_ = false;
            member->resumeReceiving();
            resuming_ = nullptr;
            if (requeued_) {
                return;
            }
        }
        waiting_[index(pool)].fetch_sub(1);
    }
}

void ReceiveBudget::noteFull() {
    fullSince_ = Clock::now();
    if (!stallTimerArmed_) {
        armStallTimer(limits_.stallTimeout);
    }
}

void ReceiveBudget::armStallTimer(Clock::duration delay) {
    stallTimerArmed_ = true;
    auto milliseconds = std::chrono::ceil<std::chrono::milliseconds>(delay);
    loop_.postAfter(milliseconds, [weak = weak_from_this()] {
        if (auto self = weak.lock()) {
            self->checkStall();
        }
    });
}

void ReceiveBudget::checkStall() {
    stallTimerArmed_ = false;
    if (partial_.load() < limits_.partialBytes) {
        return;
    }
    auto stalledSince = std::max(fullSince_, lastCompletion_);
    auto deadline = stalledSince + limits_.stallTimeout;
    auto now = Clock::now();
    if (now < deadline) {
        armStallTimer(deadline - now);
        return;
    }
    dropLargestHolder();
    if (partial_.load() >= limits_.partialBytes) {
        fullSince_ = Clock::now();
        armStallTimer(limits_.stallTimeout);
    }
}

void ReceiveBudget::dropLargestHolder() {
    std::shared_ptr<Member> largest;
    std::size_t largestBytes = 0;
    for (auto it = holders_.begin(); it != holders_.end();) {
        auto member = it->second.lock();
        if (!member) {
            it = holders_.erase(it);
            continue;
        }
        if (std::size_t bytes = member->unfinishedBytes(); bytes > largestBytes) {
            largest = std::move(member);
            largestBytes = bytes;
        }
        ++it;
    }
    if (!largest) {
        return;
    }
    systemLogf(kLogNotice,
               "receive budget: %zu bytes of unfinished frames for %lld ms with none completing; dropping %@, "
               "which holds %zu of them",
               partial_.load(), static_cast<long long>(limits_.stallTimeout.count()), largest->description(),
               largestBytes);
    largest->dropStalled(format("dropped holding %zu unfinished bytes while the receive budget was stalled",
                                largestBytes));
}

}  // namespace qm::duct
