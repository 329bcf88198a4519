// The plug-in form: the dictionary that carries a descriptor to clients. It
// holds the resolved, canonical Info dictionary, so a descriptor rebuilt from
// it needs neither the SDK nor canonicalization again.

#include "model/QMPlugInCore.h"

#include <cmath>
#include <limits>
#include <utility>

namespace {

namespace formkey {
constexpr const char* kHubProtocolVersion = "hubProtocolVersion";
constexpr const char* kPath = "path";
constexpr const char* kSystemResident = "systemResident";
constexpr const char* kIdentifier = "identifier";
constexpr const char* kVersion = "version";
constexpr const char* kBundleInfo = "bundleInfo";
constexpr const char* kInfo = "info";
constexpr const char* kUuid = "uuid";
constexpr const char* kLastModified = "lastmodified";
constexpr const char* kAnnotations = "annotations";
constexpr const char* kContainingPath = "containingPath";
constexpr const char* kContainingName = "localizedContainingDisplayName";
constexpr const char* kDisplayName = "localizedDisplayName";
constexpr const char* kShortName = "localizedShortName";
constexpr const char* kHash = "hash";
constexpr const char* kRequirement = "requirement";
}  // namespace formkey

using qm::stringAt;

void setIfPresent(qm::Dictionary& form, const char* key, const std::optional<std::string>& value) {
    if (value) {
        form.set(key, *value);
    }
}

// A form from elsewhere may hold any number: a version that is not a whole
// number within 32 bits counts as absent.
std::uint32_t hubProtocolVersionAt(const qm::Value& form) {
    const qm::Value* value = form.get(formkey::kHubProtocolVersion);
    if (value != nullptr) {
        if (auto version = value->asUnsigned(); version && *version <= std::numeric_limits<std::uint32_t>::max()) {
            return static_cast<std::uint32_t>(*version);
        }
    }
    return 1;
}

// Seconds, truncated toward zero; out of the 32-bit range counts as absent.
std::int32_t lastModifiedAt(const qm::Value& form) {
    const qm::Value* value = form.get(formkey::kLastModified);
    if (value == nullptr) {
        return 0;
    }
    auto seconds = value->asDouble();
    if (!seconds || !std::isfinite(*seconds)) {
        return 0;
    }
    double whole = std::trunc(*seconds);
    if (whole < std::numeric_limits<std::int32_t>::min() || whole > std::numeric_limits<std::int32_t>::max()) {
        return 0;
    }
    return static_cast<std::int32_t>(whole);
}

std::optional<qm::Dictionary> dictionaryAt(const qm::Value& form, std::string_view key) {
    const qm::Value* value = form.get(key);
    if (value == nullptr || !value->isDictionary()) {
        return std::nullopt;
    }
    return *value->asDictionary();
}

qm::Value valueAt(const qm::Value& form, std::string_view key) {
    const qm::Value* value = form.get(key);
    return value ? *value : qm::Value();
}

}  // namespace

qm::Dictionary QMPlugInCore::exportForm() const {
    qm::Dictionary form;
    form.set(formkey::kHubProtocolVersion, qm::Value(std::uint64_t{hubProtocolVersion()}));
    setIfPresent(form, formkey::kPath, path());
    form.set(formkey::kSystemResident, onSystemVolume());
    setIfPresent(form, formkey::kIdentifier, identifier());
    // Only a descriptor that was never canonicalized lacks a version; its
    // form then says nothing rather than something invented.
    if (qm::Value version = this->version(); !version.isNull()) {
        form.set(formkey::kVersion, version);
    }
    if (const qm::Value info = bundleInfoDictionary(); const qm::Dictionary* entries = info.asDictionary()) {
        form.set(formkey::kBundleInfo, entries->changing(qmkey::kInfoPlistUrl, std::nullopt));
    }
    if (qm::Value plugIn = plugInDictionary(); !plugIn.isNull()) {
        form.set(formkey::kInfo, plugIn);
    }
    if (auto uuid = this->uuid()) {
        form.set(formkey::kUuid, uuid->text());
    }
    form.set(formkey::kLastModified, qm::Value(std::int64_t{lastModified()}));
    form.set(formkey::kAnnotations, annotations().value_or(qm::Dictionary{}));
    setIfPresent(form, formkey::kContainingPath, containingPath());
    setIfPresent(form, formkey::kContainingName, localizedContainingName());
    setIfPresent(form, formkey::kDisplayName, localizedName());
    setIfPresent(form, formkey::kShortName, localizedShortName());
    return form;
}

std::unique_ptr<QMPlugInCore> QMPlugInCore::initWithForm(const qm::Value& form) {
    auto plugIn = std::make_unique<QMPlugInCore>();
    if (!plugIn->setupWithForm(form)) {
        return nullptr;
    }
    return plugIn;
}

bool QMPlugInCore::setupWithForm(const qm::Value& form) {
    std::optional<qm::Uuid> uuid;
    if (auto text = stringAt(form, formkey::kUuid)) {
        uuid = qm::Uuid::parse(*text);
    }
    if (!setupWithName(stringAt(form, formkey::kIdentifier), stringAt(form, formkey::kPath),
                       valueAt(form, formkey::kBundleInfo), valueAt(form, formkey::kInfo), uuid)) {
        return false;
    }
    setHubProtocolVersion(hubProtocolVersionAt(form));
    const qm::Value* hash = form.get(formkey::kHash);
    setCdhash(hash && hash->asData() ? std::optional<qm::Bytes>(*hash->asData()) : std::nullopt);
    setRequirement(stringAt(form, formkey::kRequirement));
    setLastModified(lastModifiedAt(form));
    if (auto containingPath = stringAt(form, formkey::kContainingPath)) {
        setContainingUrl(std::move(containingPath));
    }
    const qm::Value* systemResident = form.get(formkey::kSystemResident);
    setOnSystemVolume(systemResident && systemResident->asBool().value_or(false));
    setAnnotations(dictionaryAt(form, formkey::kAnnotations));
    setLocalizedName(stringAt(form, formkey::kDisplayName));
    setLocalizedShortName(stringAt(form, formkey::kShortName));
    setLocalizedContainingName(stringAt(form, formkey::kContainingName));
    return true;
}

void QMPlugInCore::updateFromForm(const qm::Value& form) {
    setAnnotations(dictionaryAt(form, formkey::kAnnotations));
}

void QMPlugInCore::setAnnotationValue(const std::string& key, const std::optional<qm::Value>& value) {
    auto current = annotations();
    if (!current) {
        return;
    }
    setAnnotations(current->changing(key, value));
}
