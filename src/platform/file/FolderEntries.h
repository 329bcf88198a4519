#pragma once
// The names in a folder.

#include <string>
#include <vector>

#include "platform/error/Error.h"

namespace qm {

// The names of the entries directly in path, without "." and "..", in the
// order the file system gives them; the errno of opendir or readdir as a
// posix error.
Result<std::vector<std::string>> folderEntryNames(const std::string& path);

}  // namespace qm
