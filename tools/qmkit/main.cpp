// qmkit: a command-line client of qmd.

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <optional>
#include <string>
#include <vector>

#include "Command.h"
#include "NumberOptions.h"
#include "platform/duct/ServiceSocket.h"

namespace {

void usage(std::FILE* to) {
    std::fputs(
        "usage: qmkit [-S service] [--json] [--timeout SECONDS] <command> [arguments]\n"
        "       qmkit --help | qmkit <command> --help | qmkit --version\n"
        "\n"
        "  -S service          the daemon's service name (default \"ovaro.quamber.qmd\");\n"
        "                      not empty, no \"/\"\n"
        "  --json              print results as JSON\n"
        "  --timeout SECONDS   give up when the daemon has not answered within SECONDS\n"
        "                      (default 30, at most 1000000; may be fractional)\n"
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
        "3 the daemon cannot be reached or did not answer in time\n",
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

// Reads the options before the command from argv[next] on, leaving next at
// the command. An exit status when qmkit is done (help, version, bad usage).
std::optional<int> readGlobalOptions(int argc, char** argv, int& next, QmkitGlobalOptions& options) {
    for (; next < argc && argv[next][0] == '-'; ++next) {
        const std::string option = argv[next];
        if (option == "--help" || option == "-h") {
            usage(stdout);
            return kQmkitOk;
        }
        if (option == "--version") {
            std::printf("qmkit %s\n", QM_VERSION);
            return kQmkitOk;
        }
        if (option == "--json") {
            options.json = true;
            continue;
        }
        if (option.rfind("-S", 0) == 0 && option != "-S") {
            options.serviceName = option.substr(2);
            continue;
        }
        if (option != "-S" && option != "--timeout") {
            return usageError("unknown option \"" + option + "\"");
        }
        if (next + 1 == argc) {
            return usageError(option + (option == "-S" ? " needs a service name" : " needs a number of seconds"));
        }
        const std::string value = argv[++next];
        if (option == "-S") {
            options.serviceName = value;
            continue;
        }
        auto timeout = parseSecondsOption(option, value);
        if (!timeout) {
            return usageError(timeout.error());
        }
        options.timeout = *timeout;
        options.timeoutText = value;
    }
    if (!qm::duct::isValidServiceName(options.serviceName)) {
        return usageError("invalid service name \"" + options.serviceName + "\": it must not be empty or hold \"/\"");
    }
    return std::nullopt;
}

}  // namespace

int main(int argc, char** argv) {
    QmkitGlobalOptions options;
    int i = 1;
    if (auto done = readGlobalOptions(argc, argv, i, options)) {
        return *done;
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
