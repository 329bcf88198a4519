#include "platform/catalog/PlugInDeclarations.h"

namespace qm {

namespace {

struct Vocabulary {
    const char* attributes;
    const char* identifier;
    const char* extensionPoint;
};
constexpr Vocabulary kNewStyle{"VTExtensionAttributes", "VTExtensionIdentifier", "VTExtensionPointName"};
constexpr Vocabulary kOldStyle{"Attributes", "ovaro.identifier", "ovaro.protocol"};

constexpr const char* kTopKey = "VTExtension";
constexpr const char* kOldTopKey = "Quamber";
constexpr const char* kMultipleKey = "Multiple";
constexpr const char* kBundleIdentifierKey = "MRBundleIdentifier";

const Value* attributesOf(const Value& dictionary, const Vocabulary& words) {
    return dictionary.get(words.attributes);
}

}  // namespace

bool declaresPlugIns(const Value& infoDictionary) {
    return infoDictionary.get(kTopKey) != nullptr || infoDictionary.get(kOldTopKey) != nullptr;
}

std::vector<DeclaredPlugIn> declaredPlugIns(const Value& infoDictionary) {
    const Value* top = infoDictionary.get(kTopKey);
    const Vocabulary* words = &kNewStyle;
    if (top == nullptr) {
        top = infoDictionary.get(kOldTopKey);
        words = &kOldStyle;
    }
    if (top == nullptr) {
        return {};
    }
    const std::optional<std::string> topPoint = stringAt(attributesOf(*top, *words), words->extensionPoint);

    const Value* multiple = top->get(kMultipleKey);
    if (const Dictionary* entries = multiple ? multiple->asDictionary() : nullptr) {
        std::vector<DeclaredPlugIn> plugIns;
        for (const auto& [identifier, entry] : *entries) {
            std::optional<std::string> point = stringAt(attributesOf(entry, *words), words->extensionPoint);
            plugIns.push_back({identifier, point ? point : topPoint, entry});
        }
        return plugIns;
    }

    std::optional<std::string> identifier = stringAt(attributesOf(*top, *words), words->identifier);
    if (!identifier) {
        identifier = stringAt(&infoDictionary, kBundleIdentifierKey);
    }
    if (!identifier) {
        return {};
    }
    return {{*identifier, topPoint, *top}};
}

}  // namespace qm
