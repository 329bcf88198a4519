// The request envelope as a client sees it: versions, names, replies,
// logging, and the wire format as another implementation speaks it.

#include <gtest/gtest.h>

#include <tuple>

#include "support/DaemonProcess.h"
#include "support/FramePeer.h"

using qmtest::DaemonProcess;
using qmtest::FramePeer;
using qmtest::bulk;
using qmtest::errorCode;
using qmtest::errorText;
using qmtest::request;

namespace {

// The envelope is checked in this order: the version, then the request's
// name. Requests sent back to back are answered in their order, with their
// ids; a message that is not a map is logged and skipped.
TEST(Protocol, EachRequestIsAnsweredInOrderOnceItsEnvelopeIsChecked) {
    DaemonProcess daemon;
    FramePeer client(daemon.socketPath());
    // {message, error code (nothing: served, with an empty reply), error text}
    auto named = [](qm::Value name) { return request({{"request", name}, {"version", std::uint64_t{3}}}); };
    const std::tuple<qm::Value, std::optional<std::uint64_t>, const char*> cases[] = {
        {bulk(3), std::nullopt, ""}, {bulk(2), std::nullopt, ""},
        {request({{"request", "bulk"}, {"version", std::int64_t{3}}}), std::nullopt, ""},  // the same number
        {request({{"request", "bulk"}, {"version", std::uint64_t{3}}, {"flags", std::uint64_t{0x1234500000abc}}}),
         std::nullopt, ""},
        {bulk(1), 7, "unsupported protocol version 1 (current 3)"},
        {bulk(4), 7, "unsupported protocol version 4 (current 3)"},
        {request({{"request", "bulk"}}), 7, "unsupported protocol version 0 (current 3)"},
        {request({{"request", "bulk"}, {"version", "3"}}), 7, "unsupported protocol version 0 (current 3)"},
        // Compared as 64 bits, reported as the low 32 bits.
        {bulk(0x100000003), 7, "unsupported protocol version 3 (current 3)"},
        {bulk(0xffffffff), 7, "unsupported protocol version -1 (current 3)"},
        {request({{"version", std::uint64_t{9}}}), 7, "unsupported protocol version 9 (current 3)"},
        {request({{"version", std::uint64_t{3}}}), 4, "invalid request format (missing type)"},
        {named(qm::Value(std::uint64_t{5})), 4, "invalid request format (missing type)"},
        {named("Bulk"), 4, "unrecognized request"}, {named("BULK"), 4, "unrecognized request"},
        {named("bulk "), 4, "unrecognized request"}, {named(""), 4, "unrecognized request"},
        {named("frobnicate"), 4, "unrecognized request"},
    };
    constexpr int kRounds = 12;
    std::vector<std::uint64_t> ids;
    for (int round = 0; round < kRounds; ++round) {
        client.send(qm::Value(qm::Array{"request", "bulk"}));
        for (const auto& c : cases) {
            ids.push_back(client.send(std::get<0>(c)));
        }
    }
    for (std::size_t i = 0; i < ids.size(); ++i) {
        const auto& [message, code, text] = cases[i % std::size(cases)];
        SCOPED_TRACE(message.description());
        auto frame = client.receive();
        ASSERT_TRUE(frame);
        EXPECT_EQ(frame->kind, 2u);
        EXPECT_EQ(frame->id, ids[i]);
        ASSERT_TRUE(frame->body.asDictionary());
        EXPECT_EQ(errorCode(frame->body), code);
        EXPECT_EQ(errorText(frame->body), text);
        EXPECT_EQ(frame->body.asDictionary()->size(), code ? 2u : 0u) << frame->body.description();
    }
    EXPECT_TRUE(daemon.waitForLog("unexpected message (request, bulk) on connection"));
    EXPECT_TRUE(daemon.waitForLog("bulk options 0x0 not supported"));
    EXPECT_TRUE(daemon.waitForLog("bulk options 0xabc not supported"));
}

// Debug lines include the count of every thousandth request of a client.
TEST(Protocol, VerbosityChoosesWhatIsLogged) {
    using Case = std::tuple<std::vector<std::string>, bool, bool>;  // flags, debug lines, full requests
    const qm::Value nope = request({{"request", "nope"}, {"version", std::uint64_t{3}}});
    const std::string client = "client " + std::to_string(::getpid()) + " ";
    for (const auto& [flags, debugLines, fullRequests] :
         {Case{{}, false, false}, Case{{"-v"}, true, false}, Case{{"-v", "-v"}, true, true}}) {
        DaemonProcess daemon(flags);
        FramePeer peer(daemon.socketPath());
        ASSERT_TRUE(peer.roundTrip(bulk()));
        ASSERT_TRUE(peer.roundTrip(nope));
        ASSERT_TRUE(daemon.waitForLog("bulk options 0x0 not supported"));  // always written
        EXPECT_EQ(daemon.waitForLog(client + "request bulk", std::chrono::milliseconds(300)), debugLines);
        EXPECT_EQ(daemon.log().find(client + "/") != std::string::npos, debugLines);
        EXPECT_EQ(daemon.log().find("incoming request {request = nope; version = 3}") != std::string::npos, fullRequests);
        EXPECT_EQ(daemon.log().find("Replying {error = \"unrecognized request\"; errorcode = 4}") != std::string::npos,
                  fullRequests);
        for (int i = 3; i <= 2000; ++i) {
            EXPECT_TRUE(i != 1000 || daemon.log().find(client + "used ") == std::string::npos) << "counted early";
            peer.send(nope);
            ASSERT_TRUE(peer.receive());
        }
        EXPECT_EQ(daemon.waitForLog(client + "used 2000 requests so far", std::chrono::milliseconds(debugLines ? 5000 : 300)),
                  debugLines);
        EXPECT_EQ(daemon.log().find(client + "used 1000 requests so far") != std::string::npos, debugLines);
        EXPECT_EQ(daemon.log().find(client + "used 999 "), std::string::npos);
    }
}

// The documented wire format, spoken by a client that shares no code with
// ours: Python's cbor2 and a struct-packed frame header.
TEST(WireFormat, AnIndependentPythonClientIsServed) {
    DaemonProcess daemon;
    auto result = qmtest::runProgram(
        {QM_SYSTEM_PYTHON, std::string(QM_SOURCE_DIR) + "/tests/daemon/wire_client.py", daemon.socketPath()});
    EXPECT_EQ(result.exitStatus, 0) << result.out << result.err;
    EXPECT_EQ(result.out, "");
}

}  // namespace
