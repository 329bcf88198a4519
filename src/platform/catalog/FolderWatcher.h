#pragma once
// Watches folders with inotify and reports, in batches, which of them saw
// something happen: an entry created, deleted, moved in or out, written or
// changed in its attributes, or the folder itself deleted or moved.
//
// A reader thread of its own collects events for a coalescing period after
// the first one and then calls the handler once with the batch (on the
// reader thread: the handler should only hand the batch on). watch() and
// unwatch() may be called from any thread. The destructor stops the reader
// and waits for it (as stop() does); no handler call runs after either returns.

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/error/Error.h"
#include "platform/fd/UniqueFd.h"

namespace qm {

class FolderWatcher {
public:
    struct Events {
        std::vector<int> touched;  // watch descriptors, each once
        std::vector<int> removed;  // watches the kernel dropped (folder gone)
        bool overflowed = false;   // the kernel's queue overflowed: events were lost
    };
    using Handler = std::function<void(Events)>;

    static Result<std::unique_ptr<FolderWatcher>> start(std::chrono::milliseconds coalescing, Handler handler);
    ~FolderWatcher();
    FolderWatcher(const FolderWatcher&) = delete;
    FolderWatcher& operator=(const FolderWatcher&) = delete;

    // The descriptor of the watch on folder (the same one for a folder
    // watched already). Errors are posix: ENOSPC when the user's watches are
    // used up, ENOENT or ENOTDIR when there is no such folder.
    Result<int> watch(const std::string& folder);
    void unwatch(int descriptor);
    // Stops the reader for good; watch() and unwatch() still work, silently.
    void stop();

private:
    FolderWatcher(UniqueFd inotify, UniqueFd stop, std::chrono::milliseconds coalescing, Handler handler);
    void readLoop();
    // Reads what is queued; false when the watcher must stop reading.
    bool drain(Events& pending);

    UniqueFd inotify_;
    UniqueFd stop_;
    const std::chrono::milliseconds coalescing_;
    Handler handler_;
    std::thread reader_;
};

}  // namespace qm
