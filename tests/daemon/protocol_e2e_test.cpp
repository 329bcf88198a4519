// The request envelope as a client sees it: versions, names, replies, logging.

#include <gtest/gtest.h>

#include "support/DaemonProcess.h"
#include "support/RawClient.h"

using qmtest::DaemonOptions;
using qmtest::DaemonProcess;
using qmtest::RawClient;
using qmtest::errorCode;
using qmtest::errorText;
using qmtest::request;

namespace {

qm::Value roundTrip(RawClient& client, const qm::Value& message) {
    auto reply = client.roundTrip(message);
    EXPECT_TRUE(reply.has_value()) << "no reply to " << message.description();
    return reply.value_or(qm::Value());
}

TEST(Protocol, UnsupportedVersionsAreRefusedWithTheVersionInTheMessage) {
    DaemonProcess daemon;
    RawClient client(daemon.socketPath());
    struct Case {
        qm::Value message;
        const char* expected;
    };
    const Case cases[] = {
        {request({{"request", "bulk"}, {"version", std::uint64_t{1}}}), "unsupported protocol version 1 (current 3)"},
        {request({{"request", "bulk"}, {"version", std::uint64_t{4}}}), "unsupported protocol version 4 (current 3)"},
        {request({{"request", "bulk"}}), "unsupported protocol version 0 (current 3)"},
        {request({{"request", "bulk"}, {"version", "3"}}), "unsupported protocol version 0 (current 3)"},
        // Compared as 64 bits, reported as the low 32 bits.
        {request({{"request", "bulk"}, {"version", std::uint64_t{0x100000003}}}),
         "unsupported protocol version 3 (current 3)"},
        {request({{"request", "bulk"}, {"version", std::uint64_t{0xffffffff}}}),
         "unsupported protocol version -1 (current 3)"},
        // The version check comes first: a nameless request gets it too.
        {request({{"version", std::uint64_t{9}}}), "unsupported protocol version 9 (current 3)"},
    };
    for (const auto& c : cases) {
        qm::Value reply = roundTrip(client, c.message);
        EXPECT_EQ(errorCode(reply), 7u) << c.message.description();
        EXPECT_EQ(errorText(reply), c.expected);
    }
}

TEST(Protocol, VersionsTwoAndThreeAreServedAndBulkRepliesEmpty) {
    DaemonProcess daemon;
    RawClient client(daemon.socketPath());
    for (std::uint64_t version : {2u, 3u}) {
        qm::Value reply = roundTrip(client, request({{"request", "bulk"}, {"version", version}}));
        ASSERT_TRUE(reply.asDictionary());
        EXPECT_TRUE(reply.asDictionary()->empty()) << reply.description();
    }
    // A signed integer holding 3 is the same number.
    qm::Value reply = roundTrip(client, request({{"request", "bulk"}, {"version", std::int64_t{3}}}));
    EXPECT_FALSE(errorCode(reply).has_value());
}

TEST(Protocol, RequestNamesAreCheckedExactly) {
    DaemonProcess daemon;
    RawClient client(daemon.socketPath());
    auto v3 = [](qm::Value name) {
        qm::Dictionary d{{"version", std::uint64_t{3}}};
        if (!name.isNull()) {
            d.set("request", name);
        }
        return qm::Value(d);
    };
    qm::Value missing = roundTrip(client, v3(qm::Value()));
    EXPECT_EQ(errorCode(missing), 4u);
    EXPECT_EQ(errorText(missing), "invalid request format (missing type)");

    qm::Value wrongType = roundTrip(client, v3(qm::Value(std::uint64_t{5})));
    EXPECT_EQ(errorText(wrongType), "invalid request format (missing type)");

    for (const char* name : {"Bulk", "BULK", "bulk ", "", "frobnicate"}) {
        qm::Value reply = roundTrip(client, v3(qm::Value(name)));
        EXPECT_EQ(errorCode(reply), 4u) << name;
        EXPECT_EQ(errorText(reply), "unrecognized request") << name;
    }
}

TEST(Protocol, BulkLogsItsUnsupportedOptionsWhateverTheirValue) {
    DaemonProcess daemon;
    RawClient client(daemon.socketPath());
    roundTrip(client, request({{"request", "bulk"}, {"version", std::uint64_t{3}}}));
    roundTrip(client, request({{"request", "bulk"}, {"version", std::uint64_t{3}}, {"flags", std::uint64_t{0x1234500000abc}}}));
    EXPECT_TRUE(daemon.waitForLog("bulk options 0x0 not supported"));
    EXPECT_TRUE(daemon.waitForLog("bulk options 0xabc not supported"));
}

TEST(Protocol, RepliesComeInRequestOrderWithTheirIds) {
    DaemonProcess daemon;
    RawClient client(daemon.socketPath());
    std::vector<std::uint64_t> ids;
    for (int i = 0; i < 200; ++i) {
        ids.push_back(client.send(request({{"request", i % 2 ? "bulk" : "nope"}, {"version", std::uint64_t{3}}})));
    }
    for (int i = 0; i < 200; ++i) {
        auto frame = client.receive();
        ASSERT_TRUE(frame) << i;
        EXPECT_EQ(frame->kind, 2u);
        EXPECT_EQ(frame->id, ids[static_cast<std::size_t>(i)]);
        EXPECT_EQ(errorCode(frame->body).has_value(), i % 2 == 0);
    }
}

TEST(Protocol, AMessageThatIsNotAMapIsLoggedAndTheConnectionStays) {
    DaemonProcess daemon;
    RawClient client(daemon.socketPath());
    client.send(qm::Value(qm::Array{"request", "bulk"}));
    client.send(qm::Value("just text"));
    qm::Value reply = roundTrip(client, request({{"request", "bulk"}, {"version", std::uint64_t{3}}}));
    EXPECT_FALSE(errorCode(reply).has_value());
    EXPECT_TRUE(daemon.waitForLog("unexpected message (request, bulk) on connection"));
}

TEST(Protocol, VerbosityChoosesWhatIsLogged) {
    struct Case {
        std::vector<std::string> flags;
        bool debugLines;
        bool fullRequests;
    };
    for (const Case& c : {Case{{}, false, false}, Case{{"-v"}, true, false}, Case{{"-v", "-v"}, true, true}}) {
        DaemonProcess daemon(qmtest::withArguments(c.flags));
        RawClient client(daemon.socketPath());
        roundTrip(client, request({{"request", "bulk"}, {"version", std::uint64_t{3}}}));
        roundTrip(client, request({{"request", "nope"}, {"version", std::uint64_t{3}}}));
        ASSERT_TRUE(daemon.waitForLog("bulk options 0x0 not supported"));  // always written
        std::string pid = std::to_string(::getpid());
        EXPECT_EQ(daemon.waitForLog("client " + pid + " request bulk", std::chrono::milliseconds(300)), c.debugLines);
        EXPECT_EQ(daemon.log().find("client " + pid + " " + "/") != std::string::npos, c.debugLines);
        EXPECT_EQ(daemon.log().find("incoming request {request = nope; version = 3}") != std::string::npos,
                  c.fullRequests);
        EXPECT_EQ(daemon.log().find("Replying {error = \"unrecognized request\"; errorcode = 4}") != std::string::npos,
                  c.fullRequests)
            << daemon.log();
    }
}

TEST(Protocol, EveryThousandthRequestOfAClientIsCounted) {
    DaemonProcess daemon(qmtest::withArguments({"-v"}));
    RawClient client(daemon.socketPath());
    std::string line = "client " + std::to_string(::getpid()) + " used ";
    for (int i = 1; i <= 2000; ++i) {
        client.send(request({{"request", "nope"}, {"version", std::uint64_t{3}}}));
        if (i % 50 == 0) {
            for (int j = 0; j < 50; ++j) {
                ASSERT_TRUE(client.receive());
            }
        }
        if (i == 999) {
            EXPECT_EQ(daemon.log().find(line), std::string::npos);
        }
    }
    EXPECT_TRUE(daemon.waitForLog(line + "1000 requests so far"));
    EXPECT_TRUE(daemon.waitForLog(line + "2000 requests so far"));
    EXPECT_EQ(daemon.log().find(line + "999 "), std::string::npos);
}

}  // namespace
