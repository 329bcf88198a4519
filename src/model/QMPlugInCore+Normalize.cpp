// Translation of old-style ("Quamber") configurations into the new
// vocabulary, done once at setup so that everything after it sees one shape.

#include "model/QMPlugInCore.h"

#include <utility>

namespace {

std::string_view newKeyForOldPlugInKey(std::string_view key) {
    if (key == "Protocol") {
        return qmkey::kProtocol;
    }
    if (key == "SDK") {
        return qmkey::kPointIdentifier;
    }
    return key;
}

std::string_view newKeyForOldAttributeKey(std::string_view key) {
    if (key == "ovaro.identifier") {
        return qmkey::kExtensionIdentifier;
    }
    if (key == "ovaro.protocol") {
        return qmkey::kPointName;
    }
    if (key == "ovaro.version") {
        return qmkey::kPointVersion;
    }
    return key;
}

}  // namespace

std::optional<qm::Dictionary> QMPlugInCore::normalizeInfoDictionary(const qm::Value& infoDictionary) {
    const qm::Dictionary* info = infoDictionary.asDictionary();
    if (info == nullptr) {
        return std::nullopt;
    }
    if (info->contains(qmkey::kTop)) {
        return *info;
    }
    const qm::Value* oldStyle = info->find(qmkey::kOldTop);
    if (oldStyle == nullptr) {
        return std::nullopt;
    }
    auto translated = newQuamberDictionaryFrom(*oldStyle);
    if (!translated) {
        return std::nullopt;
    }
    // "Quamber" stays beside its translation: the hub protocol version of an
    // old-style plug-in is decided by its presence.
    return info->changing(qmkey::kTop, qm::Value(std::move(*translated)));
}

// An old-style dictionary is translated whole or not at all: a half-translated
// one would mix both vocabularies, so a part that is not a dictionary where one
// is needed makes the whole plug-in malformed.
std::optional<qm::Dictionary> QMPlugInCore::newQuamberDictionaryFrom(const qm::Value& oldStyle) {
    const qm::Dictionary* old = oldStyle.asDictionary();
    if (old == nullptr) {
        return std::nullopt;
    }
    qm::Dictionary translated;
    for (const auto& [key, value] : *old) {
        if (key == "Attributes") {
            auto attributes = newAttributesFrom(value);
            if (!attributes) {
                return std::nullopt;
            }
            translated.set(qmkey::kAttributes, qm::Value(std::move(*attributes)));
        } else if (key == qmkey::kMultiple) {
            auto multiples = newMultiplesFrom(value);
            if (!multiples) {
                return std::nullopt;
            }
            translated.set(qmkey::kMultiple, qm::Value(std::move(*multiples)));
        } else {
            translated.set(std::string(newKeyForOldPlugInKey(key)), value);
        }
    }
    return translated;
}

std::optional<qm::Dictionary> QMPlugInCore::newMultiplesFrom(const qm::Value& oldStyleMultiples) {
    const qm::Dictionary* old = oldStyleMultiples.asDictionary();
    if (old == nullptr) {
        return std::nullopt;
    }
    qm::Dictionary translated;
    for (const auto& [identifier, entry] : *old) {
        auto plugIn = newQuamberDictionaryFrom(entry);
        if (!plugIn) {
            return std::nullopt;
        }
        translated.set(identifier, qm::Value(std::move(*plugIn)));
    }
    return translated;
}

std::optional<qm::Dictionary> QMPlugInCore::newAttributesFrom(const qm::Value& oldStyleAttributes) {
    const qm::Dictionary* old = oldStyleAttributes.asDictionary();
    if (old == nullptr) {
        return std::nullopt;
    }
    qm::Dictionary translated;
    for (const auto& [key, value] : *old) {
        translated.set(std::string(newKeyForOldAttributeKey(key)), value);
    }
    return translated;
}
