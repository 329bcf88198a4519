#pragma once
// The daemon's side of named notifications (a coalescing notify-post):
// posting N rewrites <runtime directory>/notify/N with the count of posts of
// N since reset(). Any process on the machine observes with inotify
// (IN_MOVED_TO in that folder; see NotificationWatcher); this process can
// also observe in-process through setObserver(), for tests.
//
// Thread-safe: posts may come from any thread. They are serialized, so a
// name's file never goes back to a smaller count.

#include <cstdint>
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <string_view>

#include "platform/error/Error.h"

namespace qm {

class NotificationPoster {
public:
    // runtimeDirectory is the Duct runtime directory (ductRuntimeDirectory()),
    // which must exist by reset(); nothing is touched until then.
    explicit NotificationPoster(std::string runtimeDirectory);

    const std::string& directory() const noexcept { return directory_; }

    // Makes the notify folder (0700; an existing one is set to 0700), deletes
    // every file in it (counts of an earlier daemon, leftover temporaries)
    // and sets every count to 0. The daemon calls it once at start, before
    // it serves. An error when the folder cannot be made or is not a folder;
    // files that cannot be deleted are logged and left.
    MaybeError reset();

    // Counts one more post of name and rewrites its file (a temporary renamed
    // over it). Returns when the file is in place, so a post made while
    // serving a request is visible before that request's reply. A name that
    // is not isNotificationName() is refused (EINVAL); a file that cannot be
    // written is an error (logged here as well); the post is counted either way.
    MaybeError post(std::string_view name);

    // Posts of name since reset().
    std::uint64_t count(std::string_view name) const;

    // Called after every counted post, on the posting thread, outside the
    // poster's lock, with the name and its new count. Null removes it.
    using Observer = std::function<void(const std::string& name, std::uint64_t count)>;
    void setObserver(Observer observer);

private:
    MaybeError writeCount(const std::string& name, std::uint64_t count) const;

    std::string directory_;
    mutable std::mutex mutex_;  // guards counts_ and the files; held across each write
    std::map<std::string, std::uint64_t, std::less<>> counts_;
    std::mutex observerMutex_;
    Observer observer_;
};

}  // namespace qm
