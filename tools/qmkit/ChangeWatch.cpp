#include "ChangeWatch.h"

#include <sys/epoll.h>

#include <cstdio>
#include <memory>

#include "platform/env/Environment.h"
#include "platform/notify/NotificationWatcher.h"
#include "platform/process/TerminationSignals.h"

namespace {

// Calls a function whenever its descriptor is readable, on the loop thread.
class ReadableSource final : public qm::EventSource {
public:
    explicit ReadableSource(std::function<void()> onReadable) : onReadable_(std::move(onReadable)) {}
    void handleEvents(std::uint32_t /*events*/) override { onReadable_(); }

private:
    std::function<void()> onReadable_;
};

}  // namespace

int followChanges(DaemonSession& session, qm::EventLoop& loop, const std::string& command, const ChangeLook& look) {
    auto printError = [&](const std::string& message) {
        std::fprintf(stderr, "qmkit: %s: %s\n", command.c_str(), message.c_str());
    };
    std::optional<int> status;
    auto finish = [&](int exitStatus) {
        if (!status) {
            status = exitStatus;
            loop.stop();
        }
    };
    auto lookAt = [&](const std::set<std::string>& changed) {
        if (auto done = look(changed)) {
            finish(*done);
        }
    };
    auto watcher = qm::NotificationWatcher::open(qm::ductRuntimeDirectory());
    if (!watcher) {
        printError("cannot watch for changes: " + watcher.error().text());
        return kQmkitUnreachable;
    }
    auto posts = std::make_shared<ReadableSource>([&] {
        std::set<std::string> changed;
        auto note = [&](const std::string& name, std::uint64_t) { changed.insert(name); };
        // Until nothing is left, so that the end of the watch is noticed too.
        for (;;) {
            auto calls = watcher->waitForPosts(std::chrono::milliseconds(0), note);
            if (!calls) {
                printError("cannot watch for changes: " + calls.error().text());
                finish(kQmkitUnreachable);
                return;
            }
            if (*calls == 0) {
                break;
            }
        }
        if (!changed.empty() && !status) {
            lookAt(changed);
        }
    });
    auto signals = qm::TerminationSignals::watch(loop, [&](const char*) { finish(kQmkitOk); });
    auto watching = loop.add(watcher->descriptor(), EPOLLIN, posts);
    if (!signals || !watching) {
        printError("cannot wait: " + (signals ? watching.error() : signals.error()).text());
        return kQmkitUnreachable;
    }
    session.client()->setInvalidationHandler([&loop, &finish](const qm::Error& reason) {
        loop.post([&finish, reason] {
            std::fprintf(stderr, "qmkit: %s\n", reason.text().c_str());
            finish(kQmkitUnreachable);
        });
    });
    lookAt({});
    if (!status) {
        loop.run();
    }
    // The handler refers to this frame; the connection may outlive it.
    session.client()->setInvalidationHandler(nullptr);
    return *status;
}
