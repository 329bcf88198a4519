#pragma once
// SIGTERM and SIGINT, read through a signalfd on the event loop, so the
// daemon ends in order instead of in a signal handler.
//
// blockTerminationSignals() must run on the main thread before any other
// thread starts: threads inherit the mask, so no thread takes the signal
// asynchronously.

#include <functional>
#include <memory>

#include "platform/error/Error.h"
#include "platform/fd/UniqueFd.h"
#include "platform/queue/EventLoop.h"

namespace qm {

void blockTerminationSignals();

class TerminationSignals final : public EventSource {
public:
    using Handler = std::function<void(const char* signalName)>;  // "SIGTERM" or "SIGINT"

    // Watches the (blocked) signals on the loop; the handler runs on the loop thread.
    static Result<std::shared_ptr<TerminationSignals>> watch(EventLoop& loop, Handler handler);

    void handleEvents(std::uint32_t events) override;

private:
    TerminationSignals(UniqueFd signalFd, Handler handler);

    UniqueFd signalFd_;
    Handler handler_;
};

}  // namespace qm
