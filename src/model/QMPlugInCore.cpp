#include "model/QMPlugInCore.h"

#include <cassert>
#include <cmath>
#include <utility>

#include "model/QMError.h"
#include "platform/bundle/BundleDirectory.h"
#include "platform/log/SystemLog.h"

namespace {

template <class T>
T readLocked(std::mutex& lock, const T& field) {
    std::lock_guard<std::mutex> guard(lock);
    return field;
}

template <class T>
void writeLocked(std::mutex& lock, T& field, T value) {
    std::lock_guard<std::mutex> guard(lock);
    field = std::move(value);
}

qm::Value valueAt(const qm::Value& dictionary, std::string_view key) {
    const qm::Value* value = dictionary.get(key);
    return value ? *value : qm::Value();
}

bool isTrue(const qm::Value& value) {
    if (auto b = value.asBool()) {
        return *b;
    }
    if (auto d = value.asDouble()) {
        return *d != 0;
    }
    return false;
}

}  // namespace

QMPlugInCore::QMPlugInCore() = default;
QMPlugInCore::~QMPlugInCore() = default;

// --- setup -------------------------------------------------------------------

std::unique_ptr<QMPlugInCore> QMPlugInCore::initWithName(const std::optional<std::string>& identifier,
                                                         const std::optional<std::string>& url,
                                                         const qm::Value& bundleInfo, const qm::Value& info,
                                                         std::optional<qm::Uuid> uuid) {
    auto plugIn = std::make_unique<QMPlugInCore>();
    if (!plugIn->setupWithName(identifier, url, bundleInfo, info, uuid)) {
        return nullptr;
    }
    return plugIn;
}

bool QMPlugInCore::setupWithName(const std::optional<std::string>& identifier, const std::optional<std::string>& url,
                                 const qm::Value& bundleInfo, const qm::Value& info, std::optional<qm::Uuid> uuid) {
    return !setupWithNameExplained(identifier, url, bundleInfo, info, uuid).has_value();
}

qm::MaybeError QMPlugInCore::setupWithNameExplained(const std::optional<std::string>& identifier,
                                                    const std::optional<std::string>& url,
                                                    const qm::Value& bundleInfo, const qm::Value& /*info*/,
                                                    std::optional<qm::Uuid> uuid) {
    if (!url) {
        return QMError(kQMErrorPlugInUnusable, std::nullopt);
    }
    if (!identifier) {
        std::string line = qm::format("missing identifier in plug-in at %@", *url);
        qm::systemLog(qm::kLogNotice, line);
        return QMError(kQMErrorPlugInUnusable, line);
    }
    if (bundleInfo.isNull()) {
        std::string line = qm::format("missing Info dictionary in plug-in %@ at %@", *identifier, *url);
        qm::systemLog(qm::kLogNotice, line);
        return QMError(kQMErrorPlugInUnusable, line);
    }
    // The identifier goes in first: a multiplexed bundle's plug-in dictionary is found by it.
    setIdentifier(identifier);
    setUrl(url);
    auto normalized = normalizeInfoDictionary(bundleInfo);
    if (!normalized || !setDictionaries(qm::Value(std::move(*normalized)))) {
        std::string line = qm::format("malformed plug-in dictionary in plug-in %@ at %@: %@", *identifier,
                                      qm::fileURL(*url), bundleInfo);
        qm::systemLog(qm::kLogNotice, line);
        return QMError(kQMErrorPlugInUnusable, line);
    }
    setUuid(uuid ? *uuid : qm::Uuid::random());
    return std::nullopt;
}

bool QMPlugInCore::setDictionaries(const qm::Value& infoDictionary) {
    if (!infoDictionary.isDictionary()) {
        return false;
    }
    qm::Value top = valueAt(infoDictionary, qmkey::kTop);
    if (!top.isDictionary()) {
        std::lock_guard<std::mutex> guard(lock_);
        bundleInfoDictionary_ = infoDictionary;
        topDictionary_ = top;
        return false;
    }
    // A multiplexed plug-in's dictionary is its "Multiple" entry alone: it
    // inherits nothing from the top dictionary around it.
    qm::Value plugIn = top;
    if (const qm::Value* multiple = top.get(qmkey::kMultiple)) {
        plugIn = qm::Value();
        if (auto id = identifier()) {
            plugIn = valueAt(*multiple, *id);
        }
    }
    storeDictionaries(infoDictionary, top, plugIn);
    return plugIn.isDictionary();
}

void QMPlugInCore::storeDictionaries(qm::Value bundleInfo, qm::Value top, qm::Value plugIn) {
    std::lock_guard<std::mutex> guard(lock_);
    bundleInfoDictionary_ = std::move(bundleInfo);
    topDictionary_ = std::move(top);
    plugInDictionary_ = std::move(plugIn);
}

// --- rebuilding setters ------------------------------------------------------

void QMPlugInCore::setPlugInDictionary(const qm::Value& plugInDictionary) {
    qm::Value current = this->plugInDictionary();
    if (!current.isNull() && !current.isSameObject(plugInDictionary)) {
        qm::Value top = topDictionary();
        const qm::Value* multiple = top.get(qmkey::kMultiple);
        if (multiple == nullptr) {
            setTopDictionary(plugInDictionary);
        } else if (auto id = identifier()) {
            const qm::Dictionary* entries = multiple->asDictionary();
            qm::Dictionary rebuilt = entries ? entries->changing(*id, plugInDictionary) : qm::Dictionary{{*id, plugInDictionary}};
            setTopDictionary(qm::Value(top.asDictionary()->changing(qmkey::kMultiple, qm::Value(std::move(rebuilt)))));
        }
    }
    writeLocked(lock_, plugInDictionary_, plugInDictionary);
}

void QMPlugInCore::setTopDictionary(const qm::Value& topDictionary) {
    qm::Value current = this->topDictionary();
    if (!current.isNull() && !current.isSameObject(topDictionary)) {
        qm::Value info = bundleInfoDictionary();
        if (const qm::Dictionary* entries = info.asDictionary()) {
            writeLocked(lock_, bundleInfoDictionary_, qm::Value(entries->changing(qmkey::kTop, topDictionary)));
        }
    }
    writeLocked(lock_, topDictionary_, topDictionary);
}

// --- canonical values and validation -----------------------------------------

void QMPlugInCore::canonicalize() {
    const qm::Value plugIn = plugInDictionary();
    const qm::Dictionary* declared = plugIn.asDictionary();
    if (declared == nullptr) {
        return;  // not set up: there is nothing to complete
    }
    qm::Dictionary completed = *declared;
    if (isAppExtension()) {
        if (!completed.contains(qmkey::kProtocol)) {
            completed.set(qmkey::kProtocol, qmkey::kObjectClass);
        }
        if (!completed.contains(qmkey::kPrincipalClass)) {
            completed.set(qmkey::kPrincipalClass, qmkey::kObjectClass);
        }
        // An application extension shares exactly its own bundle with its host.
        completed.set(qmkey::kShared, qm::Array{qm::Value(".")});
    }

    // Attributes of the wrong type are kept as declared and not completed:
    // the plug-in then has no usable attributes and diagnose rejects it,
    // rather than being matched on attributes it never declared.
    const qm::Value* declaredAttributes = declared->find(qmkey::kAttributes);
    if (declaredAttributes != nullptr && !declaredAttributes->isDictionary()) {
        qm::systemLogf(qm::kLogNotice, "\"%@\" of plug-in %@ is not a dictionary: %@", qmkey::kAttributes,
                       identifier(), *declaredAttributes);
    } else {
        qm::Dictionary attributes = declaredAttributes ? *declaredAttributes->asDictionary() : qm::Dictionary{};
        attributes.set(qmkey::kFormat, declared->contains(qmkey::kEmbeddedCode) ? "hybrid" : "standard");
        if (!attributes.contains(qmkey::kPointVersion)) {
            qm::Value bundleVersion = valueAt(bundleInfoDictionary(), qmkey::kBundleVersion);
            attributes.set(qmkey::kPointVersion, bundleVersion.isNull() ? qm::Value("1") : bundleVersion);
        }
        completed.set(qmkey::kAttributes, qm::Value(std::move(attributes)));
    }
    // Completed first and installed once, so all three levels agree.
    setPlugInDictionary(qm::Value(std::move(completed)));
}

qm::MaybeError QMPlugInCore::diagnose() const {
    if (!identifier()) {
        return QMError(kQMErrorPlugInUnusable, "missing identifier (no VTExtensionIdentifier, nor even MRBundleIdentifier)");
    }
    if (protocolSpec().isNull()) {
        return QMErrorWithFormat(kQMErrorPlugInUnusable, "missing \"%@\" key in Info.plist or SDK", qmkey::kProtocol);
    }
    if (attributes().isNull()) {
        return QMErrorWithFormat(kQMErrorPlugInUnusable, "missing \"%@\" key in Info.plist or SDK", qmkey::kAttributes);
    }
    const qm::Value plugIn = plugInDictionary();
    if (isAppExtension() && !(valueAt(plugIn, qmkey::kPrincipalClass) == qm::Value(qmkey::kObjectClass))) {
        return QMErrorWithFormat(kQMErrorPlugInUnusable, "Application Extensions may not use the \"%@\" key",
                                 qmkey::kPrincipalClass);
    }
    if (plugIn.get(qmkey::kPassProxy) != nullptr) {
        return QMErrorWithFormat(kQMErrorPlugInUnusable, "the \"%@\" key is not supported on this platform",
                                 qmkey::kPassProxy);
    }
    if (isHybrid()) {
        return QMError(kQMErrorPlugInUnusable, "hybrid plug-ins are not supported on this platform");
    }
    return std::nullopt;
}

// --- identity ----------------------------------------------------------------

bool QMPlugInCore::isEqual(const QMPlugInCore& other) const {
    auto mine = uuid();
    auto theirs = other.uuid();
    assert(mine && "self.uuid");
    assert(theirs && "self.uuid");
    return mine && theirs && *mine == *theirs;
}

std::size_t QMPlugInCore::hash() const {
    auto mine = uuid();
    assert(mine && "self.uuid");
    return mine ? qm::UuidHash{}(*mine) : 0;
}

// --- stored properties -------------------------------------------------------

std::optional<std::string> QMPlugInCore::identifier() const { return readLocked(lock_, identifier_); }
void QMPlugInCore::setIdentifier(std::optional<std::string> identifier) { writeLocked(lock_, identifier_, std::move(identifier)); }
std::optional<std::string> QMPlugInCore::url() const { return readLocked(lock_, url_); }
void QMPlugInCore::setUrl(std::optional<std::string> url) { writeLocked(lock_, url_, std::move(url)); }
std::optional<std::string> QMPlugInCore::containingUrl() const { return readLocked(lock_, containingUrl_); }
void QMPlugInCore::setContainingUrl(std::optional<std::string> containingUrl) {
    writeLocked(lock_, containingUrl_, std::move(containingUrl));
}
bool QMPlugInCore::onSystemVolume() const { return onSystemVolume_.load(); }
void QMPlugInCore::setOnSystemVolume(bool onSystemVolume) { onSystemVolume_.store(onSystemVolume); }
qm::Value QMPlugInCore::bundleInfoDictionary() const { return readLocked(lock_, bundleInfoDictionary_); }
qm::Value QMPlugInCore::topDictionary() const { return readLocked(lock_, topDictionary_); }
qm::Value QMPlugInCore::plugInDictionary() const { return readLocked(lock_, plugInDictionary_); }
std::uint32_t QMPlugInCore::hubProtocolVersion() const { return hubProtocolVersion_.load(); }
void QMPlugInCore::setHubProtocolVersion(std::uint32_t version) { hubProtocolVersion_.store(version); }
std::optional<std::string> QMPlugInCore::localizedName() const { return readLocked(lock_, localizedName_); }
void QMPlugInCore::setLocalizedName(std::optional<std::string> name) { writeLocked(lock_, localizedName_, std::move(name)); }
std::optional<std::string> QMPlugInCore::localizedShortName() const { return readLocked(lock_, localizedShortName_); }
void QMPlugInCore::setLocalizedShortName(std::optional<std::string> name) {
    writeLocked(lock_, localizedShortName_, std::move(name));
}
std::optional<std::string> QMPlugInCore::localizedContainingName() const {
    return readLocked(lock_, localizedContainingName_);
}
void QMPlugInCore::setLocalizedContainingName(std::optional<std::string> name) {
    writeLocked(lock_, localizedContainingName_, std::move(name));
}
std::optional<qm::Dictionary> QMPlugInCore::annotations() const { return readLocked(lock_, annotations_); }
void QMPlugInCore::setAnnotations(std::optional<qm::Dictionary> annotations) {
    writeLocked(lock_, annotations_, std::move(annotations));
}
std::int32_t QMPlugInCore::lastModified() const { return lastModified_.load(); }
void QMPlugInCore::setLastModified(std::int32_t secondsSince1970) { lastModified_.store(secondsSince1970); }
std::optional<qm::Uuid> QMPlugInCore::uuid() const { return readLocked(lock_, uuid_); }
void QMPlugInCore::setUuid(std::optional<qm::Uuid> uuid) { writeLocked(lock_, uuid_, uuid); }
std::optional<qm::Bytes> QMPlugInCore::cdhash() const { return readLocked(lock_, cdhash_); }
void QMPlugInCore::setCdhash(std::optional<qm::Bytes> cdhash) { writeLocked(lock_, cdhash_, std::move(cdhash)); }
std::optional<std::string> QMPlugInCore::requirement() const { return readLocked(lock_, requirement_); }
void QMPlugInCore::setRequirement(std::optional<std::string> requirement) {
    writeLocked(lock_, requirement_, std::move(requirement));
}

// --- computed properties -----------------------------------------------------

qm::Value QMPlugInCore::attributes() const {
    qm::Value attributes = valueAt(plugInDictionary(), qmkey::kAttributes);
    return attributes.isDictionary() ? attributes : qm::Value();
}

qm::Value QMPlugInCore::version() const { return valueAt(attributes(), qmkey::kPointVersion); }
qm::Value QMPlugInCore::protocolSpec() const { return valueAt(plugInDictionary(), qmkey::kProtocol); }
qm::Value QMPlugInCore::sdkSpec() const { return valueAt(plugInDictionary(), qmkey::kPointIdentifier); }

qm::Value QMPlugInCore::embeddedProtocolSpec() const {
    qm::Value embedded = valueAt(plugInDictionary(), qmkey::kEmbeddedProtocol);
    return embedded.isNull() ? protocolSpec() : embedded;
}

bool QMPlugInCore::isAppExtension() const {
    auto path = url();
    if (!path) {
        return false;
    }
    std::string_view p = *path;
    while (p.size() > 1 && p.back() == '/') {
        p.remove_suffix(1);
    }
    return p.ends_with(".xbun");
}

bool QMPlugInCore::isMultiplexed() const { return topDictionary().get(qmkey::kMultiple) != nullptr; }
bool QMPlugInCore::isHybrid() const { return plugInDictionary().get(qmkey::kEmbeddedCode) != nullptr; }
bool QMPlugInCore::isDedicated() const { return isTrue(valueAt(plugInDictionary(), qmkey::kDedicated)); }
bool QMPlugInCore::isData() const { return protocolSpec() == qm::Value(qmkey::kDataProtocol); }
qm::Date QMPlugInCore::timestamp() const { return qm::Date{static_cast<double>(lastModified())}; }

bool QMPlugInCore::oldStyle() const {
    qm::Value info = bundleInfoDictionary();
    if (info.get(qmkey::kTop) != nullptr) {
        return false;
    }
    const bool hasOldStyle = info.get(qmkey::kOldTop) != nullptr;
    assert(hasOldStyle && "unknown plug-in configuration style");
    return hasOldStyle;
}
