#pragma once
// Who sent a request: fixed when the client connected and never looked up
// again, so a recycled pid can never lend one process's rights to another.
// Immutable; lives as long as the client object (its pid included, even once
// the connection is gone, so a request already being served still names its
// host).

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "model/QMBundle.h"
#include "platform/fd/UniqueFd.h"
#include "platform/value/Value.h"

struct ClientIdentity {
    pid_t pid = 0;
    uid_t uid = 0;
    // The process itself, taken at accept: /proc reads about the client are
    // checked against it, so a recycled pid is never mistaken for it.
    std::shared_ptr<const qm::UniqueFd> pidfd;
    std::optional<std::string> executablePath;
    // The bundle around the client's executable, when it runs from one.
    std::optional<QMBundle> bundle;
    // The code-signing view of the client: its bundle's trusted entitlements.
    std::optional<qm::Value> entitlements;
    // More confined than the daemon (seccomp, no_new_privs, namespaces).
    bool sandboxed = true;

    std::optional<qm::Value> entitlementValueForKey(std::string_view key) const;
    // Granted when a value exists and is not boolean false.
    bool hasEntitlement(std::string_view key) const;
};
