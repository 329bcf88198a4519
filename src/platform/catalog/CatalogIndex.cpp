#include "platform/catalog/CatalogIndex.h"

#include <algorithm>

namespace qm {

bool CatalogIndex::precedes(const PlugInRecord& a, const PlugInRecord& b) {
    if (a.bundlePath != b.bundlePath) {
        return a.bundlePath < b.bundlePath;
    }
    if (a.identifier != b.identifier) {
        return a.identifier < b.identifier;
    }
    return a.uuid < b.uuid;  // byte order is the order of the canonical text
}

CatalogIndex::CatalogIndex(std::vector<PlugInRecordPtr> records, const std::vector<Application>& applications)
    : all_(std::move(records)) {
    auto inOrder = [](const PlugInRecordPtr& a, const PlugInRecordPtr& b) { return precedes(*a, *b); };
    std::sort(all_.begin(), all_.end(), inOrder);

    std::map<std::string, std::vector<PlugInRecordPtr>> plugInsOfApplication;
    for (std::size_t i = 0; i < all_.size(); ++i) {
        const PlugInRecordPtr& record = all_[i];
        byUuid_.emplace(record->uuid, record);
        auto [range, fresh] = byPath_.try_emplace(record->bundlePath, i, i + 1);
        if (!fresh) {
            range->second.second = i + 1;
        }
        if (record->extensionPoint) {
            byPoint_[*record->extensionPoint].push_back(record);
        }
        if (record->containingApplication) {
            plugInsOfApplication[record->containingApplication->path].push_back(record);
        }
    }
    for (const auto& application : applications) {
        auto record = std::make_shared<ApplicationRecord>();
        record->path = application.path;
        record->localizedName = application.localizedName;
        if (auto found = plugInsOfApplication.find(application.path); found != plugInsOfApplication.end()) {
            record->plugIns = std::move(found->second);
        }
        applications_.emplace(application.path, std::move(record));
    }
}

PlugInRecordPtr CatalogIndex::plugInWithUuid(const Uuid& uuid) const {
    auto found = byUuid_.find(uuid);
    return found == byUuid_.end() ? nullptr : found->second;
}

PlugInRecordPtr CatalogIndex::plugInAtPath(const std::string& bundlePath) const {
    auto found = byPath_.find(bundlePath);
    return found == byPath_.end() ? nullptr : all_[found->second.first];
}

ApplicationRecordPtr CatalogIndex::applicationAtPath(const std::string& applicationPath) const {
    auto found = applications_.find(applicationPath);
    return found == applications_.end() ? nullptr : found->second;
}

std::vector<PlugInRecordPtr> CatalogIndex::plugInsForExtensionPoints(const std::vector<std::string>& points,
                                                                     const PlugInFilter& filter) const {
    std::vector<PlugInRecordPtr> matches;
    std::vector<const std::string*> seen;
    for (const auto& point : points) {
        if (std::any_of(seen.begin(), seen.end(), [&point](const std::string* s) { return *s == point; })) {
            continue;
        }
        seen.push_back(&point);
        auto found = byPoint_.find(point);
        if (found == byPoint_.end()) {
            continue;
        }
        for (const auto& record : found->second) {
            if (!filter || filter(record->identifier, record->entitlements)) {
                matches.push_back(record);
            }
        }
    }
    if (seen.size() > 1) {
        std::sort(matches.begin(), matches.end(),
                  [](const PlugInRecordPtr& a, const PlugInRecordPtr& b) { return precedes(*a, *b); });
    }
    return matches;
}

}  // namespace qm
