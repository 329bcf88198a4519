#include "platform/notify/NotificationPoster.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "platform/fd/UniqueFd.h"
#include "platform/file/FolderEntries.h"
#include "platform/file/WriteAll.h"
#include "platform/log/SystemLog.h"
#include "platform/notify/NotificationFiles.h"

namespace qm {

namespace {

MaybeError makePrivateFolder(const std::string& path) {
    if (::mkdir(path.c_str(), 0700) == 0) {
        return std::nullopt;
    }
    if (errno != EEXIST) {
        return posixError(errno, "creating " + path);
    }
    struct stat status {};
    if (::lstat(path.c_str(), &status) != 0) {
        return posixError(errno, path);
    }
    if (!S_ISDIR(status.st_mode)) {
        return posixError(ENOTDIR, path);
    }
    if ((status.st_mode & 07777) != 0700 && ::chmod(path.c_str(), 0700) != 0) {
        return posixError(errno, "making " + path + " private");
    }
    return std::nullopt;
}

// Deletes the files (not folders) directly in path.
MaybeError deleteFilesIn(const std::string& path) {
    auto names = folderEntryNames(path);
    if (!names) {
        return std::move(names).error();
    }
    for (const std::string& name : *names) {
        std::string file = path + "/" + name;
        if (::unlink(file.c_str()) != 0 && errno != ENOENT) {
            systemLogf(kLogNotice, "leaving %s in place: %s", file, std::strerror(errno));
        }
    }
    return std::nullopt;
}

}  // namespace

NotificationPoster::NotificationPoster(std::string runtimeDirectory)
    : directory_(notificationDirectory(runtimeDirectory)) {}

MaybeError NotificationPoster::reset() {
    std::lock_guard lock(mutex_);
    counts_.clear();
    if (auto error = makePrivateFolder(directory_)) {
        return error;
    }
    return deleteFilesIn(directory_);
}

MaybeError NotificationPoster::post(std::string_view name) {
    if (!isNotificationName(name)) {
        return posixError(EINVAL, "not a notification name: " + std::string(name));
    }
    std::string key(name);
    std::uint64_t count = 0;
    MaybeError failure;
    {
        std::lock_guard lock(mutex_);
        count = ++counts_[key];
        failure = writeCount(key, count);
    }
    if (failure) {
        systemLogf(kLogNotice, "notification %s (post %llu) not written: %s", key,
                   static_cast<unsigned long long>(count), failure->text());
    }
    Observer observer;
    {
        std::lock_guard lock(observerMutex_);
        observer = observer_;
    }
    if (observer) {
        observer(key, count);
    }
    return failure;
}

std::uint64_t NotificationPoster::count(std::string_view name) const {
    std::lock_guard lock(mutex_);
    auto found = counts_.find(name);
    return found == counts_.end() ? 0 : found->second;
}

void NotificationPoster::setObserver(Observer observer) {
    std::lock_guard lock(observerMutex_);
    observer_ = std::move(observer);
}

// No fsync: the folder lives in the runtime directory and the counts restart
// at every start, so durability buys nothing; the rename alone makes the
// change whole for readers.
MaybeError NotificationPoster::writeCount(const std::string& name, std::uint64_t count) const {
    std::string temporary = directory_ + "/.post.XXXXXX";
    UniqueFd fd(::mkostemp(temporary.data(), O_CLOEXEC));
    if (!fd) {
        return posixError(errno, "creating a temporary file in " + directory_);
    }
    std::string target = directory_ + "/" + name;
    MaybeError failure = writeAll(fd.get(), std::to_string(count));
    if (!failure && ::close(fd.release()) != 0) {
        failure = posixError(errno, "closing");
    }
    if (!failure && ::rename(temporary.c_str(), target.c_str()) != 0) {
        failure = posixError(errno, "renaming over " + target);
    }
    if (failure) {
        ::unlink(temporary.c_str());
    }
    return failure;
}

}  // namespace qm
