#pragma once
// The busy extension instances: running processes whose executable
// (/proc/<pid>/exe) is the executable of a plug-in bundle with one of the
// asked bundle identifiers.
//
// The bundle is the innermost one around the executable, read from its
// Info file on disk (no registration needed), so an application's own
// process never makes the plug-ins inside it busy. It must declare
// plug-ins ("VTExtension" or "Quamber"), name the running file as its
// "MRBundleExecutable" and have a non-empty "MRBundleIdentifier". A process
// whose executable cannot be read (exited, another user's) or was deleted
// is not busy. Each query scans /proc afresh, so a process that exited no
// longer counts; each executable's bundle is read once per query.
// Thread-safe; blocks on /proc and file reads.

#include <sys/types.h>

#include <set>
#include <string>
#include <vector>

#include "platform/error/Error.h"

namespace qm {

struct BusyInstance {
    pid_t pid = 0;
    std::string bundleIdentifier;  // the instance's bundle-identifier property: one of those asked
    bool operator==(const BusyInstance&) const = default;
};

// The busy instances, by increasing pid; a posix error when /proc cannot
// be listed.
Result<std::vector<BusyInstance>> busyExtensionInstances(const std::set<std::string>& bundleIdentifiers);

}  // namespace qm
