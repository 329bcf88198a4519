#pragma once
// What a bundle's Info dictionary declares as plug-ins, read the way the
// catalog reads it: before any normalization, in either vocabulary.
//
// The top dictionary is "VTExtension", else the old style's "Quamber". When
// it has a "Multiple" dictionary, each entry is a plug-in identified by its
// key, whose extension point is the entry's attributes' point, else the top
// dictionary's. Otherwise the bundle is one plug-in identified by the
// attributes' identifier, else by "MRBundleIdentifier".
//
// Keys per vocabulary:        new style                old style
//   attributes                "VTExtensionAttributes"  "Attributes"
//   identifier                "VTExtensionIdentifier"  "ovaro.identifier"
//   extension point           "VTExtensionPointName"   "ovaro.protocol"

#include <optional>
#include <string>
#include <vector>

#include "platform/value/Value.h"

namespace qm {

struct DeclaredPlugIn {
    std::string identifier;
    std::optional<std::string> extensionPoint;
    Value plugInDictionary;  // the "Multiple" entry, else the top dictionary
};

// Whether the Info dictionary has "VTExtension" or "Quamber": only such a
// bundle is a plug-in bundle.
bool declaresPlugIns(const Value& infoDictionary);

// The plug-ins, in key order for "Multiple"; empty when none is identifiable.
std::vector<DeclaredPlugIn> declaredPlugIns(const Value& infoDictionary);

}  // namespace qm
