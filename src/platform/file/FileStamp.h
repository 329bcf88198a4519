#pragma once
// What tells one state of a file from another without reading it: inode,
// size and the nanosecond modification and change times. A rewrite in place
// changes the times (and usually the size), a rename puts another inode in
// place. Two writes within one tick of the file system's clock may leave the
// times alike, which is why readers that must not miss a change also look
// again at files modified very recently.

#include <sys/stat.h>

#include <cstdint>

namespace qm {

struct FileStamp {
    std::uint64_t inode = 0;
    std::int64_t size = 0;
    std::int64_t modifiedNs = 0;  // since 1970
    std::int64_t changedNs = 0;   // since 1970

    static FileStamp of(const struct stat& status) noexcept;
    bool operator==(const FileStamp&) const = default;
};

}  // namespace qm
