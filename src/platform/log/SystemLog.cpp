#include "platform/log/SystemLog.h"

#include <syslog.h>
#include <unistd.h>

#include <sys/stat.h>

#include <atomic>
#include <chrono>
#include <mutex>

#include "platform/env/Environment.h"

namespace qm {

namespace {

std::mutex& observerMutex() {
    static std::mutex mutex;
    return mutex;
}

LogObserver& observer() {
    static LogObserver instance;
    return instance;
}

void writeToStderr(std::string_view line) {
    std::string buffer;
    buffer.reserve(line.size() + 1);
    buffer.append(line);
    buffer += '\n';
    // One write per line keeps lines from concurrent threads whole.
    const char* p = buffer.data();
    std::size_t left = buffer.size();
    while (left > 0) {
        ssize_t n = ::write(STDERR_FILENO, p, left);
        if (n <= 0) {
            return;
        }
        p += n;
        left -= static_cast<std::size_t>(n);
    }
}

// glibc tries to reconnect to /dev/log on every line while no log daemon
// listens there (a container, an early boot): three wasted system calls per
// line. So lines go to syslog(3) only while /dev/log exists, which is looked
// at again at most once a second.
class SyslogGate {
public:
    bool open() {
        auto now = std::chrono::steady_clock::now().time_since_epoch().count();
        if (available_.load(std::memory_order_relaxed)) {
            return true;
        }
        auto next = nextProbe_.load(std::memory_order_relaxed);
        if (now < next || !nextProbe_.compare_exchange_strong(next, now + kProbeInterval)) {
            return false;
        }
        struct stat info{};
        bool present = ::stat("/dev/log", &info) == 0;
        available_.store(present);
        return present;
    }

private:
    static constexpr std::int64_t kProbeInterval = 1'000'000'000;  // steady_clock ticks are nanoseconds
    std::atomic<bool> available_{false};
    std::atomic<std::int64_t> nextProbe_{0};
};

SyslogGate& syslogGate() {
    static SyslogGate gate;
    return gate;
}

}  // namespace

void openSystemLog(const char* ident) {
    ::openlog(ident, LOG_NDELAY | LOG_PID, LOG_DAEMON);
}

void systemLog(int level, std::string_view line) {
    if (syslogGate().open()) {
        ::syslog(level, "%.*s", static_cast<int>(line.size()), line.data());
    }
    if (environment().logToStderr) {
        writeToStderr(line);
    }
    std::lock_guard lock(observerMutex());
    if (observer()) {
        observer()(level, line);
    }
}

void setLogObserver(LogObserver newObserver) {
    std::lock_guard lock(observerMutex());
    observer() = std::move(newObserver);
}

}  // namespace qm
