#pragma once
// "Is this process sandboxed": yes when it is more confined than the daemon
// itself: a seccomp filter or no_new_privs the daemon lacks, or another user
// or mount namespace. Anything unreadable counts as sandboxed, so a process
// that hides from the check gains nothing.

#include <sys/types.h>

namespace qm {

// `pidfd`: the process as it was accepted (-1 when there is none); the
// answer is "sandboxed" once that process is gone, since /proc/<pid> may
// name another by then.
bool isProcessSandboxed(pid_t pid, int pidfd);

}  // namespace qm
