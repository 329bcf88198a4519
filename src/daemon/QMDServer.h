#pragma once
// The daemon's one server: the listener on the named service, the queues on
// which everything runs, and the daemon's two log operations.
//
// Queues: `ductQueue` receives new connections; `mainQueue` runs every
// transaction of every client, one at a time; `syncQueue` guards the holds.
// Connection events arrive on the event-loop thread (the main thread, parked
// in run()). Nothing on `syncQueue` waits on another queue.
//
// The server lives for the whole process; there is no orderly shutdown.

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/duct/Listener.h"
#include "platform/log/SystemLog.h"
#include "platform/queue/EventLoop.h"
#include "platform/queue/SerialQueue.h"

class QMDDuctClient;

class QMDServer {
public:
    // Builds the server and its listener (not yet resumed); an error when the
    // service cannot be claimed. The new server becomes the process-wide one.
    static qm::Result<QMDServer*> initForService(const std::string& serviceName,
                                                 std::optional<std::string> databasePath);
    // The process-wide server; null before initForService.
    static QMDServer* server();

    // Resumes the listener, then runs the event loop on the calling (main)
    // thread. Returns only when the loop is stopped.
    void run();

    // Submits a work item to mainQueue: the only way transactions reach it.
    template <class Work>
    void submitWork(Work&& work) {
        mainQueue_->async(std::forward<Work>(work));
    }

    // Releases every hold that the client owns; enters syncQueue synchronously.
    void unholdClient(const QMDDuctClient& client);

    template <class... Args>
    void log(std::string_view format, const Args&... args) const {
        logLevel(qm::kLogNotice, format, args...);
    }
    // Written only at verbosity 1 or more; the arguments are not formatted otherwise.
    template <class... Args>
    void debug(std::string_view format, const Args&... args) const {
        if (verbose() != 0) {
            logLevel(qm::kLogInfo, format, args...);
        }
    }
    // The level is accepted and not used: it neither filters nor appears.
    template <class... Args>
    void logLevel(int /*level*/, std::string_view format, const Args&... args) const {
        qm::systemLog(qm::kLogNotice, qm::format(format, args...));
    }

    std::uint32_t verbose() const noexcept { return verbose_.load(); }
    void setVerbose(std::uint32_t level) noexcept { verbose_.store(level); }

    qm::SerialQueue& ductQueue() noexcept { return *ductQueue_; }
    qm::SerialQueue& mainQueue() noexcept { return *mainQueue_; }
    qm::SerialQueue& syncQueue() noexcept { return *syncQueue_; }
    qm::EventLoop& eventLoop() noexcept { return *loop_; }
    const std::optional<std::string>& databasePath() const noexcept { return databasePath_; }

private:
    QMDServer(std::unique_ptr<qm::EventLoop> loop, std::optional<std::string> databasePath);
    void startIdleExitWatch(unsigned seconds);

    std::atomic<std::uint32_t> verbose_{0};
    std::unique_ptr<qm::EventLoop> loop_;
    std::unique_ptr<qm::SerialQueue> ductQueue_;
    std::unique_ptr<qm::SerialQueue> mainQueue_;
    std::unique_ptr<qm::SerialQueue> syncQueue_;
    std::shared_ptr<qm::duct::Listener> service_;
    std::optional<std::string> databasePath_;
};
