#pragma once
// The service launcher's registrations of plug-in services for host
// processes: each is the XML property list D/services/<host pid>/<bundle
// id>.plist, holding the registration dictionary (the daemon writes
// "DuctService", "MRBundlePackageType", "ExecutablePath",
// "MRBundleIdentifier", "MRBundleVersion"); the folder layout is in
// HostFolders.h. `runtimeDirectory` is D.
//
// The three operations are serialized within the process by one lock (only
// one daemon serves a runtime directory); each blocks on file I/O.

#include <sys/types.h>

#include <cstddef>
#include <string>

#include "platform/error/Error.h"
#include "platform/value/Value.h"

namespace qm {

// The published name of an extension's bundle-identifier property (the key
// of a busy plug-in's conflict entry).
inline constexpr const char* kExtensionBundleIdentifierProperty = "MRBundleIdentifier";

// Registers the service for the host: writes the registration dictionary,
// atomically, as the file named by its "MRBundleIdentifier", replacing an
// earlier registration of that identifier for the host (the last one wins).
// First removes the folders of exited hosts. Errors: EINVAL (posix) when the
// registration is not a dictionary or its "MRBundleIdentifier" is not a
// string that can name a file (empty, holding "/" or starting with ".");
// ESRCH when the host is gone; the errno of a folder or file that cannot be
// written, or the property list's error for a value with no property-list
// form.
MaybeError addExternalService(const std::string& runtimeDirectory, pid_t hostPid, const Value& registration);

// The launcher's answers to a removal.
inline constexpr int kServiceRemoved = 0;
inline constexpr int kNoSuchService = 3;  // ESRCH: nothing was registered

// Deletes every host's registration of the bundle identifier whose
// "MRBundleVersion" is `version`, and the host folders left with no
// registration; answers kServiceRemoved, kNoSuchService, or the errno of a
// file it could not delete.
int removeExternalService(const std::string& runtimeDirectory, const std::string& bundleIdentifier,
                          const std::string& version);

// Removes the registrations of hosts that have exited (HostFolders.h);
// the daemon calls it at start. Answers how many host folders went.
std::size_t removeExitedHostRegistrations(const std::string& runtimeDirectory);

}  // namespace qm
