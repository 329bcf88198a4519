#include "platform/file/FolderEntries.h"

#include <dirent.h>

#include <cerrno>
#include <memory>
#include <string_view>

namespace qm {

namespace {

struct FolderCloser {
    void operator()(DIR* folder) const { ::closedir(folder); }
};

}  // namespace

Result<std::vector<std::string>> folderEntryNames(const std::string& path) {
    std::unique_ptr<DIR, FolderCloser> folder(::opendir(path.c_str()));
    if (!folder) {
        return posixError(errno, path);
    }
    std::vector<std::string> names;
    for (;;) {
        errno = 0;
        struct dirent* entry = ::readdir(folder.get());
        if (entry == nullptr) {
            if (errno != 0) {
                return posixError(errno, path);
            }
            return names;
        }
        std::string_view name = entry->d_name;
        if (name != "." && name != "..") {
            names.emplace_back(name);
        }
    }
}

}  // namespace qm
