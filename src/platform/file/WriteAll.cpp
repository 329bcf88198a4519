#include "platform/file/WriteAll.h"

#include <unistd.h>

#include <cerrno>

namespace qm {

MaybeError writeAll(int fd, std::span<const std::uint8_t> bytes) {
    while (!bytes.empty()) {
        ssize_t n = ::write(fd, bytes.data(), bytes.size());
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            return posixError(n < 0 ? errno : EIO, "writing");
        }
        bytes = bytes.subspan(static_cast<std::size_t>(n));
    }
    return std::nullopt;
}

MaybeError writeAll(int fd, std::string_view text) {
    return writeAll(fd, std::span(reinterpret_cast<const std::uint8_t*>(text.data()), text.size()));
}

}  // namespace qm
