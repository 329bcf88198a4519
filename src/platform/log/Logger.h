#pragma once
// The daemon's two log operations over the system log: log() always writes
// its line; debug() only at verbosity 1 or more, and formats nothing
// otherwise. The level a caller gives is accepted and not used: it neither
// filters a line nor appears in it. Thread-safe; verbosity is set once before
// the daemon serves and read from any thread.

#include <atomic>
#include <cstdint>
#include <string>
#include <string_view>

#include "platform/log/SystemLog.h"

namespace qm {

class Logger {
public:
    std::uint32_t verbose() const noexcept { return verbose_.load(); }
    void setVerbose(std::uint32_t level) noexcept { verbose_.store(level); }

    template <class... Args>
    void log(std::string_view format, const Args&... args) const {
        systemLog(kLogNotice, boundedFormat(format, args...));
    }
    template <class... Args>
    void debug(std::string_view format, const Args&... args) const {
        if (verbose() != 0) {
            systemLog(kLogNotice, boundedFormat(format, args...));
        }
    }

    // A debug line logged in full (a whole request or reply at verbosity 2),
    // split into continuation lines so no single line grows without bound.
    template <class... Args>
    void debugInFull(std::string_view format, const Args&... args) const {
        if (verbose() != 0) {
            for (const std::string& line : splitForLog(qm::format(format, args...))) {
                systemLog(kLogNotice, line);
            }
        }
    }

private:
    std::atomic<std::uint32_t> verbose_{0};
};

}  // namespace qm
