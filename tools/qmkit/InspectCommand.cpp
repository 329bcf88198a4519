// qmkit inspect BUNDLE [-i IDENTIFIER] [--sdk-dir DIR] [--json]: reads a
// plug-in bundle from disk and shows what the daemon would make of it,
// without asking the daemon.

#include <cstdio>
#include <optional>
#include <string>
#include <vector>

#include "Command.h"
#include "ReplyFormat.h"
#include "model/OfflinePlugIns.h"
#include "platform/value/Json.h"

namespace {

struct InspectOptions {
    std::string bundlePath;
    std::optional<std::string> identifier;
    std::vector<std::string> sdkDirectories;
    bool json = false;
};

void help() {
    std::fputs(
        "usage: qmkit inspect BUNDLE [-i IDENTIFIER] [--sdk-dir DIR]... [--json]\n"
        "\n"
        "Reads the plug-in bundle BUNDLE from disk, without the daemon, and does\n"
        "what the daemon would do with it: sets it up from its Info dictionary,\n"
        "merges the defaults of its SDK, fills the canonical values and validates\n"
        "it. Prints each plug-in's facts and its form, or why the daemon would\n"
        "ignore it.\n"
        "\n"
        "  -i IDENTIFIER   only the plug-in of that identifier (of a bundle\n"
        "                  holding several, a \"Multiple\" entry)\n"
        "  --sdk-dir DIR   look for SDKs (DIR/<SDK>.plist) in DIR before the SDK\n"
        "                  directories; may be repeated\n"
        "  --json          print the form as JSON (an array of forms when the\n"
        "                  bundle holds several plug-ins and no -i is given)\n"
        "\n"
        "The registration facts come from the disk: a fresh UUID, the Info file's\n"
        "modification time, the system volume from QM_SYSTEM_ROOTS and the\n"
        "containing application from the bundle's place in its PlugIns folder.\n"
        "\n"
        "exit status: 0 every plug-in is valid, 1 one is not (or the bundle cannot\n"
        "be read), 2 bad usage\n",
        stdout);
}

int usageError(const std::string& message) {
    std::fprintf(stderr, "qmkit inspect: %s\n", message.c_str());
    std::fputs("usage: qmkit inspect BUNDLE [-i IDENTIFIER] [--sdk-dir DIR]... [--json]\n", stderr);
    return kQmkitUsage;
}

// Nothing when the arguments are bad; the usage error is already printed.
std::optional<InspectOptions> parseArguments(const std::vector<std::string>& args, int& status) {
    InspectOptions options;
    std::optional<std::string> bundle;
    for (std::size_t i = 0; i < args.size(); ++i) {
        const std::string& arg = args[i];
        if (arg == "-i" || arg == "--sdk-dir") {
            if (i + 1 == args.size()) {
                status = usageError(arg + " needs a value");
                return std::nullopt;
            }
            const std::string& value = args[++i];
            if (arg == "-i") {
                options.identifier = value;
            } else {
                options.sdkDirectories.push_back(value);
            }
        } else if (arg == "--json") {
            options.json = true;
        } else if (arg.size() > 1 && arg[0] == '-') {
            status = usageError("unknown option \"" + arg + "\"");
            return std::nullopt;
        } else if (bundle) {
            status = usageError("only one BUNDLE, please");
            return std::nullopt;
        } else {
            bundle = arg;
        }
    }
    if (!bundle) {
        status = usageError("no BUNDLE given");
        return std::nullopt;
    }
    options.bundlePath = *bundle;
    return options;
}

std::string text(const qm::Value& value) {
    if (value.isNull()) {
        return "none";
    }
    const std::string* s = value.asString();
    return s ? *s : value.description();
}

void printFacts(const OfflinePlugIn& inspected) {
    const QMPlugInCore& plugIn = *inspected.plugIn;
    std::printf("plug-in %s\n", plugIn.identifier().value_or("(none)").c_str());
    std::printf("  uuid: %s\n", plugIn.uuid() ? plugIn.uuid()->text().c_str() : "none");
    std::printf("  path: %s\n", plugIn.path().value_or("none").c_str());
    std::printf("  containing application: %s\n", plugIn.containingPath().value_or("none").c_str());
    std::printf("  system volume: %s\n", plugIn.onSystemVolume() ? "yes" : "no");
    std::printf("  sdk: %s\n", text(plugIn.sdkSpec()).c_str());
    std::printf("  protocol: %s\n", text(plugIn.protocolSpec()).c_str());
    std::printf("  version: %s\n", text(plugIn.version()).c_str());
    std::printf("  hub protocol version: %u\n", plugIn.hubProtocolVersion());
    if (inspected.dataContainerPath) {
        std::printf("  data container: %s\n", inspected.dataContainerPath->c_str());
    } else if (plugIn.isData()) {
        std::printf("  data container: none (a data plug-in needs none)\n");
    } else {
        std::printf("  data container: none (the bundle names no executable)\n");
    }
    std::printf("  valid: %s\n", inspected.error ? "no" : "yes");
    std::printf("  form:\n");
    std::string form = replyAsText(qm::Value(plugIn.exportForm()));
    std::size_t start = 0;
    while (start < form.size()) {
        std::size_t end = form.find('\n', start);
        if (end == std::string::npos) {
            end = form.size();
        }
        std::printf("    %.*s\n", static_cast<int>(end - start), form.data() + start);
        start = end + 1;
    }
}

void printFailure(const OfflinePlugIn& inspected, const std::string& bundlePath) {
    const qm::Error& error = *inspected.error;
    std::string message = error.description ? *error.description : "the plug-in cannot be set up";
    std::fprintf(stderr, "qmkit: plug-in %s in %s: %s (code %lld)\n", inspected.identifier.value_or("(none)").c_str(),
                 bundlePath.c_str(), message.c_str(), static_cast<long long>(error.code));
}

int run(const std::vector<std::string>& args, const QmkitGlobalOptions& globalOptions) {
    int status = kQmkitOk;
    auto options = parseArguments(args, status);
    if (!options) {
        return status;
    }
    const bool json = options->json || globalOptions.json;

    OfflinePlugIns inspector{SdkRegistry(options->sdkDirectories)};
    auto plugIns = inspector.inspectBundle(options->bundlePath, options->identifier);
    if (!plugIns.ok()) {
        std::fprintf(stderr, "qmkit: %s (code %lld)\n", plugIns.error().text().c_str(),
                     static_cast<long long>(plugIns.error().code));
        return kQmkitDaemonError;
    }

    qm::Array forms;
    for (const OfflinePlugIn& inspected : *plugIns) {
        if (inspected.plugIn) {
            if (json) {
                forms.emplace_back(inspected.plugIn->exportForm());
            } else {
                printFacts(inspected);
            }
        }
        if (inspected.error) {
            printFailure(inspected, options->bundlePath);
            status = kQmkitDaemonError;
        }
    }
    if (json && !forms.empty()) {
        const qm::Value printed = plugIns->size() == 1 ? forms.front() : qm::Value(forms);
        std::printf("%s\n", qm::json::write(printed, true).c_str());
    }
    return status;
}

const QmkitCommandRegistration registration{{
    "inspect",
    "show what the daemon would make of a plug-in bundle (offline)",
    run,
    help,
}};

}  // namespace
