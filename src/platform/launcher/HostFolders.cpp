#include "platform/launcher/HostFolders.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <fstream>
#include <optional>

#include "platform/fd/UniqueFd.h"
#include "platform/file/Directories.h"
#include "platform/file/FolderEntries.h"
#include "platform/process/ProcessInfo.h"

namespace qm {

namespace {

constexpr const char* kStartTimeFileName = ".host-start-time";
constexpr mode_t kPrivateFolderMode = 0700;

bool isBookkeepingName(std::string_view name) {
    return name.starts_with('.');
}

std::optional<std::uint64_t> recordedStartTime(const std::string& folder) {
    std::ifstream file(folder + "/" + kStartTimeFileName);
    std::string text;
    if (!std::getline(file, text) || text.empty() || text.size() > 20 ||
        text.find_first_not_of("0123456789") != std::string::npos) {
        return std::nullopt;
    }
    return std::strtoull(text.c_str(), nullptr, 10);
}

// Written under a temporary name and renamed, so a reader never sees half a number.
MaybeError recordStartTime(const std::string& folder, std::uint64_t startTime) {
    std::string path = folder + "/" + kStartTimeFileName;
    std::string temporary = path + ".XXXXXX";
    UniqueFd fd(::mkostemp(temporary.data(), O_CLOEXEC));
    if (!fd) {
        return posixError(errno, "creating a temporary file in " + folder);
    }
    std::string text = std::to_string(startTime) + "\n";
    ssize_t written = ::write(fd.get(), text.data(), text.size());
    int error = written == static_cast<ssize_t>(text.size()) ? 0 : (written < 0 ? errno : EIO);
    if (error == 0 && ::rename(temporary.c_str(), path.c_str()) != 0) {
        error = errno;
    }
    if (error != 0) {
        ::unlink(temporary.c_str());
        return posixError(error, "recording the host's start time in " + path);
    }
    return std::nullopt;
}

bool belongsToRunningHost(const std::string& folder, pid_t pid) {
    auto recorded = recordedStartTime(folder);
    return recorded && processStartTime(pid) == recorded;
}

// Unlinks the folder's files and removes it; a folder holding anything
// else (another folder) stays.
bool removeFolder(const std::string& folder) {
    auto names = folderEntryNames(folder);
    if (!names) {
        return false;
    }
    for (const std::string& name : *names) {
        ::unlink((folder + "/" + name).c_str());
    }
    return ::rmdir(folder.c_str()) == 0;
}

}  // namespace

std::string servicesFolder(const std::string& runtimeDirectory) {
    return runtimeDirectory + "/services";
}

std::string hostFolder(const std::string& runtimeDirectory, pid_t hostPid) {
    return servicesFolder(runtimeDirectory) + "/" + std::to_string(hostPid);
}

bool isServiceFileName(std::string_view bundleIdentifier) {
    return !bundleIdentifier.empty() && bundleIdentifier.find('/') == std::string_view::npos &&
           bundleIdentifier.find('\0') == std::string_view::npos && !isBookkeepingName(bundleIdentifier);
}

MaybeError prepareHostFolder(const std::string& runtimeDirectory, pid_t hostPid, std::uint64_t startTime) {
    std::string folder = hostFolder(runtimeDirectory, hostPid);
    if (auto failed = createDirectories(folder, kPrivateFolderMode)) {
        return failed;
    }
    if (recordedStartTime(folder) == startTime) {
        return std::nullopt;
    }
    return recordStartTime(folder, startTime);
}

std::size_t removeExitedHostFolders(const std::string& runtimeDirectory) {
    std::string services = servicesFolder(runtimeDirectory);
    auto names = folderEntryNames(services);
    if (!names) {
        return 0;
    }
    std::size_t removed = 0;
    for (const std::string& name : *names) {
        auto pid = pidFromName(name);
        std::string folder = services + "/" + name;
        if (pid && !belongsToRunningHost(folder, *pid) && removeFolder(folder)) {
            ++removed;
        }
    }
    return removed;
}

void removeHostFolderWhenUnused(const std::string& folder) {
    auto names = folderEntryNames(folder);
    if (names && std::none_of(names->begin(), names->end(), [](const std::string& n) { return !isBookkeepingName(n); })) {
        removeFolder(folder);
    }
}

}  // namespace qm
