// qmd: the plug-in registry daemon.

#include <cstdlib>

#include "daemon/CommandLine.h"
#include "daemon/QMDServer.h"
#include "platform/log/SystemLog.h"

int main(int argc, char** argv) {
    auto options = parseCommandLine(argc, argv);
    if (!options) {
        return kUsageExitStatus;
    }
    qm::openSystemLog("qmd");
    auto server = QMDServer::initForService(options->serviceName, options->databasePath);
    if (!server) {
        qm::systemLog(qm::kLogNotice, server.error().text());
        qm::systemLog(qm::kLogNotice, "unable to construct server");
        return EXIT_FAILURE;
    }
    (*server)->setVerbose(options->verbosity);
    (*server)->run();
    return EXIT_SUCCESS;
}
