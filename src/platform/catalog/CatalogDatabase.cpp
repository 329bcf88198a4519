#include "platform/catalog/CatalogDatabase.h"

#include <sqlite3.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstdio>
#include <ctime>
#include <map>

#include "platform/log/SystemLog.h"
#include "platform/plist/PropertyList.h"

namespace qm {

namespace {

constexpr int kApplicationId = 0x514D4341;  // "QMCA"
constexpr int kSchemaVersion = 1;

constexpr const char* kSchema = R"(
CREATE TABLE meta (key TEXT PRIMARY KEY, value TEXT NOT NULL) WITHOUT ROWID;
CREATE TABLE bundles (
    path TEXT PRIMARY KEY,
    source TEXT,
    added INTEGER NOT NULL,
    info_key TEXT NOT NULL,
    entitlements_key TEXT NOT NULL,
    info BLOB NOT NULL,
    entitlements BLOB,
    bundle_identifier TEXT,
    bundle_version TEXT,
    name TEXT,
    short_name TEXT,
    container TEXT,
    application TEXT
) WITHOUT ROWID;
CREATE TABLE plugins (
    uuid BLOB PRIMARY KEY,
    bundle TEXT NOT NULL,
    identifier TEXT NOT NULL,
    point TEXT,
    plugin BLOB NOT NULL,
    registered INTEGER NOT NULL
) WITHOUT ROWID;
CREATE INDEX plugins_by_bundle ON plugins (bundle);
CREATE TABLE applications (path TEXT PRIMARY KEY, info_key TEXT NOT NULL, name TEXT) WITHOUT ROWID;
)";

using StatementPtr = std::unique_ptr<sqlite3_stmt, decltype(&::sqlite3_finalize)>;

Error sqliteError(sqlite3* db, int code, const std::string& context) {
    std::string message = context + ": " + (db ? ::sqlite3_errmsg(db) : ::sqlite3_errstr(code));
    return Error{CatalogDatabase::kErrorDomain, code & 0xFF, std::move(message)};
}

MaybeError execute(sqlite3* db, const char* sql) {
    int rc = ::sqlite3_exec(db, sql, nullptr, nullptr, nullptr);
    if (rc != SQLITE_OK) {
        return sqliteError(db, rc, sql);
    }
    return std::nullopt;
}

Result<StatementPtr> prepare(sqlite3* db, const char* sql) {
    sqlite3_stmt* statement = nullptr;
    int rc = ::sqlite3_prepare_v3(db, sql, -1, SQLITE_PREPARE_PERSISTENT, &statement, nullptr);
    if (rc != SQLITE_OK) {
        return sqliteError(db, rc, sql);
    }
    return StatementPtr(statement, &::sqlite3_finalize);
}

Result<std::int64_t> queryNumber(sqlite3* db, const char* sql) {
    auto statement = prepare(db, sql);
    if (!statement) {
        return statement.error();
    }
    int rc = ::sqlite3_step(statement->get());
    if (rc != SQLITE_ROW) {
        return sqliteError(db, rc, sql);
    }
    return static_cast<std::int64_t>(::sqlite3_column_int64(statement->get(), 0));
}

// Resets a statement at the end of its use, so that it can be bound again.
class Use {
public:
    explicit Use(sqlite3_stmt* statement) : statement_(statement) {}
    ~Use() {
        ::sqlite3_reset(statement_);
        ::sqlite3_clear_bindings(statement_);
    }
    Use(const Use&) = delete;
    Use& operator=(const Use&) = delete;

    void text(int index, const std::string& value) {
        ::sqlite3_bind_text(statement_, index, value.data(), static_cast<int>(value.size()), SQLITE_TRANSIENT);
    }
    void text(int index, const std::optional<std::string>& value) {
        if (value) {
            text(index, *value);
        }
    }
    void blob(int index, const void* bytes, std::size_t size) {
        ::sqlite3_bind_blob(statement_, index, bytes, static_cast<int>(size), SQLITE_TRANSIENT);
    }
    void number(int index, std::int64_t value) { ::sqlite3_bind_int64(statement_, index, value); }
    int step() { return ::sqlite3_step(statement_); }

private:
    sqlite3_stmt* statement_;
};

std::optional<std::string> columnText(sqlite3_stmt* statement, int column) {
    const auto* text = ::sqlite3_column_text(statement, column);
    if (text == nullptr) {
        return std::nullopt;
    }
    return std::string(reinterpret_cast<const char*>(text), static_cast<std::size_t>(::sqlite3_column_bytes(statement, column)));
}

std::optional<Value> columnPropertyList(sqlite3_stmt* statement, int column) {
    const auto* bytes = static_cast<const std::uint8_t*>(::sqlite3_column_blob(statement, column));
    auto size = static_cast<std::size_t>(::sqlite3_column_bytes(statement, column));
    if (bytes == nullptr) {
        return std::nullopt;
    }
    auto value = plist::parse({bytes, size});
    return value ? std::optional<Value>(std::move(value).value()) : std::nullopt;
}

Result<Bytes> encoded(const Value& value) {
    return plist::serialize(value, plist::Format::binary);
}

void makeParentFolders(const std::string& path) {
    for (std::size_t slash = path.find('/', 1); slash != std::string::npos; slash = path.find('/', slash + 1)) {
        ::mkdir(path.substr(0, slash).c_str(), 0700);
    }
}

}  // namespace

struct CatalogDatabase::Statements {
    StatementPtr deleteBundle{nullptr, &::sqlite3_finalize};
    StatementPtr deletePlugIns{nullptr, &::sqlite3_finalize};
    StatementPtr insertBundle{nullptr, &::sqlite3_finalize};
    StatementPtr insertPlugIn{nullptr, &::sqlite3_finalize};
    StatementPtr deleteApplication{nullptr, &::sqlite3_finalize};
    StatementPtr writeApplication{nullptr, &::sqlite3_finalize};
    StatementPtr writeMeta{nullptr, &::sqlite3_finalize};
};

CatalogDatabase::CatalogDatabase(std::string path, std::chrono::milliseconds lockTimeout)
    : path_(std::move(path)), lockTimeout_(lockTimeout) {}

CatalogDatabase::~CatalogDatabase() {
    closeFile();
}

Result<std::unique_ptr<CatalogDatabase>> CatalogDatabase::open(const std::string& path,
                                                               std::chrono::milliseconds lockTimeout) {
    makeParentFolders(path);
    std::unique_ptr<CatalogDatabase> database(new CatalogDatabase(path, lockTimeout));
    MaybeError failure = database->openFile();
    if (failure && isDamage(*failure)) {
        failure = database->replaceDamagedFile(*failure);
    }
    if (failure && failure->domain == kErrorDomain && failure->code == SQLITE_BUSY) {
        systemLogf(kLogNotice, "catalog database %@ is locked by another process; gave up after %lld ms", path,
                   static_cast<long long>(lockTimeout.count()));
        return posixError(EBUSY, "catalog database " + path + " is locked by another process");
    }
    if (failure) {
        systemLogf(kLogNotice, "cannot open the catalog database %@: %@", path, failure->text());
        return *failure;
    }
    return database;
}

MaybeError CatalogDatabase::openFile() {
    int rc = ::sqlite3_open_v2(path_.c_str(), &db_, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX,
                               nullptr);
    if (rc != SQLITE_OK) {
        Error error = sqliteError(db_, rc, "open " + path_);
        closeFile();
        return error;
    }
    ::sqlite3_busy_timeout(db_, static_cast<int>(lockTimeout_.count()));
    auto fail = [this](Error error) {
        closeFile();
        return MaybeError(std::move(error));
    };
    // Exclusive before WAL: the lock is then kept until close, and the WAL
    // index lives in this process's memory.
    for (const char* pragma : {"PRAGMA locking_mode=EXCLUSIVE", "PRAGMA journal_mode=WAL", "PRAGMA synchronous=FULL",
                               "BEGIN IMMEDIATE"}) {
        if (auto failure = execute(db_, pragma)) {
            return fail(*failure);
        }
    }
    auto applicationId = queryNumber(db_, "PRAGMA application_id");
    auto version = queryNumber(db_, "PRAGMA user_version");
    auto tables = queryNumber(db_, "SELECT count(*) FROM sqlite_master");
    for (const auto* read : {&applicationId, &version, &tables}) {
        if (!*read) {
            return fail(read->error());
        }
    }
    if (*applicationId == 0 && *version == 0 && *tables == 0) {
        std::string setup = std::string(kSchema) + "PRAGMA application_id=" + std::to_string(kApplicationId) +
                            "; PRAGMA user_version=" + std::to_string(kSchemaVersion) + ";";
        if (auto failure = execute(db_, setup.c_str())) {
            return fail(*failure);
        }
    } else if (*applicationId != kApplicationId || *version != kSchemaVersion) {
        return fail(Error{kErrorDomain, SQLITE_NOTADB,
                          format("not a catalog database (application_id %lld, user_version %lld)",
                                 static_cast<long long>(*applicationId), static_cast<long long>(*version))});
    }
    if (auto failure = execute(db_, "COMMIT")) {
        return fail(*failure);
    }

    statements_ = std::make_unique<Statements>();
    const std::pair<StatementPtr*, const char*> sql[] = {
        {&statements_->deleteBundle, "DELETE FROM bundles WHERE path = ?1"},
        {&statements_->deletePlugIns, "DELETE FROM plugins WHERE bundle = ?1"},
        {&statements_->insertBundle,
         "INSERT INTO bundles (path, source, added, info_key, entitlements_key, info, entitlements, "
         "bundle_identifier, bundle_version, name, short_name, container, application) "
         "VALUES (?1, ?2, ?3, ?4, ?5, ?6, ?7, ?8, ?9, ?10, ?11, ?12, ?13)"},
        {&statements_->insertPlugIn,
         "INSERT INTO plugins (uuid, bundle, identifier, point, plugin, registered) VALUES (?1, ?2, ?3, ?4, ?5, ?6)"},
        {&statements_->deleteApplication, "DELETE FROM applications WHERE path = ?1"},
        {&statements_->writeApplication, "INSERT OR REPLACE INTO applications (path, info_key, name) VALUES (?1, ?2, ?3)"},
        {&statements_->writeMeta, "INSERT OR REPLACE INTO meta (key, value) VALUES (?1, ?2)"},
    };
    for (const auto& [slot, text] : sql) {
        auto statement = prepare(db_, text);
        if (!statement) {
            return fail(statement.error());
        }
        *slot = std::move(statement).value();
    }
    return std::nullopt;
}

void CatalogDatabase::closeFile() {
    statements_.reset();
    if (db_ != nullptr) {
        ::sqlite3_close_v2(db_);
        db_ = nullptr;
    }
}

bool CatalogDatabase::isDamage(const Error& error) {
    return error.domain == kErrorDomain && (error.code == SQLITE_CORRUPT || error.code == SQLITE_NOTADB);
}

MaybeError CatalogDatabase::replaceDamagedFile(const Error& damage) {
    closeFile();
    std::string aside = path_ + ".bad-" + std::to_string(static_cast<long long>(std::time(nullptr)));
    for (const char* suffix : {"", "-wal", "-shm"}) {
        std::string from = path_ + suffix;
        std::string to = aside + suffix;
        if (std::rename(from.c_str(), to.c_str()) != 0 && errno != ENOENT) {
            systemLogf(kLogNotice, "cannot move the damaged catalog database %@ aside: %@", from,
                       posixError(errno, "rename").text());
        }
    }
    systemLogf(kLogNotice, "catalog database %@ is damaged (%@); moved to %@ and rebuilt from the install roots", path_,
               damage.text(), aside);
    return openFile();
}

Result<CatalogDatabase::Contents> CatalogDatabase::load() {
    if (db_ == nullptr) {
        return Error{kErrorDomain, SQLITE_CANTOPEN, "the catalog database is closed"};
    }
    Contents contents;
    std::map<std::string, CatalogBundle> bundles;
    std::vector<std::string> undecodable;
    auto reject = [&undecodable](const std::string& path, const char* what) {
        systemLogf(kLogNotice, "catalog entry for %@ does not decode (%@); registering it again", path, what);
        undecodable.push_back(path);
    };

    auto bundleRows = prepare(db_,
                              "SELECT path, source, added, info_key, entitlements_key, info, entitlements, "
                              "bundle_identifier, bundle_version, name, short_name, container, application FROM bundles");
    if (!bundleRows) {
        return bundleRows.error();
    }
    sqlite3_stmt* row = bundleRows->get();
    int rc;
    while ((rc = ::sqlite3_step(row)) == SQLITE_ROW) {
        CatalogBundle bundle;
        bundle.path = columnText(row, 0).value_or("");
        bundle.source = columnText(row, 1);
        bundle.added = ::sqlite3_column_int64(row, 2) != 0;
        auto infoKey = ChangeKey::parse(columnText(row, 3).value_or(""));
        auto entitlementsKey = ChangeKey::parse(columnText(row, 4).value_or(""));
        auto info = columnPropertyList(row, 5);
        bool hasEntitlements = ::sqlite3_column_type(row, 6) != SQLITE_NULL;
        bundle.entitlements = hasEntitlements ? columnPropertyList(row, 6) : std::nullopt;
        if (!infoKey || !entitlementsKey || !info || (hasEntitlements && !bundle.entitlements)) {
            reject(bundle.path, "bundle");
            continue;
        }
        bundle.infoKey = *infoKey;
        bundle.entitlementsKey = *entitlementsKey;
        bundle.infoDictionary = std::move(*info);
        bundle.bundleIdentifier = columnText(row, 7);
        bundle.bundleVersion = columnText(row, 8);
        bundle.localizedName = columnText(row, 9);
        bundle.localizedShortName = columnText(row, 10);
        bundle.dataContainerPath = columnText(row, 11);
        bundle.applicationPath = columnText(row, 12);
        std::string path = bundle.path;
        bundles.emplace(std::move(path), std::move(bundle));
    }
    if (rc != SQLITE_DONE) {
        return sqliteError(db_, rc, "reading bundles");
    }

    auto plugInRows = prepare(db_, "SELECT bundle, uuid, identifier, point, plugin, registered FROM plugins");
    if (!plugInRows) {
        return plugInRows.error();
    }
    row = plugInRows->get();
    while ((rc = ::sqlite3_step(row)) == SQLITE_ROW) {
        std::string path = columnText(row, 0).value_or("");
        auto found = bundles.find(path);
        if (found == bundles.end()) {
            continue;  // its bundle was rejected above; the rows go with it
        }
        CatalogPlugIn plugIn;
        auto identifier = columnText(row, 2);
        auto dictionary = columnPropertyList(row, 4);
        bool uuidFits = ::sqlite3_column_bytes(row, 1) == 16 && ::sqlite3_column_blob(row, 1) != nullptr;
        if (!identifier || !dictionary || !uuidFits) {
            reject(path, "plug-in");
            bundles.erase(found);
            continue;
        }
        plugIn.uuid = Uuid::fromBytes(static_cast<const std::uint8_t*>(::sqlite3_column_blob(row, 1)));
        plugIn.identifier = std::move(*identifier);
        plugIn.extensionPoint = columnText(row, 3);
        plugIn.plugInDictionary = std::move(*dictionary);
        plugIn.registeredAt = ::sqlite3_column_int64(row, 5);
        found->second.plugIns.push_back(std::move(plugIn));
    }
    if (rc != SQLITE_DONE) {
        return sqliteError(db_, rc, "reading plug-ins");
    }
    for (auto& [path, bundle] : bundles) {
        if (bundle.plugIns.empty()) {
            reject(path, "no plug-ins");
            continue;
        }
        contents.bundles.push_back(std::move(bundle));
    }

    auto applicationRows = prepare(db_, "SELECT path, info_key, name FROM applications");
    if (!applicationRows) {
        return applicationRows.error();
    }
    row = applicationRows->get();
    while ((rc = ::sqlite3_step(row)) == SQLITE_ROW) {
        CatalogApplication application;
        application.path = columnText(row, 0).value_or("");
        application.infoKey = ChangeKey::parse(columnText(row, 1).value_or("")).value_or(ChangeKey{});
        application.localizedName = columnText(row, 2);
        contents.applications.push_back(std::move(application));
    }
    if (rc != SQLITE_DONE) {
        return sqliteError(db_, rc, "reading applications");
    }

    auto language = prepare(db_, "SELECT value FROM meta WHERE key = 'language'");
    if (!language) {
        return language.error();
    }
    if ((rc = ::sqlite3_step(language->get())) == SQLITE_ROW) {
        contents.language = columnText(language->get(), 0).value_or("");
    } else if (rc != SQLITE_DONE) {
        return sqliteError(db_, rc, "reading the language");
    }

    if (!undecodable.empty()) {
        Changes cleanup;
        cleanup.removedBundles = std::move(undecodable);
        if (auto failure = write(cleanup)) {
            return *failure;
        }
    }
    return contents;
}

MaybeError CatalogDatabase::write(const Changes& changes) {
    if (changes.empty()) {
        return std::nullopt;
    }
    if (db_ == nullptr) {
        if (auto failure = openFile()) {  // a repair that failed earlier; try again
            return failure;
        }
    }
    if (auto failure = execute(db_, "BEGIN IMMEDIATE")) {
        return failure;
    }
    auto failed = [this](Error error) {
        execute(db_, "ROLLBACK");
        return MaybeError(std::move(error));
    };
    auto done = [this](Use& use, const char* what) -> MaybeError {
        int rc = use.step();
        if (rc != SQLITE_DONE) {
            return sqliteError(db_, rc, what);
        }
        return std::nullopt;
    };
    auto removeBundle = [&](const std::string& path) -> MaybeError {
        for (sqlite3_stmt* statement : {statements_->deletePlugIns.get(), statements_->deleteBundle.get()}) {
            Use use(statement);
            use.text(1, path);
            if (auto failure = done(use, "deleting a bundle")) {
                return failure;
            }
        }
        return std::nullopt;
    };

    for (const auto& path : changes.removedBundles) {
        if (auto failure = removeBundle(path)) {
            return failed(*failure);
        }
    }
    for (const auto& bundle : changes.writtenBundles) {
        if (auto failure = removeBundle(bundle.path)) {
            return failed(*failure);
        }
        auto info = encoded(bundle.infoDictionary);
        std::optional<Result<Bytes>> entitlements;
        if (bundle.entitlements) {
            entitlements.emplace(encoded(*bundle.entitlements));
        }
        if (!info || (entitlements && !*entitlements)) {
            return failed(Error{kErrorDomain, SQLITE_MISUSE, "cannot encode the Info of " + bundle.path});
        }
        {
            Use use(statements_->insertBundle.get());
            use.text(1, bundle.path);
            use.text(2, bundle.source);
            use.number(3, bundle.added ? 1 : 0);
            use.text(4, bundle.infoKey.text());
            use.text(5, bundle.entitlementsKey.text());
            use.blob(6, info->data(), info->size());
            if (entitlements) {
                use.blob(7, (*entitlements)->data(), (*entitlements)->size());
            }
            use.text(8, bundle.bundleIdentifier);
            use.text(9, bundle.bundleVersion);
            use.text(10, bundle.localizedName);
            use.text(11, bundle.localizedShortName);
            use.text(12, bundle.dataContainerPath);
            use.text(13, bundle.applicationPath);
            if (auto failure = done(use, "writing a bundle")) {
                return failed(*failure);
            }
        }
        for (const auto& plugIn : bundle.plugIns) {
            auto dictionary = encoded(plugIn.plugInDictionary);
            if (!dictionary) {
                return failed(Error{kErrorDomain, SQLITE_MISUSE, "cannot encode a plug-in of " + bundle.path});
            }
            Use use(statements_->insertPlugIn.get());
            use.blob(1, plugIn.uuid.bytes.data(), plugIn.uuid.bytes.size());
            use.text(2, bundle.path);
            use.text(3, plugIn.identifier);
            use.text(4, plugIn.extensionPoint);
            use.blob(5, dictionary->data(), dictionary->size());
            use.number(6, plugIn.registeredAt);
            if (auto failure = done(use, "writing a plug-in")) {
                return failed(*failure);
            }
        }
    }
    for (const auto& path : changes.removedApplications) {
        Use use(statements_->deleteApplication.get());
        use.text(1, path);
        if (auto failure = done(use, "deleting an application")) {
            return failed(*failure);
        }
    }
    for (const auto& application : changes.writtenApplications) {
        Use use(statements_->writeApplication.get());
        use.text(1, application.path);
        use.text(2, application.infoKey.text());
        use.text(3, application.localizedName);
        if (auto failure = done(use, "writing an application")) {
            return failed(*failure);
        }
    }
    if (changes.language) {
        Use use(statements_->writeMeta.get());
        use.text(1, std::string("language"));
        use.text(2, *changes.language);
        if (auto failure = done(use, "writing the language")) {
            return failed(*failure);
        }
    }
    if (auto failure = execute(db_, "COMMIT")) {
        return failed(*failure);
    }
    return std::nullopt;
}

}  // namespace qm
