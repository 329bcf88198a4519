#pragma once
// The service launcher's registrations of plug-in services for host
// processes: the XML property list D/services/<host pid>/<bundle id>.plist
// ("DuctService", "MRBundlePackageType", "ExecutablePath",
// "MRBundleIdentifier", "MRBundleVersion"). This side removes them.

#include <string>

namespace qm {

// The launcher's answers to a removal.
inline constexpr int kServiceRemoved = 0;
inline constexpr int kNoSuchService = 3;  // ESRCH: nothing was registered

// Deletes every host's registration of the bundle identifier whose
// "MRBundleVersion" is `version`, and the host folders left empty; answers
// kServiceRemoved, kNoSuchService, or the errno of a file it could not
// delete. `runtimeDirectory` is D.
int removeExternalService(const std::string& runtimeDirectory, const std::string& bundleIdentifier,
                          const std::string& version);

}  // namespace qm
