#include "access/AccessRequests.h"

#include <algorithm>
#include <cerrno>

#include "discovery/HostChecks.h"
#include "discovery/RecordFacts.h"
#include "model/QMBundle.h"
#include "model/QMError.h"
#include "platform/consent/ConsentStore.h"
#include "platform/env/Environment.h"
#include "platform/launcher/ServiceLauncher.h"
#include "platform/log/SystemLog.h"
#include "platform/sandbox/ReadExtensions.h"
#include "protocol/WireKeys.h"
#include "registry/HoldList.h"
#include "registry/Probes.h"
#include "registry/QMDatabase.h"
#include "registry/RequestWalks.h"

namespace {

constexpr const char* kKeyboardPoint = "ovaro.keyboard-service";

Reply denied(RequestContext& context, const QMDPlugIn& plugIn, const std::string& reason) {
    context.logger.debug("denied access to pid %d for plugin %@(%@): %@", context.client.pid, plugIn.identifier(),
                         plugIn.uuid()->text(), reason);
    return Reply::fail(kQMErrorDenied, qm::format("access to plugin %@ denied: %@", plugIn.identifier(), reason));
}

std::string sandboxProfileOf(const QMDPlugIn& plugIn) {
    const qm::Value* point = plugIn.plugInDictionary().get("VTExtensionPointIdentifier");
    if (point == nullptr || !(*point == qm::Value(kKeyboardPoint))) {
        return "plugin";
    }
    const qm::Value* openAccess = plugIn.attributes().get("RequestsOpenAccess");
    if (openAccess && openAccess->asBool() == true &&
        allowedPVCServices(plugIn).contains(qm::kKeyboardNetworkConsentService)) {
        return "plugin";
    }
    return "keyboard";
}

}  // namespace

std::set<std::string> allowedPVCServices(const QMDPlugIn& plugIn) {
    std::set<std::string> granted;
    auto containing = plugIn.containingUrl();
    if (!containing) {
        return granted;
    }
    auto application = QMBundle::initWithPath(*containing);
    auto identifier = application ? application->bundleIdentifier() : std::nullopt;
    if (!identifier) {
        qm::systemLogf(qm::kLogNotice, "failed to create bundle for %@", plugIn.path());
        return granted;
    }
    auto records = qm::consentRecordsForApplication(*identifier);
    if (!records) {
        qm::systemLogf(qm::kLogNotice, "PVCAccessCopyInformationForBundle failed for %@", *containing);
        return granted;
    }
    for (const qm::ConsentRecord& record : *records) {
        if (record.granted) {
            granted.insert(record.service);
        }
    }
    return granted;
}

qm::MaybeError enableForPid(const QMDPlugIn& plugIn, pid_t host) {
    const std::string uuid = plugIn.uuid()->text();
    qm::Dictionary environment;
    if (const auto& container = plugIn.acproxy().dataContainerPath) {
        environment.set("HOME", qm::Value(*container));
        environment.set("MRFIXED_USER_HOME", qm::Value(*container));
        environment.set("TMPDIR", qm::Value(*container + "/tmp"));
    } else {
        qm::systemLogf(qm::kLogNotice, "no data container for plug-in %@(%@) %@ at %@", plugIn.identifier(),
                       plugIn.version(), uuid, plugIn.path());
    }
    const std::string profile = sandboxProfileOf(plugIn);
    if (auto sdk = qm::testSdkDirectory()) {
        environment.set("QMTEST_SDK", qm::Value(*sdk));
    }
    const qm::Value* declared = plugIn.bundleInfoDictionary().get("DuctService");
    qm::Dictionary service = declared && declared->isDictionary() ? *declared->asDictionary() : qm::Dictionary();
    if (const qm::Value* variables = service.find("EnvironmentVariables")) {
        // Only strings make an environment; anything else in it is skipped.
        for (const auto& [name, value] : variables->asDictionary() ? *variables->asDictionary() : qm::Dictionary()) {
            if (value.isString()) {
                environment.set(name, value);
            }
        }
    }
    service.set("EnvironmentVariables", qm::Value(std::move(environment)));
    service.set("_SandboxProfile", qm::Value(profile));
    service.set("_OmitSandboxParameters", qm::Value(true));
    qm::systemLogf(qm::kLogNotice, "assigning plug-in %@(%@) to %s sandbox", plugIn.identifier(), plugIn.version(),
                   profile.c_str());
    qm::systemLogf(qm::kLogNotice, "enabling pid=%d for plug-in %@(%@) %@ %@", host, plugIn.identifier(),
                   plugIn.version(), uuid, plugIn.path());
    auto bundle = plugIn.url() ? QMBundle::initWithPath(*plugIn.url()) : std::nullopt;
    auto executable = bundle ? bundle->executablePath() : std::nullopt;
    if (!executable) {
        return QMErrorWithFormat(kQMErrorInvalidRequest, "cannot obtain executable path for plug-in %@(%@)",
                                 plugIn.identifier(), uuid);
    }
    qm::Dictionary registration{{"DuctService", qm::Value(std::move(service))},
                                {"MRBundlePackageType", qm::Value("DCT!")},
                                {"ExecutablePath", qm::Value(*executable)},
                                {"MRBundleIdentifier", qm::Value(plugIn.acproxy().bundleIdentifier.value_or(""))},
                                {"MRBundleVersion", qm::Value(plugIn.acproxy().bundleVersion.value_or(""))}};
    if (auto error = qm::addExternalService(qm::ductRuntimeDirectory(), host, qm::Value(std::move(registration)))) {
        qm::systemLogf(qm::kLogNotice, "duct error %d allowing pid %d to use plug-in %@(%@) %@ at %@",
                       static_cast<int>(error->code), host, plugIn.identifier(), plugIn.version(), uuid, plugIn.path());
        return QMErrorWithFormat(kQMErrorInvalidRequest, "unable to enable plug-in %@(%@) for pid %d",
                                 plugIn.identifier(), uuid, host);
    }
    return std::nullopt;
}

Reply readyPlugIns(RequestContext& context) {
    QM_PROBE_REQ_READY();
    std::vector<QMDPlugInPtr> enabling;
    const MatchRules rules;
    auto failure = processUuidList(context.request, context.registry, [&](const QMDPlugInPtr& plugIn) -> std::optional<Reply> {
        const std::string uuid = plugIn->uuid()->text();
        QM_PROBE_PLUGIN_READY(uuid.c_str());
        if (context.holds.holdOnPlugIn(*plugIn->uuid())) {
            return denied(context, *plugIn, "the plug-in is on hold");
        }
        if (plugIn->isData()) {
            return std::nullopt;  // nothing to launch
        }
        if (auto reason = allowForClient(rules, factsOf(*plugIn, context.registry), plugIn->plugInDictionary(),
                                         context.client)) {
            return denied(context, *plugIn, *reason);
        }
        if (std::find(enabling.begin(), enabling.end(), plugIn) == enabling.end()) {
            enabling.push_back(plugIn);
        }
        return std::nullopt;
    });
    if (failure) {
        return std::move(*failure);
    }
    // In request order; every plug-in is enabled, the first failure answers.
    qm::MaybeError first;
    for (const QMDPlugInPtr& plugIn : enabling) {
        auto error = enableForPid(*plugIn, context.client.pid);
        if (error && !first) {
            first = std::move(error);
        }
    }
    return first ? Reply::fail(kQMErrorInvalidRequest, *first) : Reply::success();
}

Reply accessPlugIns(RequestContext& context) {
    QM_PROBE_REQ_ACCESS();
    qm::Array tokens;
    auto failure = processUuidList(context.request, context.registry, [&](const QMDPlugInPtr& plugIn) -> std::optional<Reply> {
        const std::string path = plugIn->path().value_or("");
        auto token = qm::issueReadExtension(path);
        if (!token) {
            return Reply::fail(kQMErrorInvalidRequest,
                               qm::format("cannot create extension to %@: %d", path, static_cast<int>(token.error().code)));
        }
        tokens.emplace_back(std::move(token).value());
        return std::nullopt;
    });
    if (failure) {
        return std::move(*failure);
    }
    return Reply::success(qm::Dictionary{{wire::kExtensions, qm::Value(std::move(tokens))}});
}
