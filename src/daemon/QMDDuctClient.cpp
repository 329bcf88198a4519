#include "daemon/QMDDuctClient.h"

#include "daemon/QMDServer.h"
#include "daemon/Transaction.h"
#include "platform/codesign/Entitlements.h"
#include "platform/sandbox/Sandboxed.h"

namespace {

// A connection's "unexpected message" lines stop after this many; one line
// with the count follows when it closes.
constexpr unsigned kLoggedUnexpectedMessages = 10;

// The transport fixed the peer at accept; the bundle and its entitlements are
// read once, here, from the executable checked against the pidfd then. A
// connection without an identity never delivers a request.
ClientIdentity identityOf(const qm::duct::PeerConnection& connection) {
    ClientIdentity identity;
    identity.pid = connection.pid();
    const auto& peer = connection.identity();
    if (!peer) {
        return identity;
    }
    identity.uid = peer->uid;
    identity.pidfd = peer->pidfd;
    identity.executablePath = peer->executablePath;
    if (identity.executablePath) {
        identity.bundle = QMBundle::initWithExecutablePath(*identity.executablePath);
    }
    if (identity.bundle) {
        identity.entitlements = qm::readEntitlements(identity.bundle->directory());
    }
    identity.sandboxed = qm::isProcessSandboxed(identity.pid, identity.pidfd ? identity.pidfd->get() : -1);
    return identity;
}

}  // namespace

std::shared_ptr<QMDDuctClient> QMDDuctClient::initWithConnection(std::shared_ptr<qm::duct::PeerConnection> connection,
                                                                 QMDServer& server) {
    std::shared_ptr<QMDDuctClient> client(new QMDDuctClient(connection, server));
    connection->setContext(client);
    connection->setEventHandler([client](qm::duct::ConnectionEvent&& event) { client->handleEvent(std::move(event)); });
    connection->resume();
    return client;
}

QMDDuctClient::QMDDuctClient(const std::shared_ptr<qm::duct::PeerConnection>& connection, QMDServer& server)
    : connection_(connection), server_(server), identity_(identityOf(*connection)) {
    server_.debug("client %d %s", identity_.pid, identity_.executablePath.value_or(""));
}

void QMDDuctClient::handleEvent(qm::duct::ConnectionEvent&& event) {
    switch (event.kind) {
        case qm::duct::ConnectionEvent::Kind::message:
            submitRequest(std::move(*event.message));
            return;
        case qm::duct::ConnectionEvent::Kind::invalid:
            if (event.reason != "peer hung up") {
                server_.log("client %d: connection closed: %@", pid(), event.reason);
            }
            if (unexpectedMessages_ > kLoggedUnexpectedMessages) {
                server_.log("client %d sent %u unexpected messages, %u of them not logged", pid(), unexpectedMessages_,
                            unexpectedMessages_ - kLoggedUnexpectedMessages);
            }
            dead();
            return;
    }
}

void QMDDuctClient::logUnexpectedMessage(const qm::duct::IncomingMessage& message) {
    if (++unexpectedMessages_ > kLoggedUnexpectedMessages) {
        return;
    }
    auto connection = connection_.lock();
    server_.log("unexpected message %@ on connection %@", message.body(),
                connection ? connection->description() : std::string("(gone)"));
}

void QMDDuctClient::submitRequest(qm::duct::IncomingMessage&& message) {
    if (!message.body().isDictionary()) {
        logUnexpectedMessage(message);
        return;
    }
    if (server_.verbose() >= 2) {
        server_.logger().debugInFull("incoming request %@", message.body());
    }
    Transaction transaction(std::move(message), shared_from_this());
    bool mayRunInline = transaction.mayRunInline();
    // The job owns its transaction: run inline, it costs no allocation.
    server_.submitWork(
        [transaction = std::move(transaction)]() mutable {
            QMDDuctClient& client = transaction.client();
            QMDServer& server = client.server();
            server.mainQueue().assertCurrent();
            if (server.stopping()) {
                return;  // the daemon is going: queued transactions are dropped
            }
            client.requestCount += 1;
            if (client.requestCount % 1000 == 0) {
                server.debug("client %d used %u requests so far", client.pid(), client.requestCount);
            }
            transaction.dispatch();
        },
        mayRunInline);
}

void QMDDuctClient::dying() {
    server_.debug("client %d termination imminent", pid());
}

void QMDDuctClient::dead() {
    // In this order: a "lock" being served when the client dies either adds
    // its hold before the release below, which removes it, or is refused.
    acceptWork_.store(false);
    server_.holds().unholdClient(weak_from_this(), pid());
    server_.debug("client %d is dead", pid());
}

std::string QMDDuctClient::description() const {
    auto connection = connection_.lock();
    if (!connection) {
        return qm::format("<QMDDuctClient %p NO CONNECTION>", static_cast<const void*>(this));
    }
    return qm::format("<QMDDuctClient %p pid=%d con=%@>", static_cast<const void*>(this), pid(),
                      connection->description());
}
