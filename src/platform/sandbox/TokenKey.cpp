#include "platform/sandbox/TokenKey.h"

#include <fcntl.h>
#include <openssl/rand.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>

#include "platform/fd/UniqueFd.h"
#include "platform/file/Directories.h"
#include "platform/file/PathFacts.h"
#include "platform/file/WriteAll.h"

namespace qm {

namespace {

constexpr const char* kKeyFileName = "token.key";
constexpr mode_t kPrivateFolderMode = 0700;

struct KeyFile {
    dev_t device = 0;
    FileStamp stamp;
    TokenKeyBytes bytes{};
};

Result<KeyFile> readKeyFile(const std::string& path) {
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
    if (!fd) {
        return posixError(errno, "opening the token key " + path);
    }
    struct stat status {};
    if (::fstat(fd.get(), &status) != 0) {
        return posixError(errno, "token key " + path);
    }
    if (status.st_uid != ::geteuid() || (status.st_mode & 077) != 0) {
        return posixError(EACCES, "token key " + path + " is not private to its user");
    }
    if (!S_ISREG(status.st_mode) || status.st_size != static_cast<off_t>(kTokenKeyBytes)) {
        return posixError(EINVAL, "token key " + path + " is not a file of 32 bytes");
    }
    KeyFile key{status.st_dev, FileStamp::of(status), {}};
    std::size_t done = 0;
    while (done < key.bytes.size()) {
        ssize_t n = ::read(fd.get(), key.bytes.data() + done, key.bytes.size() - done);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            return posixError(n < 0 ? errno : EINVAL, "reading the token key " + path);
        }
        done += static_cast<std::size_t>(n);
    }
    return key;
}

// The key's bytes, mode 0600 whatever the umask, flushed to disk.
MaybeError writePrivately(int fd, const TokenKeyBytes& bytes, const std::string& path) {
    if (::fchmod(fd, 0600) != 0) {
        return posixError(errno, "token key " + path);
    }
    if (auto error = writeAll(fd, bytes)) {
        return posixError(static_cast<int>(error->code), "writing " + path);
    }
    if (::fsync(fd) != 0) {
        return posixError(errno, "flushing " + path);
    }
    return std::nullopt;
}

// Writes a complete private key under a temporary name and links it into
// place; link() fails on an existing name, so of two creators exactly one
// wins and the other reads the winner's key.
Result<KeyFile> createKeyFile(const std::string& path) {
    KeyFile key;
    if (::RAND_bytes(key.bytes.data(), static_cast<int>(key.bytes.size())) != 1) {
        return posixError(EIO, "no random bytes for the token key");
    }
    std::string folder = parentFolderOf(path);
    if (auto failed = createDirectories(folder, kPrivateFolderMode)) {
        return *failed;
    }
    std::string temporary = folder + "/." + kKeyFileName + ".XXXXXX";
    UniqueFd fd(::mkostemp(temporary.data(), O_CLOEXEC));  // O_EXCL, mode 0600
    if (!fd) {
        return posixError(errno, "creating a temporary token key in " + folder);
    }
    MaybeError failed = writePrivately(fd.get(), key.bytes, temporary);
    int linkError = 0;
    if (!failed && ::link(temporary.c_str(), path.c_str()) != 0) {
        linkError = errno;
    }
    ::unlink(temporary.c_str());
    if (failed) {
        return *failed;
    }
    if (linkError == EEXIST) {
        return readKeyFile(path);
    }
    if (linkError != 0) {
        return posixError(linkError, "placing the token key at " + path);
    }
    UniqueFd directory(::open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (directory) {
        ::fsync(directory.get());  // the new name survives a crash; best effort
    }
    struct stat status {};  // after link() and unlink(), which change the file's ctime
    if (::fstat(fd.get(), &status) != 0) {
        return posixError(errno, "token key " + path);
    }
    key.device = status.st_dev;
    key.stamp = FileStamp::of(status);
    return key;
}

}  // namespace

std::string tokenKeyPath(const std::string& runtimeDirectory) {
    return runtimeDirectory + "/" + kKeyFileName;
}

Result<TokenKeyBytes> TokenKeyCache::key(const std::string& keyPath, TokenKeyCreation creation) {
    std::lock_guard lock(mutex_);
    struct stat status {};
    bool exists = ::lstat(keyPath.c_str(), &status) == 0;
    int statError = exists ? 0 : errno;
    if (!exists && (statError != ENOENT || creation == TokenKeyCreation::existingOnly)) {
        return posixError(statError, "token key " + keyPath);
    }
    if (exists && loaded_ && loaded_->path == keyPath && loaded_->device == status.st_dev &&
        loaded_->stamp == FileStamp::of(status)) {
        return loaded_->bytes;
    }
    Result<KeyFile> file = exists ? readKeyFile(keyPath) : createKeyFile(keyPath);
    if (!file) {
        loaded_.reset();
        return file.error();
    }
    loaded_ = Loaded{keyPath, file->device, file->stamp, file->bytes};
    return file->bytes;
}

TokenKeyCache& processTokenKeyCache() {
    static TokenKeyCache cache;
    return cache;
}

}  // namespace qm
