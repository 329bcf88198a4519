// qmkit token verify TOKEN: checks a sandbox extension token, without the daemon.

#include <cstdio>
#include <string>
#include <vector>

#include "Command.h"
#include "ReplyFormat.h"
#include "platform/sandbox/ReadExtensions.h"

namespace {

void help() {
    std::fputs(
        "usage: qmkit [--json] token verify TOKEN\n"
        "\n"
        "Checks TOKEN against the token key of the runtime directory D (QM_DUCT_DIR,\n"
        "else $XDG_RUNTIME_DIR/ovaro, else /tmp/ovaro-<uid>), without the daemon.\n"
        "A genuine token prints its class and path, separated by a tab\n"
        "(\"read<TAB>/path\"; with --json {\"class\": ..., \"path\": ...}), and exits\n"
        "0; any other text exits 1. Never creates a key: while D has none, no token\n"
        "is genuine.\n",
        stdout);
}

int run(const std::vector<std::string>& args, const QmkitGlobalOptions& options) {
    if (args.size() != 2 || args[0] != "verify") {
        return commandUsageError("token", "expected \"verify TOKEN\"");
    }
    auto grant = qm::verifyExtension(args[1]);
    if (!grant) {
        std::fprintf(stderr, "qmkit: token verify: %s\n", grant.error().text().c_str());
        return kQmkitDaemonError;
    }
    if (options.json) {
        std::fputs(replyAsJson(qm::Value(qm::Dictionary{{"class", qm::Value(grant->tokenClass)},
                                                        {"path", qm::Value(grant->path)}}))
                       .c_str(),
                   stdout);
    } else {
        std::printf("%s\t%s\n", grant->tokenClass.c_str(), grant->path.c_str());
    }
    return kQmkitOk;
}

const QmkitCommandRegistration registration({"token", "verify a sandbox extension token (offline)", run, help});

}  // namespace
