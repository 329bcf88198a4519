#include "platform/duct/ServiceSocket.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "platform/env/Environment.h"

namespace qm::duct {

namespace {

Error ductError(int code, std::string text) {
    return Error{kDuctErrorDomain, code, std::move(text)};
}

Result<sockaddr_un> socketAddress(const std::string& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path) {
        return ductError(ENAMETOOLONG, "socket path too long: " + path);
    }
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    return address;
}

// True when something accepts connections on the path. Never blocks: a
// daemon whose backlog is full (EAGAIN) is running all the same.
bool serviceAnswers(const sockaddr_un& address) {
    UniqueFd probe(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    if (!probe) {
        return false;
    }
    return ::connect(probe.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0 ||
           errno == EAGAIN;
}

// The runtime directory is never changed, only refused: pointed at a shared
// folder by mistake, the daemon must not make it private.
MaybeError checkRuntimeDirectory(const std::string& directory, const struct stat& info) {
    if (!S_ISDIR(info.st_mode)) {
        return ductError(ENOTDIR, "runtime directory " + directory + " is not a directory");
    }
    if (info.st_uid != ::geteuid() || (info.st_mode & 07077) != 0) {
        char mode[8];
        std::snprintf(mode, sizeof mode, "%04o", static_cast<unsigned>(info.st_mode & 07777));
        return ductError(EPERM, "runtime directory " + directory + " has mode " + mode + " and owner uid " +
                                    std::to_string(info.st_uid) + ": it must be owned by uid " +
                                    std::to_string(::geteuid()) + " with mode 0700");
    }
    return std::nullopt;
}

}  // namespace

bool isValidServiceName(const std::string& serviceName) {
    return !serviceName.empty() && serviceName.find('/') == std::string::npos;
}

Result<std::string> serviceSocketPath(const std::string& serviceName) {
    if (!isValidServiceName(serviceName)) {
        return ductError(EINVAL, "invalid service name \"" + serviceName + "\"");
    }
    return ductRuntimeDirectory() + "/" + serviceName;
}

Result<std::string> prepareRuntimeDirectory() {
    std::string directory = ductRuntimeDirectory();
    if (::mkdir(directory.c_str(), 0700) != 0 && errno != EEXIST) {
        return posixError(errno, "cannot create runtime directory " + directory);
    }
    struct stat info{};
    if (::lstat(directory.c_str(), &info) != 0) {
        return posixError(errno, "cannot examine runtime directory " + directory);
    }
    if (auto refused = checkRuntimeDirectory(directory, info)) {
        return *refused;
    }
    return directory;
}

Result<ClaimedServiceSocket> openServiceSocket(const std::string& serviceName) {
    auto path = serviceSocketPath(serviceName);
    if (!path) {
        return path.error();
    }
    auto directory = prepareRuntimeDirectory();
    if (!directory) {
        return directory.error();
    }
    auto address = socketAddress(*path);
    if (!address) {
        return address.error();
    }
    // The lock file settles two daemons starting at the same instant; the
    // connect probe below settles a daemon that is already serving.
    std::string lockPath = *directory + "/." + serviceName + ".lock";
    UniqueFd lock(::open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600));
    if (!lock) {
        return posixError(errno, "cannot open " + lockPath);
    }
    if (::flock(lock.get(), LOCK_EX | LOCK_NB) != 0 || serviceAnswers(*address)) {
        return ductError(EADDRINUSE, "service already running on " + *path);
    }
    ::unlink(path->c_str());  // a stale socket: nobody answered

    UniqueFd listener(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    if (!listener) {
        return posixError(errno, "socket");
    }
    mode_t previous = ::umask(0177);  // the socket file is born 0600
    int bound = ::bind(listener.get(), reinterpret_cast<const sockaddr*>(&*address), sizeof *address);
    int bindError = errno;
    ::umask(previous);
    if (bound != 0) {
        return posixError(bindError, "cannot bind " + *path);
    }
    ::chmod(path->c_str(), 0600);
    if (::listen(listener.get(), SOMAXCONN) != 0) {
        return posixError(errno, "listen");
    }
    return ClaimedServiceSocket{std::move(listener), std::move(lock), std::move(*path)};
}

Result<UniqueFd> connectToService(const std::string& serviceName) {
    auto path = serviceSocketPath(serviceName);
    if (!path) {
        return path.error();
    }
    auto address = socketAddress(*path);
    if (!address) {
        return address.error();
    }
    UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!socket) {
        return posixError(errno, "socket");
    }
    if (::connect(socket.get(), reinterpret_cast<const sockaddr*>(&*address), sizeof *address) != 0) {
        return posixError(errno, "cannot connect to " + *path);
    }
    return socket;
}

}  // namespace qm::duct
