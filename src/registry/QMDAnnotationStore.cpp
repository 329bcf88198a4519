#include "registry/QMDAnnotationStore.h"

#include <cerrno>

#include "model/QMError.h"
#include "platform/env/Environment.h"
#include "platform/file/Directories.h"
#include "platform/log/SystemLog.h"
#include "platform/plist/PropertyList.h"
#include "registry/Probes.h"

namespace {

bool isFileNotFound(const qm::Error& error) {
    return error.domain == qm::kPosixErrorDomain && error.code == ENOENT;
}

}  // namespace

qm::Result<std::unique_ptr<QMDAnnotationStore>> QMDAnnotationStore::initWithDatabase(
    const std::optional<std::string>& databasePath) {
    std::string path;
    if (databasePath) {
        path = *databasePath;
    } else {
        auto defaultPath = defaultDatabasePath();
        if (!defaultPath) {
            return defaultPath.error();
        }
        path = *defaultPath;
    }
    std::unique_ptr<QMDAnnotationStore> store(new QMDAnnotationStore(std::move(path)));
    if (auto error = store->loadDb(); error && !isFileNotFound(*error)) {
        qm::systemLogf(qm::kLogNotice, "unable to load annotation database:%@ error:%@ (resetting)", store->path_,
                       error->text());
    }
    return store;
}

qm::Result<std::string> QMDAnnotationStore::defaultDatabasePath() {
    std::string directory = qm::xdgStateHome() + "/ovaro.quamber";
    if (auto error = qm::createDirectories(directory, 0700)) {
        return QMErrorWithFormat(kQMErrorPath, "unable to create plugin annotations directory:%@ error:%@", directory,
                                 error->text());
    }
    return directory + "/Annotations";
}

qm::MaybeError QMDAnnotationStore::loadDb() {
    auto result = [&]() -> qm::MaybeError {
        auto file = qm::plist::readFile(path_);
        if (!file) {
            return std::move(file).error();
        }
        const qm::Value* version = file->get("version");
        std::int64_t found = version ? version->asSigned().value_or(0) : 0;
        if (found != kVersion) {
            return QMErrorWithFormat(kQMErrorVersion, "found database version %d needed version %d", found, kVersion);
        }
        // A current file without a usable table is damaged like any other.
        const qm::Value* data = file->get("data");
        if (data == nullptr || !data->isDictionary()) {
            return QMError(kQMErrorVersion, std::string("the annotation database has no \"data\" dictionary"));
        }
        annotations_ = *data->asDictionary();
        return std::nullopt;
    }();
    if (result) {
        QM_PROBE_DB_LOAD(result->domain.c_str(), static_cast<std::uint64_t>(result->code));
    }
    return result;
}

qm::MaybeError QMDAnnotationStore::saveDb() const {
    qm::Dictionary file{{"version", qm::Value(kVersion)}, {"data", qm::Value(annotations_)}};
    return qm::plist::writeFileAtomically(path_, qm::Value(std::move(file)), qm::plist::Format::xml);
}

std::optional<qm::Value> QMDAnnotationStore::annotationForIdentifier(const std::string& key) const {
    const qm::Value* annotation = annotations_.find(key);
    if (annotation == nullptr) {
        return std::nullopt;
    }
    return *annotation;
}

void QMDAnnotationStore::setAnnotationForIdentifier(const std::optional<qm::Dictionary>& annotation,
                                                    const std::string& key) {
    if (!annotation) {
        annotations_.remove(key);
        saveOrLog();
        return;
    }
    // An entry that is not a dictionary (a damaged file) has nothing to merge
    // into: the new annotation replaces it.
    const qm::Value* stored = annotations_.find(key);
    qm::Dictionary merged = stored && stored->isDictionary() ? *stored->asDictionary() : qm::Dictionary();
    for (const auto& [name, value] : *annotation) {
        merged.set(name, value);
    }
    annotations_.set(key, qm::Value(std::move(merged)));
    saveOrLog();
}

void QMDAnnotationStore::saveOrLog() const {
    if (auto error = saveDb()) {
        qm::systemLogf(qm::kLogNotice, "unable to save annotations:%@ error:%@", path_, error->text());
    }
}
