#pragma once
// Which folders the catalog watches and why. Each watched folder carries
// the targets it stands for (an install root, an application, a plug-ins
// folder, a bundle whose Info file does not parse yet, the folder of a
// bundle registered by path), so that an event names the work to redo.
//
// Used on the catalog's thread only. Running out of inotify watches is
// logged once; folders that cannot be watched are simply not watched (their
// changes are seen at the next start).

#include <compare>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

namespace qm {

class FolderWatcher;

enum class WatchRole { root, application, plugInsFolder, pendingBundle, addedParent };

struct WatchTarget {
    WatchRole role;
    std::string key;  // the root, application, folder or bundle path
    auto operator<=>(const WatchTarget&) const = default;
};

class CatalogWatches {
public:
    // Without a watcher nothing is watched.
    explicit CatalogWatches(FolderWatcher* watcher) : watcher_(watcher) {}

    void watch(const std::string& folder, const WatchTarget& target);
    void unwatch(const std::string& folder, const WatchTarget& target);
    // Drops the target from every folder.
    void unwatchEverywhere(const WatchTarget& target);

    std::vector<WatchTarget> targetsOf(int descriptor) const;
    // The kernel dropped the watch (its folder is gone); returns its targets.
    std::vector<WatchTarget> forget(int descriptor);

private:
    struct Watched {
        std::string folder;
        std::set<WatchTarget> targets;
    };
    void dropIfUnused(int descriptor);

    FolderWatcher* watcher_;
    std::unordered_map<int, Watched> byDescriptor_;
    std::unordered_map<std::string, int> byFolder_;
    bool outOfWatchesLogged_ = false;
};

}  // namespace qm
