#include "registry/QMDatabase.h"

#include <algorithm>
#include <cmath>

#include "platform/log/SystemLog.h"
#include "platform/value/Utf8.h"

namespace {

constexpr const char* kAutoElect = "ovaro.developer.auto-elect-plugin";

// The literal value of one pattern: the text after a leading "=", or the
// pattern itself when it starts with a letter, mark or digit; none when it
// starts with an operator of the rule language or anything else. Any
// character beyond ASCII counts as a letter: extension points and elections
// are ASCII in practice, and a name is better narrowed than scanned in full.
std::optional<std::string> literalOf(const qm::Value& pattern) {
    const std::string* text = pattern.asString();
    if (text == nullptr || text->empty()) {
        return std::nullopt;
    }
    unsigned char first = static_cast<unsigned char>((*text)[0]);
    if (first == '=') {
        return text->substr(1);
    }
    bool alphanumeric = first >= 0x80 || (first >= '0' && first <= '9') || (first >= 'a' && first <= 'z') ||
                        (first >= 'A' && first <= 'Z');
    return alphanumeric ? std::optional<std::string>(*text) : std::nullopt;
}

// The literal values of a rule's value: one for a string, one per element of
// an array; none as soon as one is not literal.
std::optional<std::vector<std::string>> literalValuesOf(const qm::Dictionary* rules, const char* key) {
    const qm::Value* value = rules ? rules->find(key) : nullptr;
    if (value == nullptr) {
        return std::nullopt;
    }
    if (value->isString()) {
        auto literal = literalOf(*value);
        return literal ? std::optional<std::vector<std::string>>({*literal}) : std::nullopt;
    }
    const qm::Array* elements = value->asArray();
    if (elements == nullptr) {
        return std::nullopt;
    }
    std::vector<std::string> literals;
    for (const qm::Value& element : *elements) {
        auto literal = literalOf(element);
        if (!literal) {
            return std::nullopt;
        }
        literals.push_back(*literal);
    }
    return literals;
}

// An election's integer value reduced to its low 8 bits; a number out of
// range, NaN or no number at all gives 0.
unsigned lowEightBits(const qm::Value& election) {
    if (auto flag = election.asBool()) {
        return *flag ? 1 : 0;
    }
    if (auto u = election.asUnsigned()) {
        return static_cast<unsigned>(*u & 0xff);
    }
    if (auto i = election.asSigned()) {
        return static_cast<unsigned>(static_cast<std::uint64_t>(*i) & 0xff);
    }
    double d = election.asDouble().value_or(0);
    if (!std::isfinite(d) || std::fabs(d) >= 9.2e18) {
        return 0;
    }
    return static_cast<unsigned>(static_cast<std::uint64_t>(static_cast<std::int64_t>(d)) & 0xff);
}

// A stored election's integer value is not 0 (a string, which is no
// number, counts as 0).
bool integerValueIsNonZero(const qm::Value& election) {
    if (auto flag = election.asBool()) {
        return *flag;
    }
    return election.isNumber() && std::trunc(election.asDouble().value_or(0)) != 0;
}

bool numberIsTrue(const qm::Value* value) {
    if (value == nullptr) {
        return false;
    }
    if (auto flag = value->asBool()) {
        return *flag;
    }
    return value->isNumber() && !(*value == qm::Value(0));
}

}  // namespace

// Forwards the catalog's calls for as long as the registry lives.
class QMDatabase::CatalogObserver final : public qm::AppCatalogObserver {
public:
    explicit CatalogObserver(QMDatabase& registry) : registry_(registry) {}
    void pluginsDidInstall(const std::vector<qm::PlugInRecordPtr>& records) override {
        registry_.pluginsDidInstall(records);
    }
    void pluginsWillUninstall(const std::vector<qm::PlugInRecordPtr>& records) override {
        registry_.pluginsWillUninstall(records);
    }

private:
    QMDatabase& registry_;
};

qm::Result<std::unique_ptr<QMDatabase>> QMDatabase::initWithDatabase(const std::optional<std::string>& databasePath,
                                                                     std::unique_ptr<qm::AppCatalog> catalog) {
    auto annotations = QMDAnnotationStore::initWithDatabase(databasePath);
    if (!annotations) {
        return annotations.error();
    }
    std::unique_ptr<QMDatabase> registry(new QMDatabase(std::move(annotations).value(), std::move(catalog)));
    registry->observer_ = std::make_shared<CatalogObserver>(*registry);
    registry->catalog_->addObserver(registry->observer_);
    return registry;
}

void QMDatabase::start() {
    catalog_->start();
    // The catalog tells readiness only to a waiter: one thread of ours waits.
    readyWatcher_ = std::thread([this] {
        catalog_->waitUntilReady();
        std::vector<std::function<void()>> waiting;
        {
            std::lock_guard lock(readyMutex_);
            ready_ = true;
            waiting.swap(waiting_);
        }
        for (auto& ready : waiting) {
            ready();
        }
    });
}

QMDatabase::QMDatabase(std::unique_ptr<QMDAnnotationStore> annotations, std::unique_ptr<qm::AppCatalog> catalog)
    : annotations_(std::move(annotations)), catalog_(std::move(catalog)) {}

QMDatabase::~QMDatabase() {
    if (readyWatcher_.joinable()) {
        readyWatcher_.join();
    }
}

void QMDatabase::whenReady(std::function<void()> ready) {
    {
        std::lock_guard lock(readyMutex_);
        if (!ready_) {
            waiting_.push_back(std::move(ready));
            return;
        }
    }
    ready();
}

bool QMDatabase::isReady() const {
    std::lock_guard lock(readyMutex_);
    return ready_;
}

// ---- records

QMDPlugInPtr QMDatabase::createPlugInForProxy(const qm::PlugInRecordPtr& record) {
    return admit(record, QMDPlugIn::initWithACData(record));
}

QMDPlugInPtr QMDatabase::admit(const qm::PlugInRecordPtr& record, QMDPlugInPtr plugIn) {
    sync_.assertCurrent();
    if (!plugIn) {
        return nullptr;
    }
    if (plugIn->hasEntitlement(kAutoElect)) {
        autoElect(*plugIn);
    }
    cache_[record->uuid] = plugIn;
    return plugIn;
}

QMDPlugInPtr QMDatabase::cachedOrCreated(const qm::PlugInRecordPtr& record) {
    sync_.assertCurrent();
    if (auto cached = cache_.find(record->uuid); cached != cache_.end()) {
        return cached->second;
    }
    return createPlugInForProxy(record);
}

QMDPlugInPtr QMDatabase::plugInForProxy(const qm::PlugInRecordPtr& record) {
    QMDPlugInPtr plugIn;
    sync_.sync([&] { plugIn = cachedOrCreated(record); });
    return plugIn;
}

QMDPlugInPtr QMDatabase::findPlugIn(const qm::Uuid& uuid) {
    QMDPlugInPtr plugIn;
    sync_.sync([&] {
        if (auto cached = cache_.find(uuid); cached != cache_.end()) {
            plugIn = cached->second;
            return;
        }
        if (auto record = catalog_->plugInWithUuid(uuid)) {
            plugIn = createPlugInForProxy(record);
            return;
        }
        qm::systemLogf(qm::kLogNotice, "AppCatalog cannot find plug-in with UUID:%@", uuid.text());
    });
    return plugIn;
}

QMDPlugInPtr QMDatabase::findPlugInAtPath(const std::string& path) {
    auto record = catalog_->plugInAtPath(path);
    if (!record) {
        qm::systemLogf(qm::kLogNotice, "AppCatalog cannot find plug-in at path:%@", path);
        return nullptr;
    }
    return findPlugIn(record->uuid);
}

std::optional<std::vector<QMDPlugInPtr>> QMDatabase::plugInsWithinApplication(const std::string& path) {
    auto application = catalog_->applicationAtPath(path);
    if (!application || application->plugIns.empty()) {
        return std::nullopt;
    }
    std::vector<QMDPlugInPtr> plugIns;
    for (const auto& record : application->plugIns) {
        if (auto plugIn = plugInForProxy(record)) {
            plugIns.push_back(std::move(plugIn));
        }
    }
    return plugIns;
}

// ---- candidates

std::optional<qm::Value> QMDatabase::electionFor(const std::string& identifier,
                                                 const std::optional<qm::Value>& entitlements) {
    sync_.assertCurrent();
    auto annotation = annotations_->annotationForIdentifier(QMDPlugIn::annotationKeyOf(identifier, entitlements));
    const qm::Value* election = annotation ? annotation->get("election") : nullptr;
    return election ? std::optional<qm::Value>(*election) : std::nullopt;
}

std::vector<QMDPlugInPtr> QMDatabase::findPlugIns(const qm::Dictionary* rules) {
    return findCandidates(rules, false).plugIns;
}

QMDatabase::Candidates QMDatabase::findCandidates(const qm::Dictionary* rules, bool explain) {
    auto elections = literalValuesOf(rules, "VTUserElection");
    auto points = literalValuesOf(rules, "VTExtensionPointName");
    Candidates candidates;
    // One visit to the registry queue for the whole search: the election
    // filter reads the annotation store, and each candidate is looked up in
    // (or added to) the cache.
    sync_.sync([&] {
        std::vector<qm::PlugInRecordPtr> records;
        if (points) {
            qm::PlugInFilter electionFilter;
            if (elections) {
                electionFilter = [&](const std::string& identifier, const std::optional<qm::Value>& entitlements) {
                    auto election = electionFor(identifier, entitlements);
                    unsigned value = election ? lowEightBits(*election)
                                              : (numberIsTrue(entitlements ? entitlements->get(kAutoElect) : nullptr)
                                                     ? 1u
                                                     : 0u);
                    bool accepted = std::find(elections->begin(), elections->end(), std::to_string(value)) !=
                                    elections->end();
                    return accepted;
                };
            }
            if (explain && electionFilter) {
                for (const auto& record : catalog_->plugInsForExtensionPoints(*points)) {
                    if (electionFilter(record->identifier, record->entitlements)) {
                        records.push_back(record);
                    } else {
                        candidates.failedElection.push_back(record);
                    }
                }
            } else {
                records = catalog_->plugInsForExtensionPoints(*points, electionFilter);
            }
        } else {
            records = catalog_->installedPlugIns();
        }
        for (const auto& record : records) {
            if (auto cached = cache_.find(record->uuid); cached != cache_.end()) {
                candidates.plugIns.push_back(cached->second);
                continue;
            }
            if (!explain) {
                if (auto plugIn = createPlugInForProxy(record)) {
                    candidates.plugIns.push_back(std::move(plugIn));
                }
                continue;
            }
            auto built = QMDPlugIn::build(record);
            if (!built) {
                QMDPlugIn::logBuildFailure(record->bundlePath, built.error());
                candidates.misconfigured.emplace_back(record, built.error().reason);
                continue;
            }
            candidates.plugIns.push_back(admit(record, std::move(built).value()));
        }
    });
    std::erase(candidates.plugIns, nullptr);
    return candidates;
}

// ---- listing

QMDatabase::PlugInListing QMDatabase::listPlugIns(const std::optional<std::string>& point, std::size_t offset,
                                                  std::size_t limit) {
    auto index = catalog_->index();
    std::vector<qm::PlugInRecordPtr> records = point ? index->plugInsForExtensionPoints({*point}, {}) : index->all();
    std::vector<qm::CatalogRefusal> refusals;
    if (!point) {
        refusals = *catalog_->refusals();
    }
    // Both lists are in path order; a refused bundle is never registered.
    std::vector<ListedPlugIn> merged;
    merged.reserve(records.size() + refusals.size());
    auto refusal = refusals.begin();
    for (const auto& record : records) {
        for (; refusal != refusals.end() && refusal->path < record->bundlePath; ++refusal) {
            merged.push_back({nullptr, refusal->path, refusal->reason, std::nullopt});
        }
        merged.push_back({record, record->bundlePath, std::nullopt, std::nullopt});
    }
    for (; refusal != refusals.end(); ++refusal) {
        merged.push_back({nullptr, refusal->path, refusal->reason, std::nullopt});
    }

    PlugInListing listing;
    listing.total = merged.size();
    const std::size_t first = std::min(offset, merged.size());
    const std::size_t last = first + std::min(limit, merged.size() - first);
    listing.page.assign(std::make_move_iterator(merged.begin() + static_cast<std::ptrdiff_t>(first)),
                        std::make_move_iterator(merged.begin() + static_cast<std::ptrdiff_t>(last)));
    sync_.sync([&] {
        for (ListedPlugIn& listed : listing.page) {
            if (!listed.record) {
                continue;
            }
            const qm::PlugInRecord& record = *listed.record;
            if (!cache_.contains(record.uuid)) {
                auto built = QMDPlugIn::build(listed.record);
                if (!built) {
                    listed.invalidReason =
                        built.error().reason.empty() ? std::string("incomplete catalog record") : built.error().reason;
                }
            }
            auto annotation = annotations_->annotationForIdentifier(
                QMDPlugIn::annotationKeyOf(record.identifier, record.entitlements));
            if (const qm::Value* election = annotation ? annotation->get("election") : nullptr) {
                listed.election = *election;
            }
        }
    });
    return listing;
}

// ---- registration

qm::MaybeError QMDatabase::addPlugIn(const std::string& path) {
    return catalog_->registerPlugIn(path);
}

qm::MaybeError QMDatabase::removePlugIn(const std::string& path) {
    return catalog_->unregisterPlugIn(path);
}

// ---- annotations

std::optional<qm::Value> QMDatabase::annotationForPlugIn(const QMDPlugIn& plugIn) {
    std::optional<qm::Value> annotation;
    sync_.sync([&] { annotation = annotations_->annotationForIdentifier(plugIn.annotationKey()); });
    return annotation;
}

void QMDatabase::setAnnotationForPlugIn(const std::optional<qm::Dictionary>& annotation, const QMDPlugIn& plugIn) {
    sync_.sync([&] { annotations_->setAnnotationForIdentifier(annotation, plugIn.annotationKey()); });
    if (annotationsChanged_) {
        annotationsChanged_();
    }
}

void QMDatabase::autoElect(const QMDPlugIn& plugIn) {
    sync_.assertCurrent();
    auto stored = annotations_->annotationForIdentifier(plugIn.annotationKey());
    const qm::Value* election = stored ? stored->get("election") : nullptr;
    if (election && integerValueIsNonZero(*election)) {
        return;  // the user's (or an earlier) election stands
    }
    annotations_->setAnnotationForIdentifier(qm::Dictionary{{"election", qm::Value(1)}}, plugIn.annotationKey());
}

// ---- catalog notifications

void QMDatabase::pluginsDidInstall(const std::vector<qm::PlugInRecordPtr>& records) {
    for (const auto& record : records) {
        qm::systemLogf(qm::kLogNotice, "INSTALLED:%@ %@(%@) %@ %@", record->bundleIdentifier, record->identifier,
                       record->bundleVersion, record->uuid.text(), record->bundlePath);
    }
    if (plugInsChanged_) {
        plugInsChanged_();
    }
}

void QMDatabase::pluginsWillUninstall(const std::vector<qm::PlugInRecordPtr>& records) {
    // The catalog's thread waits on nobody: the cache is updated by a job of
    // the registry queue, which runs before any later lookup's. The delegate
    // only queues work of its own, so telling it from there waits on nothing.
    sync_.async([this, records] {
        sync_.assertCurrent();
        for (const auto& record : records) {
            qm::systemLogf(qm::kLogNotice, "UNINSTALLED:%@ %@(%@) %@ %@", record->bundleIdentifier, record->identifier,
                           record->bundleVersion, record->uuid.text(), record->bundlePath);
            cache_.erase(record->uuid);
        }
        if (removedPlugIns_) {
            removedPlugIns_(records);
        }
        if (plugInsChanged_) {
            plugInsChanged_();
        }
    });
}
