#include "platform/codesign/Entitlements.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <string>

#include "platform/fd/UniqueFd.h"
#include "platform/log/SystemLog.h"
#include "platform/plist/PropertyList.h"

namespace qm {

namespace {

constexpr const char* kEntitlementsFileName = "Entitlements.plist";

// Why a file or folder cannot be trusted, or nothing when it can.
std::optional<std::string> distrust(const struct stat& status) {
    if (status.st_uid != 0 && status.st_uid != ::geteuid()) {
        return "owned by uid " + std::to_string(status.st_uid);
    }
    if ((status.st_mode & (S_IWGRP | S_IWOTH)) != 0) {
        return std::string("writable by group or others");
    }
    return std::nullopt;
}

void logUntrusted(const std::string& what, const std::string& reason) {
    qm::systemLogf(qm::kLogNotice, "entitlements not honoured: %@ is %@", what, reason);
}

void logBroken(const std::string& what, const std::string& reason) {
    qm::systemLogf(qm::kLogNotice, "entitlements unreadable: %@: %@", what, reason);
}

}  // namespace

std::optional<qm::Value> readEntitlements(const BundleDirectory& bundle) {
    const std::string& folder = bundle.infoFolder();
    std::string file = folder + "/" + kEntitlementsFileName;

    // The file is opened relative to the folder that was checked, and checked
    // through its own descriptor, so swapping either for a symbolic link or
    // another file between the check and the read changes nothing.
    qm::UniqueFd folderFd(::open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!folderFd) {
        if (errno != ENOENT) {
            logBroken(folder, std::strerror(errno));
        }
        return std::nullopt;
    }
    qm::UniqueFd fileFd(
        ::openat(folderFd.get(), kEntitlementsFileName, O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK));
    if (!fileFd) {
        if (errno == ELOOP) {
            logUntrusted(file, "a symbolic link");
        } else if (errno != ENOENT) {
            logBroken(file, std::strerror(errno));
        }
        return std::nullopt;
    }

    struct stat folderStatus {};
    struct stat fileStatus {};
    if (::fstat(folderFd.get(), &folderStatus) != 0 || ::fstat(fileFd.get(), &fileStatus) != 0) {
        logBroken(file, std::strerror(errno));
        return std::nullopt;
    }
    if (auto reason = distrust(folderStatus)) {
        logUntrusted("folder " + folder, *reason);
        return std::nullopt;
    }
    if (!S_ISREG(fileStatus.st_mode)) {
        logUntrusted(file, "not a regular file");
        return std::nullopt;
    }
    if (auto reason = distrust(fileStatus)) {
        logUntrusted(file, *reason);
        return std::nullopt;
    }

    auto entitlements = qm::plist::readDescriptor(fileFd.get(), file);
    if (!entitlements) {
        logBroken(file, entitlements.error().text());
        return std::nullopt;
    }
    if (!entitlements->isDictionary()) {
        logBroken(file, "not a dictionary");
        return std::nullopt;
    }
    return std::move(entitlements).value();
}

}  // namespace qm
