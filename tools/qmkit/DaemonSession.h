#pragma once
// Requests from qmkit to qmd on one connection: connect, send, wait for the
// reply, print it, and turn the outcome into qmkit's exit status and message.
//
// Outcomes: a reply without error prints with the command's own printer (or
// as JSON with --json) and exits 0; an error reply writes "qmkit: <message>
// (code N)" on standard error and exits 1 (with --json the reply is printed
// too, for scripts that want its other keys); a daemon that cannot be reached
// or a connection that dies before the reply writes "qmkit: <reason>" and
// exits 3, and so does a reply that does not come within the timeout
// ("qmkit: no reply within N s", N as given to --timeout).

#include <functional>
#include <memory>

#include "Command.h"
#include "client/QMDaemonClient.h"
#include "platform/value/Value.h"

class DaemonSession {
public:
    using Start = std::function<void(QMDaemonClient& client, QMDaemonClient::ReplyHandler handler)>;
    using Printer = std::function<void(const qm::Value& reply)>;

    explicit DaemonSession(const QmkitGlobalOptions& options);

    // Issues the request that `start` sends and reports its reply; returns
    // the exit status. `printSuccess` prints a successful reply for people.
    // Connecting, sending and waiting are each bounded by options.timeout.
    int run(const Start& start, const Printer& printSuccess);

    // Issues one request and returns a successful reply unprinted; for any
    // other outcome, the exit status, its message (and with --json an error
    // reply) already printed. The connection is made by the first request and
    // kept for the next ones.
    qm::Result<qm::Value, int> ask(const Start& start);

    // The connection, once a request has made it; null before.
    QMDaemonClient* client() const { return client_.get(); }

private:
    const QmkitGlobalOptions& options_;
    std::unique_ptr<QMDaemonClient> client_;
};
