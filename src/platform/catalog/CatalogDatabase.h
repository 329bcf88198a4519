#pragma once
// The catalog's SQLite file: WAL mode, its own application_id and
// user_version, and an exclusive lock held for the life of the object, so
// that a second daemon on the same file waits, then fails, instead of
// sharing it.
//
// Damage means SQLite's "not a database" or "corrupt" errors, or a file
// whose application_id or user_version are not the catalog's: such a file
// (with its -wal and -shm) is moved to "<path>.bad-<unix time>", one line is
// logged, and an empty database takes its place. No other error is damage.
//
// One thread at a time (the catalog's thread); not thread-safe.

#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/catalog/CatalogEntry.h"
#include "platform/error/Error.h"

struct sqlite3;

namespace qm {

class CatalogDatabase {
public:
    // Errors carry this domain and SQLite's primary result code.
    static constexpr const char* kErrorDomain = "sqlite";

    struct Contents {
        std::vector<CatalogBundle> bundles;  // by path
        std::vector<CatalogApplication> applications;
        std::string language;  // the language names were read for; "" for none
    };

    // Written in one transaction. A written bundle replaces every row of its path.
    struct Changes {
        std::vector<std::string> removedBundles;
        std::vector<CatalogBundle> writtenBundles;
        std::vector<std::string> removedApplications;
        std::vector<CatalogApplication> writtenApplications;
        std::optional<std::string> language;
        bool empty() const {
            return removedBundles.empty() && writtenBundles.empty() && removedApplications.empty() &&
                   writtenApplications.empty() && !language;
        }
    };

    // Opens or creates the file (and its folder). Damage is repaired as
    // above. A file locked by another process is waited for lockTimeout,
    // then logged and refused (posix EBUSY).
    static Result<std::unique_ptr<CatalogDatabase>> open(const std::string& path,
                                                         std::chrono::milliseconds lockTimeout);
    ~CatalogDatabase();
    CatalogDatabase(const CatalogDatabase&) = delete;
    CatalogDatabase& operator=(const CatalogDatabase&) = delete;

    // Everything stored. A row that does not decode is logged and deleted,
    // so that its bundle is registered afresh.
    Result<Contents> load();
    MaybeError write(const Changes& changes);

    // Whether an error of load() or write() means the file is damaged;
    // replaceDamagedFile() then moves it aside and starts an empty one.
    // When that fails the database is closed: load() fails and write()
    // tries to open it again first.
    static bool isDamage(const Error& error);
    MaybeError replaceDamagedFile(const Error& damage);

    const std::string& path() const { return path_; }

private:
    struct Statements;
    CatalogDatabase(std::string path, std::chrono::milliseconds lockTimeout);
    MaybeError openFile();
    void closeFile();

    std::string path_;
    std::chrono::milliseconds lockTimeout_;
    sqlite3* db_ = nullptr;
    std::unique_ptr<Statements> statements_;
};

}  // namespace qm
