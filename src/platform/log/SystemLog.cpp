#include "platform/log/SystemLog.h"

#include <syslog.h>
#include <unistd.h>

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

}  // namespace

void openSystemLog(const char* ident) {
    ::openlog(ident, LOG_NDELAY | LOG_PID, LOG_DAEMON);
}

void systemLog(int level, std::string_view line) {
    ::syslog(level, "%.*s", static_cast<int>(line.size()), line.data());
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
