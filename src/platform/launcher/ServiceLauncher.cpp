#include "platform/launcher/ServiceLauncher.h"

#include <unistd.h>

#include <cerrno>
#include <mutex>

#include "platform/file/FolderEntries.h"
#include "platform/launcher/HostFolders.h"
#include "platform/plist/PropertyList.h"
#include "platform/process/ProcessInfo.h"

namespace qm {

namespace {

constexpr const char* kIdentifierKey = "MRBundleIdentifier";
constexpr const char* kVersionKey = "MRBundleVersion";

// Keeps a removal from deleting a host folder while a registration is
// being added to it.
std::mutex& launcherLock() {
    static std::mutex lock;
    return lock;
}

std::string registrationFile(const std::string& folder, const std::string& bundleIdentifier) {
    return folder + "/" + bundleIdentifier + ".plist";
}

}  // namespace

MaybeError addExternalService(const std::string& runtimeDirectory, pid_t hostPid, const Value& registration) {
    auto identifier = stringAt(registration, kIdentifierKey);
    if (!registration.isDictionary() || !identifier || !isServiceFileName(*identifier)) {
        return posixError(EINVAL, "a registration needs a \"MRBundleIdentifier\" that can name a file");
    }
    auto startTime = processStartTime(hostPid);
    if (!startTime) {
        return posixError(ESRCH, "host process " + std::to_string(hostPid));
    }
    std::lock_guard lock(launcherLock());
    removeExitedHostFolders(runtimeDirectory);
    if (auto failed = prepareHostFolder(runtimeDirectory, hostPid, *startTime)) {
        return failed;
    }
    std::string folder = hostFolder(runtimeDirectory, hostPid);
    auto failed = plist::writeFileAtomically(registrationFile(folder, *identifier), registration, plist::Format::xml);
    if (failed) {
        removeHostFolderWhenUnused(folder);
    }
    return failed;
}

int removeExternalService(const std::string& runtimeDirectory, const std::string& bundleIdentifier,
                          const std::string& version) {
    if (!isServiceFileName(bundleIdentifier)) {
        return kNoSuchService;
    }
    std::lock_guard lock(launcherLock());
    std::string services = servicesFolder(runtimeDirectory);
    auto hosts = folderEntryNames(services);
    if (!hosts) {
        return kNoSuchService;
    }
    int result = kNoSuchService;
    for (const std::string& host : *hosts) {
        std::string folder = services + "/" + host;
        std::string file = registrationFile(folder, bundleIdentifier);
        auto registration = plist::readFile(file);
        auto registered = registration ? stringAt(*registration, kVersionKey) : std::nullopt;
        if (registered != version) {
            continue;
        }
        if (::unlink(file.c_str()) != 0) {
            result = errno;
            continue;
        }
        if (result == kNoSuchService) {
            result = kServiceRemoved;
        }
        removeHostFolderWhenUnused(folder);
    }
    return result;
}

std::size_t removeExitedHostRegistrations(const std::string& runtimeDirectory) {
    std::lock_guard lock(launcherLock());
    return removeExitedHostFolders(runtimeDirectory);
}

}  // namespace qm
