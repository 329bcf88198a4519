#include "daemon/QMDServer.h"

#include <chrono>
#include <cstdlib>

#include "daemon/QMDDuctClient.h"
#include "platform/duct/OpenTransaction.h"
#include "platform/env/Environment.h"

namespace {

// Never released while the process runs.
std::atomic<QMDServer*> processServer{nullptr};

}  // namespace

qm::Result<QMDServer*> QMDServer::initForService(const std::string& serviceName,
                                                 std::optional<std::string> databasePath) {
    auto loop = qm::EventLoop::create();
    if (!loop) {
        return loop.error();
    }
    auto* server = new QMDServer(std::move(loop).value(), std::move(databasePath));
    server->ductQueue_ = std::make_unique<qm::SerialQueue>("duct");
    // Transactions run on the thread that read them whenever mainQueue is
    // idle: a request then costs no thread hop at all.
    server->mainQueue_ =
        std::make_unique<qm::SerialQueue>("service", qm::QualityOfService::userInitiated, /*runsInlineWhenIdle=*/true);
    server->syncQueue_ = std::make_unique<qm::SerialQueue>("serverSync");
    auto listener = qm::duct::Listener::create(*server->loop_, serviceName, *server->ductQueue_);
    if (!listener) {
        // The half-built server has no clients or work yet; it can go.
        delete server;
        return listener.error();
    }
    server->service_ = std::move(listener).value();
    delete processServer.exchange(server);
    server->service_->setConnectionHandler([server](std::shared_ptr<qm::duct::PeerConnection> connection) {
        // The client keeps itself alive through its connection.
        QMDDuctClient::initWithConnection(std::move(connection), *server);
    });
    if (auto seconds = qm::idleExitSeconds()) {
        server->startIdleExitWatch(*seconds);
    }
    return server;
}

QMDServer* QMDServer::server() {
    return processServer.load();
}

QMDServer::QMDServer(std::unique_ptr<qm::EventLoop> loop, std::optional<std::string> databasePath)
    : loop_(std::move(loop)), databasePath_(std::move(databasePath)) {}

void QMDServer::run() {
    if (auto error = service_->resume()) {
        log("cannot listen: %@", error->text());
        return;
    }
    loop_->run();
}

void QMDServer::unholdClient(const QMDDuctClient& /*client*/) {
    // Holds are taken by the "lock" request; until it is served a client
    // owns none, and there is nothing to release.
    syncQueue_->sync([this] { syncQueue_->assertCurrent(); });
}

void QMDServer::startIdleExitWatch(unsigned seconds) {
    auto idleSince = std::make_shared<std::chrono::steady_clock::time_point>(std::chrono::steady_clock::now());
    loop_->setTicker(std::chrono::milliseconds(250), [this, seconds, idleSince] {
        bool idle = qm::duct::openTransactionCount() == 0 && !mainQueue_->busy() && !ductQueue_->busy() &&
                    !syncQueue_->busy();
        auto now = std::chrono::steady_clock::now();
        if (!idle) {
            *idleSince = now;
            return;
        }
        if (now - *idleSince >= std::chrono::seconds(seconds)) {
            log("idle for %u seconds: exiting", seconds);
            std::exit(0);
        }
    });
}
