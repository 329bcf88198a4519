#pragma once
// The plug-in registry: a cache of the daemon's plug-in records in front of
// the app catalog, which is the authority on which plug-ins exist, and the
// owner of the annotation store. Each plug-in is parsed, resolved and
// validated once per UUID and then served from the cache, until the catalog
// reports its uninstallation.
//
// Threads: the registry queue ("QMDatabase") serialises every access to the
// cache and to the annotation store; callers on other queues submit to it
// synchronously and wait. Nothing running on it submits to another queue:
// the annotation-change notification and the delegate's removedPlugIns are
// issued after leaving it. Catalog reads are direct and never wait for the
// catalog's thread. The catalog's observer calls arrive on its own thread.
//
// The daemon answers no request before the registry is ready: its catalog's
// first scan of the install roots is committed.

#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <unordered_map>
#include <vector>

#include "platform/catalog/AppCatalog.h"
#include "platform/error/Error.h"
#include "platform/queue/SerialQueue.h"
#include "platform/value/Value.h"
#include "registry/QMDAnnotationStore.h"
#include "registry/QMDPlugIn.h"

using QMDPlugInPtr = std::shared_ptr<QMDPlugIn>;

class QMDatabase {
public:
    // Told, after the registry dropped them from its cache, of the plug-ins
    // the catalog uninstalls (the server removes their services).
    using RemovedPlugIns = std::function<void(const std::vector<qm::PlugInRecordPtr>&)>;
    // Posts "ovaro.quamber.annotation-change".
    using AnnotationsChanged = std::function<void()>;
    // Posts "ovaro.quamber.plugins-change": plug-ins were installed or
    // uninstalled and the registry has caught up with it.
    using PlugInsChanged = std::function<void()>;

    // Opens the annotation store (`databasePath`, else its default file) and
    // observes the catalog. Fails when the store's default folder cannot be
    // made.
    static qm::Result<std::unique_ptr<QMDatabase>> initWithDatabase(const std::optional<std::string>& databasePath,
                                                                    std::unique_ptr<qm::AppCatalog> catalog);
    ~QMDatabase();
    QMDatabase(const QMDatabase&) = delete;
    QMDatabase& operator=(const QMDatabase&) = delete;

    // Both set before the server serves.
    void setDelegate(RemovedPlugIns removedPlugIns) { removedPlugIns_ = std::move(removedPlugIns); }
    void setAnnotationsChanged(AnnotationsChanged changed) { annotationsChanged_ = std::move(changed); }
    void setPlugInsChanged(PlugInsChanged changed) { plugInsChanged_ = std::move(changed); }

    // Starts the catalog's first scan of the install roots. Once.
    void start();
    // Runs `ready` once the catalog's first scan is committed: at once when
    // it is, otherwise on a thread of the registry's.
    void whenReady(std::function<void()> ready);
    bool isReady() const;

    qm::AppCatalog& workspace() noexcept { return *catalog_; }
    qm::SerialQueue& sync() noexcept { return sync_; }

    // --- lookups ---------------------------------------------------------
    QMDPlugInPtr findPlugIn(const qm::Uuid& uuid);
    // The first plug-in of the bundle at path, in identifier then UUID order.
    QMDPlugInPtr findPlugInAtPath(const std::string& path);
    // The application's plug-ins in the catalog's order, or none when it has none.
    std::optional<std::vector<QMDPlugInPtr>> plugInsWithinApplication(const std::string& path);
    // The candidates of a "match": narrowed to the extension points the
    // rules name literally (and, within them, to the elections they name
    // literally), else every installed plug-in. In path, identifier, UUID
    // order. The rules themselves are applied afterwards.
    std::vector<QMDPlugInPtr> findPlugIns(const qm::Dictionary* rules);
    // The candidates dropped by the election filter, for explanations.
    struct Candidates {
        std::vector<QMDPlugInPtr> plugIns;
        std::vector<qm::PlugInRecordPtr> failedElection;
        // Catalog records that yield no plug-in record (mis-configured), with why.
        std::vector<std::pair<qm::PlugInRecordPtr, std::string>> misconfigured;
    };
    Candidates findCandidates(const qm::Dictionary* rules, bool explain);

    QMDPlugInPtr plugInForProxy(const qm::PlugInRecordPtr& record);

    // What a developer asks: every registered plug-in (of one extension point
    // when given), each judged valid or not, and, without a point, the
    // bundles the catalog refused, merged in path order. A plug-in not built
    // yet is judged by a build that is thrown away (no cache entry, no
    // auto-election, no log line), so listing changes nothing. Only the
    // page asked for is judged.
    struct ListedPlugIn {
        qm::PlugInRecordPtr record;  // null for a refused bundle
        std::string path;
        std::optional<std::string> invalidReason;
        std::optional<qm::Value> election;
    };
    struct PlugInListing {
        std::vector<ListedPlugIn> page;
        std::size_t total = 0;
    };
    PlugInListing listPlugIns(const std::optional<std::string>& point, std::size_t offset, std::size_t limit);

    // --- catalog registration -----------------------------------------
    // The catalog's error (domain "AppCatalog") when it refuses.
    qm::MaybeError addPlugIn(const std::string& path);
    qm::MaybeError removePlugIn(const std::string& path);

    // --- annotations ----------------------------------------------------
    std::optional<qm::Value> annotationForPlugIn(const QMDPlugIn& plugIn);
    // Merges and saves, then posts the change notification (on every call).
    void setAnnotationForPlugIn(const std::optional<qm::Dictionary>& annotation, const QMDPlugIn& plugIn);

private:
    class CatalogObserver;

    QMDatabase(std::unique_ptr<QMDAnnotationStore> annotations, std::unique_ptr<qm::AppCatalog> catalog);
    // Registry queue only.
    QMDPlugInPtr createPlugInForProxy(const qm::PlugInRecordPtr& record);
    // Auto-elects where entitled and caches a record just built.
    QMDPlugInPtr admit(const qm::PlugInRecordPtr& record, QMDPlugInPtr plugIn);
    QMDPlugInPtr cachedOrCreated(const qm::PlugInRecordPtr& record);
    void autoElect(const QMDPlugIn& plugIn);
    std::optional<qm::Value> electionFor(const std::string& identifier, const std::optional<qm::Value>& entitlements);

    void pluginsDidInstall(const std::vector<qm::PlugInRecordPtr>& records);
    void pluginsWillUninstall(const std::vector<qm::PlugInRecordPtr>& records);

    std::unique_ptr<QMDAnnotationStore> annotations_;  // registry queue only
    std::unique_ptr<qm::AppCatalog> catalog_;
    std::shared_ptr<CatalogObserver> observer_;
    RemovedPlugIns removedPlugIns_;
    AnnotationsChanged annotationsChanged_;
    PlugInsChanged plugInsChanged_;
    // Registry queue only.
    std::unordered_map<qm::Uuid, QMDPlugInPtr, qm::UuidHash> cache_;

    mutable std::mutex readyMutex_;
    bool ready_ = false;
    std::vector<std::function<void()>> waiting_;
    std::thread readyWatcher_;

    qm::SerialQueue sync_{"QMDatabase"};
};
