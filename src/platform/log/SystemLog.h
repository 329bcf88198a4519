#pragma once
// The system log: syslog(3) with ident "qmd" (or the program's own), opened
// once with LOG_NDELAY so a line never costs a reconnect. With QM_LOG_STDERR=1
// every line is also written to standard error. Thread-safe.

#include <functional>
#include <string>
#include <string_view>

#include "platform/text/Format.h"

namespace qm {

// Opens the log under the given ident; until then lines go out under the
// program's name. Call once, early, from the main thread.
void openSystemLog(const char* ident);

// Writes one line (a trailing newline is not needed). Level as in syslog(3).
void systemLog(int level, std::string_view line);

template <class... Args>
void systemLogf(int level, std::string_view fmt, const Args&... args) {
    systemLog(level, format(fmt, args...));
}

// Tests observe lines in-process through this hook (null to remove it).
using LogObserver = std::function<void(int level, std::string_view line)>;
void setLogObserver(LogObserver observer);

inline constexpr int kLogNotice = 5;
inline constexpr int kLogInfo = 6;

}  // namespace qm
