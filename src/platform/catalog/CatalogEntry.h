#pragma once
// The catalog's own form of what it registered: one entry per plug-in bundle
// and per application, as kept in memory on the catalog's thread and in its
// database. Everything a restart needs is here, so that an unchanged bundle
// is never read again; the handed-out records are built from these.

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "platform/catalog/ChangeKey.h"
#include "platform/value/Value.h"

namespace qm {

struct CatalogPlugIn {
    Uuid uuid;
    std::string identifier;
    std::optional<std::string> extensionPoint;
    Value plugInDictionary;
    std::int64_t registeredAt = 0;  // seconds since 1970
};

struct CatalogBundle {
    std::string path;                   // resolved; the key
    std::optional<std::string> source;  // the plug-ins folder in which a scan found it
    bool added = false;                 // registered by path: kept while it exists
    ChangeKey infoKey;
    ChangeKey entitlementsKey;
    Value infoDictionary;
    std::optional<Value> entitlements;
    std::optional<std::string> bundleIdentifier;
    std::optional<std::string> bundleVersion;
    std::optional<std::string> localizedName;
    std::optional<std::string> localizedShortName;
    std::optional<std::string> dataContainerPath;
    std::optional<std::string> applicationPath;  // by folder layout
    std::vector<CatalogPlugIn> plugIns;
};

struct CatalogApplication {
    std::string path;  // resolved; the key
    ChangeKey infoKey;
    std::optional<std::string> localizedName;
};

}  // namespace qm
