#pragma once
// Observes named notifications from any process: watches the notify folder
// of a runtime directory with inotify and reports each name whose count file
// landed (IN_MOVED_TO), with the count it then holds.
//
// Reports coalesce, like notify-post: posts of one name that arrive together
// are one report with the latest count, and a report may come late enough to
// show a later count than the post that caused it. After an inotify queue
// overflow every name present is reported.
//
// One thread uses one watcher at a time.

#include <chrono>
#include <cstdint>
#include <functional>
#include <string>

#include "platform/error/Error.h"
#include "platform/fd/UniqueFd.h"

namespace qm {

class NotificationWatcher {
public:
    using Callback = std::function<void(const std::string& name, std::uint64_t count)>;

    // Watches <runtimeDirectory>/notify. An error when that folder cannot be
    // watched, typically because no daemon has started there yet.
    static Result<NotificationWatcher> open(const std::string& runtimeDirectory);

    // Readable when reports are pending, for a caller's own poll or epoll.
    int descriptor() const noexcept { return inotify_.get(); }

    // Waits up to timeout (a negative one: without end) for posts, then calls
    // callback once per name that landed, on this thread. Returns the number
    // of calls: 0 when the time ran out or a signal interrupted the wait. An
    // error once the folder is removed or moved away (reports gathered with
    // that news are delivered first), or when inotify fails.
    Result<std::size_t> waitForPosts(std::chrono::milliseconds timeout, const Callback& callback);

private:
    NotificationWatcher(UniqueFd inotify, std::string directory)
        : inotify_(std::move(inotify)), directory_(std::move(directory)) {}

    UniqueFd inotify_;
    std::string directory_;
    bool watchEnded_ = false;
};

}  // namespace qm
