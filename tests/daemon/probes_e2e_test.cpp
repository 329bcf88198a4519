// The daemon's trace probes, seen by a real tracer: qmd started under
// bpftrace, one request of each kind, and every probe counted with its
// arguments. Skipped, saying why, where bpftrace cannot trace here.

#include <gtest/gtest.h>

#include <signal.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <sstream>

#include "support/DaemonProcess.h"
#include "support/Eventually.h"
#include "support/FramePeer.h"

namespace {

using qm::Array;
using qm::Dictionary;
using qm::Value;
namespace fs = std::filesystem;

constexpr const char* kBpftrace = "/usr/bin/bpftrace";

// Why bpftrace cannot trace on this machine; nothing when it can.
std::optional<std::string> whyNoTracer() {
    if (!fs::exists(kBpftrace)) {
        return std::string("no ") + kBpftrace;
    }
    auto tried = qmtest::runProgram({kBpftrace, "-e", "BEGIN { exit(); }"});
    if (tried.exitStatus != 0) {
        return "bpftrace cannot run here: " + tried.err;
    }
    return std::nullopt;
}

// The children of a process, from every one of its threads.
std::vector<pid_t> childrenOf(pid_t pid) {
    std::vector<pid_t> children;
    for (const auto& task : fs::directory_iterator("/proc/" + std::to_string(pid) + "/task")) {
        std::ifstream listed(task.path() / "children");
        for (pid_t child; listed >> child;) {
            children.push_back(child);
        }
    }
    return children;
}

TEST(Probes, EachFiresWhereItsRequestIsServedWithItsArguments) {
    if (auto why = whyNoTracer()) {
        GTEST_SKIP() << *why;
    }
    qmtest::TempDir dir;
    fs::copy(fs::path(QM_SOURCE_DIR) / "examples/Applications", dir.file("system"), fs::copy_options::recursive);
    fs::create_directories(dir.file("extra"));
    fs::copy(dir.file("system/Notes.app/PlugIns/Spelling.bundle"), dir.file("extra/Spelling.bundle"),
             fs::copy_options::recursive);
    // An annotations file of another version: the store's load fails.
    fs::create_directories(dir.file("state/ovaro.quamber"));
    qmtest::writeFile(dir.file("state/ovaro.quamber/Annotations"),
                      "<plist version=\"1.0\"><dict><key>version</key><integer>3</integer></dict></plist>");

    const std::string qmd = fs::canonical(QMD_BINARY_PATH).string();
    const std::string traced = dir.file("trace.txt");
    const std::string script = "usdt:" + qmd + ":qmd:* { @[probe] = count(); }\n" +
                               "usdt:" + qmd + ":qmd:plugin__add, usdt:" + qmd +
                               ":qmd:plugin__ready { printf(\"%s %s\\n\", probe, str(arg0)); }\n" + "usdt:" + qmd +
                               ":qmd:plugin__remove, usdt:" + qmd +
                               ":qmd:db__load { printf(\"%s %s %d\\n\", probe, str(arg0), arg1); }\n" +
                               // The README's latency and holds one-liners attach to these two functions;
                               // function probes fire in every process of the binary, hence cpid.
                               "uretprobe:" + qmd + ":_ZN11Transaction8dispatchEv /pid == cpid/ { @dispatched = count(); }\n" +
                               "uretprobe:" + qmd + ":_ZN8HoldList7addHoldESt10shared_ptrIK13QMDPlugInHoldE " +
                               "/pid == cpid && retval & 1/ { @holds_taken = count(); }\n";
    qmtest::DaemonProcess daemon({}, {{"QM_SYSTEM_ROOTS", dir.file("system")},
                                      {"QM_SDK_PATH", std::string(QM_SOURCE_DIR) + "/examples/SDKs"},
                                      {"XDG_STATE_HOME", dir.file("state")}},
                                 "qmtest.qmd", {.launcher = {kBpftrace, "-o", traced, "-e", script, "-c"}, .passedSockets = {}});
    qmtest::FramePeer client(daemon.socketPath());
    auto send = [&](Dictionary request, std::optional<std::uint64_t> error = std::nullopt) {
        Value reply = client.ask(std::move(request));
        EXPECT_EQ(qmtest::errorCode(reply), error) << reply.description();
        return reply;
    };
    const std::string extra = fs::canonical(dir.file("extra/Spelling.bundle")).string();
    send({{"request", Value("bulk")}});
    send({{"request", Value("add")}, {"paths", Value(Array{Value(extra)})}});
    send({{"request", Value("remove")}, {"paths", Value(Array{Value(extra)})}});
    send({{"request", Value("remove")}, {"paths", Value(Array{Value(dir.file("nowhere"))})}}, 9);
    send({{"request", Value("match")}, {"rules", Value(Dictionary{})}});
    const Value listed = send({{"request", Value("list")}, {"point", Value("ovaro.share-services")}});
    ASSERT_TRUE(listed.get("plugins") && listed.get("plugins")->asArray()->size() == 1) << listed.description();
    const Value share = *listed.get("plugins")->asArray()->front().get("uuid");
    send({{"request", Value("annotate")}, {"uuids", Value(Array{share})},
          {"annotations", Value(Dictionary{{"election", Value(1)}})}});
    send({{"request", Value("ready")}, {"uuids", Value(Array{share})}});
    send({{"request", Value("access")}, {"uuids", Value(Array{share})}});
    send({{"request", Value("lock")}, {"paths", Value(Array{Value(dir.file("system/Notes.app"))})},
          {"flags", Value(std::uint64_t{1})}});

    // The tracer writes its counts once the daemon is gone.
    const std::vector<pid_t> traced_daemon = childrenOf(daemon.pid());
    ASSERT_EQ(traced_daemon.size(), 1u);
    ::kill(traced_daemon.front(), SIGTERM);
    ASSERT_TRUE(daemon.waitForExit(std::chrono::seconds(20)));
    const std::string trace = qmtest::readFile(traced);

    // Lines of the count map: "@[usdt:<binary>:qmd:<probe>]: <count>".
    std::map<std::string, int> counts;
    std::istringstream traceLines(trace);
    for (std::string line; std::getline(traceLines, line);) {
        const std::size_t name = line.rfind(":qmd:");
        const std::size_t end = line.find("]: ");
        if (line.starts_with("@[usdt:") && name != std::string::npos && end != std::string::npos && name < end) {
            counts[line.substr(name + 5, end - name - 5)] = std::stoi(line.substr(end + 3));
        }
    }
    const std::map<std::string, int> expected{
        {"req__add", 1},      {"req__remove", 2},   {"req__bulk", 1},       {"req__holddown", 1},
        {"req__match", 1},    {"req__ready", 1},    {"req__access", 1},     {"req__annotate", 1},
        {"plugin__add", 1},   {"plugin__remove", 2}, {"plugin__ready", 1},  {"db__load", 1},
    };
    EXPECT_EQ(counts, expected) << trace;
    EXPECT_NE(trace.find("@dispatched: 10\n"), std::string::npos) << trace;
    EXPECT_NE(trace.find("@holds_taken: 1\n"), std::string::npos) << trace;
    const std::string lines[] = {
        ":qmd:plugin__add " + extra + "\n",
        ":qmd:plugin__remove " + extra + " 1\n",
        ":qmd:plugin__remove " + dir.file("nowhere") + " 0\n",
        ":qmd:plugin__ready " + share.asUuid()->text() + "\n",
        ":qmd:db__load Quamber 7\n",
    };
    for (const std::string& line : lines) {
        EXPECT_NE(trace.find(line), std::string::npos) << line << " in\n" << trace;
    }
}

}  // namespace
