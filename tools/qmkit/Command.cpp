#include "Command.h"

#include <cstdio>

namespace {

std::vector<QmkitCommand>& registry() {
    static std::vector<QmkitCommand> commands;
    return commands;
}

}  // namespace

const std::vector<QmkitCommand>& qmkitCommands() {
    return registry();
}

QmkitCommandRegistration::QmkitCommandRegistration(const QmkitCommand& command) {
    registry().push_back(command);
}

int commandUsageError(const std::string& command, const std::string& message) {
    std::fprintf(stderr, "qmkit: %s: %s\nqmkit: see 'qmkit %s --help'\n", command.c_str(), message.c_str(),
                 command.c_str());
    return kQmkitUsage;
}
