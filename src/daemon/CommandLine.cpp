#include "daemon/CommandLine.h"

#include <unistd.h>

#include <cstdio>
#include <cstring>

namespace {

void printUsage() {
    std::fputs("Usage: qmd [-S servicename] [-v]\n", stderr);
}

}  // namespace

std::optional<QMDOptions> parseCommandLine(int argc, char** argv) {
    QMDOptions options;
    ::optind = 1;
    int option;
    while ((option = ::getopt(argc, argv, "d:S:v")) != -1) {
        switch (option) {
            case 'd':
                options.databasePath = ::optarg;
                break;
            case 'S':
                options.serviceName = ::optarg;
                break;
            case 'v':
                ++options.verbosity;
                break;
            default:
                printUsage();
                return std::nullopt;
        }
    }
    if (::optind < argc) {
        printUsage();  // a stray operand
        return std::nullopt;
    }
    return options;
}

std::optional<int> handleInformationalOption(int argc, char** argv) {
    if (argc != 2) {
        return std::nullopt;
    }
    if (std::strcmp(argv[1], "--version") == 0) {
        std::printf("qmd %s\n", QM_VERSION);
        return 0;
    }
    if (std::strcmp(argv[1], "--help") == 0) {
        std::fputs(
            "Usage: qmd [-S servicename] [-d database-path] [-v ...]\n"
            "The plug-in registry daemon: serves the named service (default ovaro.quamber.qmd)\n"
            "on a socket in $QM_DUCT_DIR (else $XDG_RUNTIME_DIR/ovaro, else /tmp/ovaro-<uid>).\n"
            "  -S name   the service name to listen on\n"
            "  -d path   the annotations file (default $XDG_STATE_HOME/ovaro.quamber/Annotations)\n"
            "  -v        more log lines; twice: every request and reply in full\n"
            "  --help, --version\n"
            "Ends on SIGTERM or SIGINT; with QM_IDLE_EXIT=<seconds>, after that long idle.\n"
            "Exit status: 0 ended in order, 1 could not start, 2 bad usage.\n",
            stdout);
        return 0;
    }
    return std::nullopt;
}
