#include "daemon/QMDDuctClient.h"

#include "daemon/QMDServer.h"
#include "daemon/Transaction.h"
#include "platform/codesign/Entitlements.h"

std::shared_ptr<QMDDuctClient> QMDDuctClient::initWithConnection(std::shared_ptr<qm::duct::PeerConnection> connection,
                                                                 QMDServer& server) {
    std::shared_ptr<QMDDuctClient> client(new QMDDuctClient(connection, server));
    connection->setContext(client);
    connection->setEventHandler([client](qm::duct::ConnectionEvent&& event) { client->handleEvent(std::move(event)); });
    connection->resume();
    return client;
}

QMDDuctClient::QMDDuctClient(std::shared_ptr<qm::duct::PeerConnection> connection, QMDServer& server)
    : connection_(connection), server_(server) {
    auto executable = connection->peerExecutablePath();
    if (executable) {
        bundle_ = QMBundle::initWithExecutablePath(*executable);
    }
    server_.debug("client %d %s", connection->pid(), executable ? executable->c_str() : "");
    if (bundle_) {
        task_ = qm::readEntitlements(bundle_->directory());
    }
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
            dead();
            return;
    }
}

void QMDDuctClient::submitRequest(qm::duct::IncomingMessage&& message) {
    if (!message.body().isDictionary()) {
        auto connection = connection_.lock();
        server_.log("unexpected message %@ on connection %@", message.body(),
                    connection ? connection->description() : std::string("(gone)"));
        return;
    }
    if (server_.verbose() >= 2) {
        server_.debug("incoming request %@", message.body());
    }
    auto transaction = std::make_shared<Transaction>(std::move(message), shared_from_this());
    server_.submitWork([transaction] {
        QMDDuctClient& client = transaction->client();
        client.server().mainQueue().assertCurrent();
        client.requestCount += 1;
        if (client.requestCount % 1000 == 0) {
            client.server().debug("client %d used %u requests so far", client.pid(), client.requestCount);
        }
        transaction->dispatch();
    });
}

void QMDDuctClient::dying() {
    server_.debug("client %d termination imminent", pid());
}

void QMDDuctClient::dead() {
    server_.unholdClient(*this);
    server_.debug("client %d is dead", pid());
    acceptWork_.store(false);
}

pid_t QMDDuctClient::pid() const {
    auto connection = connection_.lock();
    return connection ? connection->pid() : 0;
}

std::optional<qm::Value> QMDDuctClient::entitlementValueForKey(std::string_view key) const {
    if (!task_) {
        return std::nullopt;
    }
    const qm::Value* value = task_->get(key);
    if (value == nullptr) {
        return std::nullopt;
    }
    return *value;
}

bool QMDDuctClient::hasEntitlement(std::string_view key) const {
    auto value = entitlementValueForKey(key);
    // Boolean false, and so a number equal to it (0), is the only refusal.
    return value && !(*value == qm::Value(false)) && !(value->isNumber() && *value == qm::Value(0));
}

std::string QMDDuctClient::description() const {
    auto connection = connection_.lock();
    if (!connection) {
        return qm::format("<QMDDuctClient %p NO CONNECTION>", static_cast<const void*>(this));
    }
    return qm::format("<QMDDuctClient %p pid=%d con=%@>", static_cast<const void*>(this), connection->pid(),
                      connection->description());
}
