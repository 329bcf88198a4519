#pragma once
// The user's annotations of plug-ins (elections, and data clients attach),
// all in memory and persisted whole in one XML property list after every
// change: {"version": 16, "data": {annotation key: annotation}}. Entries are
// keyed by annotation key (the plug-in identifier, or that of the plug-in it
// replaces), so they survive reinstallations; no operation removes one.
//
// No lock of its own: every call after opening runs on the registry queue.

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "platform/error/Error.h"
#include "platform/value/Value.h"

class QMDAnnotationStore {
public:
    // The only version of the file this store reads and writes.
    static constexpr std::int64_t kVersion = 16;

    // Opens the store on `databasePath` (taken as given), else on the default
    // file. A file that is absent starts an empty table silently; one that
    // cannot be loaded is logged and the table starts empty (the file stays
    // until the next save replaces it). The error is fatal for the daemon:
    // the default folder cannot be found or created.
    static qm::Result<std::unique_ptr<QMDAnnotationStore>> initWithDatabase(
        const std::optional<std::string>& databasePath);
    // $XDG_STATE_HOME/ovaro.quamber/Annotations; creates the folder (0700).
    static qm::Result<std::string> defaultDatabasePath();

    // Replaces the table with the file's content.
    qm::MaybeError loadDb();
    // Writes the whole table atomically: readers, and a crash at any instant,
    // find the old file or the new one, whole.
    qm::MaybeError saveDb() const;

    std::optional<qm::Value> annotationForIdentifier(const std::string& key) const;
    // Merges the annotation's keys into the entry under key (an absent
    // annotation removes the entry) and saves; a failed save is logged and
    // the change stays in memory until the next save.
    void setAnnotationForIdentifier(const std::optional<qm::Dictionary>& annotation, const std::string& key);

    const std::string& annotationsPath() const noexcept { return path_; }

private:
    explicit QMDAnnotationStore(std::string path) : path_(std::move(path)) {}
    void saveOrLog() const;

    const std::string path_;
    qm::Dictionary annotations_;
};
