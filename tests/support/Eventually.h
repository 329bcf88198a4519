#pragma once
// Waiting for what another thread or process brings about.

#include <chrono>
#include <functional>
#include <thread>

namespace qmtest {

// Polls the condition until it holds; false when it still does not after the timeout.
inline bool eventually(const std::function<bool()>& condition, std::chrono::milliseconds timeout = std::chrono::seconds(5)) {
    for (auto deadline = std::chrono::steady_clock::now() + timeout; !condition();) {
        if (std::chrono::steady_clock::now() > deadline) {
            return false;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return true;
}

}  // namespace qmtest
