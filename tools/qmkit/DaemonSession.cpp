#include "DaemonSession.h"

#include <cerrno>
#include <cstdio>
#include <string>

#include "ReplyFormat.h"
#include "platform/duct/ServiceSocket.h"

namespace {

void printError(const std::string& message) {
    std::fprintf(stderr, "qmkit: %s\n", message.c_str());
}

// The client's two timeouts: no reply in time, or a write the daemon does not take.
bool timedOut(const qm::Error& error) {
    return error.domain == qm::duct::kDuctErrorDomain && error.code == ETIMEDOUT;
}

}  // namespace

DaemonSession::DaemonSession(const QmkitGlobalOptions& options) : options_(options) {}

qm::Result<qm::Value, int> DaemonSession::ask(const Start& start) {
    if (!client_) {
        auto client = QMDaemonClient::initWithServiceName(options_.serviceName.c_str(), options_.timeout);
        if (!client) {
            printError("cannot reach qmd (service \"" + options_.serviceName + "\"): " + client.error().text());
            return int{kQmkitUnreachable};
        }
        client_ = std::move(client).value();
    }
    QMDaemonClient& qmd = *client_;
    qm::Result<qm::Value> reply = qmd.waitForReply(
        [&](QMDaemonClient::ReplyHandler handler) { start(qmd, std::move(handler)); }, options_.timeout);
    if (!reply) {
        printError(timedOut(reply.error()) ? "no reply within " + options_.timeoutText + " s" : reply.error().text());
        return int{kQmkitUnreachable};
    }
    if (std::optional<qm::Error> error = QMDaemonClient::errorInReply(reply)) {
        if (options_.json) {
            std::fputs(replyAsJson(*reply).c_str(), stdout);
        }
        printError(error->text() + " (code " + std::to_string(error->code) + ")");
        return int{kQmkitDaemonError};
    }
    return std::move(reply).value();
}

int DaemonSession::run(const Start& start, const Printer& printSuccess) {
    auto reply = ask(start);
    if (!reply) {
        return reply.error();
    }
    if (options_.json) {
        std::fputs(replyAsJson(*reply).c_str(), stdout);
    } else {
        printSuccess(*reply);
    }
    return kQmkitOk;
}
