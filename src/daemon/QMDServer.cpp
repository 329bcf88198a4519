#include "daemon/QMDServer.h"

#include <unistd.h>

#include <chrono>

#include "daemon/QMDDuctClient.h"
#include "platform/duct/OpenTransaction.h"
#include "platform/env/Environment.h"
#include "platform/launcher/ServiceLauncher.h"
#include "protocol/WireKeys.h"

namespace {

// Never released while the process runs.
std::atomic<QMDServer*> processServer{nullptr};

// How long an ending daemon lets the running transaction write its reply.
constexpr std::chrono::seconds kExitFlushLimit{5};

}  // namespace

qm::Result<QMDServer*> QMDServer::initForService(const std::string& serviceName, std::unique_ptr<QMDatabase> registry,
                                                 std::optional<unsigned> idleExitSeconds) {
    auto loop = qm::EventLoop::create();
    if (!loop) {
        return loop.error();
    }
    std::unique_ptr<QMDServer> server(new QMDServer(std::move(loop).value(), std::move(registry)));
    server->ductQueue_ = std::make_unique<qm::SerialQueue>("duct");
    // Transactions that block nothing run on the thread that read them
    // whenever mainQueue is idle: such a request costs no thread hop at all.
    server->mainQueue_ =
        std::make_unique<qm::SerialQueue>("service", qm::QualityOfService::userInitiated, /*runsInlineWhenIdle=*/true);
    auto listener = qm::duct::Listener::create(*server->loop_, serviceName, *server->ductQueue_);
    if (!listener) {
        return listener.error();
    }
    server->service_ = std::move(listener).value();
    // Counts restart with the daemon (a failure was logged by the poster),
    // before the registry starts and may post; registrations of hosts that
    // exited meanwhile go.
    (void)server->notifications_.reset();
    qm::removeExitedHostRegistrations(qm::ductRuntimeDirectory());
    QMDServer* raw = server.get();
    server->service_->setConnectionHandler([raw](std::shared_ptr<qm::duct::PeerConnection> connection) {
        // The client keeps itself alive through its connection.
        QMDDuctClient::initWithConnection(std::move(connection), *raw);
    });
    auto signals = qm::TerminationSignals::watch(*raw->loop_, [raw](const char* signalName) {
        raw->exitInOrder(qm::format("exiting on %s", signalName));
    });
    if (!signals) {
        return signals.error();
    }
    raw->signals_ = std::move(signals).value();
    if (idleExitSeconds) {
        raw->startIdleExitWatch(*idleExitSeconds);
    }
    delete processServer.exchange(server.release());
    return raw;
}

QMDServer* QMDServer::server() {
    return processServer.load();
}

QMDServer::QMDServer(std::unique_ptr<qm::EventLoop> loop, std::unique_ptr<QMDatabase> registry)
    : loop_(std::move(loop)),
      registry_(std::move(registry)),
      notifications_(qm::ductRuntimeDirectory()),
      holds_([this] { (void)notifications_.post(wire::kAnnotationChangeNotification); }) {
    registry_->setAnnotationsChanged([this] { (void)notifications_.post(wire::kAnnotationChangeNotification); });
    registry_->setPlugInsChanged([this] { (void)notifications_.post(wire::kPlugInsChangeNotification); });
    registry_->setDelegate([this](const std::vector<qm::PlugInRecordPtr>& records) { removedPlugIns(records); });
}

void QMDServer::run() {
    registry_->whenReady([this] { loop_->post([this] { resumeListener(); }); });
    loop_->run();
}

void QMDServer::removedPlugIns(const std::vector<qm::PlugInRecordPtr>& records) {
    mainQueue_->asyncOnWorker([this, records] {
        for (const auto& record : records) {
            if (!record->bundleIdentifier) {
                continue;
            }
            int result = qm::removeExternalService(qm::ductRuntimeDirectory(), *record->bundleIdentifier,
                                                   record->bundleVersion.value_or(""));
            if (result != qm::kServiceRemoved && result != qm::kNoSuchService) {
                log("PLUGIN REMOVAL:%@ RESULT:%d", *record->bundleIdentifier, result);
            }
        }
    });
}

void QMDServer::stop() {
    loop_->stop();
}

void QMDServer::resumeListener() {
    if (stopping()) {
        return;
    }
    if (auto error = service_->resume()) {
        exitInOrder(qm::format("cannot listen on %@: %@", service_->socketPath(), error->text()));
        return;
    }
    debug("listening on %@", service_->socketPath());
}

void QMDServer::startIdleExitWatch(unsigned seconds) {
    auto idleSince = std::make_shared<std::chrono::steady_clock::time_point>(std::chrono::steady_clock::now());
    loop_->setTicker(std::chrono::milliseconds(250), [this, seconds, idleSince] {
        bool idle = qm::duct::openTransactionCount() == 0 && !mainQueue_->busy() && !ductQueue_->busy() &&
                    !syncQueue().busy();
        auto now = std::chrono::steady_clock::now();
        if (!idle) {
            *idleSince = now;
            return;
        }
        if (now - *idleSince >= std::chrono::seconds(seconds)) {
            exitInOrder(qm::format("idle for %u seconds: exiting", seconds));
        }
    });
}

void QMDServer::exitInOrder(std::string line) {
    if (stopping_.exchange(true)) {
        return;
    }
    service_->stop();
    auto deadline = std::chrono::steady_clock::now() + kExitFlushLimit;
    loop_->setTicker(std::chrono::milliseconds(10), [this, deadline, line = std::move(line)] {
        bool flushing = mainQueue_->busy() || qm::duct::PeerConnection::connectionsWithUnsentReplies() != 0;
        if (flushing && std::chrono::steady_clock::now() < deadline) {
            return;
        }
        service_->unlinkOwnSocket();
        log("%@", line);
        ::_exit(0);
    });
}
