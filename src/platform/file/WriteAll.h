#pragma once
// Writing a whole buffer to a descriptor, through short writes and EINTR.

#include <cstdint>
#include <span>
#include <string_view>

#include "platform/error/Error.h"

namespace qm {

// Nothing once every byte is written; otherwise the posix error (EIO when
// the descriptor takes nothing).
MaybeError writeAll(int fd, std::span<const std::uint8_t> bytes);
MaybeError writeAll(int fd, std::string_view text);

}  // namespace qm
