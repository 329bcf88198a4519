#pragma once
// Every entry of the daemon's "list", page after page.

#include <optional>
#include <string>

#include "DaemonSession.h"
#include "platform/value/Value.h"

// The entries in the daemon's order, of one extension point when given; for
// any failure, the exit status, its message already printed.
qm::Result<qm::Array, int> listAllPlugIns(DaemonSession& session, const std::optional<std::string>& point);
