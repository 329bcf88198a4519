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

int DaemonSession::run(const Start& start, const Printer& printSuccess) const {
    auto client = QMDaemonClient::initWithServiceName(options_.serviceName.c_str(), options_.timeout);
    if (!client) {
        printError("cannot reach qmd (service \"" + options_.serviceName + "\"): " + client.error().text());
        return kQmkitUnreachable;
    }
    QMDaemonClient& qmd = **client;
    qm::Result<qm::Value> reply = qmd.waitForReply(
        [&](QMDaemonClient::ReplyHandler handler) { start(qmd, std::move(handler)); }, options_.timeout);
    if (!reply) {
        printError(timedOut(reply.error()) ? "no reply within " + options_.timeoutText + " s" : reply.error().text());
        return kQmkitUnreachable;
    }
    std::optional<qm::Error> error = QMDaemonClient::errorInReply(reply);
    if (options_.json) {
        std::fputs(replyAsJson(*reply).c_str(), stdout);
    }
    if (error) {
        printError(error->text() + " (code " + std::to_string(error->code) + ")");
        return kQmkitDaemonError;
    }
    if (!options_.json) {
        printSuccess(*reply);
    }
    return kQmkitOk;
}
