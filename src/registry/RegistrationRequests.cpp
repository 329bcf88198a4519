#include "registry/RegistrationRequests.h"

#include <cstdint>

#include "model/QMError.h"
#include "platform/catalog/CatalogRecords.h"
#include "platform/log/SystemLog.h"
#include "protocol/WireKeys.h"
#include "registry/Probes.h"
#include "registry/QMDatabase.h"
#include "registry/RequestWalks.h"

Reply addPlugIns(RequestContext& context) {
    QM_PROBE_REQ_ADD();
    return processPaths(context.request, [&](const std::string& path, bool resolved) -> std::optional<Reply> {
        if (!resolved) {
            return Reply::fail(kQMErrorPath, qm::format("invalid plugin path: %@", path));
        }
        QM_PROBE_PLUGIN_ADD(path.c_str());
        auto error = context.registry.addPlugIn(path);
        if (!error) {
            return std::nullopt;
        }
        // An application is no plug-in bundle: the path is the mistake.
        if (qm::appCatalogErrorOf(*error) == qm::AppCatalogError::applicationBundle) {
            return Reply::fail(kQMErrorPath, qm::format("invalid plugin path: %@", path));
        }
        qm::systemLogf(qm::kLogNotice, "failed to register plug-in at %@", path);
        return Reply::fail(kQMErrorRegistration, qm::format("unable to register plug-in at %@", path));
    });
}

Reply removePlugIns(RequestContext& context) {
    QM_PROBE_REQ_REMOVE();
    return processPaths(context.request, [&](const std::string& path, bool resolved) -> std::optional<Reply> {
        QM_PROBE_PLUGIN_REMOVE(path.c_str(), resolved ? 1 : 0);
        if (context.registry.removePlugIn(path)) {
            return Reply::fail(kQMErrorPath, qm::format("no plugin at %@", path));
        }
        return std::nullopt;
    });
}

Reply bulkPlugIns(RequestContext& context) {
    QM_PROBE_REQ_BULK();
    const qm::Value* flagsValue = context.request.get(wire::kFlags);
    std::uint64_t flags = flagsValue ? flagsValue->asUnsigned().value_or(0) : 0;
    qm::systemLogf(qm::kLogNotice, "bulk options 0x%lx not supported", flags & 0xffffffffu);
    return Reply::success();
}
