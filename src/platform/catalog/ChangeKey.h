#pragma once
// How the catalog tells that a file changed without reading it: its inode,
// size and modification and status-change times in nanoseconds. Replacing
// a file (a new inode), rewriting it in place (mtime, ctime) and changing
// its owner or mode (ctime) all change the key; no content is hashed.

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace qm {

struct ChangeKey {
    std::uint64_t inode = 0;
    std::int64_t size = 0;
    std::int64_t modifiedNs = 0;
    std::int64_t changedNs = 0;

    // A missing file has the all-zero key.
    bool exists() const noexcept { return inode != 0; }
    bool operator==(const ChangeKey&) const = default;

    // "inode:size:mtime:ctime", as stored.
    std::string text() const;
    static std::optional<ChangeKey> parse(std::string_view text);
};

// The key of the file at path (symbolic links followed); all zero when it
// cannot be examined.
ChangeKey changeKeyOf(const std::string& path);

}  // namespace qm
