#pragma once
// One hold: a set of plug-ins kept out of use for the client that took it,
// named by a fresh random token. While a hold exists the process is not idle.
// Immutable once made; shared between the hold list and whoever took it.

#include <sys/types.h>

#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/duct/OpenTransaction.h"
#include "platform/value/Uuid.h"
#include "registry/HoldOwner.h"

class QMDPlugInHold {
public:
    // Duplicates among the plug-ins collapse (a plug-in is its UUID). The
    // holder's pid and executable are kept for the list of holds.
    QMDPlugInHold(std::vector<qm::Uuid> plugIns, std::weak_ptr<const HoldOwner> client, pid_t holderPid = 0,
                  std::optional<std::string> holderExecutable = std::nullopt);

    const qm::Uuid& uuid() const noexcept { return uuid_; }
    // The held plug-ins, sorted, without duplicates.
    const std::vector<qm::Uuid>& blocked() const noexcept { return blocked_; }
    const std::weak_ptr<const HoldOwner>& client() const noexcept { return client_; }
    std::chrono::system_clock::time_point created() const noexcept { return created_; }
    pid_t holderPid() const noexcept { return holderPid_; }
    const std::optional<std::string>& holderExecutable() const noexcept { return holderExecutable_; }

    bool operator==(const QMDPlugInHold& other) const noexcept { return uuid_ == other.uuid_; }

private:
    qm::Uuid uuid_;
    std::vector<qm::Uuid> blocked_;
    std::weak_ptr<const HoldOwner> client_;
    std::chrono::system_clock::time_point created_;
    pid_t holderPid_;
    std::optional<std::string> holderExecutable_;
    qm::duct::OpenTransaction keepsProcessAwake_;
};
