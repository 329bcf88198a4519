#include "platform/prefs/PreferenceDomain.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cassert>
#include <cerrno>
#include <cstring>
#include <ctime>
#include <utility>

#include "platform/env/Environment.h"
#include "platform/fd/UniqueFd.h"
#include "platform/log/SystemLog.h"
#include "platform/plist/PropertyList.h"

namespace qm {

namespace {

// A file modified this recently may be rewritten again within the same
// clock tick without its stamp changing, so it is read at every synchronize.
constexpr std::int64_t kRecentNs = 2'000'000'000;

bool modifiedRecently(const FileStamp& stamp) {
    struct timespec now {};
    ::clock_gettime(CLOCK_REALTIME, &now);
    std::int64_t nowNs = static_cast<std::int64_t>(now.tv_sec) * 1'000'000'000 + now.tv_nsec;
    // A time in the future (a clock set back) counts as recent too.
    return nowNs - stamp.modifiedNs < kRecentNs;
}

}  // namespace

PreferenceDomain PreferenceDomain::forUser(std::string_view domain) {
    assert(!domain.empty() && domain.find('/') == std::string_view::npos && !domain.starts_with('.'));
    return PreferenceDomain(xdgConfigHome() + "/ovaro/" + std::string(domain) + ".plist");
}

PreferenceDomain::PreferenceDomain(std::string path) : path_(std::move(path)) {}

bool PreferenceDomain::synchronize() {
    struct stat status {};
    if (::stat(path_.c_str(), &status) != 0) {
        int error = errno;
        forgetValues(std::nullopt);
        bool missing = error == ENOENT || error == ENOTDIR;
        if (!missing && error != reportedStatError_) {
            systemLogf(kLogNotice, "preferences %s unreadable (%s); using none", path_, std::strerror(error));
        }
        reportedStatError_ = missing ? 0 : error;
        return false;
    }
    reportedStatError_ = 0;
    FileStamp seen = FileStamp::of(status);
    if (readStamp_ && *readStamp_ == seen && !modifiedRecently(seen)) {
        return false;
    }
    // The stamp kept is the one of the descriptor actually read, so a rename
    // between the stat and the open cannot pair old content with a new stamp.
    UniqueFd fd(::open(path_.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
    if (!fd) {
        int error = errno;
        if (error == ENOENT || error == ENOTDIR) {  // removed since the stat
            forgetValues(std::nullopt);
            return false;
        }
        forgetValues(seen);
        reportDamage(seen, std::strerror(error));
        return true;
    }
    if (::fstat(fd.get(), &status) == 0) {
        seen = FileStamp::of(status);
    }
    auto parsed = plist::readDescriptor(fd.get(), path_);
    if (!parsed) {
        forgetValues(seen);
        reportDamage(seen, parsed.error().text());
        return true;
    }
    const Dictionary* root = parsed->asDictionary();
    if (root == nullptr) {
        forgetValues(seen);
        reportDamage(seen, std::string("its top is of type ") + valueTypeName(parsed->type()) + ", not a dictionary");
        return true;
    }
    values_ = *root;
    readStamp_ = seen;
    reportedStamp_.reset();
    return true;
}

std::optional<Value> PreferenceDomain::valueForKey(std::string_view key) const {
    if (const Value* value = values_.find(key)) {
        return *value;
    }
    return std::nullopt;
}

void PreferenceDomain::forgetValues(std::optional<FileStamp> stamp) {
    values_ = Dictionary();
    readStamp_ = stamp;
}

void PreferenceDomain::reportDamage(const FileStamp& stamp, const std::string& reason) {
    if (reportedStamp_ == stamp) {
        return;
    }
    reportedStamp_ = stamp;
    systemLogf(kLogNotice, "preferences %s damaged (%s); using none", path_, reason);
}

}  // namespace qm
