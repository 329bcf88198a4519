#pragma once
// One connected client process: who it is, fixed when it connected (pid,
// executable, bundle, entitlements), and the bridge from its connection's
// events to transactions on mainQueue.
//
// Ownership: the connection keeps the client alive (its context and its
// event handler); transactions hold their client strongly and may outlive the
// connection; holds refer to it weakly; the client refers to its connection
// weakly.

#include <sys/types.h>

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/duct/PeerConnection.h"
#include "platform/value/Value.h"
#include "registry/ClientIdentity.h"
#include "registry/HoldOwner.h"

class QMDServer;

class QMDDuctClient final : public HoldOwner, public std::enable_shared_from_this<QMDDuctClient> {
public:
    // Sets the client up on a new connection and resumes the connection.
    static std::shared_ptr<QMDDuctClient> initWithConnection(std::shared_ptr<qm::duct::PeerConnection> connection,
                                                             QMDServer& server);

    // The peer's termination is imminent (kept for completeness: no Linux source).
    void dying();
    // The connection is invalid: refuse further work, then release the
    // client's holds without waiting for syncQueue.
    void dead();

    // The peer's process id, for the client's whole life (also once the
    // connection is gone, so a request being served still names its host).
    pid_t pid() const noexcept { return identity_.pid; }
    const ClientIdentity& identity() const noexcept { return identity_; }
    std::optional<qm::Value> entitlementValueForKey(std::string_view key) const {
        return identity_.entitlementValueForKey(key);
    }
    bool hasEntitlement(std::string_view key) const { return identity_.hasEntitlement(key); }
    std::string description() const;

    bool acceptWork() const noexcept override { return acceptWork_.load(); }
    std::weak_ptr<qm::duct::PeerConnection> connection() const { return connection_; }
    QMDServer& server() const noexcept { return server_; }

    // Requests dispatched so far; mainQueue only.
    std::uint32_t requestCount = 0;

private:
    QMDDuctClient(const std::shared_ptr<qm::duct::PeerConnection>& connection, QMDServer& server);
    void handleEvent(qm::duct::ConnectionEvent&& event);
    void submitRequest(qm::duct::IncomingMessage&& message);
    void logUnexpectedMessage(const qm::duct::IncomingMessage& message);

    std::atomic<bool> acceptWork_{true};
    std::weak_ptr<qm::duct::PeerConnection> connection_;
    QMDServer& server_;
    const ClientIdentity identity_;
    // Event-loop thread only.
    unsigned unexpectedMessages_ = 0;
};
