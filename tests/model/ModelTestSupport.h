#pragma once
// Helpers shared by the model's tests: captured log lines, environment
// variables set for one test and restored after it, and short value literals.

#include <cstdlib>
#include <initializer_list>
#include <mutex>
#include <optional>
#include <ostream>
#include <string>
#include <vector>

#include "platform/log/SystemLog.h"
#include "platform/value/Value.h"

namespace qm {
// Readable values in test failure messages.
inline void PrintTo(const Value& value, std::ostream* out) {
    *out << value.description();
}
}  // namespace qm

namespace modeltest {

// Collects every system-log line written while it lives.
class LogCapture {
public:
    LogCapture() {
        qm::setLogObserver([this](int, std::string_view line) {
            std::lock_guard<std::mutex> guard(lock_);
            lines_.emplace_back(line);
        });
    }
    ~LogCapture() { qm::setLogObserver(nullptr); }
    LogCapture(const LogCapture&) = delete;
    LogCapture& operator=(const LogCapture&) = delete;

    std::vector<std::string> lines() const {
        std::lock_guard<std::mutex> guard(lock_);
        return lines_;
    }
    bool contains(const std::string& text) const {
        for (const std::string& line : lines()) {
            if (line.find(text) != std::string::npos) {
                return true;
            }
        }
        return false;
    }

private:
    mutable std::mutex lock_;
    std::vector<std::string> lines_;
};

// Sets (or, with nothing, unsets) one variable and restores it at the end.
class ScopedEnvironment {
public:
    ScopedEnvironment(const char* name, const std::optional<std::string>& value) : name_(name) {
        if (const char* old = std::getenv(name)) {
            old_ = old;
        }
        set(value);
    }
    ~ScopedEnvironment() { set(old_); }
    ScopedEnvironment(const ScopedEnvironment&) = delete;
    ScopedEnvironment& operator=(const ScopedEnvironment&) = delete;

private:
    void set(const std::optional<std::string>& value) {
        if (value) {
            ::setenv(name_.c_str(), value->c_str(), 1);
        } else {
            ::unsetenv(name_.c_str());
        }
    }
    std::string name_;
    std::optional<std::string> old_;
};

inline qm::Value dict(std::initializer_list<qm::Dictionary::Entry> entries) {
    return qm::Value(qm::Dictionary(entries));
}

inline qm::Value array(std::initializer_list<qm::Value> elements) {
    return qm::Value(qm::Array(elements));
}

// The value at a path of dictionary keys, or null.
inline qm::Value at(const qm::Value& value, std::initializer_list<const char*> keys) {
    qm::Value current = value;
    for (const char* key : keys) {
        const qm::Value* next = current.get(key);
        if (next == nullptr) {
            return qm::Value();
        }
        current = *next;
    }
    return current;
}

}  // namespace modeltest
