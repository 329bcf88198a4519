#include "platform/catalog/AppCatalog.h"

#include <algorithm>
#include <cassert>
#include <future>

#include "platform/catalog/AppCatalogPass.h"
#include "platform/catalog/BundleLayout.h"
#include "platform/env/Environment.h"
#include "platform/file/PathFacts.h"
#include "platform/log/SystemLog.h"

namespace qm {

namespace {

Error catalogError(AppCatalogError code, std::string description) {
    return Error{kAppCatalogErrorDomain, static_cast<std::int64_t>(code), std::move(description)};
}

// Runs work on the queue's worker and waits for its result.
template <class Work>
MaybeError runOnWorker(SerialQueue& queue, Work&& work) {
    assert(!queue.heldByThisThread() && "the catalog's thread waits for itself");
    std::promise<MaybeError> promise;
    auto result = promise.get_future();
    queue.asyncOnWorker([&work, promise = std::move(promise)]() mutable { promise.set_value(work()); });
    return result.get();
}

}  // namespace

AppCatalogOptions AppCatalogOptions::fromEnvironment() {
    AppCatalogOptions options;
    options.databasePath = catalogDatabasePath();
    options.systemRoots = qm::systemRoots();
    options.userRoot = userApplicationsRoot();
    options.containersDirectory = dataContainersDirectory();
    options.language = userLanguage();
    return options;
}

Result<std::unique_ptr<AppCatalog>> AppCatalog::open(AppCatalogOptions options) {
    auto database = CatalogDatabase::open(options.databasePath, options.lockTimeout);
    if (!database) {
        return database.error();
    }
    return std::unique_ptr<AppCatalog>(new AppCatalog(std::move(options), std::move(database).value()));
}

AppCatalog::AppCatalog(AppCatalogOptions options, std::unique_ptr<CatalogDatabase> database)
    : options_(std::move(options)),
      database_(std::move(database)),
      watches_(nullptr),
      index_(std::make_shared<const CatalogIndex>(std::vector<PlugInRecordPtr>{},
                                                  std::vector<CatalogIndex::Application>{})),
      queue_("AppCatalog", QualityOfService::utility) {
    // The handler runs on the watcher's reader, which the destructor stops
    // before anything else, so it never outlives this object.
    auto watcher = FolderWatcher::start(options_.coalescing, [this](FolderWatcher::Events events) {
        queue_.asyncOnWorker([this, events = std::move(events)] { handleEvents(events); });
    });
    if (watcher) {
        watcher_ = std::move(watcher).value();
        watches_ = CatalogWatches(watcher_.get());
    } else {
        systemLogf(kLogNotice, "catalog folders are not watched (%@): changes are seen at the next start",
                   watcher.error().text());
    }
}

AppCatalog::~AppCatalog() {
    if (watcher_) {
        watcher_->stop();
    }
    queue_.sync([] {});  // work already queued finishes while its state is alive
}

void AppCatalog::addObserver(const std::shared_ptr<AppCatalogObserver>& observer) {
    std::lock_guard lock(observersMutex_);
    observers_.push_back(observer);
}

void AppCatalog::start() {
    {
        std::lock_guard lock(readyMutex_);
        assert(!started_ && "start() once");
        started_ = true;
    }
    queue_.asyncOnWorker([this] { firstScan(); });
}

void AppCatalog::waitUntilReady() const {
    std::unique_lock lock(readyMutex_);
    readyChanged_.wait(lock, [this] { return ready_; });
}

bool AppCatalog::isReady() const {
    std::lock_guard lock(readyMutex_);
    return ready_;
}

bool AppCatalog::isStarted() const {
    std::lock_guard lock(readyMutex_);
    return started_;
}

MaybeError AppCatalog::registerPlugIn(const std::string& bundlePath) {
    assert(isStarted() && "registerPlugIn before start()");
    return runOnWorker(queue_, [this, &bundlePath] { return registerOnQueue(bundlePath); });
}

MaybeError AppCatalog::unregisterPlugIn(const std::string& bundlePath) {
    assert(isStarted() && "unregisterPlugIn before start()");
    return runOnWorker(queue_, [this, &bundlePath] { return unregisterOnQueue(bundlePath); });
}

// Lookups -------------------------------------------------------------------

std::shared_ptr<const CatalogIndex> AppCatalog::index() const {
    std::lock_guard lock(indexMutex_);
    return index_;
}

CatalogRefusals AppCatalog::refusals() const {
    std::lock_guard lock(indexMutex_);
    return refusals_ ? refusals_ : std::make_shared<const std::vector<CatalogRefusal>>();
}

PlugInRecordPtr AppCatalog::plugInWithUuid(const Uuid& uuid) const {
    return index()->plugInWithUuid(uuid);
}

PlugInRecordPtr AppCatalog::plugInAtPath(const std::string& bundlePath) const {
    return index()->plugInAtPath(lookupPath(bundlePath));
}

ApplicationRecordPtr AppCatalog::applicationAtPath(const std::string& applicationPath) const {
    return index()->applicationAtPath(lookupPath(applicationPath));
}

std::vector<PlugInRecordPtr> AppCatalog::installedPlugIns() const {
    return index()->all();
}

std::vector<PlugInRecordPtr> AppCatalog::plugInsForExtensionPoints(const std::vector<std::string>& points,
                                                                   const PlugInFilter& filter) const {
    return index()->plugInsForExtensionPoints(points, filter);
}

std::string AppCatalog::lookupPath(const std::string& path) const {
    if (auto resolved = resolvedPath(path)) {
        return *resolved;
    }
    std::string given = path;
    while (given.size() > 1 && given.back() == '/') {
        given.pop_back();
    }
    return given;
}

MaybeError AppCatalog::registerOnQueue(const std::string& bundlePath) {
    queue_.assertCurrent();
    auto resolved = resolvedPath(bundlePath);
    if (!resolved) {
        return catalogError(AppCatalogError::notAPlugIn,
                            format("no plug-in bundle at %@: %@", bundlePath, resolved.error().text()));
    }
    Pass pass;
    std::string reason;
    MaybeError refusal;
    if (examine(pass, *resolved, std::nullopt, true, &reason) == BundleReadOutcome::plugIn) {
        std::string parent = parentFolderOf(*resolved);
        watches_.watch(parent, {WatchRole::addedParent, parent});
    } else if (looksLikeApplication(*resolved)) {
        refusal = catalogError(AppCatalogError::applicationBundle,
                               format("%@ is an application, not a plug-in bundle", *resolved));
    } else {
        refusal = catalogError(AppCatalogError::notAPlugIn, format("no plug-in bundle at %@: %@", *resolved, reason));
    }
    if (auto failure = commit(pass)) {
        return catalogError(AppCatalogError::storage, "the catalog could not save the change: " + failure->text());
    }
    return refusal;
}

MaybeError AppCatalog::unregisterOnQueue(const std::string& bundlePath) {
    queue_.assertCurrent();
    std::string path = lookupPath(bundlePath);
    if (!bundles_.contains(path)) {
        return catalogError(AppCatalogError::notRegistered, format("no plug-in bundle is registered at %@", path));
    }
    Pass pass;
    pass.bundles[path] = std::nullopt;
    if (auto failure = commit(pass)) {
        return catalogError(AppCatalogError::storage, "the catalog could not save the change: " + failure->text());
    }
    return std::nullopt;
}

}  // namespace qm
