#pragma once
// The granted holds, in the order they were granted. Every read and write
// runs on syncQueue ("serverSync"), which is always entered last: nothing
// running there submits to another queue and waits, so it cannot deadlock
// with mainQueue or the registry queue.
//
// Client death cannot leave a hold behind: the client first stops accepting
// work, then submits unholdClient(); addHold() refuses, on syncQueue, a client
// that no longer accepts work. A "lock" already past its envelope checks when
// its client dies either lands before the release (which then removes it) or
// is refused.

#include <sys/types.h>

#include <cstddef>
#include <functional>
#include <memory>
#include <unordered_map>
#include <vector>

#include "platform/queue/SerialQueue.h"
#include "platform/value/Uuid.h"
#include "registry/QMDPlugInHold.h"

class HoldList {
public:
    // `changed` runs on syncQueue after every release and on the caller's
    // thread after every hold added; it must not wait on another queue.
    explicit HoldList(std::function<void()> changed);

    qm::SerialQueue& syncQueue() noexcept { return syncQueue_; }

    // True when any hold blocks the plug-in. Blocks on syncQueue; constant
    // time, whatever the number of holds.
    bool holdOnPlugIn(const qm::Uuid& plugIn);
    // Appends the hold; false, and nothing posted, when its client no longer
    // accepts work (or is gone). Blocks on syncQueue.
    bool addHold(std::shared_ptr<const QMDPlugInHold> hold);
    // Releases the hold with this token, if any. Blocks on syncQueue.
    void unholdToken(const qm::Uuid& token);
    // Releases every hold of this very client object. Does not wait: it is
    // called from a connection's event, which never blocks.
    void unholdClient(std::weak_ptr<const HoldOwner> client, pid_t pid);

    // The holds as they stand. Blocks on syncQueue.
    std::vector<std::shared_ptr<const QMDPlugInHold>> holds();

private:
    void appendOnQueue(std::shared_ptr<const QMDPlugInHold> hold);
    void removeOnQueue(std::size_t index);

    qm::SerialQueue syncQueue_;
    std::function<void()> changed_;
    // syncQueue only.
    std::vector<std::shared_ptr<const QMDPlugInHold>> holds_;
    std::unordered_map<qm::Uuid, std::size_t, qm::UuidHash> holdsPerPlugIn_;
};
