#pragma once
// A serial work queue: jobs run one at a time, in submission order, each to
// completion. Objects that live on a queue are reached by submitting to it,
// not by locking; functions that must run there say so with assertCurrent().
//
// Each queue has one worker thread. A queue made with `runsInlineWhenIdle`
// runs an async() job directly on the submitting thread when nothing is
// running or waiting on the queue and the submitting thread runs on no queue
// at all (still one job at a time, and still "on" the queue for isCurrent());
// this saves two thread hops per request on the daemon's hot path. Jobs
// submitted meanwhile wait for the worker. A thread that already runs a job
// never runs another queue's async job inline: X.sync -> Y.async -> X.sync
// would otherwise find X held by the very thread that waits for it.
//
// sync() blocks the caller until its job has run; on an idle queue the job
// runs on the caller's thread. Each thread keeps the stack of queues whose
// jobs it is running, so sync() onto any queue the calling thread holds,
// however deep, asserts instead of deadlocking. By the daemon's lock order
// nothing on the registry queue or syncQueue calls sync() on another queue.

#include <condition_variable>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <type_traits>

namespace qm {

// Quality-of-service classes, mapped to thread nice values (see .cpp).
enum class QualityOfService : int {
    background = 9,
    utility = 17,
    standard = 21,
    userInitiated = 25,
    userInteractive = 33,
};

// A job waiting on a queue: any callable, move-only ones included, so a job
// can own what it works on (a request and its reply slot) without shared
// ownership. One allocation per waiting job; none for a job run inline.
class QueuedJob {
public:
    template <class Job>
        requires(!std::is_same_v<std::decay_t<Job>, QueuedJob>)
    QueuedJob(Job&& job) : job_(std::make_unique<Holder<std::decay_t<Job>>>(std::forward<Job>(job))) {}  // NOLINT
    void operator()() { job_->run(); }
    explicit operator bool() const noexcept { return job_ != nullptr; }

private:
    struct Base {
        virtual ~Base() = default;
        virtual void run() = 0;
    };
    template <class Job>
    struct Holder final : Base {
        explicit Holder(Job&& j) : job(std::move(j)) {}
        explicit Holder(const Job& j) : job(j) {}
        void run() override { job(); }
        Job job;
    };
    std::unique_ptr<Base> job_;
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
        if (runsInlineWhenIdle_ && !runsOnAnyQueue() && tryClaimIdle()) {
            // No type erasure (and no allocation) on the inline path.
            runInline(job);
            return;
        }
        enqueue(QueuedJob(std::forward<Job>(job)));
    }
    // The job runs once, on the worker thread, never on the caller's: for
    // jobs that may block, submitted from a thread that must not.
    template <class Job>
    void asyncOnWorker(Job&& job) {
        enqueue(QueuedJob(std::forward<Job>(job)));
    }
    // Blocks until the job has run on this queue.
    void sync(const std::function<void()>& job);

    // True when the calling code runs as a job of this queue (the innermost
    // queue of the calling thread).
    bool isCurrent() const noexcept;
    // True when the calling thread runs a job of this queue at any depth.
    bool heldByThisThread() const noexcept;
    // True when the calling thread runs a job of any queue.
    static bool runsOnAnyQueue() noexcept;
    void assertCurrent() const noexcept;

    // True while a job runs or waits.
    bool busy() const;
    const std::string& label() const noexcept { return label_; }

private:
    void workerLoop();
    void enqueue(QueuedJob job);
    void runAsCurrent(QueuedJob& job);
    // Pushes this queue on the calling thread's stack of running queues for
    // its scope; the entry lives in the frame that runs the job, so the stack
    // costs no allocation.
    struct Running {
        const SerialQueue* queue;
        const Running* outer;
    };
    class ScopedRunning {
    public:
        explicit ScopedRunning(const SerialQueue* queue) noexcept : entry_{queue, innermost_} { innermost_ = &entry_; }
        ~ScopedRunning() { innermost_ = entry_.outer; }
        ScopedRunning(const ScopedRunning&) = delete;
        ScopedRunning& operator=(const ScopedRunning&) = delete;

    private:
        Running entry_;
    };
    template <class Job>
    void runInline(Job& job) {
        {
            ScopedRunning running(this);
            job();
        }
        releaseClaim();
    }
    static thread_local const Running* innermost_;
    bool tryClaimIdle();           // takes the queue for the calling thread when idle
    void releaseClaim();

    const std::string label_;
    const QualityOfService qos_;
    const bool runsInlineWhenIdle_;
    mutable std::mutex mutex_;
    std::condition_variable wake_;
    std::deque<QueuedJob> pending_;
    bool running_ = false;  // a thread owns the queue and runs a job
    bool stopping_ = false;
    std::thread worker_;
};

}  // namespace qm
