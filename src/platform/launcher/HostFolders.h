#pragma once
// The layout of the service launcher's registrations under the runtime
// directory D:
//   D/services/<host pid>/<bundle id>.plist     one registration
//   D/services/<host pid>/.host-start-time      the host's start time
// A host folder belongs to the process with that pid and start time (field
// 22 of /proc/<pid>/stat), so a recycled pid never inherits an exited
// host's registrations. Names starting with "." are bookkeeping and
// temporary files, never registrations.
//
// These functions do not synchronize: the launcher (ServiceLauncher.h)
// calls them under its lock. They block on file I/O.

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "platform/error/Error.h"

namespace qm {

// D/services.
std::string servicesFolder(const std::string& runtimeDirectory);

// D/services/<pid>.
std::string hostFolder(const std::string& runtimeDirectory, pid_t hostPid);

// Whether a bundle identifier can name a registration file: not empty, no
// "/", not starting with "." (which could leave the folder or hide among
// the bookkeeping files).
bool isServiceFileName(std::string_view bundleIdentifier);

// Makes the host's folder (and D/services), mode 0700, and records the
// host's start time in it unless it holds that time already.
MaybeError prepareHostFolder(const std::string& runtimeDirectory, pid_t hostPid, std::uint64_t startTime);

// Removes every host folder whose pid is gone, whose start time differs
// from the running process's, or that records none; answers how many went.
// Names that are not pids are left alone.
std::size_t removeExitedHostFolders(const std::string& runtimeDirectory);

// Removes the folder, with its bookkeeping files, when it holds no
// registration.
void removeHostFolderWhenUnused(const std::string& folder);

}  // namespace qm
