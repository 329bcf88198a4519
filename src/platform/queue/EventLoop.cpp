#include "platform/queue/EventLoop.h"

#include <pthread.h>
#include <sys/eventfd.h>

#include <cassert>
#include <algorithm>
#include <cerrno>

namespace qm {

namespace {

constexpr EventLoop::RegistrationId kWakeId = 0;

std::uint64_t thisThreadId() {
    return static_cast<std::uint64_t>(::pthread_self());
}

}  // namespace

Result<std::unique_ptr<EventLoop>> EventLoop::create() {
    UniqueFd epoll(::epoll_create1(EPOLL_CLOEXEC));
    if (!epoll) {
        return posixError(errno, "epoll_create1");
    }
    UniqueFd wake(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    if (!wake) {
        return posixError(errno, "eventfd");
    }
    epoll_event event{};
    event.events = EPOLLIN;
    event.data.u64 = kWakeId;
    if (::epoll_ctl(epoll.get(), EPOLL_CTL_ADD, wake.get(), &event) != 0) {
        return posixError(errno, "epoll_ctl");
    }
    return std::unique_ptr<EventLoop>(new EventLoop(std::move(epoll), std::move(wake)));
}

EventLoop::EventLoop(UniqueFd epoll, UniqueFd wake) : epoll_(std::move(epoll)), wake_(std::move(wake)) {}

EventLoop::~EventLoop() = default;

Result<EventLoop::RegistrationId> EventLoop::add(int fd, std::uint32_t events, std::shared_ptr<EventSource> source) {
    RegistrationId id;
    {
        std::lock_guard lock(mutex_);
        id = nextId_++;
        sources_.emplace(id, std::move(source));
    }
    epoll_event event{};
    event.events = events;
    event.data.u64 = id;
    if (::epoll_ctl(epoll_.get(), EPOLL_CTL_ADD, fd, &event) != 0) {
        int error = errno;
        std::lock_guard lock(mutex_);
        sources_.erase(id);
        return posixError(error, "epoll_ctl add");
    }
    return id;
}

MaybeError EventLoop::modify(RegistrationId id, int fd, std::uint32_t events) {
    epoll_event event{};
    event.events = events;
    event.data.u64 = id;
    if (::epoll_ctl(epoll_.get(), EPOLL_CTL_MOD, fd, &event) != 0) {
        return posixError(errno, "epoll_ctl modify");
    }
    return std::nullopt;
}

void EventLoop::remove(RegistrationId id, int fd) {
    ::epoll_ctl(epoll_.get(), EPOLL_CTL_DEL, fd, nullptr);
    std::shared_ptr<EventSource> released;
    {
        std::lock_guard lock(mutex_);
        auto it = sources_.find(id);
        if (it == sources_.end()) {
            return;
        }
        released = std::move(it->second);
        sources_.erase(it);
    }
    // `released` may be the last reference: destroy it outside the lock.
}

void EventLoop::post(std::function<void()> work) {
    {
        std::lock_guard lock(mutex_);
        posted_.push_back(std::move(work));
    }
    std::uint64_t one = 1;
    [[maybe_unused]] ssize_t n = ::write(wake_.get(), &one, sizeof one);
}

void EventLoop::postAfter(std::chrono::milliseconds delay, std::function<void()> work) {
    post([this, delay, work = std::move(work)]() mutable {
        timers_.push_back(Timer{std::chrono::steady_clock::now() + delay, std::chrono::milliseconds(0), std::move(work)});
    });
}

void EventLoop::setTicker(std::chrono::milliseconds interval, std::function<void()> tick) {
    post([this, interval, tick = std::move(tick)]() mutable {
        timers_.push_back(Timer{std::chrono::steady_clock::now() + interval, interval, std::move(tick)});
    });
}

void EventLoop::runDueTimers() {
    auto now = std::chrono::steady_clock::now();
    std::vector<std::function<void()>> due;
    for (auto it = timers_.begin(); it != timers_.end();) {
        if (it->due > now) {
            ++it;
            continue;
        }
        if (it->period.count() > 0) {
            due.push_back(it->work);
            it->due = now + it->period;
            ++it;
        } else {
            due.push_back(std::move(it->work));
            it = timers_.erase(it);
        }
    }
    for (auto& work : due) {
        work();
    }
}

void EventLoop::drainPosted() {
    std::uint64_t count;
    while (::read(wake_.get(), &count, sizeof count) > 0) {
    }
    std::vector<std::function<void()>> work;
    {
        std::lock_guard lock(mutex_);
        work.swap(posted_);
    }
    for (auto& job : work) {
        job();
    }
}

int EventLoop::nextTimeoutMs() const {
    if (timers_.empty()) {
        return -1;
    }
    auto next = timers_.front().due;
    for (const auto& timer : timers_) {
        next = std::min(next, timer.due);
    }
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(next - std::chrono::steady_clock::now());
    return left.count() < 0 ? 0 : static_cast<int>(left.count()) + 1;
}

void EventLoop::run() {
    loopThread_.store(thisThreadId());
    constexpr int kBatch = 64;
    epoll_event events[kBatch];
    while (!stopping_.load()) {
        int n = ::epoll_wait(epoll_.get(), events, kBatch, nextTimeoutMs());
        if (n < 0 && errno != EINTR) {
            break;  // the epoll descriptor itself is broken: nothing more can be served
        }
        for (int i = 0; i < n; ++i) {
            RegistrationId id = events[i].data.u64;
            if (id == kWakeId) {
                drainPosted();
                continue;
            }
            std::shared_ptr<EventSource> source;
            {
                std::lock_guard lock(mutex_);
                auto it = sources_.find(id);
                if (it == sources_.end()) {
                    continue;  // removed earlier in this batch
                }
                source = it->second;
            }
            source->handleEvents(events[i].events);
        }
        if (!timers_.empty()) {
            runDueTimers();
        }
    }
    loopThread_.store(0);
}

void EventLoop::stop() {
    stopping_.store(true);
    std::uint64_t one = 1;
    [[maybe_unused]] ssize_t n = ::write(wake_.get(), &one, sizeof one);
}

bool EventLoop::isCurrent() const noexcept {
    return loopThread_.load() == thisThreadId();
}

}  // namespace qm
