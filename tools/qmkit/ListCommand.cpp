// qmkit list [--point POINT]: every plug-in the daemon has registered, and
// every bundle its catalog refused, with whether each is valid.

#include <cstdio>
#include <optional>
#include <string>
#include <vector>

#include "Command.h"
#include "DaemonSession.h"
#include "PlugInListing.h"
#include "ReplyFormat.h"

namespace {

void help() {
    std::fputs(
        "usage: qmkit [-S service] [--json] [--timeout SECONDS] list [--point POINT]\n"
        "\n"
        "Lists every plug-in the daemon has registered, in path, identifier and\n"
        "UUID order, one per line, with tab-separated fields:\n"
        "\n"
        "  UUID  IDENTIFIER  VERSION  EXTENSION-POINT  PATH  valid|invalid: REASON\n"
        "\n"
        "An empty field prints as \"-\". Bundles that the daemon found in a plug-ins\n"
        "folder and did not register are listed too, with \"-\" for their UUID and\n"
        "why. With --json, prints the entries as a JSON array of {\"uuid\" (absent\n"
        "for a refused bundle), \"identifier\", \"path\", \"point\", \"version\",\n"
        "\"valid\", \"reason\" (when not valid), \"election\" (when the plug-in has\n"
        "one)}.\n"
        "\n"
        "  --point POINT   only the plug-ins of the extension point POINT (refused\n"
        "                  bundles have none, so they are left out)\n",
        stdout);
}

std::string field(const qm::Value& entry, const char* key) {
    const qm::Value* value = entry.get(key);
    if (value && value->asUuid()) {
        return value->asUuid()->text();
    }
    const std::string* text = value ? value->asString() : nullptr;
    return text && !text->empty() ? *text : "-";
}

void printEntries(const qm::Array& entries) {
    for (const qm::Value& entry : entries) {
        const qm::Value* valid = entry.get("valid");
        const std::string verdict =
            valid && valid->asBool().value_or(false) ? "valid" : "invalid: " + field(entry, "reason");
        std::printf("%s\t%s\t%s\t%s\t%s\t%s\n", field(entry, "uuid").c_str(), field(entry, "identifier").c_str(),
                    field(entry, "version").c_str(), field(entry, "point").c_str(), field(entry, "path").c_str(),
                    verdict.c_str());
    }
}

int run(const std::vector<std::string>& args, const QmkitGlobalOptions& options) {
    std::optional<std::string> point;
    for (std::size_t i = 0; i < args.size(); ++i) {
        if (args[i] != "--point") {
            return commandUsageError("list", "unexpected argument \"" + args[i] + "\"");
        }
        if (i + 1 == args.size()) {
            return commandUsageError("list", "--point needs an extension point");
        }
        point = args[++i];
    }
    DaemonSession session(options);
    auto entries = listAllPlugIns(session, point);
    if (!entries) {
        return entries.error();
    }
    if (options.json) {
        std::fputs(replyAsJson(qm::Value(std::move(entries).value())).c_str(), stdout);
    } else {
        printEntries(*entries);
    }
    return kQmkitOk;
}

const QmkitCommandRegistration registration({"list", "list the registered plug-ins, valid or not", run, help});

}  // namespace
