#pragma once
// A serial work queue: jobs run one at a time, in submission order, each to
// completion. Objects that live on a queue are reached by submitting to it,
// not by locking; functions that must run there say so with assertCurrent().
//
// Each queue has one worker thread. A queue made with `runsInlineWhenIdle`
// runs a submitted job directly on the submitting thread when nothing is
// running or waiting on the queue (still one job at a time, and still "on"
// the queue for isCurrent()); this saves two thread hops per request on the
// daemon's hot path. Jobs submitted meanwhile wait for the worker.
//
// sync() blocks the caller until its job has run. Calling sync() on the queue
// one is already running on is a deadlock and asserts; by the daemon's lock
// order nothing on the registry queue or syncQueue calls sync() on another queue.

#include <condition_variable>
#include <deque>
#include <functional>
#include <mutex>
#include <string>
#include <thread>

namespace qm {

// Quality-of-service classes, mapped to thread nice values (see .cpp).
enum class QualityOfService : int {
    background = 9,
    utility = 17,
    standard = 21,
    userInitiated = 25,
    userInteractive = 33,
};

class SerialQueue {
public:
    explicit SerialQueue(std::string label, QualityOfService qos = QualityOfService::standard,
                         bool runsInlineWhenIdle = false);
    // Runs the jobs still waiting, then stops the worker.
    ~SerialQueue();
    SerialQueue(const SerialQueue&) = delete;
    SerialQueue& operator=(const SerialQueue&) = delete;

    // The job runs once; on an idle inline queue, before async() returns.
    template <class Job>
    void async(Job&& job) {
        if (runsInlineWhenIdle_ && !isCurrent() && tryClaimIdle()) {
            // No std::function (and no allocation) on the inline path.
            runInline(job);
            return;
        }
        enqueue(std::function<void()>(std::forward<Job>(job)));
    }
    // Blocks until the job has run on this queue.
    void sync(const std::function<void()>& job);

    // True when the calling code runs as a job of this queue.
    bool isCurrent() const noexcept;
    void assertCurrent() const noexcept;

    // True while a job runs or waits.
    bool busy() const;
    const std::string& label() const noexcept { return label_; }

private:
    void workerLoop();
    void enqueue(std::function<void()> job);
    void runAsCurrent(const std::function<void()>& job);
    template <class Job>
    void runInline(Job& job) {
        const SerialQueue* outer = enterQueue();
        job();
        leaveQueue(outer);
        releaseClaim();
    }
    const SerialQueue* enterQueue() noexcept;
    void leaveQueue(const SerialQueue* outer) noexcept;
    bool tryClaimIdle();           // takes the queue for the calling thread when idle
    void releaseClaim();

    const std::string label_;
    const QualityOfService qos_;
    const bool runsInlineWhenIdle_;
    mutable std::mutex mutex_;
    std::condition_variable wake_;
    std::deque<std::function<void()>> pending_;
    bool running_ = false;  // a thread owns the queue and runs a job
    bool stopping_ = false;
    std::thread worker_;
};

}  // namespace qm
