#pragma once
// An immutable view of everything registered, with the indexes the lookups
// need: by UUID, by bundle path, by application path and by extension
// point. The catalog builds a new one after each committed change and
// publishes it; readers keep the one they took for as long as they need it.
// Immutable, so any thread may read it.

#include <map>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/catalog/CatalogRecords.h"

namespace qm {

class CatalogIndex {
public:
    struct Application {
        std::string path;
        std::optional<std::string> localizedName;
    };

    // Records in any order; applications known without plug-ins as well as
    // those the records name.
    CatalogIndex(std::vector<PlugInRecordPtr> records, const std::vector<Application>& applications);

    PlugInRecordPtr plugInWithUuid(const Uuid& uuid) const;
    // The first plug-in of the bundle at the (resolved) path, in order.
    PlugInRecordPtr plugInAtPath(const std::string& bundlePath) const;
    ApplicationRecordPtr applicationAtPath(const std::string& applicationPath) const;
    // Every plug-in, in path, identifier, UUID order.
    const std::vector<PlugInRecordPtr>& all() const { return all_; }
    // The plug-ins of the named points that pass the filter (when given), in
    // order; each named point costs one hash lookup.
    std::vector<PlugInRecordPtr> plugInsForExtensionPoints(const std::vector<std::string>& points,
                                                           const PlugInFilter& filter) const;

    // The order of every list: bundle path bytes, then identifier, then UUID text.
    static bool precedes(const PlugInRecord& a, const PlugInRecord& b);

private:
    std::vector<PlugInRecordPtr> all_;
    std::unordered_map<Uuid, PlugInRecordPtr, UuidHash> byUuid_;
    std::map<std::string, std::pair<std::size_t, std::size_t>, std::less<>> byPath_;  // range in all_
    std::unordered_map<std::string, std::vector<PlugInRecordPtr>> byPoint_;
    std::map<std::string, ApplicationRecordPtr, std::less<>> applications_;
};

}  // namespace qm
