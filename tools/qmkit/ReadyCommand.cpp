// qmkit ready UUID...: readies plug-ins for this process to launch.

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <string>
#include <vector>

#include "Command.h"
#include "DaemonSession.h"
#include "Table.h"
#include "UuidArguments.h"
#include "platform/env/Environment.h"
#include "platform/file/FolderEntries.h"
#include "platform/launcher/HostFolders.h"

namespace {

constexpr std::string_view kRegistrationSuffix = ".plist";

void help() {
    std::fputs(
        "usage: qmkit [-S service] [--json] [--timeout SECONDS] ready UUID...\n"
        "\n"
        "Readies the plug-ins of the given UUIDs for launch by this process. The\n"
        "daemon answers with nothing but success; qmkit then prints the service\n"
        "registrations it finds for itself, D/services/<its pid>/<bundle id>.plist\n"
        "(D the runtime directory: QM_DUCT_DIR, else $XDG_RUNTIME_DIR/ovaro, else\n"
        "/tmp/ovaro-<uid>). A data plug-in needs none. With --json:\n"
        "{\"registrations\": [{\"bundle\": ..., \"file\": ...}, ...]}.\n"
        "\n"
        "The registrations belong to this qmkit process and are removed once it\n"
        "has exited, on the daemon's next \"ready\".\n",
        stdout);
}

// The registration files of this process, sorted by bundle identifier.
qm::Result<Table> registrations() {
    const std::string folder = qm::hostFolder(qm::ductRuntimeDirectory(), ::getpid());
    Table table{{{"bundle", "BUNDLE"}, {"file", "REGISTRATION"}}, {}};
    auto names = qm::folderEntryNames(folder);
    if (!names) {
        if (names.error().domain == qm::kPosixErrorDomain && names.error().code == ENOENT) {
            return table;
        }
        return names.error();
    }
    std::sort(names->begin(), names->end());
    for (const std::string& name : *names) {
        if (name.front() == '.') {
            continue;  // bookkeeping and temporaries
        }
        std::string bundle = name;
        if (bundle.size() > kRegistrationSuffix.size() && bundle.ends_with(kRegistrationSuffix)) {
            bundle.resize(bundle.size() - kRegistrationSuffix.size());
        }
        table.rows.push_back({bundle, folder + "/" + name});
    }
    return table;
}

int run(const std::vector<std::string>& args, const QmkitGlobalOptions& options) {
    auto uuids = parseUuidArguments(args, "UUID");
    if (!uuids) {
        return commandUsageError("ready", uuids.error());
    }
    auto reply = DaemonSession(options).ask([&uuids](QMDaemonClient& client, QMDaemonClient::ReplyHandler handler) {
        client.readyPlugIns(*uuids, 0, std::move(handler));
    });
    if (!reply) {
        return reply.error();
    }
    auto table = registrations();
    if (!table) {
        std::fprintf(stderr, "qmkit: ready: cannot list the registrations: %s\n", table.error().text().c_str());
        return kQmkitDaemonError;
    }
    std::fputs((options.json ? table->json("registrations") : table->text()).c_str(), stdout);
    return kQmkitOk;
}

const QmkitCommandRegistration registration({"ready", "ready plug-ins for launch and show the registrations", run,
                                             help});

}  // namespace
