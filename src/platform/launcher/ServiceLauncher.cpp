#include "platform/launcher/ServiceLauncher.h"

#include <unistd.h>

#include <cerrno>

#include "platform/file/FolderEntries.h"
#include "platform/plist/PropertyList.h"

namespace qm {

int removeExternalService(const std::string& runtimeDirectory, const std::string& bundleIdentifier,
                          const std::string& version) {
    // A name that could leave its folder registers nothing.
    if (bundleIdentifier.empty() || bundleIdentifier.find('/') != std::string::npos || bundleIdentifier[0] == '.') {
        return kNoSuchService;
    }
    std::string services = runtimeDirectory + "/services";
    auto hosts = folderEntryNames(services);
    if (!hosts) {
        return kNoSuchService;
    }
    int result = kNoSuchService;
    for (const std::string& host : *hosts) {
        std::string folder = services + "/" + host;
        std::string file = folder + "/" + bundleIdentifier + ".plist";
        auto registration = plist::readFile(file);
        const Value* registered = registration ? registration->get("MRBundleVersion") : nullptr;
        if (registered == nullptr || registered->asString() == nullptr || *registered->asString() != version) {
            continue;
        }
        if (::unlink(file.c_str()) != 0) {
            result = errno;
            continue;
        }
        if (result == kNoSuchService) {
            result = kServiceRemoved;
        }
        ::rmdir(folder.c_str());  // only succeeds once the host has no registration left
    }
    return result;
}

}  // namespace qm
