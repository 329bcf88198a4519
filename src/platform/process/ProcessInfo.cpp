#include "platform/process/ProcessInfo.h"

#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>

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

std::optional<pid_t> pidFromName(std::string_view name) {
    constexpr std::size_t kMostDigits = 9;  // every pid the kernel hands out (at most 2^22)
    if (name.empty() || name.size() > kMostDigits || name.find_first_not_of("0123456789") != std::string_view::npos) {
        return std::nullopt;
    }
    pid_t pid = 0;
    for (char digit : name) {
        pid = pid * 10 + (digit - '0');
    }
    return pid > 0 ? std::optional<pid_t>(pid) : std::nullopt;
}

std::optional<std::uint64_t> processStartTime(pid_t pid) {
    if (pid <= 0) {
        return std::nullopt;
    }
    std::ifstream file("/proc/" + std::to_string(pid) + "/stat");
    std::string stat((std::istreambuf_iterator<char>(file)), std::istreambuf_iterator<char>());
    // The command name (field 2) may hold spaces and parentheses: count the
    // fields from the last ')'; each field follows one space.
    auto close = stat.rfind(')');
    if (close == std::string::npos) {
        return std::nullopt;
    }
    constexpr int kStartTimeField = 22;
    const char* cursor = stat.c_str() + close;
    for (int field = 3; field <= kStartTimeField; ++field) {
        cursor = std::strchr(cursor + 1, ' ');
        if (cursor == nullptr) {
            return std::nullopt;
        }
    }
    char* end = nullptr;
    errno = 0;
    unsigned long long ticks = std::strtoull(cursor + 1, &end, 10);
    if (errno != 0 || end == cursor + 1 || (*end != ' ' && *end != '\n' && *end != '\0')) {
        return std::nullopt;
    }
    return ticks;
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
