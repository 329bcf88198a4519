#include "platform/file/Directories.h"

#include <sys/stat.h>

#include <cerrno>

namespace qm {

MaybeError createDirectories(const std::string& path, mode_t mode) {
    for (std::size_t end = path.find('/', 1);; end = path.find('/', end + 1)) {
        std::string folder = path.substr(0, end);
        if (!folder.empty() && ::mkdir(folder.c_str(), mode) == 0) {
            ::chmod(folder.c_str(), mode);  // the umask narrowed what mkdir made
        } else if (!folder.empty() && errno != EEXIST) {
            return posixError(errno, "cannot create " + folder);
        }
        if (end == std::string::npos) {
            break;
        }
    }
    struct stat info{};
    if (::stat(path.c_str(), &info) != 0 || !S_ISDIR(info.st_mode)) {
        return posixError(ENOTDIR, path);
    }
    return std::nullopt;
}

}  // namespace qm
