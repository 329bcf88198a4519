// qmkit: a command-line client of qmd.

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "Command.h"

namespace {

void usage(std::FILE* to) {
    std::fputs(
        "usage: qmkit [-S service] [--json] <command> [arguments]\n"
        "       qmkit --help | qmkit <command> --help\n"
        "\n"
        "  -S service   the daemon's service name (default \"ovaro.quamber.qmd\")\n"
        "  --json       print results as JSON\n"
        "\n"
        "commands:\n",
        to);
    std::vector<QmkitCommand> commands = qmkitCommands();
    std::sort(commands.begin(), commands.end(),
              [](const QmkitCommand& a, const QmkitCommand& b) { return std::strcmp(a.name, b.name) < 0; });
    for (const QmkitCommand& command : commands) {
        std::fprintf(to, "  %-10s %s\n", command.name, command.synopsis);
    }
    std::fputs(
        "\n"
        "exit status: 0 success, 1 the daemon answered an error, 2 bad usage,\n"
        "3 the daemon cannot be reached\n",
        to);
}

int usageError(const std::string& message) {
    std::fprintf(stderr, "qmkit: %s\n", message.c_str());
    usage(stderr);
    return kQmkitUsage;
}

const QmkitCommand* findCommand(const std::string& name) {
    for (const QmkitCommand& command : qmkitCommands()) {
        if (name == command.name) {
            return &command;
        }
    }
    return nullptr;
}

bool asksForHelp(const std::vector<std::string>& args) {
    return std::any_of(args.begin(), args.end(), [](const std::string& a) { return a == "--help" || a == "-h"; });
}

}  // namespace

int main(int argc, char** argv) {
    QmkitGlobalOptions options;
    int i = 1;
    for (; i < argc && argv[i][0] == '-'; ++i) {
        std::string option = argv[i];
        if (option == "--help" || option == "-h") {
            usage(stdout);
            return kQmkitOk;
        }
        if (option == "--json") {
            options.json = true;
        } else if (option == "-S") {
            if (i + 1 == argc) {
                return usageError("-S needs a service name");
            }
            options.serviceName = argv[++i];
        } else if (option.rfind("-S", 0) == 0) {
            options.serviceName = option.substr(2);
        } else {
            return usageError("unknown option \"" + option + "\"");
        }
    }
    if (i == argc) {
        return usageError("no command given");
    }
    const QmkitCommand* command = findCommand(argv[i]);
    if (!command) {
        return usageError(std::string("unknown command \"") + argv[i] + "\"");
    }
    std::vector<std::string> args(argv + i + 1, argv + argc);
    if (asksForHelp(args)) {
        command->help();
        return kQmkitOk;
    }
    return command->run(args, options);
}
