// QMDaemonClient against a daemon that the test plays frame by frame: the
// keys each request sends, and what the library makes of every kind of reply.
// Transport failures are the transport's tests; the real daemon's are e2e.

#include <gtest/gtest.h>

#include <cerrno>
#include <functional>
#include <tuple>

#include "client/QMDaemonClient.h"
#include "support/FramePeer.h"
#include "support/LogCapture.h"
#include "support/ReplyCollector.h"
#include "support/ScopedEnvironment.h"
#include "support/TempDir.h"

using qm::Array;
using qm::Dictionary;
using qm::Value;
using qmtest::FramePeer;

namespace {

using namespace std::chrono_literals;

class DaemonClient : public ::testing::Test {
protected:
    // Connects a client to the service and takes the daemon's end.
    void connect(const char* name = "test.qmd") {
        qm::UniqueFd listener = FramePeer::listenAt(scratch_.file(name ? name : "ovaro.quamber.qmd"));
        auto client = QMDaemonClient::initWithServiceName(name, 5000ms);
        ASSERT_TRUE(client.ok()) << client.error().text();
        client_ = std::move(client).value();
        daemon_.emplace(FramePeer::accept(listener));
    }

    qmtest::TempDir scratch_;
    qmtest::ScopedEnvironment ductDirectory_{"QM_DUCT_DIR", scratch_.path()};
    qmtest::ReplyCollector replies_;  // outlives the client, which fails what is still pending
    std::unique_ptr<QMDaemonClient> client_;
    std::optional<FramePeer> daemon_;
};

// Handlers run on the reply queue in the order the replies come, which here
// is the reverse of the requests'. No service name means the default service.
TEST_F(DaemonClient, EveryRequestSendsItsEnvelopeAndKeysAndGetsItsOwnReply) {
    ASSERT_NO_FATAL_FAILURE(connect(nullptr));
    qm::Uuid u1 = qm::Uuid::random();
    qm::Uuid u2 = qm::Uuid::random();
    Dictionary rules{{"VTExtensionPointName", "ovaro.share"}};
    Dictionary annotations{{"election", 1}};
    std::vector<std::string> paths{"/a/b.xbun", "/c"};
    Value pathArray(Array{Value("/a/b.xbun"), Value("/c")});
    QMDaemonClient& c = *client_;
    auto envelope = [](const char* name, std::initializer_list<Dictionary::Entry> keys) {
        return Value(Dictionary(keys).changing("request", name).changing("version", std::uint64_t{3}));
    };
    const std::pair<std::function<void(QMDaemonClient::ReplyHandler)>, Value> cases[] = {
        {[&](auto h) { c.addPlugIns(paths, h); }, envelope("add", {{"paths", pathArray}})},
        {[&](auto h) { c.removePlugIns(paths, h); }, envelope("remove", {{"paths", pathArray}})},
        {[&](auto h) { c.bulkPlugins(0x8000000000000005u, h); },
         envelope("bulk", {{"flags", std::uint64_t{0x8000000000000005u}}})},
        {[&](auto h) { c.bulkPlugins(0, h); }, envelope("bulk", {{"flags", std::uint64_t{0}}})},
        {[&](auto h) { c.readyPlugIns({u1, u2}, 7, h); }, envelope("ready", {{"uuids", Value(Array{u1, u2})}, {"flags", 7u}})},
        {[&](auto h) { c.accessPlugIns({u2, u1}, 0, h); }, envelope("access", {{"uuids", Value(Array{u2, u1})}, {"flags", 0u}})},
        {[&](auto h) { c.matchPlugIns(rules, 2, h); }, envelope("match", {{"rules", Value(rules)}, {"flags", 2u}})},
        {[&](auto h) { c.setPluginAnnotations({u1}, annotations, h); },
         envelope("annotate", {{"uuids", Value(Array{u1})}, {"annotations", Value(annotations)}})},
        {[&](auto h) { c.holdPlugins(paths, 1, h); }, envelope("lock", {{"paths", pathArray}, {"flags", 1u}})},
        {[&](auto h) { c.releaseHold(u2, h); }, envelope("lock", {{"uuids", Value(Array{u2})}})},
    };
    std::vector<std::uint64_t> ids;
    for (int i = 0; i < static_cast<int>(std::size(cases)); ++i) {
        cases[i].first(replies_.handler(i, &c.replyQueue()));
        auto frame = daemon_->receive();
        ASSERT_TRUE(frame) << i;
        const Value& sent = frame->body;
        EXPECT_EQ(sent, cases[i].second) << sent.description();
        // The wire types, not only the numeric values.
        EXPECT_EQ(sent.get("version")->type(), qm::ValueType::unsignedInteger);
        if (const Value* flags = sent.get("flags")) {
            EXPECT_EQ(flags->type(), qm::ValueType::unsignedInteger);
        }
        for (const Value& uuid : sent.get("uuids") ? *sent.get("uuids")->asArray() : Array{}) {
            EXPECT_EQ(uuid.type(), qm::ValueType::uuid);
        }
        ids.push_back(frame->id);
    }
    for (int i = static_cast<int>(ids.size()) - 1; i >= 0; --i) {
        daemon_->reply(ids[static_cast<std::size_t>(i)], qmtest::request({{"n", i}}));
    }
    ASSERT_TRUE(replies_.waitForReplies(ids.size()));
    EXPECT_EQ(replies_.order(), (std::vector<int>{9, 8, 7, 6, 5, 4, 3, 2, 1, 0}));
    EXPECT_TRUE(replies_.ranOnTheirQueues());
    EXPECT_EQ(*replies_.reply(4), qmtest::request({{"n", 4}}));

    // Another version goes into every request, built ones included.
    c.setProtocolVersion(2);
    QMDaemonClient::Message message = c.request("x-anything");
    QMDaemonClient::setUuids(message, {qm::Uuid()});
    c.send(message, replies_.handler(10));
    auto frame = daemon_->receive();
    ASSERT_TRUE(frame);
    EXPECT_EQ(frame->body,
              qmtest::request({{"request", "x-anything"}, {"version", std::uint64_t{2}}, {"uuids", Value(Array{qm::Uuid()})}}));
}

TEST_F(DaemonClient, ErrorRepliesBecomeQuamberErrorsWithTheirCodeAndMessage) {
    // {reply, code (nothing: success), message}
    const std::tuple<qm::Result<Value>, std::optional<std::int64_t>, std::string> cases[] = {
        {qmtest::request({{"errorcode", std::uint64_t{14}}, {"error", "plug-ins are busy"}, {"conflicts", Value(Array{})}}),
         14, "plug-ins are busy"},
        {qmtest::request({{"errorcode", std::uint64_t{9}}}), 9, "unknown error returned by Quamber subsystem"},
        {qmtest::request({}), std::nullopt, ""},
        {qmtest::request({{"errorcode", std::uint64_t{0}}}), std::nullopt, ""},
        {qmtest::request({{"matches", Value::packed(Value(Array{}))}}), std::nullopt, ""},
        // The daemon sign-extends negative codes; they come back unchanged.
        {qmtest::request({{"errorcode", std::uint64_t{0xfffffffffffffffeu}}, {"error", "negative"}}), -2, "negative"},
        // Only the low 32 bits are the code.
        {qmtest::request({{"errorcode", std::uint64_t{0x100000007u}}, {"error", "seven"}}), 7, "seven"},
        // Inconsistent replies are errors, never crashes.
        {qmtest::request({{"error", "no code given"}}), 4, "qmd reported error without a code: no code given"},
        {qmtest::request({{"errorcode", std::uint64_t{0}}, {"error", "zero"}}), 4, "qmd reported error without a code: zero"},
        {qmtest::request({{"errorcode", "14"}}), 4, "qmd sent an error code that is not an integer: 14"},
        {Value(Array{Value(1)}), 4, "qmd sent a reply that is not a dictionary: (1)"},
        {Value("text"), 4, "qmd sent a reply that is not a dictionary: text"},
        // No reply at all: the transport's error is code 4 with its description.
        {qm::Error{"duct", ECONNRESET, "connection invalid: daemon closed the connection"}, 4,
         "connection invalid: daemon closed the connection"},
    };
    for (const auto& [reply, code, message] : cases) {
        SCOPED_TRACE(reply.ok() ? reply->description() : reply.error().text());
        auto error = QMDaemonClient::errorInReply(reply);
        if (!code) {
            EXPECT_FALSE(error.has_value()) << error->text();
            continue;
        }
        ASSERT_TRUE(error.has_value());
        EXPECT_EQ(error->domain, "Quamber");
        EXPECT_EQ(error->code, *code);
        EXPECT_EQ(error->text(), message);
    }
}

// What a lost connection does to pending and later requests is the
// transport's test; the library logs it, once.
TEST_F(DaemonClient, AReplyThatNeverComesTimesOutAndAHangUpIsLoggedOnce) {
    ASSERT_NO_FATAL_FAILURE(connect());
    auto reply = client_->sendAndWait(client_->request("bulk"), 100ms);
    ASSERT_FALSE(reply.ok());
    EXPECT_EQ(reply.error().domain, "duct");
    EXPECT_EQ(reply.error().code, ETIMEDOUT);
    EXPECT_EQ(reply.error().text(), "no reply from qmd within 100 ms");
    EXPECT_EQ(QMDaemonClient::errorInReply(reply)->code, 4);

    qmtest::LogCapture log;
    ASSERT_TRUE(daemon_->receive());
    daemon_->close();
    ASSERT_TRUE(log.waitFor("Communications error: connection invalid: daemon closed the connection"));
    client_->bulkPlugins(0, replies_.handler(1));
    ASSERT_TRUE(replies_.waitForReplies(1));
    EXPECT_EQ(log.countContaining("Communications error"), 1u);
}

// Forms travel packed (tag 24) at version 3 only, and survive the wire.
TEST_F(DaemonClient, PackingHappensOnlyAtVersionThree) {
    Value forms(Array{qmtest::request({{"id", "a"}, {"date", qm::Date{1e9}}}), qmtest::request({{"id", "b"}, {"n", 2}})});
    EXPECT_FALSE(QMDaemonClient::convertToDuct(forms, 2).has_value());
    EXPECT_FALSE(QMDaemonClient::convertToDuct(forms, 4).has_value());
    auto packed = QMDaemonClient::convertToDuct(forms, 3);
    ASSERT_TRUE(packed.has_value());
    EXPECT_EQ(packed->type(), qm::ValueType::packed);

    ASSERT_NO_FATAL_FAILURE(connect());
    auto reply = client_->waitForReply(
        [&](auto handler) {
            client_->matchPlugIns({}, 0, handler);
            auto frame = daemon_->receive();
            ASSERT_TRUE(frame);
            daemon_->reply(frame->id, qmtest::request({{"matches", *packed}}));
        },
        5000ms);
    ASSERT_TRUE(reply.ok()) << reply.error().text();
    auto matches = client_->convertFromDuct(*reply->get("matches"));
    ASSERT_TRUE(matches.has_value());
    EXPECT_EQ(*matches, forms);
    EXPECT_FALSE(client_->convertFromDuct(forms).has_value()) << "not a packed value";
    client_->setProtocolVersion(2);
    EXPECT_FALSE(client_->convertFromDuct(*packed).has_value());
}

}  // namespace
