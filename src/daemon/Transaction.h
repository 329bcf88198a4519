#pragma once
// One request from its arrival to its reply. A transaction runs on mainQueue,
// from dispatch() to exactly one of done() / fail(), after which it sends
// nothing more. A transaction of a client that no longer accepts work ends
// without a reply.
//
// The request handlers are operations of Transaction, one file each.

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "platform/duct/PeerConnection.h"
#include "platform/error/Error.h"
#include "platform/value/Value.h"

class QMDDuctClient;
class QMDServer;

class Transaction {
public:
    Transaction(qm::duct::IncomingMessage request, std::shared_ptr<QMDDuctClient> client);

    // Checks the envelope and calls the request's handler.
    void dispatch();
    // Sends the reply (nothing when the connection is gone).
    void done();
    // fail:message: — writes "errorcode" (sign-extended) and "error" (when
    // there is a message), then done().
    void fail(int code, std::optional<std::string> message);
    // fail:error: — an error of the daemon's own domain keeps its own code.
    void fail(int code, const qm::Error& error);

    QMDDuctClient& client() const noexcept { return *client_; }
    QMDServer& server() const noexcept;
    const qm::Value& request() const noexcept { return request_.body(); }
    qm::Dictionary& reply() noexcept { return reply_; }
    std::uint64_t version() const noexcept { return version_; }
    bool finished() const noexcept { return finished_; }

    // Request handlers.
    void bulkPlugIns();

private:
    qm::duct::IncomingMessage request_;
    std::shared_ptr<QMDDuctClient> client_;
    qm::Dictionary reply_;
    std::uint64_t version_ = 0;
    bool finished_ = false;
};
