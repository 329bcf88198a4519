#include "platform/types/MimeTypePairs.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <optional>
#include <string_view>

#include "platform/fd/UniqueFd.h"
#include "platform/log/SystemLog.h"

namespace qm {

namespace {

// The real files are a few kilobytes; anything this large is not one.
constexpr std::size_t kMaxFileBytes = 4u * 1024 * 1024;

// The whole file, or nothing (logged unless the file is simply absent).
std::optional<std::string> readSmallFile(const std::string& path) {
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
    if (!fd) {
        if (errno != ENOENT && errno != ENOTDIR) {
            systemLogf(kLogNotice, "type database file %s unreadable: %s", path, std::strerror(errno));
        }
        return std::nullopt;
    }
    struct stat status {};
    if (::fstat(fd.get(), &status) != 0 || !S_ISREG(status.st_mode)) {
        systemLogf(kLogNotice, "type database file %s is not a regular file", path);
        return std::nullopt;
    }
    std::string text;
    char buffer[16384];
    for (;;) {
        ssize_t n = ::read(fd.get(), buffer, sizeof buffer);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            systemLogf(kLogNotice, "type database file %s unreadable: %s", path, std::strerror(errno));
            return std::nullopt;
        }
        if (n == 0) {
            return text;
        }
        if (text.size() + static_cast<std::size_t>(n) > kMaxFileBytes) {
            systemLogf(kLogNotice, "type database file %s is larger than %u bytes; ignored", path,
                       static_cast<unsigned>(kMaxFileBytes));
            return std::nullopt;
        }
        text.append(buffer, static_cast<std::size_t>(n));
    }
}

bool isBlank(char c) {
    return c == ' ' || c == '\t' || c == '\r';
}

// Splits a line into its blank-separated words.
std::vector<std::string_view> words(std::string_view line) {
    std::vector<std::string_view> found;
    std::size_t i = 0;
    while (i < line.size()) {
        while (i < line.size() && isBlank(line[i])) {
            ++i;
        }
        std::size_t start = i;
        while (i < line.size() && !isBlank(line[i])) {
            ++i;
        }
        if (i > start) {
            found.push_back(line.substr(start, i - start));
        }
    }
    return found;
}

}  // namespace

std::vector<MimeTypePair> readMimeTypePairs(const std::string& path) {
    std::vector<MimeTypePair> pairs;
    auto text = readSmallFile(path);
    if (!text) {
        return pairs;
    }
    std::string_view rest(*text);
    unsigned malformed = 0;
    while (!rest.empty()) {
        std::size_t end = rest.find('\n');
        std::string_view line = rest.substr(0, end);
        rest = end == std::string_view::npos ? std::string_view() : rest.substr(end + 1);
        auto columns = words(line);
        if (columns.empty() || columns.front().starts_with('#')) {
            continue;
        }
        if (columns.size() != 2) {
            ++malformed;
            continue;
        }
        pairs.push_back({std::string(columns[0]), std::string(columns[1])});
    }
    if (malformed != 0) {
        systemLogf(kLogNotice, "type database file %s: %u malformed lines skipped", path, malformed);
    }
    return pairs;
}

}  // namespace qm
