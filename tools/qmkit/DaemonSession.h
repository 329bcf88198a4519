#pragma once
// One request from qmkit to qmd: connect, send, wait for the reply, print it,
// and turn the outcome into qmkit's exit status and message.
//
// Outcomes: a reply without error prints with the command's own printer (or
// as JSON with --json) and exits 0; an error reply writes "qmkit: <message>
// (code N)" on standard error and exits 1 (with --json the reply is printed
// too, for scripts that want its other keys); a daemon that cannot be
// reached, a connection that dies before the reply, or no reply within the
// timeout writes "qmkit: <reason>" and exits 3.

#include <chrono>
#include <functional>

#include "Command.h"
#include "client/QMDaemonClient.h"
#include "platform/value/Value.h"

class DaemonSession {
public:
    // Bounds connecting, writing and waiting for the reply.
    static constexpr std::chrono::milliseconds kTimeout{30000};

    using Start = std::function<void(QMDaemonClient& client, QMDaemonClient::ReplyHandler handler)>;
    using Printer = std::function<void(const qm::Value& reply)>;

    explicit DaemonSession(const QmkitGlobalOptions& options);

    // Issues the request that `start` sends and reports its reply; returns
    // the exit status. `printSuccess` prints a successful reply for people.
    int run(const Start& start, const Printer& printSuccess) const;

private:
    const QmkitGlobalOptions& options_;
};
