#pragma once
// Helpers shared by the model's tests: captured log lines, environment
// variables set for one test and restored after it, and short value literals.

#include <initializer_list>

#include "platform/value/Value.h"
#include "support/LogCapture.h"
#include "support/ScopedEnvironment.h"

namespace modeltest {

using qmtest::LogCapture;
using qmtest::ScopedEnvironment;

inline qm::Value dict(std::initializer_list<qm::Dictionary::Entry> entries) {
    return qm::Value(qm::Dictionary(entries));
}

inline qm::Value array(std::initializer_list<qm::Value> elements) {
    return qm::Value(qm::Array(elements));
}

// The value at a path of dictionary keys, or null.
inline qm::Value at(qm::Value value, std::initializer_list<const char*> keys) {
    for (const char* key : keys) {
        const qm::Value* next = value.get(key);
        value = next ? *next : qm::Value();
    }
    return value;
}

}  // namespace modeltest
