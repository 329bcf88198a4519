#pragma once
// Facts about other processes, from /proc and pidfds.

#include <sys/types.h>

#include <optional>
#include <string>

#include "platform/fd/UniqueFd.h"

namespace qm {

// The executable of a process (/proc/<pid>/exe), read into a 2048-byte buffer;
// nothing when it cannot be read or does not fit.
std::optional<std::string> executablePathOfProcess(pid_t pid);

// A pidfd for the process, or an invalid descriptor where the kernel refuses.
UniqueFd openPidfd(pid_t pid);

// True while the process behind the pidfd has not exited.
bool pidfdProcessAlive(int pidfd);

}  // namespace qm
