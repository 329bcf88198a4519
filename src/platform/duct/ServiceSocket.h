#pragma once
// Finding, claiming and opening the socket of a named service in the Duct
// runtime directory.
//
// Start-up rules: a service name that is empty or holds "/" is refused. The
// runtime directory must be a directory owned by this user; it is created
// with mode 0700 when missing. An existing socket file is probed with a
// connect: when a daemon answers, start-up fails ("service already running");
// otherwise the stale file is replaced. The socket is created with mode 0600.

#include <string>

#include "platform/error/Error.h"
#include "platform/fd/UniqueFd.h"

namespace qm::duct {

inline constexpr const char* kDuctErrorDomain = "duct";

// The path of a service's socket, after checking the name (no I/O).
Result<std::string> serviceSocketPath(const std::string& serviceName);

// Creates (or checks) the runtime directory with mode 0700; returns its path.
Result<std::string> prepareRuntimeDirectory();

struct ClaimedServiceSocket {
    UniqueFd listener;  // bound and listening, non-blocking
    UniqueFd lock;      // held for the life of the listener: start-up of a twin waits on nothing
    std::string path;
};

// Claims the service name and returns a listening socket, non-blocking.
Result<ClaimedServiceSocket> openServiceSocket(const std::string& serviceName);

// Connects to a service as a client (blocking socket); errno-based error.
Result<UniqueFd> connectToService(const std::string& serviceName);

}  // namespace qm::duct
