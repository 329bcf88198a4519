// The catalog's scans: the first one, the rechecks that folder events
// cause, and what registration by path shares with them. They stage changes
// in a Pass; commit() makes them real. All on the catalog's thread.

#include <sys/stat.h>

#include <algorithm>

#include "platform/bundle/BundleDirectory.h"
#include "platform/catalog/AppCatalog.h"
#include "platform/catalog/AppCatalogPass.h"
#include "platform/catalog/BundleLayout.h"
#include "platform/catalog/BundleNames.h"
#include "platform/file/PathFacts.h"
#include "platform/log/SystemLog.h"

namespace qm {

namespace {

bool isDirectory(const std::string& path) {
    struct stat status {};
    return ::stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
}

void makeFolders(const std::string& path) {
    for (std::size_t slash = path.find('/', 1); slash != std::string::npos; slash = path.find('/', slash + 1)) {
        ::mkdir(path.substr(0, slash).c_str(), 0700);
    }
    ::mkdir(path.c_str(), 0700);
}

}  // namespace

void AppCatalog::firstScan() {
    queue_.assertCurrent();
    for (const auto& configured : options_.systemRoots) {
        auto resolved = resolvedPath(configured);
        if (!resolved) {
            systemLogf(kLogNotice, "system install root %@ skipped: %@", configured, resolved.error().text());
            continue;
        }
        roots_.push_back(*resolved);
        systemRootPaths_.push_back(*resolved);
    }
    makeFolders(options_.userRoot);
    if (auto user = resolvedPath(options_.userRoot)) {
        if (std::find(roots_.begin(), roots_.end(), *user) == roots_.end()) {
            roots_.push_back(*user);
        }
    } else {
        systemLogf(kLogNotice, "user install root %@ skipped: %@", options_.userRoot, user.error().text());
    }

    auto contents = database_->load();
    if (!contents) {
        if (CatalogDatabase::isDamage(contents.error())) {
            if (auto failure = database_->replaceDamagedFile(contents.error())) {
                systemLogf(kLogNotice, "catalog database unusable: %@", failure->text());
            }
        } else {
            systemLogf(kLogNotice, "cannot read the catalog database: %@; rebuilding from the install roots",
                       contents.error().text());
        }
        contents = CatalogDatabase::Contents{};
    }
    for (auto& application : contents->applications) {
        std::string path = application.path;
        applications_[path].stored = std::move(application);
    }
    for (auto& bundle : contents->bundles) {
        std::string path = bundle.path;
        bundles_.emplace(std::move(path), makeEntry(std::move(bundle)));
    }

    Pass pass;
    if (contents->language != options_.language.value_or("")) {
        relocalize(pass);
    }
    fullScan(pass);
    if (auto failure = commit(pass)) {
        systemLogf(kLogNotice, "first catalog scan not saved: %@", failure->text());
    }
    publish();
    {
        std::lock_guard lock(readyMutex_);
        ready_ = true;
    }
    readyChanged_.notify_all();
}

void AppCatalog::handleEvents(const FolderWatcher::Events& events) {
    queue_.assertCurrent();
    Pass pass;
    std::set<WatchTarget> targets;  // roots first, then applications, then folders
    for (int descriptor : events.touched) {
        for (auto& target : watches_.targetsOf(descriptor)) {
            targets.insert(std::move(target));
        }
    }
    // A dropped watch's targets are looked at again, which watches their
    // folders anew when they were replaced rather than removed.
    for (int descriptor : events.removed) {
        for (auto& target : watches_.forget(descriptor)) {
            targets.insert(std::move(target));
        }
    }
    if (events.overflowed) {
        systemLog(kLogNotice, "catalog folder events were lost; looking at every install root again");
        fullScan(pass);
        targets.clear();
    }
    for (const auto& target : targets) {
        switch (target.role) {
            case WatchRole::root:
                if (std::find(roots_.begin(), roots_.end(), target.key) != roots_.end()) {
                    rescanRoot(pass, target.key, false);
                }
                break;
            case WatchRole::application: {
                auto known = applications_.find(target.key);
                if (known == applications_.end() || !known->second.root) {
                    break;
                }
                if (isDirectory(target.key)) {
                    recheckApplication(pass, target.key, *known->second.root);
                } else {
                    leaveRoot(pass, target.key);
                }
                break;
            }
            case WatchRole::plugInsFolder:
                if (folderOwner_.contains(target.key)) {
                    watches_.watch(target.key, target);
                }
                recheckFolder(pass, target.key);
                break;
            case WatchRole::pendingBundle:
                if (auto pending = pendingBundles_.find(target.key); pending != pendingBundles_.end()) {
                    std::string folder = pending->second;
                    if (folderOwner_.contains(folder)) {
                        examine(pass, target.key, folder, false, nullptr);
                    }
                }
                break;
            case WatchRole::addedParent:
                watches_.watch(target.key, target);
                recheckAddedIn(pass, target.key);
                break;
        }
    }
    if (auto failure = commit(pass)) {
        systemLogf(kLogNotice, "catalog change not saved: %@", failure->text());
    }
}

void AppCatalog::fullScan(Pass& pass) {
    for (const auto& root : roots_) {
        rescanRoot(pass, root, true);
    }
    for (const auto& [path, entry] : bundles_) {
        const CatalogBundle* bundle = currentBundle(pass, path);
        if (bundle == nullptr) {
            continue;
        }
        if (bundle->source && !folderOwner_.contains(*bundle->source)) {
            recheckFolder(pass, *bundle->source);  // a folder no longer scanned
        } else if (!bundle->source && !bundle->added) {
            pass.bundles[path] = std::nullopt;
        }
    }
    for (const auto& [path, entry] : bundles_) {
        if (entry.stored.added) {
            std::string parent = parentFolderOf(path);
            watches_.watch(parent, {WatchRole::addedParent, parent});
            recheckRegistered(pass, path);
        }
    }
    for (const auto& [path, application] : applications_) {
        if (!application.root) {
            refreshApplicationName(pass, path);
        }
    }
}

void AppCatalog::rescanRoot(Pass& pass, const std::string& root, bool deep) {
    watches_.watch(root, {WatchRole::root, root});
    std::set<std::string> present;
    for (const auto& application : applicationsInRoot(root)) {
        if (auto resolved = resolvedPath(application)) {
            present.insert(*resolved);
        }
    }
    std::vector<std::string> gone;
    for (const auto& [path, application] : applications_) {
        if (application.root == root && !present.contains(path)) {
            gone.push_back(path);
        }
    }
    for (const auto& path : gone) {
        leaveRoot(pass, path);
    }
    for (const auto& path : present) {
        auto known = applications_.find(path);
        bool inThisRoot = known != applications_.end() && known->second.root == root;
        if (!inThisRoot || deep) {
            recheckApplication(pass, path, root);
        }
    }
}

void AppCatalog::recheckApplication(Pass& pass, const std::string& application, const std::string& root) {
    if (!pass.applicationsDone.insert(application).second) {
        return;
    }
    KnownApplication& known = applications_[application];
    known.stored.path = application;
    pass.applicationsMoved = pass.applicationsMoved || known.root != root;
    known.root = root;
    const WatchTarget target{WatchRole::application, application};
    watches_.watch(application, target);
    watches_.watch(application + "/Contents", target);
    refreshApplicationName(pass, application);

    std::vector<std::string> folders;
    for (const auto& folder : plugInsFoldersOf(application)) {
        if (auto resolved = resolvedPath(folder)) {
            folders.push_back(*resolved);
        }
    }
    std::vector<std::string> old = std::exchange(known.folders, folders);
    for (const auto& folder : old) {
        if (std::find(folders.begin(), folders.end(), folder) == folders.end()) {
            folderOwner_.erase(folder);
            watches_.unwatchEverywhere({WatchRole::plugInsFolder, folder});
            recheckFolder(pass, folder);
        }
    }
    for (const auto& folder : folders) {
        folderOwner_[folder] = application;
        watches_.watch(folder, {WatchRole::plugInsFolder, folder});
        recheckFolder(pass, folder);
    }
}

void AppCatalog::leaveRoot(Pass& pass, const std::string& application) {
    auto known = applications_.find(application);
    if (known == applications_.end()) {
        return;
    }
    known->second.root.reset();
    pass.applicationsMoved = true;
    watches_.unwatchEverywhere({WatchRole::application, application});
    for (const auto& folder : std::exchange(known->second.folders, {})) {
        folderOwner_.erase(folder);
        watches_.unwatchEverywhere({WatchRole::plugInsFolder, folder});
        recheckFolder(pass, folder);
    }
}

void AppCatalog::refreshApplicationName(Pass& pass, const std::string& application, bool evenIfUnchanged) {
    const ChangeKey key = bundleFileKeys(application).info;
    const CatalogApplication* current = currentApplication(pass, application);
    if (current && current->infoKey == key && !evenIfUnchanged) {
        return;
    }
    CatalogApplication row{application, key, std::nullopt};
    if (key.exists()) {
        if (auto bundle = BundleDirectory::atPath(application)) {
            ++infoFilesParsed_;
            if (auto info = bundle->infoDictionary()) {
                row.localizedName = bundleNames(bundle->infoFolder(), *info, options_.language).localizedName;
            }
        }
    }
    pass.applications[application] = std::move(row);
}

std::vector<std::string> AppCatalog::bundlesFoundIn(Pass& pass, const std::string& folder) const {
    if (!pass.bySource) {
        pass.bySource.emplace();
        for (const auto& [path, entry] : bundles_) {
            if (entry.stored.source) {
                (*pass.bySource)[*entry.stored.source].push_back(path);
            }
        }
    }
    std::vector<std::string> paths;
    if (auto found = pass.bySource->find(folder); found != pass.bySource->end()) {
        paths = found->second;
    }
    for (const auto& [path, staged] : pass.bundles) {
        if (staged && staged->source == folder) {
            paths.push_back(path);
        }
    }
    return paths;
}

void AppCatalog::recheckFolder(Pass& pass, const std::string& folder) {
    if (!pass.foldersDone.insert(folder).second) {
        return;
    }
    std::set<std::string> present;
    if (folderOwner_.contains(folder)) {
        for (const auto& child : subdirectoriesOf(folder)) {
            if (auto resolved = resolvedPath(child)) {
                present.insert(*resolved);
            }
        }
    }
    for (const auto& path : bundlesFoundIn(pass, folder)) {
        const CatalogBundle* bundle = currentBundle(pass, path);
        if (bundle == nullptr || present.contains(path)) {
            continue;
        }
        if (bundle->added && bundleFileKeys(path).info.exists()) {
            CatalogBundle kept = *bundle;  // registered by path as well: stays while it exists
            kept.source.reset();
            pass.bundles[path] = std::move(kept);
        } else {
            pass.bundles[path] = std::nullopt;
        }
    }
    for (auto pending = pendingBundles_.begin(); pending != pendingBundles_.end();) {
        if (pending->second == folder && !present.contains(pending->first)) {
            watches_.unwatchEverywhere({WatchRole::pendingBundle, pending->first});
            pending = pendingBundles_.erase(pending);
        } else {
            ++pending;
        }
    }
    std::vector<std::string> gone;
    for (const auto& [path, refusal] : refused_) {
        if (parentFolderOf(path) == folder && !present.contains(path)) {
            gone.push_back(path);
        }
    }
    for (const auto& path : gone) {
        forgetRefusal(path);
    }
    for (const auto& path : present) {
        examine(pass, path, folder, false, nullptr);
    }
}

void AppCatalog::recheckAddedIn(Pass& pass, const std::string& parent) {
    for (const auto& [path, entry] : bundles_) {
        if (entry.stored.added && parentFolderOf(path) == parent) {
            recheckRegistered(pass, path);
        }
    }
}

void AppCatalog::recheckRegistered(Pass& pass, const std::string& path) {
    if (currentBundle(pass, path) == nullptr) {
        return;
    }
    if (!bundleFileKeys(path).info.exists()) {
        pass.bundles[path] = std::nullopt;
        return;
    }
    examine(pass, path, std::nullopt, false, nullptr);
}

BundleReadOutcome AppCatalog::examine(Pass& pass, const std::string& path, const std::optional<std::string>& source,
                                      bool added, std::string* reason) {
    const CatalogBundle* existing = currentBundle(pass, path);
    const BundleFileKeys keys = bundleFileKeys(path);
    const std::optional<std::string> newSource = source ? source : (existing ? existing->source : std::nullopt);
    const bool newAdded = added || (existing && existing->added);
    if (existing && keys.info.exists() && existing->infoKey == keys.info &&
        existing->entitlementsKey == keys.entitlements) {
        if (existing->source != newSource || existing->added != newAdded) {
            CatalogBundle changed = *existing;
            changed.source = newSource;
            changed.added = newAdded;
            pass.bundles[path] = std::move(changed);
        }
        return BundleReadOutcome::plugIn;
    }

    BundleReadResult read;
    auto refusal = refused_.find(path);
    if (!existing && refusal != refused_.end() && refusal->second.infoKey == keys.info) {
        read.outcome = refusal->second.outcome;
        read.reason = refusal->second.reason;
    } else {
        if (keys.info.exists()) {
            ++infoFilesParsed_;
            read = readPlugInBundle(path, {options_.language, options_.containersDirectory});
        } else {
            read.reason = "no Info.plist";
        }
        if (read.outcome == BundleReadOutcome::plugIn) {
            read.entry->source = newSource;
            read.entry->added = newAdded;
            pass.bundles[path] = std::move(read.entry);
            forgetRefusal(path);
            watchPending(path, source, false);
            return BundleReadOutcome::plugIn;
        }
        if (existing) {
            pass.bundles[path] = std::nullopt;  // it was a plug-in; it is no longer
        }
        refuse(path, {keys.info, read.outcome, read.reason});
    }
    // A bundle still being written is watched until its Info parses.
    if (read.outcome != BundleReadOutcome::unreadable) {
        watchPending(path, source, false);
    } else if (source) {
        watchPending(path, source, true);
    }
    if (reason) {
        *reason = read.reason;
    }
    return read.outcome;
}

void AppCatalog::watchPending(const std::string& bundle, const std::optional<std::string>& folder, bool pending) {
    const WatchTarget target{WatchRole::pendingBundle, bundle};
    if (!pending) {
        if (pendingBundles_.erase(bundle) > 0) {
            watches_.unwatchEverywhere(target);
        }
        return;
    }
    pendingBundles_[bundle] = *folder;
    watches_.watch(bundle, target);
    watches_.watch(bundle + "/Contents", target);
}

void AppCatalog::relocalize(Pass& pass) {
    for (const auto& [path, entry] : bundles_) {
        auto bundle = BundleDirectory::atPath(path);
        if (!bundle) {
            continue;  // gone: the scan drops it
        }
        BundleNames names = bundleNames(bundle->infoFolder(), entry.stored.infoDictionary, options_.language);
        if (names.localizedName != entry.stored.localizedName ||
            names.localizedShortName != entry.stored.localizedShortName) {
            CatalogBundle renamed = entry.stored;
            renamed.localizedName = std::move(names.localizedName);
            renamed.localizedShortName = std::move(names.localizedShortName);
            pass.bundles[path] = std::move(renamed);
        }
    }
    for (const auto& [path, application] : applications_) {
        refreshApplicationName(pass, path, true);
    }
    pass.language = options_.language.value_or("");
}

void AppCatalog::settleApplications(Pass& pass) {
    std::set<std::string> referenced;
    for (const auto& [path, entry] : bundles_) {
        if (!pass.bundles.contains(path) && entry.stored.applicationPath) {
            referenced.insert(*entry.stored.applicationPath);
        }
    }
    for (const auto& [path, staged] : pass.bundles) {
        if (staged && staged->applicationPath) {
            referenced.insert(*staged->applicationPath);
        }
    }
    for (const auto& application : referenced) {
        if (!applications_.contains(application) && !pass.applications.contains(application)) {
            refreshApplicationName(pass, application);
        }
    }
    for (const auto& [path, application] : applications_) {
        if (!application.root && !referenced.contains(path)) {
            pass.applications[path] = std::nullopt;
        }
    }
}

}  // namespace qm
