#pragma once
// One request from its arrival to its reply. A transaction runs on mainQueue,
// from dispatch() to exactly one of done() / fail(), after which it sends
// nothing more. A transaction of a client that no longer accepts work ends
// without a reply.

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "platform/duct/PeerConnection.h"
#include "platform/value/Value.h"
#include "registry/Request.h"

class QMDDuctClient;
class QMDServer;

class Transaction {
public:
    Transaction(qm::duct::IncomingMessage request, std::shared_ptr<QMDDuctClient> client);

    // True when dispatching this request blocks nothing: its envelope is
    // answered with an error, or its route runs inline. Only then may it run
    // on the thread that read it.
    bool mayRunInline() const;

    // Checks the envelope and calls the request's handler.
    void dispatch();
    // Sends the reply (nothing when the connection is gone).
    void done();
    // fail:message: writes "errorcode" (sign-extended) and "error" (when
    // there is a message), then done().
    void fail(int code, std::optional<std::string> message);

    QMDDuctClient& client() const noexcept { return *client_; }
    QMDServer& server() const noexcept;
    const qm::Value& request() const noexcept { return request_.body(); }
    std::uint64_t version() const noexcept { return version_; }

private:
    void finish(Reply reply);
    // fail() with a message made once, shared by every reply that carries it.
    void failWithMessage(int code, const qm::Value& message);

    qm::duct::IncomingMessage request_;
    std::shared_ptr<QMDDuctClient> client_;
    qm::Dictionary reply_;
    std::uint64_t version_ = 0;
    bool finished_ = false;
};
