#include "platform/catalog/CatalogWatches.h"

#include <cerrno>

#include "platform/catalog/FolderWatcher.h"
#include "platform/log/SystemLog.h"

namespace qm {

void CatalogWatches::watch(const std::string& folder, const WatchTarget& target) {
    if (watcher_ == nullptr) {
        return;
    }
    if (auto known = byFolder_.find(folder); known != byFolder_.end()) {
        byDescriptor_[known->second].targets.insert(target);
        return;
    }
    auto descriptor = watcher_->watch(folder);
    if (!descriptor) {
        const Error& error = descriptor.error();
        if (error.code == ENOSPC) {
            if (!outOfWatchesLogged_) {
                outOfWatchesLogged_ = true;
                systemLogf(kLogNotice,
                           "out of inotify watches (fs.inotify.max_user_watches): changes under %@ and other "
                           "folders are seen at the next start",
                           folder);
            }
        } else if (error.code != ENOENT && error.code != ENOTDIR) {
            systemLogf(kLogNotice, "cannot watch %@: %@", folder, error.text());
        }
        return;
    }
    // The same folder reached under another name shares the descriptor.
    Watched& watched = byDescriptor_[*descriptor];
    if (watched.folder.empty()) {
        watched.folder = folder;
    }
    watched.targets.insert(target);
    byFolder_[folder] = *descriptor;
}

void CatalogWatches::unwatch(const std::string& folder, const WatchTarget& target) {
    auto known = byFolder_.find(folder);
    if (known == byFolder_.end()) {
        return;
    }
    int descriptor = known->second;
    byDescriptor_[descriptor].targets.erase(target);
    dropIfUnused(descriptor);
}

void CatalogWatches::unwatchEverywhere(const WatchTarget& target) {
    std::vector<int> touched;
    for (auto& [descriptor, watched] : byDescriptor_) {
        if (watched.targets.erase(target) > 0) {
            touched.push_back(descriptor);
        }
    }
    for (int descriptor : touched) {
        dropIfUnused(descriptor);
    }
}

std::vector<WatchTarget> CatalogWatches::targetsOf(int descriptor) const {
    auto found = byDescriptor_.find(descriptor);
    if (found == byDescriptor_.end()) {
        return {};
    }
    return {found->second.targets.begin(), found->second.targets.end()};
}

std::vector<WatchTarget> CatalogWatches::forget(int descriptor) {
    auto found = byDescriptor_.find(descriptor);
    if (found == byDescriptor_.end()) {
        return {};
    }
    std::vector<WatchTarget> targets(found->second.targets.begin(), found->second.targets.end());
    std::erase_if(byFolder_, [descriptor](const auto& entry) { return entry.second == descriptor; });
    byDescriptor_.erase(found);
    return targets;
}

void CatalogWatches::dropIfUnused(int descriptor) {
    auto found = byDescriptor_.find(descriptor);
    if (found == byDescriptor_.end() || !found->second.targets.empty()) {
        return;
    }
    watcher_->unwatch(descriptor);
    std::erase_if(byFolder_, [descriptor](const auto& entry) { return entry.second == descriptor; });
    byDescriptor_.erase(found);
}

}  // namespace qm
