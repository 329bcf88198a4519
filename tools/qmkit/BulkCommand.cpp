// qmkit bulk [--flags N]: the "bulk" request.

#include <cstdint>
#include <cstdio>
#include <string>
#include <vector>

#include "Command.h"
#include "DaemonSession.h"
#include "NumberOptions.h"

namespace {

void help() {
    std::fputs(
        "usage: qmkit [-S service] [--json] [--timeout SECONDS] bulk [--flags N]\n"
        "\n"
        "Sends the \"bulk\" request with the given flags (decimal or 0x-hex, at most\n"
        "64 bits, default 0). Prints nothing on success (\"{}\" with --json).\n",
        stdout);
}

int run(const std::vector<std::string>& args, const QmkitGlobalOptions& options) {
    std::uint64_t flags = 0;
    for (std::size_t i = 0; i < args.size(); ++i) {
        if (args[i] != "--flags" || i + 1 == args.size()) {
            std::fprintf(stderr, "qmkit: bulk: unexpected argument \"%s\"\n", args[i].c_str());
            std::fputs("qmkit: see 'qmkit bulk --help'\n", stderr);
            return kQmkitUsage;
        }
        auto parsed = parseUnsignedOption("--flags", args[++i]);
        if (!parsed) {
            std::fprintf(stderr, "qmkit: bulk: %s\n", parsed.error().c_str());
            return kQmkitUsage;
        }
        flags = *parsed;
    }
    return DaemonSession(options).run(
        [flags](QMDaemonClient& client, QMDaemonClient::ReplyHandler handler) {
            client.bulkPlugins(flags, std::move(handler));
        },
        [](const qm::Value&) {});
}

const QmkitCommandRegistration registration({"bulk", "send the \"bulk\" request", run, help});

}  // namespace
