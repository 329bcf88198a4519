#include "access/LockRequest.h"

#include "model/PlugInKeys.h"
#include "model/QMError.h"
#include "model/ValueHelpers.h"
#include "platform/launcher/ServiceLauncher.h"
#include "platform/log/SystemLog.h"
#include "platform/wardend/BusyInstances.h"
#include "protocol/WireKeys.h"
#include "registry/HoldList.h"
#include "registry/Probes.h"
#include "registry/QMDatabase.h"
#include "registry/RequestWalks.h"

namespace {

enum HoldFlags : std::uint64_t { kHoldApplications = 1, kHoldPlugIns = 2 };

// `checkBusy`: a conflict entry when a running instance of the plug-in
// exists; nothing otherwise.
std::optional<qm::Value> checkBusy(const QMDPlugIn& plugIn) {
    auto identifier = qm::stringAt(plugIn.bundleInfoDictionary(), qmkey::kBundleIdentifier);
    if (!identifier) {
        return std::nullopt;
    }
    auto instances = qm::busyExtensionInstances({*identifier});
    if (!instances) {
        qm::systemLogf(qm::kLogNotice, "cannot look for busy instances of %@: %@", *identifier, instances.error().text());
        return std::nullopt;
    }
    // Every instance names its bundle identifier (the busy check only counts
    // bundles that have one): the first one is the conflict.
    if (instances->empty()) {
        return std::nullopt;
    }
    return qm::Value(qm::Dictionary{
        {qm::kExtensionBundleIdentifierProperty, qm::Value(instances->front().bundleIdentifier)}});
}

Reply release(RequestContext& context, const qm::Array& tokens) {
    for (const qm::Value& token : tokens) {
        if (auto uuid = token.asUuid()) {
            context.holds.unholdToken(*uuid);
        }
    }
    return Reply::success();
}

}  // namespace

Reply lockDownPlugIns(RequestContext& context) {
    QM_PROBE_REQ_HOLDDOWN();
    if (const qm::Array* tokens = QMGetDuctArray(context.request, wire::kUuids)) {
        return release(context, *tokens);
    }
    const qm::Value* flagsValue = context.request.get(wire::kFlags);
    std::uint64_t flags = flagsValue ? flagsValue->asUnsigned().value_or(0) : 0;
    std::vector<QMDPlugInPtr> plugIns;
    auto failure = marshalPaths(context.request, [&](const std::string& path, bool resolved) -> std::optional<Reply> {
        if (!resolved) {
            return Reply::fail(kQMErrorPath, qm::format("invalid path: %@", path));
        }
        if (flags == kHoldPlugIns) {
            QMDPlugInPtr plugIn = context.registry.findPlugInAtPath(path);
            if (!plugIn) {
                return Reply::fail(kQMErrorPath, qm::format("no plug-in at path:%@", path));
            }
            plugIns.push_back(std::move(plugIn));
            return std::nullopt;
        }
        if (flags == kHoldApplications) {
            if (auto within = context.registry.plugInsWithinApplication(path)) {
                plugIns.insert(plugIns.end(), within->begin(), within->end());
            }
            return std::nullopt;
        }
        return Reply::fail(kQMErrorInvalidRequest, "invalid request format (unsupported hold flags)");
    });
    if (failure) {
        return std::move(*failure);
    }
    if (flags != kHoldPlugIns) {
        qm::Array busy;
        qm::Array conflicts;
        for (const QMDPlugInPtr& plugIn : plugIns) {
            if (auto conflict = checkBusy(*plugIn)) {
                busy.emplace_back(plugIn->identifier().value_or(""));
                conflicts.push_back(std::move(*conflict));
            }
        }
        if (!busy.empty()) {
            context.logger.debug("hold rejected. Busy plug-ins:%@", qm::Value(std::move(busy)));
            Reply refused = Reply::fail(kQMErrorBusy, "plug-ins are busy");
            refused.values.set(wire::kConflicts, qm::Value(std::move(conflicts)));
            return refused;
        }
    }
    std::vector<qm::Uuid> held;
    for (const QMDPlugInPtr& plugIn : plugIns) {
        held.push_back(*plugIn->uuid());
    }
    auto hold = std::make_shared<QMDPlugInHold>(std::move(held), context.holdOwner, context.client.pid,
                                                context.client.executablePath);
    if (!context.holds.addHold(hold)) {
        // The client died while its request was served: no hold for it, and
        // nobody to read this answer.
        return Reply::fail(kQMErrorDenied, "the client is gone");
    }
    context.logger.debug("hold request granted uuid:%@", hold->uuid().text());
    return Reply::success(qm::Dictionary{{wire::kUuids, qm::Value(hold->uuid())}});
}
