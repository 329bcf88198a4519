#pragma once
// Facts about a path on disk that the catalog and the offline tools read:
// its canonical form and its modification time.

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/error/Error.h"

namespace qm {

// The canonical absolute path (symbolic links, "." and ".." resolved), or
// the errno of the resolution as a posix error.
Result<std::string> resolvedPath(const std::string& path);

// The modification time in whole seconds since 1970, or the errno of stat.
Result<std::int64_t> modificationTime(const std::string& path);

// The folder holding path: "/" for a path just under the root, "." for a
// bare name.
std::string parentFolderOf(const std::string& path);

// Whether path is root itself or lies under it, at a path-component boundary
// ("/a/bc" is not under "/a/b"). Both are taken as they are: resolve them first.
bool isPathWithin(std::string_view path, std::string_view root);

}  // namespace qm
