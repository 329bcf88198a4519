// Making a pass real: the database first, then the catalog's state, the
// published index and the observers, in that order. On the catalog's thread.

#include <algorithm>
#include <unordered_set>

#include "platform/catalog/AppCatalog.h"
#include "platform/catalog/AppCatalogPass.h"
#include "platform/catalog/BundleLayout.h"

namespace qm {

namespace {

std::vector<PlugInRecordPtr> missingFrom(const std::vector<PlugInRecordPtr>& records,
                                         const std::vector<PlugInRecordPtr>& others) {
    std::unordered_set<Uuid, UuidHash> present;
    for (const auto& record : others) {
        present.insert(record->uuid);
    }
    std::vector<PlugInRecordPtr> missing;
    for (const auto& record : records) {
        if (!present.contains(record->uuid)) {
            missing.push_back(record);
        }
    }
    std::sort(missing.begin(), missing.end(),
              [](const PlugInRecordPtr& a, const PlugInRecordPtr& b) { return CatalogIndex::precedes(*a, *b); });
    return missing;
}

}  // namespace

const CatalogBundle* AppCatalog::currentBundle(const Pass& pass, const std::string& path) const {
    if (auto staged = pass.bundles.find(path); staged != pass.bundles.end()) {
        return staged->second ? &*staged->second : nullptr;
    }
    auto found = bundles_.find(path);
    return found == bundles_.end() ? nullptr : &found->second.stored;
}

const CatalogApplication* AppCatalog::currentApplication(const Pass& pass, const std::string& path) const {
    if (auto staged = pass.applications.find(path); staged != pass.applications.end()) {
        return staged->second ? &*staged->second : nullptr;
    }
    auto found = applications_.find(path);
    return found == applications_.end() ? nullptr : &found->second.stored;
}

namespace {

// What a pass staged for one kind of row: written rows, and removed paths.
template <class Staged, class Row>
void addStaged(const Staged& staged, std::vector<Row>& written, std::vector<std::string>& removed) {
    for (const auto& [path, row] : staged) {
        if (row) {
            written.push_back(*row);
        } else {
            removed.push_back(path);
        }
    }
}

// Every row as it stands after a pass: the known ones as the pass leaves
// them, then the ones the pass adds.
template <class Known, class Staged, class Current, class Row>
void addEverything(const Known& known, const Staged& staged, Current current, std::vector<Row>& written) {
    for (const auto& entry : known) {
        if (const Row* row = current(entry.first)) {
            written.push_back(*row);
        }
    }
    for (const auto& [path, row] : staged) {
        if (row && !known.contains(path)) {
            written.push_back(*row);
        }
    }
}

}  // namespace

CatalogDatabase::Changes AppCatalog::changesOf(const Pass& pass) const {
    CatalogDatabase::Changes changes;
    addStaged(pass.bundles, changes.writtenBundles, changes.removedBundles);
    addStaged(pass.applications, changes.writtenApplications, changes.removedApplications);
    changes.language = pass.language;
    return changes;
}

CatalogDatabase::Changes AppCatalog::everythingAfter(const Pass& pass) const {
    CatalogDatabase::Changes changes;
    addEverything(bundles_, pass.bundles, [&](const std::string& path) { return currentBundle(pass, path); },
                  changes.writtenBundles);
    addEverything(applications_, pass.applications,
                  [&](const std::string& path) { return currentApplication(pass, path); },
                  changes.writtenApplications);
    changes.language = options_.language.value_or("");
    return changes;
}

MaybeError AppCatalog::commit(Pass& pass) {
    queue_.assertCurrent();
    settleApplications(pass);
    if (pass.bundles.empty() && pass.applications.empty() && !pass.language) {
        if (pass.applicationsMoved || refusalsChanged_) {
            publish();
        }
        return std::nullopt;
    }
    MaybeError failure = database_->write(changesOf(pass));
    if (failure && CatalogDatabase::isDamage(*failure)) {
        // The catalog in memory is whole: it becomes the new file's content.
        failure = database_->replaceDamagedFile(*failure);
        if (!failure) {
            failure = database_->write(everythingAfter(pass));
        }
    }
    if (failure) {
        return failure;
    }
    auto [removed, installed] = apply(pass);
    publish();
    notify(removed, installed);
    return std::nullopt;
}

std::pair<std::vector<PlugInRecordPtr>, std::vector<PlugInRecordPtr>> AppCatalog::apply(Pass& pass) {
    std::set<std::string> renamed;
    for (auto& [path, staged] : pass.applications) {
        if (staged) {
            KnownApplication& known = applications_[path];
            if (known.stored.localizedName != staged->localizedName) {
                renamed.insert(path);
            }
            known.stored = std::move(*staged);
        } else if (auto found = applications_.find(path); found != applications_.end() && !found->second.root) {
            applications_.erase(found);
        }
    }
    std::vector<PlugInRecordPtr> before;
    std::vector<PlugInRecordPtr> after;
    for (auto& [path, staged] : pass.bundles) {
        if (auto found = bundles_.find(path); found != bundles_.end()) {
            before.insert(before.end(), found->second.records.begin(), found->second.records.end());
            bundles_.erase(found);
        }
        if (staged) {
            Entry entry = makeEntry(std::move(*staged));
            after.insert(after.end(), entry.records.begin(), entry.records.end());
            bundles_.emplace(path, std::move(entry));
        }
    }
    // Records are immutable: those of a renamed application are made anew,
    // with the same identities.
    for (auto& [path, entry] : bundles_) {
        const auto& application = entry.stored.applicationPath;
        if (application && renamed.contains(*application) && !pass.bundles.contains(path)) {
            entry = makeEntry(std::move(entry.stored));
        }
    }
    return {missingFrom(before, after), missingFrom(after, before)};
}

AppCatalog::Entry AppCatalog::makeEntry(CatalogBundle stored) const {
    Entry entry;
    entry.stored = std::move(stored);
    for (const auto& plugIn : entry.stored.plugIns) {
        entry.records.push_back(makeRecord(entry.stored, plugIn));
    }
    return entry;
}

PlugInRecordPtr AppCatalog::makeRecord(const CatalogBundle& bundle, const CatalogPlugIn& plugIn) const {
    auto record = std::make_shared<PlugInRecord>();
    record->uuid = plugIn.uuid;
    record->bundlePath = bundle.path;
    record->identifier = plugIn.identifier;
    record->extensionPoint = plugIn.extensionPoint;
    record->infoDictionary = bundle.infoDictionary;
    record->plugInDictionary = plugIn.plugInDictionary;
    record->registrationDate = Date{static_cast<double>(plugIn.registeredAt)};
    record->onSystemVolume = isUnderAnyRoot(bundle.path, systemRootPaths_);
    if (bundle.applicationPath) {
        ContainingApplication application{*bundle.applicationPath, std::nullopt};
        if (auto known = applications_.find(*bundle.applicationPath); known != applications_.end()) {
            application.localizedName = known->second.stored.localizedName;
        }
        record->containingApplication = std::move(application);
    }
    record->localizedName = bundle.localizedName;
    record->localizedShortName = bundle.localizedShortName;
    record->entitlements = bundle.entitlements;
    record->dataContainerPath = bundle.dataContainerPath;
    record->bundleIdentifier = bundle.bundleIdentifier;
    record->bundleVersion = bundle.bundleVersion;
    return record;
}

void AppCatalog::publish() {
    std::vector<PlugInRecordPtr> records;
    for (const auto& [path, entry] : bundles_) {
        records.insert(records.end(), entry.records.begin(), entry.records.end());
    }
    std::vector<CatalogIndex::Application> applications;
    for (const auto& [path, application] : applications_) {
        applications.push_back({path, application.stored.localizedName});
    }
    auto index = std::make_shared<const CatalogIndex>(std::move(records), applications);
    auto refusals = std::make_shared<std::vector<CatalogRefusal>>();
    for (const auto& [path, refusal] : refused_) {
        refusals->push_back({path, refusal.reason});
    }
    refusalsChanged_ = false;
    std::lock_guard lock(indexMutex_);
    index_ = std::move(index);
    refusals_ = std::move(refusals);
}

void AppCatalog::refuse(const std::string& path, Refusal refusal) {
    auto found = refused_.find(path);
    if (found == refused_.end() || found->second.reason != refusal.reason) {
        refusalsChanged_ = true;
    }
    refused_.insert_or_assign(path, std::move(refusal));
}

void AppCatalog::forgetRefusal(const std::string& path) {
    refusalsChanged_ = refused_.erase(path) > 0 || refusalsChanged_;
}

void AppCatalog::notify(const std::vector<PlugInRecordPtr>& removed, const std::vector<PlugInRecordPtr>& installed) {
    if (removed.empty() && installed.empty()) {
        return;
    }
    std::vector<std::shared_ptr<AppCatalogObserver>> observers;
    {
        std::lock_guard lock(observersMutex_);
        std::erase_if(observers_, [](const auto& observer) { return observer.expired(); });
        for (const auto& observer : observers_) {
            if (auto live = observer.lock()) {
                observers.push_back(std::move(live));
            }
        }
    }
    for (const auto& observer : observers) {
        if (!removed.empty()) {
            observer->pluginsWillUninstall(removed);
        }
        if (!installed.empty()) {
            observer->pluginsDidInstall(installed);
        }
    }
}

}  // namespace qm
