#include "platform/queue/SerialQueue.h"

#include <pthread.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cassert>

namespace qm {

namespace {


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
        QueuedJob job = std::move(pending_.front());
        pending_.pop_front();
        running_ = true;
        lock.unlock();
        runAsCurrent(job);
        { QueuedJob destroyed = std::move(job); }  // captures go off the lock, still on this thread
        lock.lock();
        running_ = false;
    }
}

thread_local const SerialQueue::Running* SerialQueue::innermost_ = nullptr;

void SerialQueue::runAsCurrent(QueuedJob& job) {
    ScopedRunning running(this);
    job();
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

void SerialQueue::enqueue(QueuedJob job) {
    assert(job);
    {
        std::lock_guard lock(mutex_);
        pending_.push_back(std::move(job));
    }
    wake_.notify_all();
}

void SerialQueue::sync(const std::function<void()>& job) {
    assert(!heldByThisThread() && "sync() onto a queue this thread already runs: deadlock");
    if (tryClaimIdle()) {
        {
            ScopedRunning running(this);
            job();
        }
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
    return innermost_ != nullptr && innermost_->queue == this;
}

bool SerialQueue::heldByThisThread() const noexcept {
    for (const auto* entry = innermost_; entry; entry = entry->outer) {
        if (entry->queue == this) {
            return true;
        }
    }
    return false;
}

bool SerialQueue::runsOnAnyQueue() noexcept {
    return innermost_ != nullptr;
}

void SerialQueue::assertCurrent() const noexcept {
    assert(isCurrent() && "must run on this queue");
}

bool SerialQueue::busy() const {
    std::lock_guard lock(mutex_);
    return running_ || !pending_.empty();
}

}  // namespace qm
