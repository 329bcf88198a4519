#pragma once
// Creating folders with the permission bits asked for, whatever the umask.

#include <string>
#include <sys/types.h>

#include "platform/error/Error.h"

namespace qm {

// Creates path and every missing folder above it with `mode`; folders that
// exist already are left as they are. A posix error names the folder that
// could not be made.
MaybeError createDirectories(const std::string& path, mode_t mode);

}  // namespace qm
