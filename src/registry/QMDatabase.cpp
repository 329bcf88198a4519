#include "registry/QMDatabase.h"

QMDatabase::QMDatabase(std::optional<std::string> databasePath) : databasePath_(std::move(databasePath)) {}

void QMDatabase::whenReady(std::function<void()> ready) {
    {
        std::lock_guard lock(mutex_);
        if (!ready_) {
            waiting_.push_back(std::move(ready));
            return;
        }
    }
    ready();
}

void QMDatabase::markReady() {
    std::vector<std::function<void()>> waiting;
    {
        std::lock_guard lock(mutex_);
        if (ready_) {
            return;
        }
        ready_ = true;
        waiting.swap(waiting_);
    }
    for (auto& ready : waiting) {
        ready();
    }
}

bool QMDatabase::isReady() const {
    std::lock_guard lock(mutex_);
    return ready_;
}
