// "bulk": a placeholder for batch options that are not supported; it logs
// the options it was given and succeeds.

#include <cstdint>

#include "client/WireKeys.h"
#include "daemon/Probes.h"
#include "daemon/QMDServer.h"
#include "daemon/Transaction.h"
#include "platform/log/SystemLog.h"

void Transaction::bulkPlugIns() {
    QM_PROBE_REQ_BULK();
    const qm::Value* flagsValue = request().get(wire::kFlags);
    std::uint64_t flags = flagsValue ? flagsValue->asUnsigned().value_or(0) : 0;
    qm::systemLogf(qm::kLogNotice, "bulk options 0x%lx not supported", flags & 0xffffffffu);
    done();
}
