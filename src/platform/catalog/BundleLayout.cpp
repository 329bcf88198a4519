#include "platform/catalog/BundleLayout.h"

#include <dirent.h>
#include <sys/stat.h>

#include <algorithm>
#include <memory>

#include "platform/file/PathFacts.h"

namespace qm {

namespace {

constexpr std::string_view kApplicationSuffix = ".app";
constexpr std::string_view kPlugInsFolder = "PlugIns";
constexpr std::string_view kContentsFolder = "Contents";

bool isDirectory(const std::string& path) {
    struct stat status {};
    return ::stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
}

std::string_view lastComponentOf(std::string_view path) {
    auto slash = path.rfind('/');
    return slash == std::string_view::npos ? path : path.substr(slash + 1);
}

bool isApplicationName(std::string_view name) {
    return name.size() > kApplicationSuffix.size() && name.ends_with(kApplicationSuffix);
}

}  // namespace

std::vector<std::string> subdirectoriesOf(const std::string& folder) {
    std::vector<std::string> names;
    struct CloseDirectory {
        void operator()(DIR* directory) const { ::closedir(directory); }
    };
    std::unique_ptr<DIR, CloseDirectory> directory(::opendir(folder.c_str()));
    if (!directory) {
        return names;
    }
    while (const dirent* entry = ::readdir(directory.get())) {
        std::string_view name = entry->d_name;
        if (name == "." || name == "..") {
            continue;
        }
        bool maybeDirectory = entry->d_type == DT_DIR || entry->d_type == DT_LNK || entry->d_type == DT_UNKNOWN;
        if (maybeDirectory) {
            names.emplace_back(name);
        }
    }
    std::sort(names.begin(), names.end());
    std::vector<std::string> paths;
    std::string prefix = folder.ends_with('/') ? folder : folder + "/";
    for (const auto& name : names) {
        std::string path = prefix + name;
        if (isDirectory(path)) {
            paths.push_back(std::move(path));
        }
    }
    return paths;
}

std::vector<std::string> applicationsInRoot(const std::string& root) {
    std::vector<std::string> applications = subdirectoriesOf(root);
    std::erase_if(applications, [](const std::string& path) { return !isApplicationName(lastComponentOf(path)); });
    return applications;
}

std::vector<std::string> plugInsFoldersOf(const std::string& application) {
    std::vector<std::string> folders;
    for (std::string folder : {application + "/PlugIns", application + "/Contents/PlugIns"}) {
        if (isDirectory(folder)) {
            folders.push_back(std::move(folder));
        }
    }
    return folders;
}

bool looksLikeApplication(const std::string& path) {
    return path.ends_with(".app") || !plugInsFoldersOf(path).empty();
}

std::optional<std::string> containingApplicationPath(const std::string& bundlePath) {
    std::string plugIns = parentFolderOf(bundlePath);
    if (lastComponentOf(plugIns) != kPlugInsFolder) {
        return std::nullopt;
    }
    std::string holder = parentFolderOf(plugIns);
    if (isApplicationName(lastComponentOf(holder))) {
        return holder;
    }
    if (lastComponentOf(holder) == kContentsFolder) {
        std::string application = parentFolderOf(holder);
        if (isApplicationName(lastComponentOf(application))) {
            return application;
        }
    }
    return std::nullopt;
}

bool isUnderAnyRoot(std::string_view path, const std::vector<std::string>& roots) {
    return std::any_of(roots.begin(), roots.end(), [path](const std::string& root) { return isPathWithin(path, root); });
}

}  // namespace qm
