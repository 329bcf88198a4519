#pragma once
// The listener of a named service. Each accepted peer becomes a
// PeerConnection, handed to the event handler on the listener's event queue.
// Nothing is accepted before resume(): peers that connect earlier wait in the
// socket's backlog.
//
// Running out of descriptors never spins: accepting pauses until a
// connection closes, or a second has passed.
//
// Each peer's identity is fixed right after accept, and all its connections
// draw on one ReceiveBudget: the daemon has one listener, so that budget is
// the process's.

#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "platform/duct/PeerConnection.h"
#include "platform/duct/ServiceSocket.h"
#include "platform/queue/EventLoop.h"
#include "platform/queue/SerialQueue.h"

namespace qm::duct {

class Listener final : public EventSource, public std::enable_shared_from_this<Listener> {
public:
    using ConnectionHandler = std::function<void(std::shared_ptr<PeerConnection>)>;

    // Listens on the service's socket; with systemd socket activation, on the
    // passed socket instead. Without a budget, one with the default limits.
    static Result<std::shared_ptr<Listener>> create(EventLoop& loop, const std::string& serviceName,
                                                    SerialQueue& eventQueue,
                                                    std::shared_ptr<ReceiveBudget> budget = nullptr);
    ~Listener() override;

    void setConnectionHandler(ConnectionHandler handler);  // before resume()
    MaybeError resume();
    // Stops accepting for good (loop thread); peers that connect later wait
    // in the backlog until the socket closes.
    void stop();
    const std::string& serviceName() const noexcept { return serviceName_; }
    // Where the socket lies (for a passed socket, what the kernel reports).
    const std::string& socketPath() const noexcept { return socketPath_; }
    // Removes the socket file, only when this process bound it: a socket
    // passed by the service manager stays for the next activation.
    void unlinkOwnSocket();
    const std::shared_ptr<ReceiveBudget>& budget() const noexcept { return budget_; }

    void handleEvents(std::uint32_t events) override;

private:
    Listener(EventLoop& loop, std::string serviceName, SerialQueue& eventQueue, UniqueFd socket, UniqueFd lock,
             std::string socketPath, bool boundHere, std::shared_ptr<ReceiveBudget> budget);
    void acceptPending();
    void pauseAccepting();
    void resumeAccepting();

    EventLoop& loop_;
    const std::string serviceName_;
    SerialQueue& eventQueue_;
    UniqueFd socket_;
    UniqueFd lock_;
    const std::string socketPath_;
    const bool boundHere_;
    const std::shared_ptr<ReceiveBudget> budget_;
    ConnectionHandler handler_;
    EventLoop::RegistrationId registration_ = 0;
    bool registered_ = false;
    bool paused_ = false;  // loop thread only
};

}  // namespace qm::duct
