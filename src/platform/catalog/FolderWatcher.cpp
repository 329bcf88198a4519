#include "platform/catalog/FolderWatcher.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "platform/log/SystemLog.h"

namespace qm {

namespace {

constexpr std::uint32_t kWatchedEvents = IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_CLOSE_WRITE |
                                         IN_ATTRIB | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;

void addOnce(std::vector<int>& list, int descriptor) {
    if (std::find(list.begin(), list.end(), descriptor) == list.end()) {
        list.push_back(descriptor);
    }
}

}  // namespace

Result<std::unique_ptr<FolderWatcher>> FolderWatcher::start(std::chrono::milliseconds coalescing, Handler handler) {
    UniqueFd inotify(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
    if (!inotify) {
        return posixError(errno, "inotify_init1");
    }
    UniqueFd stop(::eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC));
    if (!stop) {
        return posixError(errno, "eventfd");
    }
    return std::unique_ptr<FolderWatcher>(
        new FolderWatcher(std::move(inotify), std::move(stop), coalescing, std::move(handler)));
}

FolderWatcher::FolderWatcher(UniqueFd inotify, UniqueFd stop, std::chrono::milliseconds coalescing, Handler handler)
    : inotify_(std::move(inotify)), stop_(std::move(stop)), coalescing_(coalescing), handler_(std::move(handler)) {
    reader_ = std::thread([this] { readLoop(); });
}

FolderWatcher::~FolderWatcher() {
    stop();
}

void FolderWatcher::stop() {
    if (!reader_.joinable()) {
        return;
    }
    std::uint64_t one = 1;
    [[maybe_unused]] auto written = ::write(stop_.get(), &one, sizeof one);
    reader_.join();
}

Result<int> FolderWatcher::watch(const std::string& folder) {
    int descriptor = ::inotify_add_watch(inotify_.get(), folder.c_str(), kWatchedEvents);
    if (descriptor < 0) {
        return posixError(errno, "inotify_add_watch " + folder);
    }
    return descriptor;
}

void FolderWatcher::unwatch(int descriptor) {
    ::inotify_rm_watch(inotify_.get(), descriptor);
}

void FolderWatcher::readLoop() {
    using Clock = std::chrono::steady_clock;
    Events pending;
    bool collecting = false;
    Clock::time_point deadline;
    for (;;) {
        int timeout = -1;
        if (collecting) {
            auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now()).count();
            timeout = static_cast<int>(std::max<long long>(left, 0));
        }
        pollfd fds[2] = {{inotify_.get(), POLLIN, 0}, {stop_.get(), POLLIN, 0}};
        int ready = ::poll(fds, 2, timeout);
        if (ready < 0 && errno != EINTR) {
            systemLogf(kLogNotice, "catalog folder watch stopped: poll: %@", std::strerror(errno));
            return;
        }
        if (ready > 0 && (fds[1].revents & POLLIN) != 0) {
            return;
        }
        if (ready > 0 && (fds[0].revents & POLLIN) != 0) {
            if (!drain(pending)) {
                return;
            }
            bool something = pending.overflowed || !pending.touched.empty() || !pending.removed.empty();
            if (something && !collecting) {
                collecting = true;
                deadline = Clock::now() + coalescing_;
            }
        }
        if (collecting && Clock::now() >= deadline) {
            collecting = false;
            handler_(std::exchange(pending, Events{}));
        }
    }
}

bool FolderWatcher::drain(Events& pending) {
    alignas(inotify_event) char buffer[16 * 1024];
    for (;;) {
        ssize_t got = ::read(inotify_.get(), buffer, sizeof buffer);
        if (got < 0) {
            if (errno == EINTR) {
                continue;
            }
            if (errno == EAGAIN) {
                return true;
            }
            systemLogf(kLogNotice, "catalog folder watch stopped: read: %@", std::strerror(errno));
            return false;
        }
        for (ssize_t offset = 0; offset < got;) {
            inotify_event event;
            std::memcpy(&event, buffer + offset, sizeof event);
            offset += static_cast<ssize_t>(sizeof(inotify_event) + event.len);
            if ((event.mask & IN_Q_OVERFLOW) != 0) {
                pending.overflowed = true;
            } else if ((event.mask & IN_IGNORED) != 0) {
                addOnce(pending.removed, event.wd);
            } else {
                addOnce(pending.touched, event.wd);
            }
        }
    }
}

}  // namespace qm
