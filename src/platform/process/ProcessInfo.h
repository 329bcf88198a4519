#pragma once
// Facts about other processes, from /proc and pidfds.

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/fd/UniqueFd.h"

namespace qm {

// The executable of a process (/proc/<pid>/exe), read into a 2048-byte buffer;
// nothing when it cannot be read or does not fit.
std::optional<std::string> executablePathOfProcess(pid_t pid);

// The pid a /proc entry or a folder is named after: plain decimal digits of
// a positive pid; nothing for any other name.
std::optional<pid_t> pidFromName(std::string_view name);

// When the process started, in clock ticks after boot (field 22 of
// /proc/<pid>/stat): with the pid, it names one process, since a recycled
// pid comes with another start time. Nothing when the process is gone.
std::optional<std::uint64_t> processStartTime(pid_t pid);

// A pidfd for the process, or an invalid descriptor where the kernel refuses.
UniqueFd openPidfd(pid_t pid);

// True while the process behind the pidfd has not exited.
bool pidfdProcessAlive(int pidfd);

}  // namespace qm
