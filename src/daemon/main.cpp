// qmd: the plug-in registry daemon.

#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <memory>

#include "daemon/CommandLine.h"
#include "daemon/QMDServer.h"
#include "platform/env/Environment.h"
#include "platform/log/SystemLog.h"
#include "platform/process/TerminationSignals.h"

namespace {

// Start-up failures reach standard error as well as the log (which writes
// there itself with QM_LOG_STDERR=1).
int failStartUp(const std::string& reason) {
    qm::systemLog(qm::kLogNotice, reason);
    qm::systemLog(qm::kLogNotice, "unable to construct server");
    if (!qm::environment().logToStderr) {
        std::fprintf(stderr, "qmd: %s\nqmd: unable to construct server\n", reason.c_str());
    }
    // No destructors: queue threads may already run.
    std::fflush(stderr);
    ::_exit(EXIT_FAILURE);
}

}  // namespace

int main(int argc, char** argv) {
    if (auto exitStatus = handleInformationalOption(argc, argv)) {
        return *exitStatus;
    }
    auto options = parseCommandLine(argc, argv);
    if (!options) {
        return kUsageExitStatus;
    }
    // Before any thread starts, so that every thread inherits the mask.
    qm::blockTerminationSignals();
    qm::openSystemLog("qmd");
    auto idleExit = qm::idleExitSeconds();
    if (!idleExit) {
        return failStartUp(idleExit.error().text());
    }
    auto catalog = qm::AppCatalog::open(qm::AppCatalogOptions::fromEnvironment());
    if (!catalog) {
        return failStartUp(catalog.error().text());
    }
    auto registry = QMDatabase::initWithDatabase(options->databasePath, std::move(catalog).value());
    if (!registry) {
        return failStartUp(registry.error().text());
    }
    auto server = QMDServer::initForService(options->serviceName, std::move(registry).value(), *idleExit);
    if (!server) {
        return failStartUp(server.error().text());
    }
    (*server)->setVerbose(options->verbosity);
    (*server)->registry().start();
    (*server)->run();
    return EXIT_SUCCESS;
}
