#pragma once
// Who is at the other end of an accepted socket, fixed when it is accepted
// and never asked again: a recycled pid can never inherit a peer's identity.

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>

#include "platform/fd/UniqueFd.h"

namespace qm::duct {

struct PeerIdentity {
    pid_t pid = 0;
    uid_t uid = 0;
    gid_t gid = 0;
    // The peer process itself, whatever its pid names later; every copy of
    // the identity shares the one descriptor.
    std::shared_ptr<const UniqueFd> pidfd;
    // /proc/<pid>/exe, read while the pidfd's process still lived.
    std::optional<std::string> executablePath;
};

// Where the pidfd comes from. `socketOption` asks the socket (SO_PEERPIDFD)
// and falls back to pidfd_open() where the kernel refuses; `pidfdOpen` goes
// straight to the fallback, as on kernels before 6.5.
enum class PidfdSource { socketOption, pidfdOpen };

// The identity of the peer of a freshly accepted socket; nothing when it
// cannot be pinned to one process: no credentials, no pidfd, or a pidfd
// opened by pid after the peer had already hung up (its pid may then name
// another process already).
std::optional<PeerIdentity> capturePeerIdentity(int socket, PidfdSource source = PidfdSource::socketOption);

}  // namespace qm::duct
