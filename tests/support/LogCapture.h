#pragma once
// Collects every system-log line written in this process while it lives.

#include <algorithm>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "platform/log/SystemLog.h"
#include "support/Eventually.h"

namespace qmtest {

class LogCapture {
public:
    LogCapture() {
        qm::setLogObserver([this](int, std::string_view line) {
            std::lock_guard lock(mutex_);
            lines_.emplace_back(line);
        });
    }
    ~LogCapture() { qm::setLogObserver(nullptr); }
    LogCapture(const LogCapture&) = delete;
    LogCapture& operator=(const LogCapture&) = delete;

    std::vector<std::string> lines() const {
        std::lock_guard lock(mutex_);
        return lines_;
    }
    std::string text() const {
        std::string all;
        for (const auto& line : lines()) {
            all.append(line).append("\n");
        }
        return all;
    }
    bool contains(const std::string& needle) const { return text().find(needle) != std::string::npos; }
    std::size_t countContaining(const std::string& needle) const {
        auto all = lines();
        return std::count_if(all.begin(), all.end(), [&](const auto& line) { return line.find(needle) != std::string::npos; });
    }
    // Waits up to five seconds for a line holding the text.
    bool waitFor(const std::string& needle) const {
        return eventually([&] { return contains(needle); });
    }

private:
    mutable std::mutex mutex_;
    std::vector<std::string> lines_;
};

}  // namespace qmtest
