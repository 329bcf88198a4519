// qmkit inspect BUNDLE [-i IDENTIFIER] [--sdk-dir DIR]... [-v] [--provenance]:
// reads a plug-in bundle from disk and shows what the daemon would make of
// it, without asking the daemon: for plug-in developers.

#include <cstdio>
#include <optional>
#include <string>
#include <vector>

#include "Command.h"
#include "ReplyFormat.h"
#include "model/InfoProvenance.h"
#include "model/OfflinePlugIns.h"
#include "model/PlugInKeys.h"
#include "platform/value/Json.h"

namespace {

constexpr const char* kUsage =
    "usage: qmkit inspect BUNDLE [-i IDENTIFIER] [--sdk-dir DIR]... [-v] [--provenance] [--json]\n";

struct InspectOptions {
    std::string bundlePath;
    std::optional<std::string> identifier;
    std::vector<std::string> sdkDirectories;
    bool json = false;
    bool verbose = false;
    bool provenance = false;
};

void help() {
    std::fputs(kUsage, stdout);
    std::fputs(
        "\n"
        "Reads the plug-in bundle BUNDLE from disk, without the daemon, and does\n"
        "what the daemon would do with it: sets it up from its Info dictionary,\n"
        "merges the defaults of its SDK, fills the canonical values and validates\n"
        "it. Prints a summary of each plug-in: identifier, version, extension\n"
        "point, the SDK and the file it came from (or every place looked), the\n"
        "data container, and whether the daemon would use it or exactly why not.\n"
        "A path that is no plug-in bundle is explained: no such path, not a\n"
        "directory, no Info.plist, an unreadable Info dictionary, an application\n"
        "rather than a plug-in (with its plug-ins), a bundle declaring none.\n"
        "\n"
        "  -i IDENTIFIER   only the plug-in of that identifier; an identifier the\n"
        "                  bundle lacks is refused with the ones it has\n"
        "  --sdk-dir DIR   look for SDKs (DIR/<SDK>.plist) in DIR before the SDK\n"
        "                  directories; may be repeated\n"
        "  -v              also print the whole plug-in form\n"
        "  --provenance    print every value of the merged Info dictionary with\n"
        "                  where it came from: \"bundle\", the SDK file, \"bundle +\n"
        "                  SDK\" (a merged \"Shared\" set) or \"canonical\"\n"
        "  --json          print an object per plug-in (an array when the bundle\n"
        "                  holds several and no -i is given): \"identifier\",\n"
        "                  \"path\", \"version\", \"point\", \"sdk\", \"dataContainer\",\n"
        "                  \"valid\", \"error\" {\"code\", \"message\"} when not valid,\n"
        "                  \"form\" with -v, \"provenance\" with --provenance; a path\n"
        "                  that is no plug-in bundle prints {\"path\", \"valid\": false,\n"
        "                  \"error\"}\n"
        "\n"
        "The registration facts come from the disk: a fresh UUID, the Info file's\n"
        "modification time, the system volume from QM_SYSTEM_ROOTS and the\n"
        "containing application from the bundle's place in its PlugIns folder.\n"
        "\n"
        "exit status: 0 every plug-in is valid, 1 one is not (or the path is no\n"
        "plug-in bundle), 2 bad usage\n",
        stdout);
}

int usageError(const std::string& message) {
    std::fprintf(stderr, "qmkit inspect: %s\n", message.c_str());
    std::fputs(kUsage, stderr);
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
        } else if (arg == "-v") {
            options.verbose = true;
        } else if (arg == "--provenance") {
            options.provenance = true;
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
    if (s) {
        return *s;
    }
    return value.isArray() || value.isDictionary() ? qm::json::write(value, false) : value.description();
}

qm::Value pointOf(const QMPlugInCore& plugIn) {
    const qm::Value attributes = plugIn.attributes();
    const qm::Value* point = attributes.get(qmkey::kPointName);
    return point ? *point : qm::Value();
}

std::string messageOf(const qm::Error& error) {
    return error.description ? *error.description : "the plug-in cannot be set up";
}

const char* sourceName(InfoOrigin::Source source) {
    switch (source) {
        case InfoOrigin::Source::bundle:
            return "bundle";
        case InfoOrigin::Source::sdk:
            return "sdk";
        case InfoOrigin::Source::bundleAndSdk:
            return "bundle + sdk";
        case InfoOrigin::Source::canonical:
            return "canonical";
    }
    return "canonical";
}

// Where a value came from, for people and for scripts: the SDK's file
// rather than the word.
std::string sourceText(InfoOrigin::Source source, const OfflinePlugIn& inspected) {
    const std::string file = inspected.sdk.file.value_or("sdk");
    switch (source) {
        case InfoOrigin::Source::sdk:
            return file;
        case InfoOrigin::Source::bundleAndSdk:
            return "bundle + " + file;
        default:
            return sourceName(source);
    }
}

std::vector<InfoOrigin> provenanceOf(const OfflinePlugIn& inspected) {
    return infoProvenance(inspected.plugIn->bundleInfoDictionary(), inspected.infoBeforeSdk, inspected.sdk.dictionary);
}

std::string keyPathText(const std::vector<std::string>& keyPath) {
    std::string joined;
    for (const std::string& key : keyPath) {
        joined += (joined.empty() ? "" : "/") + key;
    }
    return joined;
}

std::string sdkText(const OfflinePlugIn& inspected) {
    if (!inspected.sdkName) {
        return "none named";
    }
    if (inspected.sdk.file) {
        return *inspected.sdkName + " (" + *inspected.sdk.file + ")";
    }
    std::string looked;
    for (const std::string& place : inspected.sdk.placesLooked) {
        looked += (looked.empty() ? "" : ", ") + place;
    }
    return *inspected.sdkName + " not found; looked in " + (looked.empty() ? "no place (not a file name)" : looked);
}

std::string dataContainerText(const OfflinePlugIn& inspected) {
    if (inspected.dataContainerPath) {
        return *inspected.dataContainerPath;
    }
    return inspected.plugIn->isData() ? "none (a data plug-in needs none)" : "none (the bundle names no executable)";
}

void printIndented(const std::string& block, const char* indent) {
    std::size_t start = 0;
    while (start < block.size()) {
        std::size_t end = block.find('\n', start);
        end = end == std::string::npos ? block.size() : end;
        std::printf("%s%.*s\n", indent, static_cast<int>(end - start), block.data() + start);
        start = end + 1;
    }
}

void printSummary(const OfflinePlugIn& inspected, const InspectOptions& options) {
    const QMPlugInCore& plugIn = *inspected.plugIn;
    std::printf("plug-in %s\n", plugIn.identifier().value_or("(none)").c_str());
    std::printf("  path: %s\n", plugIn.path().value_or("none").c_str());
    std::printf("  version: %s\n", text(plugIn.version()).c_str());
    std::printf("  extension point: %s\n", text(pointOf(plugIn)).c_str());
    std::printf("  sdk: %s\n", sdkText(inspected).c_str());
    std::printf("  protocol: %s\n", text(plugIn.protocolSpec()).c_str());
    std::printf("  containing application: %s\n", plugIn.containingPath().value_or("none").c_str());
    std::printf("  system volume: %s\n", plugIn.onSystemVolume() ? "yes" : "no");
    std::printf("  hub protocol version: %u\n", plugIn.hubProtocolVersion());
    std::printf("  data container: %s\n", dataContainerText(inspected).c_str());
    if (inspected.error) {
        std::printf("  valid: no: %s (code %lld)\n", messageOf(*inspected.error).c_str(),
                    static_cast<long long>(inspected.error->code));
    } else {
        std::printf("  valid: yes\n");
    }
    if (options.provenance) {
        std::printf("  provenance:\n");
        for (const InfoOrigin& origin : provenanceOf(inspected)) {
            std::printf("    %s = %s  [%s]\n", keyPathText(origin.keyPath).c_str(), text(origin.value).c_str(),
                        sourceText(origin.source, inspected).c_str());
        }
    }
    if (options.verbose) {
        std::printf("  form:\n");
        printIndented(replyAsText(qm::Value(plugIn.exportForm())), "    ");
    }
}

qm::Value errorAsJson(const qm::Error& error) {
    return qm::Value(qm::Dictionary{{"code", qm::Value(static_cast<std::int64_t>(error.code))},
                                    {"message", qm::Value(messageOf(error))}});
}

qm::Value summaryAsJson(const OfflinePlugIn& inspected, const InspectOptions& options) {
    qm::Dictionary summary{{"valid", qm::Value(!inspected.error)}};
    if (inspected.identifier) {
        summary.set("identifier", qm::Value(*inspected.identifier));
    }
    if (inspected.error) {
        summary.set("error", errorAsJson(*inspected.error));
    }
    if (!inspected.plugIn) {
        return qm::Value(std::move(summary));
    }
    const QMPlugInCore& plugIn = *inspected.plugIn;
    summary.set("path", qm::Value(plugIn.path().value_or("")));
    summary.set("version", plugIn.version());
    summary.set("point", pointOf(plugIn));
    if (inspected.sdkName) {
        qm::Array looked;
        for (const std::string& place : inspected.sdk.placesLooked) {
            looked.emplace_back(place);
        }
        qm::Dictionary sdk{{"name", qm::Value(*inspected.sdkName)}, {"looked", qm::Value(std::move(looked))}};
        if (inspected.sdk.file) {
            sdk.set("file", qm::Value(*inspected.sdk.file));
        }
        summary.set("sdk", qm::Value(std::move(sdk)));
    }
    summary.set("dataContainer",
                inspected.dataContainerPath ? qm::Value(*inspected.dataContainerPath) : qm::Value());
    if (options.verbose) {
        summary.set("form", qm::Value(plugIn.exportForm()));
    }
    if (options.provenance) {
        qm::Array origins;
        for (const InfoOrigin& origin : provenanceOf(inspected)) {
            qm::Array keyPath(origin.keyPath.begin(), origin.keyPath.end());
            qm::Dictionary entry{{"key", qm::Value(std::move(keyPath))},
                                 {"value", origin.value},
                                 {"source", qm::Value(sourceName(origin.source))}};
            if (origin.source == InfoOrigin::Source::sdk || origin.source == InfoOrigin::Source::bundleAndSdk) {
                entry.set("file", qm::Value(inspected.sdk.file.value_or("")));
            }
            origins.emplace_back(std::move(entry));
        }
        summary.set("provenance", qm::Value(std::move(origins)));
    }
    return qm::Value(std::move(summary));
}

int run(const std::vector<std::string>& args, const QmkitGlobalOptions& globalOptions) {
    int status = kQmkitOk;
    auto options = parseArguments(args, status);
    if (!options) {
        return status;
    }
    options->json = options->json || globalOptions.json;

    OfflinePlugIns inspector{SdkRegistry(options->sdkDirectories)};
    auto plugIns = inspector.inspectBundle(options->bundlePath, options->identifier);
    if (!plugIns.ok()) {
        if (options->json) {
            const qm::Value failure(qm::Dictionary{{"path", qm::Value(options->bundlePath)},
                                                   {"valid", qm::Value(false)},
                                                   {"error", errorAsJson(plugIns.error())}});
            std::printf("%s\n", qm::json::write(failure, true).c_str());
        }
        std::fprintf(stderr, "qmkit: %s (code %lld)\n", plugIns.error().text().c_str(),
                     static_cast<long long>(plugIns.error().code));
        return kQmkitDaemonError;
    }

    qm::Array summaries;
    for (const OfflinePlugIn& inspected : *plugIns) {
        if (options->json) {
            summaries.push_back(summaryAsJson(inspected, *options));
        } else if (inspected.plugIn) {
            printSummary(inspected, *options);
        }
        if (inspected.error) {
            std::fprintf(stderr, "qmkit: plug-in %s in %s: %s (code %lld)\n",
                         inspected.identifier.value_or("(none)").c_str(), options->bundlePath.c_str(),
                         messageOf(*inspected.error).c_str(), static_cast<long long>(inspected.error->code));
            status = kQmkitDaemonError;
        }
    }
    if (options->json) {
        const qm::Value printed = summaries.size() == 1 ? summaries.front() : qm::Value(summaries);
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
