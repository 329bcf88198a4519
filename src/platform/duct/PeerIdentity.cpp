#include "platform/duct/PeerIdentity.h"

#include <poll.h>
#include <sys/socket.h>

#include "platform/process/ProcessInfo.h"

namespace qm::duct {

namespace {

// Debian 12's headers lack it; kernels from 6.5 answer it.
constexpr int kSoPeerPidfd = 77;

UniqueFd socketPeerPidfd(int socket) {
    int pidfd = -1;
    socklen_t length = sizeof pidfd;
    if (::getsockopt(socket, SOL_SOCKET, kSoPeerPidfd, &pidfd, &length) != 0 || pidfd < 0) {
        return UniqueFd();
    }
    return UniqueFd(pidfd);
}

bool hasHungUp(int socket) {
    pollfd entry{socket, POLLRDHUP, 0};
    return ::poll(&entry, 1, 0) != 0 && (entry.revents & (POLLRDHUP | POLLHUP | POLLERR | POLLNVAL)) != 0;
}

}  // namespace

std::optional<PeerIdentity> capturePeerIdentity(int socket, PidfdSource source) {
    ucred credentials{};
    socklen_t length = sizeof credentials;
    if (::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0) {
        return std::nullopt;
    }
    UniqueFd pidfd = source == PidfdSource::socketOption ? socketPeerPidfd(socket) : UniqueFd();
    if (!pidfd) {
        pidfd = openPidfd(credentials.pid);
        // The pid was the peer's when it connected. Once the socket has hung
        // up, the peer may have exited and its pid gone to another process,
        // so a pidfd opened now proves nothing.
        if (!pidfd || hasHungUp(socket)) {
            return std::nullopt;
        }
    }
    PeerIdentity identity{credentials.pid, credentials.uid, credentials.gid,
                          std::make_shared<const UniqueFd>(std::move(pidfd)), std::nullopt};
    // Read first, then check that the process behind the pidfd still lives:
    // otherwise the path may belong to a process that took over the pid.
    auto path = executablePathOfProcess(identity.pid);
    if (path && pidfdProcessAlive(identity.pidfd->get())) {
        identity.executablePath = std::move(path);
    }
    return identity;
}

}  // namespace qm::duct
