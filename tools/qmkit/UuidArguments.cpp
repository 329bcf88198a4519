#include "UuidArguments.h"

qm::Result<std::vector<qm::Uuid>, std::string> parseUuidArguments(const std::vector<std::string>& args,
                                                                   const std::string& what) {
    if (args.empty()) {
        return "expected one or more " + what + "s";
    }
    std::vector<qm::Uuid> uuids;
    for (const std::string& arg : args) {
        auto uuid = qm::Uuid::parse(arg);
        if (!uuid) {
            return "\"" + arg + "\" is not a " + what;
        }
        uuids.push_back(*uuid);
    }
    return uuids;
}
