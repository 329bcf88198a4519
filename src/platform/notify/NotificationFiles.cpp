#include "platform/notify/NotificationFiles.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

#include "platform/fd/UniqueFd.h"

namespace qm {

namespace {

// Leaves room under NAME_MAX for any suffix a writer may add.
constexpr std::size_t kMaxNameBytes = 200;
// 20 digits hold any 64-bit count; more is not a count file.
constexpr std::size_t kMaxContentBytes = 32;

}  // namespace

std::string notificationDirectory(const std::string& runtimeDirectory) {
    return runtimeDirectory + "/notify";
}

bool isNotificationName(std::string_view name) {
    return !name.empty() && name.size() <= kMaxNameBytes && !name.starts_with('.') &&
           name.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
}

std::optional<std::uint64_t> parseNotificationCount(std::string_view content) {
    if (content.ends_with('\n')) {
        content.remove_suffix(1);
    }
    if (content.empty()) {
        return std::nullopt;
    }
    std::uint64_t count = 0;
    for (char c : content) {
        if (c < '0' || c > '9') {
            return std::nullopt;
        }
        auto digit = static_cast<std::uint64_t>(c - '0');
        if (count > (UINT64_MAX - digit) / 10) {
            return std::nullopt;
        }
        count = count * 10 + digit;
    }
    return count;
}

Result<std::uint64_t> readNotificationCount(const std::string& notificationDirectory, std::string_view name) {
    if (!isNotificationName(name)) {
        return posixError(EINVAL, "not a notification name: " + std::string(name));
    }
    std::string path = notificationDirectory + "/" + std::string(name);
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
    if (!fd) {
        if (errno == ENOENT) {
            return std::uint64_t{0};
        }
        return posixError(errno, path);
    }
    char buffer[kMaxContentBytes + 1];
    std::size_t length = 0;
    while (length < sizeof buffer) {
        ssize_t n = ::read(fd.get(), buffer + length, sizeof buffer - length);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            return posixError(errno, path);
        }
        if (n == 0) {
            break;
        }
        length += static_cast<std::size_t>(n);
    }
    auto count = length <= kMaxContentBytes ? parseNotificationCount(std::string_view(buffer, length)) : std::nullopt;
    if (!count) {
        return posixError(EBADMSG, path + " holds no count");
    }
    return *count;
}

}  // namespace qm
