#include "platform/bundle/BundleDirectory.h"

#include <sys/stat.h>
#include <unistd.h>

#include <mutex>

#include "platform/file/PathFacts.h"
#include "platform/log/SystemLog.h"
#include "platform/plist/PropertyList.h"
#include "platform/process/ProcessInfo.h"

namespace qm {

namespace {

constexpr const char* kInfoFileName = "Info.plist";
constexpr const char* kContentsFolder = "Contents";
constexpr const char* kDesktopExecutableFolder = "/Contents/Exec";
constexpr const char* kExecutableKey = "MRBundleExecutable";
constexpr const char* kInfoPlistURLKey = "MRBundleInfoPlistURL";

std::string joinPath(const std::string& folder, std::string_view name) {
    std::string joined = folder;
    if (joined.empty() || joined.back() != '/') {
        joined += '/';
    }
    joined += name;
    return joined;
}

// Absolute (relative paths are taken from the current directory), without
// trailing slashes; nothing for an empty path or one that no file can have.
std::optional<std::string> absolutePath(const std::string& path) {
    if (path.empty() || path.find('\0') != std::string::npos) {
        return std::nullopt;
    }
    std::string result = path;
    if (result.front() != '/') {
        char buffer[4096];
        if (!::getcwd(buffer, sizeof buffer)) {
            return std::nullopt;
        }
        result = joinPath(buffer, result);
    }
    while (result.size() > 1 && result.back() == '/') {
        result.pop_back();
    }
    return result;
}

std::optional<mode_t> fileMode(const std::string& path) {
    struct stat status {};
    if (::stat(path.c_str(), &status) != 0) {
        return std::nullopt;
    }
    return status.st_mode;
}

bool isDirectory(const std::string& path) {
    auto mode = fileMode(path);
    return mode && S_ISDIR(*mode);
}

bool isRegularFile(const std::string& path) {
    auto mode = fileMode(path);
    return mode && S_ISREG(*mode);
}

bool isPlainFileName(std::string_view name) {
    return !name.empty() && name != "." && name != ".." && name.find('/') == std::string_view::npos &&
           name.find('\0') == std::string_view::npos;
}

bool isUnreserved(unsigned char c) {
    return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '-' || c == '.' ||
           c == '_' || c == '~';
}

std::optional<qm::Value> readInfoDictionary(const std::string& bundlePath, const std::string& infoPath) {
    auto info = qm::plist::readFile(infoPath);
    if (!info) {
        qm::systemLogf(qm::kLogNotice, "bundle %@: unreadable Info.plist: %@", bundlePath, info.error().text());
        return std::nullopt;
    }
    const qm::Dictionary* dictionary = info->asDictionary();
    if (!dictionary) {
        qm::systemLogf(qm::kLogNotice, "bundle %@: Info.plist is not a dictionary", bundlePath);
        return std::nullopt;
    }
    return qm::Value(dictionary->changing(kInfoPlistURLKey, qm::Value(fileURL(infoPath))));
}

}  // namespace

struct BundleDirectory::State {
    std::string path;
    std::string infoFolder;
    bool desktopStyle = false;

    std::once_flag infoOnce;
    std::optional<qm::Value> info;
};

BundleDirectory::BundleDirectory(std::shared_ptr<State> state) : state_(std::move(state)) {}

std::optional<BundleDirectory> BundleDirectory::atPath(const std::string& bundlePath) {
    auto path = absolutePath(bundlePath);
    if (!path || !isDirectory(*path)) {
        return std::nullopt;
    }
    auto state = std::make_shared<State>();
    state->path = *path;
    std::string contents = joinPath(*path, kContentsFolder);
    if (isRegularFile(joinPath(*path, kInfoFileName))) {
        state->infoFolder = *path;
    } else if (isRegularFile(joinPath(contents, kInfoFileName))) {
        state->infoFolder = contents;
        state->desktopStyle = true;
    } else {
        return std::nullopt;
    }
    return BundleDirectory(std::move(state));
}

std::optional<BundleDirectory> BundleDirectory::aroundExecutable(const std::string& executablePath) {
    auto executable = absolutePath(executablePath);
    if (!executable || *executable == "/") {
        return std::nullopt;
    }
    auto mode = fileMode(*executable);
    if (!mode || S_ISDIR(*mode)) {
        return std::nullopt;
    }
    std::string folder = parentFolderOf(*executable);
    auto state = std::make_shared<State>();
    if (isRegularFile(joinPath(folder, kInfoFileName))) {
        state->path = folder;
        state->infoFolder = folder;
        return BundleDirectory(std::move(state));
    }
    std::string_view execFolder = kDesktopExecutableFolder;
    if (folder.size() > execFolder.size() && folder.ends_with(execFolder)) {
        std::string bundle = folder.substr(0, folder.size() - execFolder.size());
        std::string contents = joinPath(bundle, kContentsFolder);
        if (isRegularFile(joinPath(contents, kInfoFileName))) {
            state->path = bundle;
            state->infoFolder = contents;
            state->desktopStyle = true;
            return BundleDirectory(std::move(state));
        }
    }
    return std::nullopt;
}

std::optional<BundleDirectory> BundleDirectory::ofRunningProcess() {
    auto executable = qm::executablePathOfProcess(::getpid());
    if (!executable) {
        return std::nullopt;
    }
    return aroundExecutable(*executable);
}

const std::string& BundleDirectory::path() const {
    return state_->path;
}

const std::string& BundleDirectory::infoFolder() const {
    return state_->infoFolder;
}

std::string BundleDirectory::infoPlistPath() const {
    return joinPath(state_->infoFolder, kInfoFileName);
}

bool BundleDirectory::isDesktopStyle() const {
    return state_->desktopStyle;
}

std::optional<qm::Value> BundleDirectory::infoDictionary() const {
    State& state = *state_;
    std::call_once(state.infoOnce, [&state, this] { state.info = readInfoDictionary(state.path, infoPlistPath()); });
    return state.info;
}

std::optional<std::string> BundleDirectory::executablePath() const {
    auto info = infoDictionary();
    if (!info) {
        return std::nullopt;
    }
    const qm::Value* name = info->get(kExecutableKey);
    const std::string* text = name ? name->asString() : nullptr;
    if (!text || !isPlainFileName(*text)) {
        return std::nullopt;
    }
    std::string folder = state_->desktopStyle ? joinPath(state_->path, "Contents/Exec") : state_->path;
    return joinPath(folder, *text);
}

std::string fileURL(const std::string& absolutePath) {
    static const char kHex[] = "0123456789ABCDEF";
    std::string url = "file://";
    url.reserve(url.size() + absolutePath.size());
    for (char c : absolutePath) {
        auto byte = static_cast<unsigned char>(c);
        if (isUnreserved(byte) || byte == '/') {
            url += c;
        } else {
            url += '%';
            url += kHex[byte >> 4];
            url += kHex[byte & 0x0F];
        }
    }
    return url;
}

}  // namespace qm
