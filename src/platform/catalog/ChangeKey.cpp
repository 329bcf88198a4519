#include "platform/catalog/ChangeKey.h"

#include <sys/stat.h>

#include <charconv>

namespace qm {

namespace {

std::int64_t nanoseconds(const struct timespec& time) {
    return static_cast<std::int64_t>(time.tv_sec) * 1'000'000'000 + time.tv_nsec;
}

// Reads one number and the separator after it (none after the last).
template <class Number>
bool readField(std::string_view& text, Number& out, bool last) {
    auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), out);
    if (error != std::errc()) {
        return false;
    }
    text.remove_prefix(static_cast<std::size_t>(end - text.data()));
    if (last) {
        return text.empty();
    }
    if (text.empty() || text.front() != ':') {
        return false;
    }
    text.remove_prefix(1);
    return true;
}

}  // namespace

std::string ChangeKey::text() const {
    return std::to_string(inode) + ":" + std::to_string(size) + ":" + std::to_string(modifiedNs) + ":" +
           std::to_string(changedNs);
}

std::optional<ChangeKey> ChangeKey::parse(std::string_view text) {
    ChangeKey key;
    if (readField(text, key.inode, false) && readField(text, key.size, false) &&
        readField(text, key.modifiedNs, false) && readField(text, key.changedNs, true)) {
        return key;
    }
    return std::nullopt;
}

ChangeKey changeKeyOf(const std::string& path) {
    struct stat status {};
    if (::stat(path.c_str(), &status) != 0) {
        return {};
    }
    return {static_cast<std::uint64_t>(status.st_ino), static_cast<std::int64_t>(status.st_size),
            nanoseconds(status.st_mtim), nanoseconds(status.st_ctim)};
}

}  // namespace qm
