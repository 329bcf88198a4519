#include "platform/file/FileStamp.h"

namespace qm {

namespace {

std::int64_t nanoseconds(const struct timespec& time) {
    constexpr std::int64_t kPerSecond = 1'000'000'000;
    return static_cast<std::int64_t>(time.tv_sec) * kPerSecond + time.tv_nsec;
}

}  // namespace

FileStamp FileStamp::of(const struct stat& status) noexcept {
    return FileStamp{static_cast<std::uint64_t>(status.st_ino), static_cast<std::int64_t>(status.st_size),
                     nanoseconds(status.st_mtim), nanoseconds(status.st_ctim)};
}

}  // namespace qm
