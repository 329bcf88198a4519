#pragma once
// The plug-in registry. The daemon answers no request before the registry is
// ready, that is, before its first scan of the installed plug-ins is
// committed: a request that arrives earlier waits in the socket's backlog.
//
// Thread-safety: whenReady() and markReady() may be called from any thread.

#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

class QMDatabase {
public:
    // `databasePath`: the annotations file to use instead of the default one.
    explicit QMDatabase(std::optional<std::string> databasePath);

    // Runs `ready` once the registry is ready: at once, on the calling
    // thread, when it already is; otherwise on the thread that marks it ready.
    void whenReady(std::function<void()> ready);
    // The first scan is committed. Later calls change nothing.
    void markReady();
    bool isReady() const;

    const std::optional<std::string>& databasePath() const noexcept { return databasePath_; }

private:
    const std::optional<std::string> databasePath_;
    mutable std::mutex mutex_;
    bool ready_ = false;
    std::vector<std::function<void()>> waiting_;
};
