#include "Bench.h"

#include <sched.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <memory>
#include <map>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "ChildProcess.h"
#include "EchoServer.h"
#include "LoadRun.h"
#include "RoundTripClient.h"
#include "platform/duct/CborCodec.h"
#include "platform/duct/Frame.h"

namespace {

constexpr const char* kServiceName = "qmd.bench";

struct BenchRequest {
    std::string label;
    qm::Value message;
    // True when qmd's reply is the one this path must produce.
    std::function<bool(const qm::Value& reply)> replyIsExpected;
    // Sets the daemon up for this request; what it returns lives while it is measured.
    std::function<std::shared_ptr<void>(const std::string& qmdPath)> prepare;
};

// Heap allocations qmd makes per request, all threads included.
struct AllocationRow {
    std::string request;
    double perRequest = 0;
};

struct Row {
    std::string request;
    int clients = 0;
    bool pinned = false;
    std::size_t requestBytes = 0;
    std::size_t replyBytes = 0;
    LoadResult qmd;
    LoadResult echo;
};

bool isUnrecognized(const qm::Value& reply) {
    const qm::Value* code = reply.get("errorcode");
    const qm::Value* text = reply.get("error");
    return code && code->asUnsigned() == 4u && text && text->asString() && *text->asString() == "unrecognized request";
}

bool isEmptyDictionary(const qm::Value& reply) {
    return reply.asDictionary() && reply.asDictionary()->empty();
}

void writeText(const std::string& path, const std::string& text) {
    std::FILE* file = std::fopen(path.c_str(), "w");
    if (file != nullptr) {
        std::fputs(text.c_str(), file);
        std::fclose(file);
    }
}

constexpr int kMatchedPlugIns = 10;

bool holdsTheMatchedForms(const qm::Value& reply) {
    const qm::Value* packed = reply.get("matches");
    const qm::Value* forms = packed ? packed->packedContent() : nullptr;
    return forms && forms->asArray() && forms->asArray()->size() == kMatchedPlugIns;
}

// An application whose plug-ins "match" answers: small, valid, alike.
void writeMatchedPlugIns(const std::string& root) {
    std::string application = root + "/Bench.app";
    std::filesystem::create_directories(application + "/PlugIns");
    writeText(application + "/Info.plist",
              "<plist version=\"1.0\"><dict><key>MRBundleIdentifier</key><string>bench.app</string></dict></plist>");
    for (int i = 0; i < kMatchedPlugIns; ++i) {
        std::string bundle = application + "/PlugIns/P" + std::to_string(i) + ".bundle";
        std::filesystem::create_directories(bundle);
        writeText(bundle + "/Info.plist",
                  "<plist version=\"1.0\"><dict><key>MRBundleIdentifier</key><string>bench.plugin." +
                      std::to_string(i) +
                      "</string><key>MRBundleExecutable</key><string>P</string><key>MRBundleVersion</key>"
                      "<string>1.0</string><key>VTExtension</key><dict><key>VTExtensionAttributes</key><dict>"
                      "<key>VTExtensionPointName</key><string>bench.point</string></dict>"
                      "<key>VTExtensionProtocol</key><string>BenchProtocol</string></dict></dict></plist>");
        writeText(bundle + "/P", "#!/bin/sh\n");
    }
    // One plug-in the rules do not select, for holds that must not slow discovery.
    std::string other = application + "/PlugIns/Other.bundle";
    std::filesystem::create_directories(other);
    writeText(other + "/Info.plist",
              "<plist version=\"1.0\"><dict><key>MRBundleIdentifier</key><string>bench.other</string>"
              "<key>MRBundleExecutable</key><string>P</string><key>VTExtension</key><dict>"
              "<key>VTExtensionAttributes</key><dict><key>VTExtensionPointName</key><string>bench.other</string>"
              "</dict><key>VTExtensionProtocol</key><string>BenchProtocol</string></dict></dict></plist>");
    writeText(other + "/P", "#!/bin/sh\n");
}

constexpr int kHolds = 100;

qm::Value request(std::initializer_list<qm::Dictionary::Entry> entries) {
    qm::Dictionary message(entries);
    message.set("version", qm::Value(std::uint64_t{3}));
    return qm::Value(std::move(message));
}

std::optional<qm::Value> roundTripValue(RoundTripClient& client, const qm::Value& message) {
    qm::Bytes frame = *qm::duct::encodeFrame(qm::duct::FrameKind::message, 1, message);
    const qm::Bytes* payload = client.roundTrip(frame);
    auto reply = payload ? qm::cbor::decode(*payload) : qm::Result<qm::Value>(qm::Error{});
    return reply ? std::optional<qm::Value>(*reply) : std::nullopt;
}

// The UUIDs of the matched plug-ins, from qmd itself.
std::vector<qm::Value> matchedUuids(const std::string& qmdPath) {
    std::vector<qm::Value> uuids;
    auto client = RoundTripClient::connect(qmdPath);
    auto reply = client ? roundTripValue(*client, request({{"request", "match"},
                                                             {"rules", qm::Value(qm::Dictionary{{"VTExtensionPointName", "bench.point"}})}}))
                        : std::nullopt;
    const qm::Value* packed = reply ? reply->get("matches") : nullptr;
    const qm::Value* forms = packed ? packed->packedContent() : nullptr;
    for (const qm::Value& form : forms && forms->asArray() ? *forms->asArray() : qm::Array{}) {
        if (auto uuid = qm::Uuid::parse(*form.get("uuid")->asString())) {
            uuids.emplace_back(*uuid);
        }
    }
    return uuids;
}

// A connection that keeps kHolds holds on the plug-in no rule selects.
std::shared_ptr<void> holdOther(const std::string& qmdPath, const std::string& otherPath) {
    auto client = RoundTripClient::connect(qmdPath);
    if (!client) {
        return nullptr;
    }
    auto holder = std::make_shared<RoundTripClient>(std::move(*client));
    for (int i = 0; i < kHolds; ++i) {
        auto reply = roundTripValue(*holder, request({{"request", "lock"}, {"flags", std::uint64_t{2}},
                                                      {"paths", qm::Value(qm::Array{qm::Value(otherPath)})}}));
        if (!reply || !reply->get("uuids")) {
            return nullptr;
        }
    }
    return holder;
}

std::vector<BenchRequest> benchRequests(const std::string& qmdPath, const std::string& scratch) {
    std::vector<qm::Value> uuids = matchedUuids(qmdPath);
    auto granted = [](std::size_t count) {
        return [count](const qm::Value& reply) {
            const qm::Value* tokens = reply.get("extensions");
            return tokens && tokens->asArray() && tokens->asArray()->size() == count;
        };
    };
    auto first = [&](std::size_t count) {
        return qm::Value(qm::Array(uuids.begin(), uuids.begin() + static_cast<std::ptrdiff_t>(std::min(count, uuids.size()))));
    };
    qm::Value match = request({{"request", "match"},
                               {"rules", qm::Value(qm::Dictionary{{"VTExtensionPointName", "bench.point"}})}});
    std::string other = scratch + "/roots/Bench.app/PlugIns/Other.bundle";
    return {
        {"envelope", request({{"request", "x-unknown"}}), isUnrecognized, {}},
        {"bulk", request({{"request", "bulk"}, {"flags", std::uint64_t{0}}}), isEmptyDictionary, {}},
        {"match", match, holdsTheMatchedForms, {}},
        {"match+holds", match, holdsTheMatchedForms,
         [other](const std::string& path) { return holdOther(path, other); }},
        {"access 1", request({{"request", "access"}, {"uuids", first(1)}}), granted(1), {}},
        {"access 10", request({{"request", "access"}, {"uuids", first(10)}}), granted(10), {}},
        {"ready 1", request({{"request", "ready"}, {"uuids", first(1)}}), isEmptyDictionary, {}},
        {"ready 10", request({{"request", "ready"}, {"uuids", first(10)}}), isEmptyDictionary, {}},
    };
}

// Threads and children created after this inherit the mask.
bool setAffinity(const cpu_set_t& mask) {
    return ::sched_setaffinity(0, sizeof mask, &mask) == 0;
}

bool waitForSocket(const std::string& path, ChildProcess& server) {
    for (int i = 0; i < 1000; ++i) {
        if (RoundTripClient::connect(path)) {
            return true;
        }
        if (!server.running()) {
            return false;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
}

ChildProcess startDaemon(const std::string& scratch, std::map<std::string, std::string> extraEnvironment = {}) {
    std::map<std::string, std::string> environment = {
        {"PATH", "/usr/bin:/bin"},
        {"HOME", scratch},
        {"QM_DUCT_DIR", scratch + "/duct"},
        {"XDG_DATA_HOME", scratch + "/data"},
        {"XDG_CONFIG_HOME", scratch + "/config"},
        {"XDG_STATE_HOME", scratch + "/state"},
        {"QM_SYSTEM_ROOTS", scratch + "/roots"},
        {"QM_SDK_PATH", scratch + "/sdks"},
    };
    environment.merge(extraEnvironment);
    return ChildProcess::exec({QMD_BINARY_PATH, "-S", kServiceName}, environment, scratch + "/qmd.log");
}

// qmd's reply payload to the request, checked; nothing when it is not the
// expected one.
std::optional<qm::Bytes> probe(const std::string& path, qm::Bytes frame, const BenchRequest& request) {
    auto client = RoundTripClient::connect(path);
    if (!client) {
        return std::nullopt;
    }
    const qm::Bytes* payload = client->roundTrip(frame);
    if (!payload) {
        return std::nullopt;
    }
    auto reply = qm::cbor::decode(*payload);
    if (!reply || !request.replyIsExpected(*reply)) {
        std::fprintf(stderr, "qmd_bench: unexpected reply to %s: %s\n", request.label.c_str(),
                     reply ? reply->description().c_str() : reply.error().text().c_str());
        return std::nullopt;
    }
    return *payload;
}

bool measureMode(bool pinned, const std::string& scratch, std::chrono::milliseconds duration, std::vector<Row>& rows) {
    ChildProcess daemon = startDaemon(scratch);
    std::string qmdPath = scratch + "/duct/" + kServiceName;
    if (!waitForSocket(qmdPath, daemon)) {
        std::fprintf(stderr, "qmd_bench: qmd did not start; see %s/qmd.log\n", scratch.c_str());
        return false;
    }
    for (const BenchRequest& request : benchRequests(qmdPath, scratch)) {
        std::shared_ptr<void> prepared = request.prepare ? request.prepare(qmdPath) : nullptr;
        if (request.prepare && !prepared) {
            std::fprintf(stderr, "qmd_bench: could not set qmd up for %s\n", request.label.c_str());
            return false;
        }
        qm::Bytes frame = *qm::duct::encodeFrame(qm::duct::FrameKind::message, 1, request.message);
        auto replyPayload = probe(qmdPath, frame, request);
        if (!replyPayload) {
            return false;
        }
        std::string echoPath = scratch + "/echo.sock";
        ChildProcess echo = startEchoServer(echoPath, *replyPayload);
        if (!waitForSocket(echoPath, echo)) {
            std::fputs("qmd_bench: the echo server did not start\n", stderr);
            return false;
        }
        for (int clients : {1, 8}) {
            Row row{request.label, clients, pinned, frame.size(), qm::duct::kFrameHeaderSize + replyPayload->size(),
                    {}, {}};
            row.echo = runLoad(echoPath, frame, clients, duration);
            row.qmd = runLoad(qmdPath, frame, clients, duration);
            if (!row.echo.ok || !row.qmd.ok) {
                std::fprintf(stderr, "qmd_bench: a connection broke while measuring %s\n", request.label.c_str());
                return false;
            }
            rows.push_back(row);
        }
    }
    return true;
}

#ifdef QM_ALLOC_COUNTER_PATH
// The preloaded counter's total so far, after asking qmd for it.
std::optional<unsigned long long> allocationCount(ChildProcess& daemon, const std::string& countFile) {
    std::filesystem::remove(countFile);
    ::kill(daemon.pid(), SIGUSR2);
    for (int i = 0; i < 200; ++i) {
        if (std::FILE* file = std::fopen(countFile.c_str(), "r")) {
            unsigned long long count = 0;
            bool read = std::fscanf(file, "%llu", &count) == 1;
            std::fclose(file);
            if (read) {
                return count;
            }
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return std::nullopt;
}

// Allocations per request, from the counter preloaded into a qmd of its own;
// one blocking client, after a warm-up, so that only the request path counts.
bool measureAllocations(const std::string& scratch, std::vector<AllocationRow>& rows) {
    std::string countFile = scratch + "/allocations";
    ChildProcess daemon =
        startDaemon(scratch, {{"LD_PRELOAD", QM_ALLOC_COUNTER_PATH}, {"QM_ALLOCATION_COUNT_FILE", countFile}});
    std::string path = scratch + "/duct/" + kServiceName;
    if (!waitForSocket(path, daemon)) {
        std::fputs("qmd_bench: qmd with the allocation counter did not start\n", stderr);
        return false;
    }
    constexpr int kWarmUp = 1000;
    constexpr int kCounted = 20000;
    for (const BenchRequest& request : benchRequests(path, scratch)) {
        // The request path itself: what writes files is left out.
        if (request.label != "envelope" && request.label != "bulk" && request.label != "match") {
            continue;
        }
        qm::Bytes frame = *qm::duct::encodeFrame(qm::duct::FrameKind::message, 1, request.message);
        auto client = RoundTripClient::connect(path);
        for (int i = 0; client && i < kWarmUp; ++i) {
            client->roundTrip(frame);
        }
        auto before = allocationCount(daemon, countFile);
        bool ok = client && before;
        for (int i = 0; ok && i < kCounted; ++i) {
            ok = client->roundTrip(frame) != nullptr;
        }
        auto after = allocationCount(daemon, countFile);
        if (!ok || !after) {
            std::fprintf(stderr, "qmd_bench: counting allocations of %s failed\n", request.label.c_str());
            return false;
        }
        rows.push_back({request.label, static_cast<double>(*after - *before) / kCounted});
    }
    return true;
}
#endif

// Mean time per round trip, qmd over echo.
double timeRatio(const Row& row) {
    return row.echo.roundTripsPerSecond / row.qmd.roundTripsPerSecond;
}

double p50Ratio(const Row& row) {
    return row.qmd.p50Micros / row.echo.p50Micros;
}

void printAllocations(const std::vector<AllocationRow>& rows) {
    if (rows.empty()) {
        std::printf("\nallocations per request: not measured (sanitized build)\n");
        return;
    }
    std::printf("\nheap allocations per request in qmd (all threads, one client):");
    for (const AllocationRow& row : rows) {
        std::printf("  %s %.1f", row.request.c_str(), row.perRequest);
    }
    std::printf("\n");
}

// Whether the run paid for log lines: syslog(3) is skipped while no log
// daemon listens on /dev/log, and "bulk" logs one line per request.
void printLogNote() {
    struct stat info{};
    if (::stat("/dev/log", &info) == 0) {
        std::printf("log lines: written to the system log (/dev/log present); \"bulk\" paid for one per request\n");
    } else {
        std::printf("log lines: skipped, no log daemon listens on /dev/log; \"bulk\" would write one per request\n");
    }
}

void printTable(const std::vector<Row>& rows, double seconds) {
    std::printf("qmd beside a raw Unix-socket echo of the same frames, %.1f s per figure\n", seconds);
    std::printf("pinned: daemon, echo server and clients on CPU 0; unpinned: no affinity\n\n");
    std::printf("%-12s %7s %-8s %9s | %10s %8s %8s | %10s %8s %8s | %9s %7s\n", "request", "clients", "cpu",
                "frames B", "qmd rt/s", "p50 us", "p99 us", "echo rt/s", "p50 us", "p99 us", "qmd/echo", "p50");
    for (const Row& row : rows) {
        std::string frames = std::to_string(row.requestBytes) + "/" + std::to_string(row.replyBytes);
        std::printf("%-12s %7d %-8s %9s | %10.0f %8.1f %8.1f | %10.0f %8.1f %8.1f | %8.2fx %6.2fx\n",
                    row.request.c_str(), row.clients, row.pinned ? "pinned" : "unpinned", frames.c_str(),
                    row.qmd.roundTripsPerSecond, row.qmd.p50Micros, row.qmd.p99Micros, row.echo.roundTripsPerSecond,
                    row.echo.p50Micros, row.echo.p99Micros, timeRatio(row), p50Ratio(row));
    }
    std::printf("\nqmd/echo: time per round trip (echo rt/s over qmd rt/s); p50: qmd p50 over echo p50\n");
    const Row* plain = nullptr;
    const Row* held = nullptr;
    for (const Row& row : rows) {
        if (row.pinned && row.clients == 1) {
            plain = row.request == "match" ? &row : plain;
            held = row.request == "match+holds" ? &row : held;
        }
    }
    if (plain && held) {
        double slower = plain->qmd.roundTripsPerSecond / held->qmd.roundTripsPerSecond - 1;
        std::printf("target: match with %d holds in place at most 10%% slower, pinned: %+.1f%% (%s)\n", kHolds,
                    100 * slower, slower <= 0.10 ? "met" : "missed");
    }
    for (const Row& row : rows) {
        if (row.pinned && row.clients == 1 && (row.request == "envelope" || row.request == "match")) {
            double target = row.request == "match" ? 1.5 : 1.2;
            std::printf("target: %s, pinned, 1 client, at most %.1fx the echo: %.2fx (%s)\n", row.request.c_str(),
                        target, timeRatio(row), timeRatio(row) <= target ? "met" : "missed");
        }
    }
}

}  // namespace

int runBench(const BenchOptions& options) {
    char scratchTemplate[] = "/tmp/qmd-bench-XXXXXX";
    if (!::mkdtemp(scratchTemplate)) {
        std::perror("qmd_bench: mkdtemp");
        return 1;
    }
    std::string scratch = scratchTemplate;
    for (const char* dir : {"/duct", "/roots", "/sdks", "/data", "/config", "/state"}) {
        ::mkdir((scratch + dir).c_str(), 0700);
    }
    writeMatchedPlugIns(scratch + "/roots");
    cpu_set_t everywhere;
    CPU_ZERO(&everywhere);
    ::sched_getaffinity(0, sizeof everywhere, &everywhere);
    cpu_set_t cpuZero;
    CPU_ZERO(&cpuZero);
    CPU_SET(0, &cpuZero);

    auto duration = std::chrono::milliseconds(static_cast<long long>(options.secondsPerFigure * 1000));
    std::vector<Row> rows;
    std::vector<AllocationRow> allocations;
    bool ok = setAffinity(cpuZero) && measureMode(true, scratch, duration, rows);
    ok = ok && setAffinity(everywhere) && measureMode(false, scratch, duration, rows);
#ifdef QM_ALLOC_COUNTER_PATH
    ok = ok && measureAllocations(scratch, allocations);
#endif
    if (ok) {
        printTable(rows, options.secondsPerFigure);
        printAllocations(allocations);
        printLogNote();
    }
    std::error_code ignored;
    if (ok) {
        std::filesystem::remove_all(scratch, ignored);
    }
    return ok ? 0 : 1;
}
