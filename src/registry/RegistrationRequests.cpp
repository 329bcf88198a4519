#include "registry/RegistrationRequests.h"

#include <cstdint>

#include "platform/log/SystemLog.h"
#include "protocol/WireKeys.h"
#include "registry/Probes.h"

Reply bulkPlugIns(RequestContext& context) {
    QM_PROBE_REQ_BULK();
    const qm::Value* flagsValue = context.request.get(wire::kFlags);
    std::uint64_t flags = flagsValue ? flagsValue->asUnsigned().value_or(0) : 0;
    qm::systemLogf(qm::kLogNotice, "bulk options 0x%lx not supported", flags & 0xffffffffu);
    return Reply::success();
}
