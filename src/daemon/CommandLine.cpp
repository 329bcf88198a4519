#include "daemon/CommandLine.h"

#include <unistd.h>

#include <cstdio>

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
