#include "registry/QMDPlugIn.h"

#include <cmath>
#include <limits>

#include "model/OfflinePlugIns.h"
#include "model/QMError.h"
#include "model/ValueHelpers.h"
#include "platform/log/SystemLog.h"

namespace {

constexpr std::string_view kReplacePlugIn = "ovaro.developer.replace-plugin";

// Seconds since 1970 truncated toward zero into 32 bits.
std::int32_t wholeSeconds(const qm::Date& date) {
    double seconds = std::trunc(date.secondsSince1970);
    if (!(seconds >= std::numeric_limits<std::int32_t>::min() && seconds <= std::numeric_limits<std::int32_t>::max())) {
        return 0;
    }
    return static_cast<std::int32_t>(seconds);
}

}  // namespace

qm::Result<std::shared_ptr<QMDPlugIn>, QMDPlugIn::BuildFailure> QMDPlugIn::build(qm::PlugInRecordPtr record) {
    if (!record || record->bundlePath.empty() || !record->infoDictionary.isDictionary()) {
        return BuildFailure{};
    }
    auto plugIn = std::make_shared<QMDPlugIn>(record);
    if (auto error = plugIn->setupWithNameExplained(record->identifier, record->bundlePath, record->infoDictionary,
                                                    record->plugInDictionary, record->uuid)) {
        return BuildFailure{error->text(), true};
    }
    plugIn->setLastModified(wholeSeconds(record->registrationDate));
    plugIn->setOnSystemVolume(record->onSystemVolume);
    plugIn->resolveSDK();
    plugIn->setHubProtocolVersion(OfflinePlugIns::hubProtocolVersionOf(*plugIn));
    plugIn->setContainingUrl(record->containingApplication
                                 ? std::optional<std::string>(record->containingApplication->path)
                                 : std::nullopt);
    if (auto error = plugIn->diagnose()) {
        return BuildFailure{error->text(), false};
    }
    return plugIn;
}

std::shared_ptr<QMDPlugIn> QMDPlugIn::initWithACData(qm::PlugInRecordPtr record) {
    std::string path = record ? record->bundlePath : std::string();
    auto built = build(std::move(record));
    if (!built) {
        logBuildFailure(path, built.error());
        return nullptr;
    }
    return std::move(built).value();
}

void QMDPlugIn::logBuildFailure(const std::string& bundlePath, const BuildFailure& failure) {
    if (!failure.reason.empty() && !failure.loggedBySetup) {
        qm::systemLogf(qm::kLogNotice, "ignoring mis-configured plug-in at %@: %@", bundlePath, failure.reason);
    }
}

const qm::Dictionary& QMDPlugIn::form() const {
    std::call_once(formOnce_, [this] { form_ = exportForm(); });
    return form_;
}

std::optional<std::string> QMDPlugIn::localizedName() const {
    return record_->localizedName;
}

std::optional<std::string> QMDPlugIn::localizedShortName() const {
    return record_->localizedShortName;
}

std::optional<std::string> QMDPlugIn::localizedContainingName() const {
    return record_->containingApplication ? record_->containingApplication->localizedName : std::nullopt;
}

std::optional<qm::Value> QMDPlugIn::entitlements() const {
    return record_->entitlements;
}

std::optional<qm::Value> QMDPlugIn::valueForEntitlement(std::string_view name) const {
    const qm::Value* value = record_->entitlements ? record_->entitlements->get(name) : nullptr;
    return value ? std::optional<qm::Value>(*value) : std::nullopt;
}

bool QMDPlugIn::hasEntitlement(std::string_view name) const {
    return entitlementGranted(valueForEntitlement(name));
}

std::string QMDPlugIn::annotationKeyOf(const std::string& identifier, const std::optional<qm::Value>& entitlements) {
    const qm::Value* replaced = entitlements ? entitlements->get(kReplacePlugIn) : nullptr;
    const std::string* key = replaced ? replaced->asString() : nullptr;
    return key ? *key : identifier;
}

std::string QMDPlugIn::annotationKey() const {
    return annotationKeyOf(identifier().value_or(record_->identifier), record_->entitlements);
}

qm::MaybeError QMDPlugIn::diagnose() const {
    if (auto error = QMPlugInCore::diagnose()) {
        return error;
    }
    if (!isData() && !record_->dataContainerPath) {
        return QMError(kQMErrorPlugInUnusable, std::string("this plug-in has no sandbox data container"));
    }
    return std::nullopt;
}
