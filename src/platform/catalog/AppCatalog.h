#pragma once
// The application catalog: which plug-in bundles are registered, each
// plug-in's identity (a UUID and a registration date that survive restarts)
// and the facts read from its bundle. It knows bundles and their plug-in
// entries, nothing of what uses them.
//
// Sources of registrations:
// - install roots (the system roots and the user's root): the ".app"
//   directories directly inside a root are applications; the bundles
//   directly in an application's PlugIns/ or Contents/PlugIns/ whose Info
//   declares "VTExtension" or "Quamber" are its plug-ins. Other bundles are
//   skipped silently.
// - registerPlugIn(path): kept across restarts while the bundle exists.
//
// A bundle is read once per state of its Info and Entitlements files (see
// ChangeKey): when either changes, its registration is replaced (an
// uninstall, then an install with new UUIDs and date). Everything a restart
// needs is stored in an SQLite file, so unchanged bundles are not read again
// at start; differences found at start are reported like any other.
//
// Folder events (inotify) on the roots, the applications (and Contents/),
// their plug-ins folders, the folders of bundles registered by path and
// bundles whose Info does not parse yet are coalesced (100 ms) and
// re-checked with stat; lost events mean a full rescan. An Info file
// rewritten inside a registered bundle, with no event in a watched folder,
// is seen at the next start.
//
// Threads. The catalog has its own thread (a serial queue) on which every
// change is made, committed and reported to observers, plus a reader of
// folder events. Reads never go through that thread: they take the last
// published index (see CatalogIndex), on the caller's thread, from any
// thread. registerPlugIn and unregisterPlugIn hand their work to the
// catalog's thread and wait for it; they must not be called from an
// observer. The catalog's thread waits on nobody but its observers.
//
// Life: open() opens the database; addObserver(); start() schedules the
// first scan of the install roots; waitUntilReady() returns once that scan
// is committed and reported. Lookups before that answer from an empty index.

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "platform/catalog/CatalogDatabase.h"
#include "platform/catalog/CatalogEntry.h"
#include "platform/catalog/CatalogIndex.h"
#include "platform/catalog/CatalogRecords.h"
#include "platform/catalog/CatalogWatches.h"
#include "platform/catalog/FolderWatcher.h"
#include "platform/catalog/PlugInBundleReader.h"
#include "platform/error/Error.h"
#include "platform/queue/SerialQueue.h"

namespace qm {

struct AppCatalogOptions {
    std::string databasePath;
    std::vector<std::string> systemRoots;  // a missing one is logged and skipped
    std::string userRoot;                  // created when missing
    std::string containersDirectory;
    std::optional<std::string> language;   // for InfoPlist.strings
    std::chrono::milliseconds lockTimeout{5000};
    std::chrono::milliseconds coalescing{100};

    // $QM_CATALOG_DB, $QM_SYSTEM_ROOTS, $XDG_DATA_HOME/ovaro/{Applications,
    // Containers}, the user's language.
    static AppCatalogOptions fromEnvironment();
};

class AppCatalog {
public:
    // Opens (or creates, or replaces when damaged) the database. Fails when
    // another process holds it past the lock timeout, or it cannot be made.
    static Result<std::unique_ptr<AppCatalog>> open(AppCatalogOptions options);
    ~AppCatalog();
    AppCatalog(const AppCatalog&) = delete;
    AppCatalog& operator=(const AppCatalog&) = delete;

    // Kept weakly; add before start() to hear about differences found by the
    // first scan. Any thread.
    void addObserver(const std::shared_ptr<AppCatalogObserver>& observer);

    // Schedules the first scan on the catalog's thread and returns. Once.
    void start();
    // Blocks until the first scan is committed and its observer calls made.
    void waitUntilReady() const;
    bool isReady() const;

    // Registers the plug-in bundle at path (resolved first). A path already
    // registered keeps its UUIDs. Errors (domain kAppCatalogErrorDomain):
    // notAPlugIn, applicationBundle, storage. Returns after the commit and
    // the observer calls. Requires start(); waits for the first scan.
    MaybeError registerPlugIn(const std::string& bundlePath);
    // Drops whatever is registered at path (resolved when it still exists).
    // Errors: notRegistered, storage. A plug-in of an installed application
    // comes back, with new UUIDs, at the next event in its folder or start.
    MaybeError unregisterPlugIn(const std::string& bundlePath);

    // Lookups: thread-safe, never wait for the catalog's thread. Paths are
    // resolved when they exist, else taken as given.
    PlugInRecordPtr plugInWithUuid(const Uuid& uuid) const;
    // The first plug-in of the bundle, in identifier then UUID order.
    PlugInRecordPtr plugInAtPath(const std::string& bundlePath) const;
    ApplicationRecordPtr applicationAtPath(const std::string& applicationPath) const;
    // Every registered plug-in, in path, identifier, UUID order.
    std::vector<PlugInRecordPtr> installedPlugIns() const;
    // The plug-ins of the named extension points that pass the filter (none
    // given: all), in path, identifier, UUID order. The filter runs on the
    // calling thread; the cost follows the points' plug-ins, not the catalog.
    std::vector<PlugInRecordPtr> plugInsForExtensionPoints(const std::vector<std::string>& points,
                                                           const PlugInFilter& filter = {}) const;
    // The whole current index, for several lookups on one state.
    std::shared_ptr<const CatalogIndex> index() const;
    // The bundles read and not registered, in path order, as last published.
    CatalogRefusals refusals() const;

    // How many Info files the catalog has parsed since it was opened (tests
    // use it to see that unchanged bundles are not read again).
    std::uint64_t infoFilesParsed() const { return infoFilesParsed_.load(); }

private:
    // An application known to the catalog: one found in a root (root set),
    // or the containing application of a registered bundle.
    struct KnownApplication {
        CatalogApplication stored;
        std::optional<std::string> root;
        std::vector<std::string> folders;  // its plug-ins folders, resolved
    };
    struct Entry {
        CatalogBundle stored;
        std::vector<PlugInRecordPtr> records;
    };
    struct Refusal {
        ChangeKey infoKey;
        BundleReadOutcome outcome;
        std::string reason;
    };
    struct Pass;

    AppCatalog(AppCatalogOptions options, std::unique_ptr<CatalogDatabase> database);
    bool isStarted() const;

    // All of these run on the catalog's thread.
    void firstScan();
    void handleEvents(const FolderWatcher::Events& events);
    void fullScan(Pass& pass);
    void rescanRoot(Pass& pass, const std::string& root, bool deep);
    void recheckApplication(Pass& pass, const std::string& application, const std::string& root);
    void leaveRoot(Pass& pass, const std::string& application);
    void refreshApplicationName(Pass& pass, const std::string& application, bool evenIfUnchanged = false);
    void recheckFolder(Pass& pass, const std::string& folder);
    std::vector<std::string> bundlesFoundIn(Pass& pass, const std::string& folder) const;
    void watchPending(const std::string& bundle, const std::optional<std::string>& folder, bool pending);
    void recheckAddedIn(Pass& pass, const std::string& parent);
    void recheckRegistered(Pass& pass, const std::string& path);
    BundleReadOutcome examine(Pass& pass, const std::string& path, const std::optional<std::string>& source,
                              bool added, std::string* reason);
    void relocalize(Pass& pass);
    void settleApplications(Pass& pass);
    MaybeError commit(Pass& pass);
    CatalogDatabase::Changes changesOf(const Pass& pass) const;
    CatalogDatabase::Changes everythingAfter(const Pass& pass) const;
    // Makes the committed pass the catalog's state; returns the records
    // uninstalled and installed by it.
    std::pair<std::vector<PlugInRecordPtr>, std::vector<PlugInRecordPtr>> apply(Pass& pass);
    MaybeError registerOnQueue(const std::string& bundlePath);
    MaybeError unregisterOnQueue(const std::string& bundlePath);

    const CatalogBundle* currentBundle(const Pass& pass, const std::string& path) const;
    const CatalogApplication* currentApplication(const Pass& pass, const std::string& path) const;
    Entry makeEntry(CatalogBundle stored) const;
    PlugInRecordPtr makeRecord(const CatalogBundle& bundle, const CatalogPlugIn& plugIn) const;
    void publish();
    // refused_ changes through these, so the next commit publishes them.
    void refuse(const std::string& path, Refusal refusal);
    void forgetRefusal(const std::string& path);
    void notify(const std::vector<PlugInRecordPtr>& removed, const std::vector<PlugInRecordPtr>& installed);
    std::string lookupPath(const std::string& path) const;

    const AppCatalogOptions options_;
    std::unique_ptr<CatalogDatabase> database_;

    // The catalog thread's state.
    std::vector<std::string> roots_;            // resolved, the system roots first
    std::vector<std::string> systemRootPaths_;  // resolved
    std::map<std::string, Entry> bundles_;
    std::map<std::string, KnownApplication> applications_;
    std::map<std::string, std::string> folderOwner_;     // plug-ins folder -> its application
    std::map<std::string, std::string> pendingBundles_;  // bundle -> its plug-ins folder, until its Info parses
    std::map<std::string, Refusal> refused_;             // bundles read and not registered
    bool refusalsChanged_ = false;                       // since the last publish
    std::unique_ptr<FolderWatcher> watcher_;
    CatalogWatches watches_;

    std::atomic<std::uint64_t> infoFilesParsed_{0};

    mutable std::mutex indexMutex_;
    std::shared_ptr<const CatalogIndex> index_;
    CatalogRefusals refusals_;

    std::mutex observersMutex_;
    std::vector<std::weak_ptr<AppCatalogObserver>> observers_;

    mutable std::mutex readyMutex_;
    mutable std::condition_variable readyChanged_;
    bool started_ = false;
    bool ready_ = false;

    // Last: destroyed first, so no job outlives the state it works on.
    SerialQueue queue_;
};

}  // namespace qm
