#pragma once
// What the daemon's peers may make it hold, after dbus-broker's per-peer
// quotas: memory follows the bytes that arrived, never what a header
// announces, and every pool has a limit written where it is enforced.
//
// Two process-wide pools (the daemon has one listener, which owns the
// budget):
// - partial: bytes received but not decoded yet, over all connections. A
//   connection that holds bytes receives more only while the pool is under
//   its limit. A connection that holds none may always make one read of up
//   to ReceiveBuffer::kInitialCapacity: its first frame is always admitted,
//   so a quiet client's request gets in while others fill the pool.
// - decoded: decoded requests not answered yet, charged with what decoding
//   allocated and released when the request is replied to or dropped. A
//   frame is decoded only if the pool can take the most it may decode to
//   (cbor::decodedSizeBound), except that a connection with no request in
//   flight is always admitted its next frame: none starves, and a request
//   larger than the whole pool can still be served.
// Per connection, PeerConnection adds: one maximal frame of received bytes,
// and 64 requests in flight.
//
// A connection that must wait stops reading (its hang-ups are still seen)
// and joins the pool's queue; when the pool has room again, connections
// resume in the order they started waiting. When the partial pool stays full
// for stallTimeout with no frame completing, the connection holding the most
// unfinished bytes is dropped with a log line: peers that trickle frames
// cannot keep the pool to themselves.
//
// Threading: everything runs on the event loop's thread, except
// releaseDecoded() and the counters, which any thread may call.

#include <array>
#include <atomic>
#include <chrono>
#include <cstddef>
#include <deque>
#include <memory>
#include <string>
#include <unordered_map>

#include "platform/queue/EventLoop.h"

namespace qm::duct {

struct ReceiveLimits {
    std::size_t partialBytes = 64u * 1024 * 1024;
    std::size_t decodedBytes = 64u * 1024 * 1024;
    std::chrono::milliseconds stallTimeout{5000};
};

class ReceiveBudget final : public std::enable_shared_from_this<ReceiveBudget> {
public:
    enum class Pool { partial, decoded };

    // A connection that draws on the budget. Called on the loop thread.
    class Member {
    public:
        // The pool it waits for has room: try again. A member that must
        // wait again calls wait() again, and keeps its place in the queue.
        virtual void resumeReceiving() = 0;
        virtual std::size_t unfinishedBytes() const = 0;
        virtual void dropStalled(const std::string& reason) = 0;
        virtual std::string description() const = 0;

    protected:
        ~Member() = default;
    };

    // Own it with a shared_ptr: its timers and wake-ups hold it weakly. The
    // loop must outlive it and every message charged to it.
    ReceiveBudget(EventLoop& loop, ReceiveLimits limits = {});
    ReceiveBudget(const ReceiveBudget&) = delete;
    ReceiveBudget& operator=(const ReceiveBudget&) = delete;

    const ReceiveLimits& limits() const noexcept { return limits_; }
    std::size_t partialBytes() const noexcept { return partial_.load(); }
    std::size_t decodedBytes() const noexcept { return decoded_.load(); }
    // Connections queued for a pool, counting one being resumed.
    std::size_t waiting(Pool pool) const noexcept { return waiting_[index(pool)].load(); }

    // The partial pool (loop thread). How many bytes a member that holds
    // `held` may receive now; 0 means it must wait.
    std::size_t receiveAllowance(std::size_t held) const noexcept;
    void chargePartial(const std::shared_ptr<Member>& member, std::size_t bytes);
    // `frameCompleted`: a whole frame left the pool, which counts as
    // progress against stalls.
    void releasePartial(std::size_t bytes, bool frameCompleted);
    // The member closed: it is no candidate for dropping any more.
    void leave(Member& member) noexcept;
    // For a member destroyed without closing, once its loop has stopped:
    // takes its bytes off the pool and wakes nobody.
    void forget(Member& member, std::size_t bytes) noexcept;

    // The decoded pool. mayDecode() and chargeDecoded() on the loop thread;
    // releaseDecoded() on any.
    bool mayDecode(std::size_t payloadSize, bool nothingInFlight) const noexcept;
    void chargeDecoded(std::size_t bytes) noexcept;
    void releaseDecoded(std::size_t bytes);

    // Queues a member until the pool has room (loop thread).
    void wait(Pool pool, const std::shared_ptr<Member>& member);

private:
    static constexpr std::size_t index(Pool pool) { return pool == Pool::partial ? 0 : 1; }
    void scheduleResume();
    void resumeWaiters();
    void resumeWaiters(Pool pool);
    void noteFull();
    void armStallTimer(std::chrono::steady_clock::duration delay);
    void checkStall();
    void dropLargestHolder();

    EventLoop& loop_;
    const ReceiveLimits limits_;
    std::atomic<std::size_t> partial_{0};  // written on the loop thread only
    std::atomic<std::size_t> decoded_{0};

    // Loop thread only.
    std::unordered_map<Member*, std::weak_ptr<Member>> holders_;  // members that received bytes, until they leave
    std::array<std::deque<std::weak_ptr<Member>>, 2> waiters_;
    Member* resuming_ = nullptr;  // the member resumeWaiters() is trying, and for which pool
    Pool resumingPool_ = Pool::partial;
    bool requeued_ = false;
    std::chrono::steady_clock::time_point fullSince_{};
    std::chrono::steady_clock::time_point lastCompletion_{};
    bool stallTimerArmed_ = false;

    // Waiters per pool, counting one being resumed: read by releaseDecoded()
    // on other threads, so a release never misses a waiter.
    std::array<std::atomic<std::size_t>, 2> waiting_{};
    std::atomic<bool> resumeScheduled_{false};
};

}  // namespace qm::duct
