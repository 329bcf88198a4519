#include "model/QMBundle.h"

namespace {

constexpr const char* kIdentifierKey = "MRBundleIdentifier";
constexpr const char* kExecutableFolderMark = "/Exec/";
constexpr const char* kSupportFolder = "Contents";
constexpr const char* kPlugInsFolder = "PlugIns";

std::string appendComponent(const std::string& folder, const std::string& name) {
    if (!folder.empty() && folder.back() == '/') {
        return folder + name;
    }
    return folder + "/" + name;
}

}  // namespace

QMBundle::QMBundle(qm::BundleDirectory directory) : directory_(std::move(directory)) {}

std::optional<QMBundle> QMBundle::initWithPath(const std::string& bundlePath) {
    auto directory = qm::BundleDirectory::atPath(bundlePath);
    if (!directory) {
        return std::nullopt;
    }
    return QMBundle(std::move(*directory));
}

std::optional<QMBundle> QMBundle::initWithExecutablePath(const std::string& executablePath) {
    if (auto directory = qm::BundleDirectory::aroundExecutable(executablePath)) {
        return QMBundle(std::move(*directory));
    }
    return initWithPath(executablePath);
}

std::optional<QMBundle> QMBundle::initForMainBundle() {
    auto directory = qm::BundleDirectory::ofRunningProcess();
    if (!directory) {
        return std::nullopt;
    }
    return QMBundle(std::move(*directory));
}

std::optional<std::string> QMBundle::path() const {
    return directory_.path();
}

std::string QMBundle::url() const {
    return qm::fileURL(directory_.path());
}

std::optional<std::string> QMBundle::executablePath() const {
    if (auto executable = directory_.executablePath()) {
        return executable;
    }
    return path();
}

std::optional<qm::Value> QMBundle::infoDictionary() const {
    return directory_.infoDictionary();
}

std::optional<std::string> QMBundle::bundleIdentifier() const {
    auto info = infoDictionary();
    if (!info) {
        return std::nullopt;
    }
    const qm::Value* identifier = info->get(kIdentifierKey);
    const std::string* text = identifier ? identifier->asString() : nullptr;
    if (!text) {
        return std::nullopt;
    }
    return *text;
}

// Not cached: it derives from the path and the Info dictionary, which the
// bundle directory already keeps, so recomputing always gives the same answer.
std::optional<std::string> QMBundle::supportPath() const {
    auto bundlePath = path();
    if (!bundlePath) {
        return std::nullopt;
    }
    auto executable = executablePath();
    if (executable && executable->find(kExecutableFolderMark) != std::string::npos) {
        return appendComponent(*bundlePath, kSupportFolder);
    }
    return bundlePath;
}

std::optional<std::string> QMBundle::bundleDirectory(const std::string& name) const {
    auto support = supportPath();
    if (!support) {
        return std::nullopt;
    }
    return appendComponent(*support, name);
}

std::optional<std::string> QMBundle::plugInsPath() const {
    return bundleDirectory(kPlugInsFolder);
}
