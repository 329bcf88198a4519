#pragma once
// Collects what reply handlers and connection events deliver, on whatever
// thread they run, for a test to wait on and read in arrival order.

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <utility>
#include <vector>

#include "platform/error/Error.h"
#include "platform/queue/SerialQueue.h"
#include "platform/value/Value.h"

namespace qmtest {

class ReplyCollector {
public:
    // A handler that files its reply under the tag and, given a queue, checks
    // that it runs on that queue.
    std::function<void(qm::Result<qm::Value>)> handler(int tag, const qm::SerialQueue* queue = nullptr) {
        return [this, tag, queue](qm::Result<qm::Value> reply) {
            std::lock_guard lock(mutex_);
            offQueue_ = offQueue_ || (queue && !queue->isCurrent());
            replies_.emplace_back(tag, std::move(reply));
            changed_.notify_all();
        };
    }
    std::function<void(const qm::Error&)> eventHandler() {
        return [this](const qm::Error& error) {
            std::lock_guard lock(mutex_);
            events_.push_back(error);
            changed_.notify_all();
        };
    }

    bool waitForReplies(std::size_t count, std::chrono::milliseconds timeout = std::chrono::seconds(5)) {
        std::unique_lock lock(mutex_);
        return changed_.wait_for(lock, timeout, [&] { return replies_.size() >= count; });
    }
    bool waitForEvents(std::size_t count) {
        std::unique_lock lock(mutex_);
        return changed_.wait_for(lock, std::chrono::seconds(5), [&] { return events_.size() >= count; });
    }

    qm::Result<qm::Value> reply(int tag) {
        std::lock_guard lock(mutex_);
        auto it = std::find_if(replies_.begin(), replies_.end(), [&](const auto& entry) { return entry.first == tag; });
        return it != replies_.end() ? it->second
                                    : qm::Result<qm::Value>(qm::Error{"test", 0, "no reply for " + std::to_string(tag)});
    }
    // The reply's value; null (and a failure) when it is an error.
    qm::Value value(int tag) {
        auto result = reply(tag);
        EXPECT_TRUE(result.ok()) << result.error().text();
        return result.ok() ? *result : qm::Value();
    }
    std::vector<int> order() {
        std::lock_guard lock(mutex_);
        std::vector<int> tags;
        std::transform(replies_.begin(), replies_.end(), std::back_inserter(tags), [](const auto& entry) { return entry.first; });
        return tags;
    }
    std::vector<qm::Error> events() {
        std::lock_guard lock(mutex_);
        return events_;
    }
    bool ranOnTheirQueues() {
        std::lock_guard lock(mutex_);
        return !offQueue_;
    }

private:
    std::mutex mutex_;
    std::condition_variable changed_;
    std::vector<std::pair<int, qm::Result<qm::Value>>> replies_;
    std::vector<qm::Error> events_;
    bool offQueue_ = false;
};

}  // namespace qmtest
