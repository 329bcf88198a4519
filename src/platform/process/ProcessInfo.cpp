#include "platform/process/ProcessInfo.h"

#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>

namespace qm {

std::optional<std::string> executablePathOfProcess(pid_t pid) {
    if (pid <= 0) {
        return std::nullopt;
    }
    std::string link = "/proc/" + std::to_string(pid) + "/exe";
    char buffer[2048];
    ssize_t n = ::readlink(link.c_str(), buffer, sizeof buffer);
    if (n <= 0 || static_cast<std::size_t>(n) >= sizeof buffer) {
        return std::nullopt;
    }
    return std::string(buffer, static_cast<std::size_t>(n));
}

UniqueFd openPidfd(pid_t pid) {
    if (pid <= 0) {
        return UniqueFd();
    }
    return UniqueFd(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
}

bool pidfdProcessAlive(int pidfd) {
    if (pidfd < 0) {
        return false;
    }
    return ::syscall(SYS_pidfd_send_signal, pidfd, 0, nullptr, 0) == 0 || errno == EPERM;
}

}  // namespace qm
