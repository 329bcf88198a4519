#include "platform/file/PathFacts.h"

#include <sys/stat.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <memory>

namespace qm {

Result<std::string> resolvedPath(const std::string& path) {
    std::unique_ptr<char, decltype(&std::free)> resolved(::realpath(path.c_str(), nullptr), &std::free);
    if (!resolved) {
        return posixError(errno, "realpath " + path);
    }
    return std::string(resolved.get());
}

Result<std::int64_t> modificationTime(const std::string& path) {
    struct stat status {};
    if (::stat(path.c_str(), &status) != 0) {
        return posixError(errno, "stat " + path);
    }
    return static_cast<std::int64_t>(status.st_mtim.tv_sec);
}

bool isPathWithin(std::string_view path, std::string_view root) {
    while (root.size() > 1 && root.back() == '/') {
        root.remove_suffix(1);
    }
    if (root.empty() || !path.starts_with(root)) {
        return false;
    }
    if (path.size() == root.size() || root == "/") {
        return true;
    }
    return path[root.size()] == '/';
}

std::string parentFolderOf(const std::string& path) {
    auto slash = path.rfind('/');
    if (slash == std::string::npos) {
        return ".";
    }
    return slash == 0 ? "/" : path.substr(0, slash);
}

}  // namespace qm
