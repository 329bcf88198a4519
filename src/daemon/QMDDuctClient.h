#pragma once
// One connected client process: who it is (pid, executable bundle,
// entitlements), and the bridge from its connection's events to transactions
// on mainQueue.
//
// Ownership: the connection keeps the client alive (its context and its
// event handler); transactions hold their client strongly and may outlive the
// connection; the client refers to its connection weakly.

#include <sys/types.h>

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "model/QMBundle.h"
#include "platform/duct/PeerConnection.h"
#include "platform/value/Value.h"

class QMDServer;

class QMDDuctClient : public std::enable_shared_from_this<QMDDuctClient> {
public:
    // Sets the client up on a new connection and resumes the connection.
    static std::shared_ptr<QMDDuctClient> initWithConnection(std::shared_ptr<qm::duct::PeerConnection> connection,
                                                             QMDServer& server);

    // The peer's termination is imminent (kept for completeness: no Linux source).
    void dying();
    // The connection is invalid: release the client's holds, refuse further work.
    void dead();

    // The peer's process id; 0 once the connection no longer exists.
    pid_t pid() const;
    std::optional<qm::Value> entitlementValueForKey(std::string_view key) const;
    // Granted when a value exists and is not boolean false.
    bool hasEntitlement(std::string_view key) const;
    std::string description() const;

    bool acceptWork() const noexcept { return acceptWork_.load(); }
    const std::optional<QMBundle>& bundle() const noexcept { return bundle_; }
    std::weak_ptr<qm::duct::PeerConnection> connection() const { return connection_; }
    QMDServer& server() const noexcept { return server_; }

    // Requests dispatched so far; mainQueue only.
    std::uint32_t requestCount = 0;

private:
    QMDDuctClient(std::shared_ptr<qm::duct::PeerConnection> connection, QMDServer& server);
    void handleEvent(qm::duct::ConnectionEvent&& event);
    void submitRequest(qm::duct::IncomingMessage&& message);

    std::atomic<bool> acceptWork_{true};
    std::weak_ptr<qm::duct::PeerConnection> connection_;
    QMDServer& server_;
    std::optional<QMBundle> bundle_;
    // The code-signing view of the peer: the entitlements of its bundle, read
    // once when it connected (the pidfd check makes sure they are its own).
    std::optional<qm::Value> task_;
};
