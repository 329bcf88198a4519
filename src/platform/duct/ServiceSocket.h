#pragma once
// Finding, claiming and opening the socket of a named service in the Duct
// runtime directory.
//
// Start-up rules: a service name that is empty or holds "/" is refused. The
// runtime directory must be a directory owned by this user with no group or
// other permission; it is created with mode 0700 when missing, and refused,
// never changed, otherwise. An existing socket file is probed with a
// non-blocking connect: when a daemon answers, start-up fails ("service
// already running on PATH"); otherwise the stale file is replaced. The socket
// is created with mode 0600.

#include <string>

#include "platform/error/Error.h"
#include "platform/fd/UniqueFd.h"

namespace qm::duct {

inline constexpr const char* kDuctErrorDomain = "duct";

// A service name names a socket inside the runtime directory: it is not
// empty and holds no "/".
bool isValidServiceName(const std::string& serviceName);

// The path of a service's socket, after checking the name (no I/O).
Result<std::string> serviceSocketPath(const std::string& serviceName);

// Creates the runtime directory with mode 0700, or checks the one that
// exists; returns its path.
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
