#include "registry/HoldList.h"

#include "platform/log/SystemLog.h"

namespace {

// Whether two weak references name the same object, even once it is gone.
bool sameOwner(const std::weak_ptr<const HoldOwner>& a, const std::weak_ptr<const HoldOwner>& b) {
    return !a.owner_before(b) && !b.owner_before(a);
}

}  // namespace

HoldList::HoldList(std::function<void()> changed) : syncQueue_("serverSync"), changed_(std::move(changed)) {}

bool HoldList::holdOnPlugIn(const qm::Uuid& plugIn) {
    bool held = false;
    syncQueue_.sync([&] {
        syncQueue_.assertCurrent();
        held = holdsPerPlugIn_.contains(plugIn);
    });
    return held;
}

bool HoldList::addHold(std::shared_ptr<const QMDPlugInHold> hold) {
    bool added = false;
    syncQueue_.sync([&] {
        syncQueue_.assertCurrent();
        auto client = hold->client().lock();
        if (!client || !client->acceptWork()) {
            return;
        }
        appendOnQueue(std::move(hold));
        added = true;
    });
    if (added && changed_) {
        changed_();
    }
    return added;
}

void HoldList::unholdToken(const qm::Uuid& token) {
    syncQueue_.sync([&] {
        syncQueue_.assertCurrent();
        for (std::size_t i = 0; i < holds_.size(); ++i) {
            if (holds_[i]->uuid() == token) {
                qm::systemLogf(qm::kLogNotice, "releasing plug-in hold %@ at client's request", token.text());
                removeOnQueue(i);
                return;
            }
        }
    });
}

void HoldList::unholdClient(std::weak_ptr<const HoldOwner> client, pid_t pid) {
    syncQueue_.async([this, client = std::move(client), pid] {
        syncQueue_.assertCurrent();
        for (std::size_t i = 0; i < holds_.size();) {
            if (!sameOwner(holds_[i]->client(), client)) {
                ++i;
                continue;
            }
            qm::systemLogf(qm::kLogNotice, "releasing plug-in hold %@ for dead client pid %d", holds_[i]->uuid().text(),
                           pid);
            removeOnQueue(i);
        }
    });
}

std::vector<std::shared_ptr<const QMDPlugInHold>> HoldList::holds() {
    std::vector<std::shared_ptr<const QMDPlugInHold>> copy;
    syncQueue_.sync([&] {
        syncQueue_.assertCurrent();
        copy = holds_;
    });
    return copy;
}

void HoldList::appendOnQueue(std::shared_ptr<const QMDPlugInHold> hold) {
    for (const qm::Uuid& plugIn : hold->blocked()) {
        ++holdsPerPlugIn_[plugIn];
    }
    holds_.push_back(std::move(hold));
}

void HoldList::removeOnQueue(std::size_t index) {
    std::shared_ptr<const QMDPlugInHold> hold = std::move(holds_[index]);
    holds_.erase(holds_.begin() + static_cast<std::ptrdiff_t>(index));
    for (const qm::Uuid& plugIn : hold->blocked()) {
        auto count = holdsPerPlugIn_.find(plugIn);
        if (--count->second == 0) {
            holdsPerPlugIn_.erase(count);
        }
    }
    if (changed_) {
        changed_();
    }
}
