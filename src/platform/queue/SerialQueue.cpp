#include "platform/queue/SerialQueue.h"

#include <pthread.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cassert>

namespace qm {

namespace {

thread_local const SerialQueue* currentQueue = nullptr;

// Linux has no QoS classes; the nearest lever for a normal thread is its
// nice value. Raising priority needs CAP_SYS_NICE: without it the thread
// keeps the default, which is harmless.
int niceValueFor(QualityOfService qos) {
    switch (qos) {
        case QualityOfService::userInteractive: return -10;
        case QualityOfService::userInitiated: return -5;
        case QualityOfService::standard: return 0;
        case QualityOfService::utility: return 5;
        case QualityOfService::background: return 10;
    }
    return 0;
}

void nameThisThread(const std::string& label) {
    std::string name = label.substr(0, 15);  // the kernel keeps 15 characters
    ::pthread_setname_np(::pthread_self(), name.c_str());
}

}  // namespace

SerialQueue::SerialQueue(std::string label, QualityOfService qos, bool runsInlineWhenIdle)
    : label_(std::move(label)), qos_(qos), runsInlineWhenIdle_(runsInlineWhenIdle) {
    worker_ = std::thread([this] {
        nameThisThread(label_);
        ::setpriority(PRIO_PROCESS, static_cast<id_t>(::syscall(SYS_gettid)), niceValueFor(qos_));
        workerLoop();
    });
}

SerialQueue::~SerialQueue() {
    {
        std::lock_guard lock(mutex_);
        stopping_ = true;
    }
    wake_.notify_all();
    if (worker_.joinable()) {
        worker_.join();
    }
}

void SerialQueue::workerLoop() {
    std::unique_lock lock(mutex_);
    for (;;) {
        wake_.wait(lock, [this] { return (!running_ && !pending_.empty()) || (stopping_ && pending_.empty() && !running_); });
        if (pending_.empty()) {
            return;  // stopping, nothing left
        }
        std::function<void()> job = std::move(pending_.front());
        pending_.pop_front();
        running_ = true;
        lock.unlock();
        runAsCurrent(job);
        job = nullptr;  // destroy captures off the lock, still on this thread
        lock.lock();
        running_ = false;
    }
}

const SerialQueue* SerialQueue::enterQueue() noexcept {
    const SerialQueue* outer = currentQueue;
    currentQueue = this;
    return outer;
}

void SerialQueue::leaveQueue(const SerialQueue* outer) noexcept {
    currentQueue = outer;
}

void SerialQueue::runAsCurrent(const std::function<void()>& job) {
    const SerialQueue* outer = enterQueue();
    job();
    leaveQueue(outer);
}

bool SerialQueue::tryClaimIdle() {
    std::lock_guard lock(mutex_);
    if (running_ || !pending_.empty() || stopping_) {
        return false;
    }
    running_ = true;
    return true;
}

void SerialQueue::releaseClaim() {
    bool jobsWaiting;
    {
        std::lock_guard lock(mutex_);
        running_ = false;
        jobsWaiting = !pending_.empty();
    }
    // Jobs that arrived while the caller held the queue are the worker's.
    // Waking it for nothing would cost a context switch per job.
    if (jobsWaiting) {
        wake_.notify_all();
    }
}

void SerialQueue::enqueue(std::function<void()> job) {
    assert(job);
    {
        std::lock_guard lock(mutex_);
        pending_.push_back(std::move(job));
    }
    wake_.notify_all();
}

void SerialQueue::sync(const std::function<void()>& job) {
    assert(!isCurrent() && "sync() onto the queue already running: deadlock");
    if (tryClaimIdle()) {
        runAsCurrent(job);
        releaseClaim();
        return;
    }
    std::mutex doneMutex;
    std::condition_variable doneSignal;
    bool done = false;
    async([&] {
        job();
        std::lock_guard lock(doneMutex);
        done = true;
        doneSignal.notify_one();
    });
    std::unique_lock lock(doneMutex);
    doneSignal.wait(lock, [&] { return done; });
}

bool SerialQueue::isCurrent() const noexcept {
    return currentQueue == this;
}

void SerialQueue::assertCurrent() const noexcept {
    assert(isCurrent() && "must run on this queue");
}

bool SerialQueue::busy() const {
    std::lock_guard lock(mutex_);
    return running_ || !pending_.empty();
}

}  // namespace qm
