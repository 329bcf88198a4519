#pragma once
// Who sent a request: fixed when the client connected and never looked up
// again, so a recycled pid can never lend one process's rights to another.
// Immutable; lives as long as the client object (its pid included, even once
// the connection is gone, so a request already being served still names its
// host).

#include <sys/types.h>

#include <optional>
#include <string>
#include <string_view>

#include "model/QMBundle.h"
#include "platform/value/Value.h"

struct ClientIdentity {
    pid_t pid = 0;
    uid_t uid = 0;
    std::optional<std::string> executablePath;
    // The bundle around the client's executable, when it runs from one.
    std::optional<QMBundle> bundle;
    // The code-signing view of the client: its bundle's trusted entitlements.
    std::optional<qm::Value> entitlements;

    std::optional<qm::Value> entitlementValueForKey(std::string_view key) const;
    // Granted when a value exists and is not boolean false.
    bool hasEntitlement(std::string_view key) const;
};
