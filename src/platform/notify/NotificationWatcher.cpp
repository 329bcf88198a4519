#include "platform/notify/NotificationWatcher.h"

#include <poll.h>
#include <sys/inotify.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <set>
#include <string_view>
#include <vector>

#include "platform/file/FolderEntries.h"
#include "platform/notify/NotificationFiles.h"

namespace qm {

namespace {

constexpr std::uint32_t kWatchMask = IN_MOVED_TO | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;
constexpr std::uint32_t kWatchEnds = IN_DELETE_SELF | IN_MOVE_SELF | IN_IGNORED;

// What one drain of the inotify queue found.
struct Landings {
    std::vector<std::string> names;  // in order of arrival, each once
    std::set<std::string, std::less<>> known;
    bool overflowed = false;
    bool watchEnded = false;
    MaybeError failure;

    void add(std::string_view name) {
        if (isNotificationName(name) && known.emplace(name).second) {
            names.emplace_back(name);
        }
    }
};

void readEvents(int fd, Landings& landings) {
    alignas(struct inotify_event) char buffer[8192];
    for (;;) {
        ssize_t n = ::read(fd, buffer, sizeof buffer);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0 && errno != EAGAIN) {
            landings.failure = posixError(errno, "reading notification events");
        }
        if (n <= 0) {
            return;
        }
        std::size_t offset = 0;
        while (offset + sizeof(struct inotify_event) <= static_cast<std::size_t>(n)) {
            struct inotify_event event {};
            std::memcpy(&event, buffer + offset, sizeof event);
            const char* name = buffer + offset + sizeof event;
            offset += sizeof event + event.len;
            if ((event.mask & IN_Q_OVERFLOW) != 0) {
                landings.overflowed = true;
            }
            if ((event.mask & kWatchEnds) != 0) {
                landings.watchEnded = true;
            }
            if ((event.mask & IN_MOVED_TO) != 0 && event.len > 0) {
                landings.add(std::string_view(name, ::strnlen(name, event.len)));
            }
        }
    }
}

void addEveryName(const std::string& directory, Landings& landings) {
    auto names = folderEntryNames(directory);
    if (names) {
        for (const std::string& name : *names) {
            landings.add(name);
        }
    }
}

}  // namespace

Result<NotificationWatcher> NotificationWatcher::open(const std::string& runtimeDirectory) {
    std::string directory = notificationDirectory(runtimeDirectory);
    UniqueFd inotify(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
    if (!inotify) {
        return posixError(errno, "inotify");
    }
    if (::inotify_add_watch(inotify.get(), directory.c_str(), kWatchMask) < 0) {
        return posixError(errno, "watching " + directory);
    }
    return NotificationWatcher(std::move(inotify), std::move(directory));
}

Result<std::size_t> NotificationWatcher::waitForPosts(std::chrono::milliseconds timeout, const Callback& callback) {
    using Clock = std::chrono::steady_clock;
    const bool endless = timeout.count() < 0;
    const auto deadline = Clock::now() + (endless ? std::chrono::milliseconds(0) : timeout);
    for (;;) {
        if (watchEnded_) {
            return posixError(ENOENT, "no longer watching " + directory_);
        }
        int waitMs = -1;
        if (!endless) {
            auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now()).count();
            waitMs = static_cast<int>(std::clamp<std::int64_t>(left, 0, INT32_MAX));
        }
        struct pollfd ready {inotify_.get(), POLLIN, 0};
        int polled = ::poll(&ready, 1, waitMs);
        if (polled < 0 && errno != EINTR) {
            return posixError(errno, "waiting for notifications");
        }
        if (polled <= 0) {
            return std::size_t{0};
        }
        Landings landings;
        readEvents(inotify_.get(), landings);
        if (landings.failure) {
            return *landings.failure;
        }
        if (landings.overflowed) {
            addEveryName(directory_, landings);
        }
        watchEnded_ = landings.watchEnded;
        std::size_t calls = 0;
        for (const std::string& name : landings.names) {
            // An absent file (0) or an unreadable one: a restart removed it since.
            auto count = readNotificationCount(directory_, name);
            if (count.ok() && *count > 0) {
                callback(name, *count);
                ++calls;
            }
        }
        if (calls > 0) {
            return calls;
        }
    }
}

}  // namespace qm
