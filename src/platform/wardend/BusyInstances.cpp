#include "platform/wardend/BusyInstances.h"

#include <algorithm>
#include <map>
#include <optional>

#include "platform/bundle/BundleDirectory.h"
#include "platform/catalog/PlugInDeclarations.h"
#include "platform/file/FolderEntries.h"
#include "platform/process/ProcessInfo.h"

namespace qm {

namespace {

constexpr std::string_view kDeletedSuffix = " (deleted)";
constexpr const char* kBundleIdentifierKey = "MRBundleIdentifier";

// The bundle identifier of the plug-in bundle whose executable this is.
std::optional<std::string> plugInIdentifierOfExecutable(const std::string& executable) {
    auto bundle = BundleDirectory::aroundExecutable(executable);
    if (!bundle || bundle->executablePath() != executable) {
        return std::nullopt;
    }
    auto info = bundle->infoDictionary();
    if (!info || !declaresPlugIns(*info)) {
        return std::nullopt;
    }
    auto identifier = stringAt(*info, kBundleIdentifierKey);
    if (!identifier || identifier->empty()) {
        return std::nullopt;
    }
    return identifier;
}

}  // namespace

Result<std::vector<BusyInstance>> busyExtensionInstances(const std::set<std::string>& bundleIdentifiers) {
    std::vector<BusyInstance> busy;
    if (bundleIdentifiers.empty()) {
        return busy;
    }
    auto entries = folderEntryNames("/proc");
    if (!entries) {
        return entries.error();
    }
    std::map<std::string, std::optional<std::string>> identifierByExecutable;
    for (const std::string& name : *entries) {
        auto pid = pidFromName(name);
        auto executable = pid ? executablePathOfProcess(*pid) : std::nullopt;
        if (!executable || executable->ends_with(kDeletedSuffix)) {
            continue;
        }
        auto known = identifierByExecutable.find(*executable);
        if (known == identifierByExecutable.end()) {
            known = identifierByExecutable.emplace(*executable, plugInIdentifierOfExecutable(*executable)).first;
        }
        const std::optional<std::string>& identifier = known->second;
        if (identifier && bundleIdentifiers.contains(*identifier)) {
            busy.push_back(BusyInstance{*pid, *identifier});
        }
    }
    std::sort(busy.begin(), busy.end(), [](const BusyInstance& a, const BusyInstance& b) { return a.pid < b.pid; });
    return busy;
}

}  // namespace qm
