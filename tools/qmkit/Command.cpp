#include "Command.h"

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
