#pragma once
// The epoll event loop that the main thread parks in for the life of the
// daemon. Sources are registered with a file descriptor and an interest set;
// their handleEvents() runs on the loop thread. Level-triggered, so a source
// that stops reading early (fairness) is called again on the next turn.
//
// Thread-safety: add(), modify(), remove() and post() may be called from any
// thread. A source is kept alive by the loop while registered; remove() makes
// sure it is not called again once remove() has returned on the loop thread
// (from another thread, an event already being dispatched may still finish).

#include <sys/epoll.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <unordered_map>
#include <vector>

#include "platform/error/Error.h"
#include "platform/fd/UniqueFd.h"

namespace qm {

class EventSource {
public:
    virtual ~EventSource() = default;
    virtual void handleEvents(std::uint32_t events) = 0;
};

class EventLoop {
public:
    using RegistrationId = std::uint64_t;

    static Result<std::unique_ptr<EventLoop>> create();
    ~EventLoop();
    EventLoop(const EventLoop&) = delete;
    EventLoop& operator=(const EventLoop&) = delete;

    Result<RegistrationId> add(int fd, std::uint32_t events, std::shared_ptr<EventSource> source);
    MaybeError modify(RegistrationId id, int fd, std::uint32_t events);
    void remove(RegistrationId id, int fd);

    // Runs the closure on the loop thread, soon.
    void post(std::function<void()> work);

    // Runs the closure on the loop thread once, after the delay.
    void postAfter(std::chrono::milliseconds delay, std::function<void()> work);
    // Runs `tick` on the loop thread every `interval` (first after one interval).
    void setTicker(std::chrono::milliseconds interval, std::function<void()> tick);

    // Dispatches events until stop(); returns after stop().
    void run();
    void stop();
    bool isCurrent() const noexcept;

private:
    EventLoop(UniqueFd epoll, UniqueFd wake);
    void drainPosted();
    int nextTimeoutMs() const;

    UniqueFd epoll_;
    UniqueFd wake_;  // eventfd for post() and stop()
    std::mutex mutex_;
    std::unordered_map<RegistrationId, std::shared_ptr<EventSource>> sources_;
    std::vector<std::function<void()>> posted_;
    RegistrationId nextId_ = 1;
    std::atomic<bool> stopping_{false};
    std::atomic<std::uint64_t> loopThread_{0};
    struct Timer {
        std::chrono::steady_clock::time_point due;
        std::chrono::milliseconds period;  // zero: once
        std::function<void()> work;
    };
    void runDueTimers();
    std::vector<Timer> timers_;  // loop thread only
};

}  // namespace qm
