#pragma once
// Where named notifications live, shared by the poster (the daemon) and any
// observer: the folder <runtime directory>/notify holds one file per name
// that was posted, whose whole content is the decimal count of posts since
// the daemon started (no newline). A file is only ever replaced by rename,
// so a reader sees a whole count; an absent file means no post yet.
// Temporary files there start with ".".

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/error/Error.h"

namespace qm {

// <runtimeDirectory>/notify
std::string notificationDirectory(const std::string& runtimeDirectory);

// A notification name is a file name of its folder: not empty, at most 200
// bytes, no "/" or NUL, not starting with "." (kept for temporaries).
bool isNotificationName(std::string_view name);

// The count in a notification file's content; nothing unless it is decimal
// digits (a trailing newline allowed) that fit 64 bits.
std::optional<std::uint64_t> parseNotificationCount(std::string_view content);

// The number of posts of name as the folder says now: 0 when its file is
// absent. An error when the file cannot be read or holds no count.
Result<std::uint64_t> readNotificationCount(const std::string& notificationDirectory, std::string_view name);

}  // namespace qm
