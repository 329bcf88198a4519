// qmkit release TOKEN...: ends holds, whoever took them.

#include <cstdio>
#include <string>
#include <vector>

#include "Command.h"
#include "DaemonSession.h"
#include "UuidArguments.h"

namespace {

void help() {
    std::fputs(
        "usage: qmkit [-S service] [--json] [--timeout SECONDS] release TOKEN...\n"
        "\n"
        "Releases the holds named by their tokens, whichever connection took them\n"
        "(see 'qmkit hold'). A token that names no hold is not an error. Prints\n"
        "nothing on success (\"{}\" with --json).\n",
        stdout);
}

int run(const std::vector<std::string>& args, const QmkitGlobalOptions& options) {
    auto tokens = parseUuidArguments(args, "hold token");
    if (!tokens) {
        return commandUsageError("release", tokens.error());
    }
    return DaemonSession(options).run(
        [&tokens](QMDaemonClient& client, QMDaemonClient::ReplyHandler handler) {
            QMDaemonClient::Message message = client.request("lock");
            QMDaemonClient::setUuids(message, *tokens);
            client.send(message, std::move(handler));
        },
        [](const qm::Value&) {});
}

const QmkitCommandRegistration registration({"release", "release holds by their tokens", run, help});

}  // namespace
