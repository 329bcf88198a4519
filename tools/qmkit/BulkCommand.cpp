// qmkit bulk [--flags N]: the "bulk" request.

#include <charconv>
#include <cstdint>
#include <cstdio>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "Command.h"
#include "DaemonSession.h"

namespace {

// Decimal, or hexadecimal after "0x"; the whole text must be a number.
std::optional<std::uint64_t> parseFlags(std::string_view text) {
    int base = 10;
    if (text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X')) {
        text.remove_prefix(2);
        base = 16;
    }
    std::uint64_t value = 0;
    auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), value, base);
    if (text.empty() || error != std::errc() || end != text.data() + text.size()) {
        return std::nullopt;
    }
    return value;
}

void help() {
    std::fputs(
        "usage: qmkit [-S service] [--json] bulk [--flags N]\n"
        "\n"
        "Sends the \"bulk\" request with the given flags (decimal or 0x-hex, default 0).\n"
        "Prints nothing on success (\"{}\" with --json).\n",
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
        auto parsed = parseFlags(args[++i]);
        if (!parsed) {
            std::fprintf(stderr, "qmkit: bulk: flags must be a number, not \"%s\"\n", args[i].c_str());
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
