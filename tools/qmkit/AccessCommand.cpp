// qmkit access UUID...: read tokens for plug-in bundles.

#include <cstdio>
#include <string>
#include <vector>

#include "Command.h"
#include "DaemonSession.h"
#include "Table.h"
#include "UuidArguments.h"

namespace {

void help() {
    std::fputs(
        "usage: qmkit [-S service] [--json] [--timeout SECONDS] access UUID...\n"
        "\n"
        "Asks for access to the plug-ins of the given UUIDs and prints the read\n"
        "token the daemon grants for each one's bundle, one line per UUID, in\n"
        "order. With --json: {\"tokens\": [{\"uuid\": ..., \"token\": ...}, ...]}.\n"
        "'qmkit token verify' checks a token.\n",
        stdout);
}

int run(const std::vector<std::string>& args, const QmkitGlobalOptions& options) {
    auto uuids = parseUuidArguments(args, "UUID");
    if (!uuids) {
        return commandUsageError("access", uuids.error());
    }
    auto reply = DaemonSession(options).ask([&uuids](QMDaemonClient& client, QMDaemonClient::ReplyHandler handler) {
        client.accessPlugIns(*uuids, 0, std::move(handler));
    });
    if (!reply) {
        return reply.error();
    }
    const qm::Value* extensions = reply->get("extensions");
    const qm::Array* tokens = extensions ? extensions->asArray() : nullptr;
    if (!tokens || tokens->size() != uuids->size()) {
        std::fputs("qmkit: access: the reply does not hold one token per UUID\n", stderr);
        return kQmkitDaemonError;
    }
    Table table{{{"uuid", "UUID"}, {"token", "TOKEN"}}, {}};
    for (std::size_t i = 0; i < tokens->size(); ++i) {
        const std::string* token = (*tokens)[i].asString();
        table.rows.push_back({(*uuids)[i].text(), token ? *token : (*tokens)[i].description()});
    }
    std::fputs((options.json ? table.json("tokens") : table.text()).c_str(), stdout);
    return kQmkitOk;
}

const QmkitCommandRegistration registration({"access", "get read tokens for plug-in bundles", run, help});

}  // namespace
