#pragma once
// The daemon's one server: the listener on the named service, the queues on
// which everything runs, the registry, the holds and the daemon's two log
// operations.
//
// Queues: `ductQueue` receives new connections; `mainQueue` runs every
// transaction of every client, one at a time; the holds' `syncQueue` guards
// the holds. Connection events arrive on the event-loop thread (the main
// thread, parked in run()), which never blocks. Nothing on `syncQueue` or the
// registry queue waits on another queue.
//
// The server lives for the whole process. It ends on SIGTERM or SIGINT, or
// when idle with QM_IDLE_EXIT, always the same way: see exitInOrder().

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "discovery/QMDUserPrefs.h"
#include "platform/duct/Listener.h"
#include "platform/log/Logger.h"
#include "platform/notify/NotificationPoster.h"
#include "platform/process/TerminationSignals.h"
#include "platform/queue/EventLoop.h"
#include "platform/queue/SerialQueue.h"
#include "registry/HoldList.h"
#include "registry/QMDatabase.h"

class QMDServer {
public:
    // Builds the server around its registry, and its listener (not yet
    // resumed); an error when the service cannot be claimed. The new server
    // becomes the process-wide one. `idleExitSeconds`: exit when idle that long.
    static qm::Result<QMDServer*> initForService(const std::string& serviceName, std::unique_ptr<QMDatabase> registry,
                                                 std::optional<unsigned> idleExitSeconds = std::nullopt);
    // The process-wide server; null before initForService.
    static QMDServer* server();

    // Runs the event loop on the calling (main) thread; the listener is
    // resumed once the registry is ready, so no request is answered before
    // the registry's first scan is committed. Returns only when the loop is
    // stopped (tests); the daemon itself ends in exitInOrder().
    void run();
    // Stops the event loop (tests).
    void stop();

    // Submits a transaction to mainQueue, the only way transactions reach it.
    // `mayRunOnCaller`: the work blocks nothing, so it may run on the
    // submitting thread when mainQueue is idle; otherwise it runs on
    // mainQueue's worker, which writes its own reply.
    template <class Work>
    void submitWork(Work&& work, bool mayRunOnCaller) {
        if (mayRunOnCaller) {
            mainQueue_->async(std::forward<Work>(work));
        } else {
            mainQueue_->asyncOnWorker(std::forward<Work>(work));
        }
    }

    template <class... Args>
    void log(std::string_view format, const Args&... args) const {
        logger_.log(format, args...);
    }
    // Written only at verbosity 1 or more; the arguments are not formatted otherwise.
    template <class... Args>
    void debug(std::string_view format, const Args&... args) const {
        logger_.debug(format, args...);
    }
    const qm::Logger& logger() const noexcept { return logger_; }
    std::uint32_t verbose() const noexcept { return logger_.verbose(); }
    void setVerbose(std::uint32_t level) noexcept { logger_.setVerbose(level); }

    QMDatabase& registry() noexcept { return *registry_; }
    HoldList& holds() noexcept { return holds_; }
    QMDUserPrefs& userPrefs() noexcept { return userPrefs_; }  // mainQueue only
    qm::NotificationPoster& notifications() noexcept { return notifications_; }

    // The registry's delegate: the catalog uninstalls these plug-ins, whose
    // services go (on mainQueue, never waiting for it).
    void removedPlugIns(const std::vector<qm::PlugInRecordPtr>& records);
    qm::SerialQueue& ductQueue() noexcept { return *ductQueue_; }
    qm::SerialQueue& mainQueue() noexcept { return *mainQueue_; }
    qm::SerialQueue& syncQueue() noexcept { return holds_.syncQueue(); }
    qm::EventLoop& eventLoop() noexcept { return *loop_; }

    // True once the daemon is ending: transactions not yet dispatched are dropped.
    bool stopping() const noexcept { return stopping_.load(); }

private:
    QMDServer(std::unique_ptr<qm::EventLoop> loop, std::unique_ptr<QMDatabase> registry);
    void resumeListener();
    void startIdleExitWatch(unsigned seconds);
    // Loop thread. Stops accepting, drops queued transactions, lets the
    // running one write its reply and the backlogs drain (5 s at most),
    // removes a socket it bound itself, logs `line` and _exit(0)s: static
    // destructors never run while queue threads live, and holds vanish with
    // the process.
    void exitInOrder(std::string line);

    qm::Logger logger_;
    std::atomic<bool> stopping_{false};
    std::unique_ptr<qm::EventLoop> loop_;
    std::unique_ptr<QMDatabase> registry_;
    qm::NotificationPoster notifications_;
    HoldList holds_;
    QMDUserPrefs userPrefs_;
    std::unique_ptr<qm::SerialQueue> ductQueue_;
    std::unique_ptr<qm::SerialQueue> mainQueue_;
    std::shared_ptr<qm::duct::Listener> service_;
    std::shared_ptr<qm::TerminationSignals> signals_;
};
