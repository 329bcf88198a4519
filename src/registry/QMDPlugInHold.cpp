#include "registry/QMDPlugInHold.h"

#include <algorithm>

QMDPlugInHold::QMDPlugInHold(std::vector<qm::Uuid> plugIns, std::weak_ptr<const HoldOwner> client, pid_t holderPid,
                             std::optional<std::string> holderExecutable)
    : uuid_(qm::Uuid::random()), blocked_(std::move(plugIns)), client_(std::move(client)),
      created_(std::chrono::system_clock::now()), holderPid_(holderPid),
      holderExecutable_(std::move(holderExecutable)) {
    std::sort(blocked_.begin(), blocked_.end());
    blocked_.erase(std::unique(blocked_.begin(), blocked_.end()), blocked_.end());
}
