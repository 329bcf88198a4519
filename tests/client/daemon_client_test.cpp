// QMDaemonClient against a scripted daemon: the keys each request sends, and
// what the library makes of every kind of reply, good or bad.

#include <sys/socket.h>
#include <sys/un.h>

#include <gtest/gtest.h>

#include <cerrno>
#include <condition_variable>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <thread>

#include "client/QMDaemonClient.h"
#include "platform/duct/CborCodec.h"
#include "platform/duct/Frame.h"
#include "platform/log/SystemLog.h"
#include "support/TempDir.h"

using qm::Array;
using qm::Dictionary;
using qm::Value;

namespace {

using namespace std::chrono_literals;

// What the scripted daemon does with one request.
struct Action {
    enum class Kind { reply, rawBytes, ignore, hangUp };
    Kind kind = Kind::reply;
    Value reply;
    qm::Bytes bytes;

    static Action answer(Value value) { return {Kind::reply, std::move(value), {}}; }
    static Action raw(qm::Bytes bytes) { return {Kind::rawBytes, Value(), std::move(bytes)}; }
    static Action ignore() { return {Kind::ignore, Value(), {}}; }
    static Action hangUp() { return {Kind::hangUp, Value(), {}}; }
};

// A daemon on a real socket in the runtime directory that serves one
// connection with a script, and records every request it reads.
class FakeDaemon {
public:
    using Script = std::function<Action(std::size_t index, std::uint64_t id, const Value& request)>;

    FakeDaemon(const std::string& runtimeDirectory, const std::string& serviceName, Script script)
        : script_(std::move(script)) {
        listener_.reset(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        std::string path = runtimeDirectory + "/" + serviceName;
        std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
        EXPECT_EQ(::bind(listener_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
        EXPECT_EQ(::listen(listener_.get(), 4), 0);
        thread_ = std::thread([this] { serve(); });
    }

    ~FakeDaemon() {
        ::shutdown(listener_.get(), SHUT_RDWR);
        {
            std::lock_guard lock(mutex_);
            if (connection_) {
                ::shutdown(connection_.get(), SHUT_RDWR);
            }
        }
        thread_.join();
    }

    std::vector<Value> requests() {
        std::lock_guard lock(mutex_);
        return requests_;
    }

    bool waitForRequests(std::size_t count) {
        std::unique_lock lock(mutex_);
        return changed_.wait_for(lock, 5s, [&] { return requests_.size() >= count; });
    }

private:
    void serve() {
        int fd = ::accept4(listener_.get(), nullptr, nullptr, SOCK_CLOEXEC);
        if (fd < 0) {
            return;
        }
        {
            std::lock_guard lock(mutex_);
            connection_.reset(fd);
        }
        for (std::size_t index = 0;; ++index) {
            std::uint8_t header[qm::duct::kFrameHeaderSize];
            if (!readExactly(header, sizeof header)) {
                return;
            }
            auto h = qm::duct::readFrameHeader(header);
            qm::Bytes payload(h.payloadLength);
            if (!readExactly(payload.data(), payload.size())) {
                return;
            }
            auto request = qm::cbor::decode(payload);
            EXPECT_TRUE(request.ok());
            Value body = request ? *request : Value();
            Action action = script_(index, h.messageId, body);
            {
                std::lock_guard lock(mutex_);
                requests_.push_back(body);
                changed_.notify_all();
            }
            switch (action.kind) {
                case Action::Kind::reply: write(*qm::duct::encodeFrame(qm::duct::FrameKind::reply, h.messageId, action.reply)); break;
                case Action::Kind::rawBytes: write(action.bytes); break;
                case Action::Kind::ignore: break;
                case Action::Kind::hangUp: {
                    std::lock_guard lock(mutex_);
                    connection_.reset();
                    return;
                }
            }
        }
    }

    bool readExactly(std::uint8_t* into, std::size_t size) {
        std::size_t got = 0;
        while (got < size) {
            ssize_t n = ::recv(connection_.get(), into + got, size - got, 0);
            if (n <= 0) {
                return false;
            }
            got += static_cast<std::size_t>(n);
        }
        return true;
    }

    void write(const qm::Bytes& bytes) {
        ssize_t n = ::send(connection_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
        EXPECT_EQ(n, static_cast<ssize_t>(bytes.size()));
    }

    Script script_;
    qm::UniqueFd listener_;
    qm::UniqueFd connection_;
    std::thread thread_;
    std::mutex mutex_;
    std::condition_variable changed_;
    std::vector<Value> requests_;
};

Action answerEmpty(std::size_t, std::uint64_t, const Value&) {
    return Action::answer(Value(Dictionary{}));
}

class DaemonClient : public ::testing::Test {
protected:
    void SetUp() override {
        ::setenv("QM_DUCT_DIR", scratch_.path().c_str(), 1);
        qm::setLogObserver([this](int, std::string_view line) {
            std::lock_guard lock(logMutex_);
            logLines_.emplace_back(line);
        });
    }
    void TearDown() override {
        qm::setLogObserver(nullptr);
        ::unsetenv("QM_DUCT_DIR");
    }

    std::unique_ptr<FakeDaemon> startDaemon(FakeDaemon::Script script, const std::string& name = "test.qmd") {
        return std::make_unique<FakeDaemon>(scratch_.path(), name, std::move(script));
    }

    std::unique_ptr<QMDaemonClient> connect(const char* name = "test.qmd") {
        auto client = QMDaemonClient::initWithServiceName(name, 5000ms);
        EXPECT_TRUE(client.ok()) << (client.ok() ? "" : client.error().text());
        return client.ok() ? std::move(client).value() : nullptr;
    }

    std::vector<std::string> logLines() {
        std::lock_guard lock(logMutex_);
        return logLines_;
    }

    bool waitForLogLine(const std::string& line) {
        for (int i = 0; i < 500; ++i) {
            auto lines = logLines();
            if (std::find(lines.begin(), lines.end(), line) != lines.end()) {
                return true;
            }
            std::this_thread::sleep_for(10ms);
        }
        return false;
    }

    qmtest::TempDir scratch_;
    std::mutex logMutex_;
    std::vector<std::string> logLines_;
};

qm::Result<Value> wait(QMDaemonClient& client, const std::function<void(QMDaemonClient::ReplyHandler)>& start) {
    return client.waitForReply(start, 5000ms);
}

Value dictionary(std::initializer_list<Dictionary::Entry> entries) {
    return Value(Dictionary(entries));
}

TEST_F(DaemonClient, EveryRequestOperationSendsItsEnvelopeAndKeys) {
    auto daemon = startDaemon(answerEmpty);
    auto client = connect();
    ASSERT_TRUE(client);
    qm::Uuid u1 = qm::Uuid::random();
    qm::Uuid u2 = qm::Uuid::random();
    Dictionary rules{{"VTExtensionPointName", "ovaro.share"}};
    Dictionary annotations{{"election", 1}};
    std::vector<std::string> paths{"/a/b.xbun", "/c"};
    auto& c = *client;

    std::vector<std::function<void(QMDaemonClient::ReplyHandler)>> calls = {
        [&](auto h) { c.addPlugIns(paths, h); },
        [&](auto h) { c.removePlugIns(paths, h); },
        [&](auto h) { c.bulkPlugins(0x8000000000000005u, h); },
        [&](auto h) { c.readyPlugIns({u1, u2}, 7, h); },
        [&](auto h) { c.accessPlugIns({u2, u1}, 0, h); },
        [&](auto h) { c.matchPlugIns(rules, 2, h); },
        [&](auto h) { c.setPluginAnnotations({u1}, annotations, h); },
        [&](auto h) { c.holdPlugins(paths, 1, h); },
        [&](auto h) { c.releaseHold(u2, h); },
    };
    for (const auto& call : calls) {
        auto reply = wait(c, call);
        ASSERT_TRUE(reply.ok()) << reply.error().text();
        EXPECT_FALSE(QMDaemonClient::errorInReply(reply).has_value());
    }

    Value v3(std::uint64_t{3});
    Value pathArray(Array{Value("/a/b.xbun"), Value("/c")});
    const Value expected[] = {
        dictionary({{"request", "add"}, {"version", v3}, {"paths", pathArray}}),
        dictionary({{"request", "remove"}, {"version", v3}, {"paths", pathArray}}),
        dictionary({{"request", "bulk"}, {"version", v3}, {"flags", std::uint64_t{0x8000000000000005u}}}),
        dictionary({{"request", "ready"}, {"version", v3}, {"uuids", Value(Array{u1, u2})}, {"flags", std::uint64_t{7}}}),
        dictionary({{"request", "access"}, {"version", v3}, {"uuids", Value(Array{u2, u1})}, {"flags", std::uint64_t{0}}}),
        dictionary({{"request", "match"}, {"version", v3}, {"rules", Value(rules)}, {"flags", std::uint64_t{2}}}),
        dictionary({{"request", "annotate"}, {"version", v3}, {"uuids", Value(Array{u1})}, {"annotations", Value(annotations)}}),
        dictionary({{"request", "lock"}, {"version", v3}, {"paths", pathArray}, {"flags", std::uint64_t{1}}}),
        dictionary({{"request", "lock"}, {"version", v3}, {"uuids", Value(Array{u2})}}),
    };
    auto requests = daemon->requests();
    ASSERT_EQ(requests.size(), std::size(expected));
    for (std::size_t i = 0; i < requests.size(); ++i) {
        EXPECT_EQ(requests[i], expected[i]) << requests[i].description();
        // The wire types, not only the numeric values.
        EXPECT_EQ(requests[i].get("version")->type(), qm::ValueType::unsignedInteger);
        if (const Value* flags = requests[i].get("flags")) {
            EXPECT_EQ(flags->type(), qm::ValueType::unsignedInteger);
        }
        if (const Value* uuids = requests[i].get("uuids")) {
            for (const Value& uuid : *uuids->asArray()) {
                EXPECT_EQ(uuid.type(), qm::ValueType::uuid);
            }
        }
    }
}

TEST_F(DaemonClient, TheProtocolVersionGoesIntoEveryRequest) {
    auto daemon = startDaemon(answerEmpty);
    auto client = connect();
    ASSERT_TRUE(client);
    EXPECT_EQ(client->protocolVersion(), 3);
    client->setProtocolVersion(2);
    ASSERT_TRUE(wait(*client, [&](auto h) { client->bulkPlugins(0, h); }).ok());
    QMDaemonClient::Message message = client->request("x-anything");
    QMDaemonClient::setUuids(message, {qm::Uuid()});
    ASSERT_TRUE(client->sendAndWait(message, 5000ms).ok());
    auto requests = daemon->requests();
    ASSERT_EQ(requests.size(), 2u);
    EXPECT_EQ(*requests[0].get("version"), Value(std::uint64_t{2}));
    EXPECT_EQ(requests[1], dictionary({{"request", "x-anything"},
                                       {"version", std::uint64_t{2}},
                                       {"uuids", Value(Array{qm::Uuid()})}}));
}

TEST_F(DaemonClient, HandlersRunOnTheReplyQueueInReplyOrder) {
    auto daemon = startDaemon(answerEmpty);
    auto client = connect();
    ASSERT_TRUE(client);
    std::mutex mutex;
    std::condition_variable done;
    std::vector<int> order;
    bool allOnQueue = true;
    for (int i = 0; i < 20; ++i) {
        client->bulkPlugins(static_cast<std::uint64_t>(i), [&, i](qm::Result<Value> reply) {
            std::lock_guard lock(mutex);
            allOnQueue = allOnQueue && client->replyQueue().isCurrent() && reply.ok();
            order.push_back(i);
            done.notify_all();
        });
    }
    std::unique_lock lock(mutex);
    ASSERT_TRUE(done.wait_for(lock, 5s, [&] { return order.size() == 20; }));
    EXPECT_TRUE(allOnQueue);
    for (int i = 0; i < 20; ++i) {
        EXPECT_EQ(order[static_cast<std::size_t>(i)], i);
    }
    EXPECT_EQ(client->replyQueue().label(), "qmd_client");
}

TEST_F(DaemonClient, ErrorRepliesBecomeQuamberErrorsWithTheirCodeAndMessage) {
    struct Case {
        Value reply;
        std::optional<std::int64_t> code;  // nothing: success
        std::string message;
    };
    const std::vector<Case> cases = {
        {dictionary({{"errorcode", std::uint64_t{14}}, {"error", "plug-ins are busy"}, {"conflicts", Value(Array{})}}),
         14, "plug-ins are busy"},
        {dictionary({{"errorcode", std::uint64_t{9}}}), 9, "unknown error returned by Quamber subsystem"},
        {dictionary({}), std::nullopt, ""},
        {dictionary({{"errorcode", std::uint64_t{0}}}), std::nullopt, ""},
        {dictionary({{"matches", Value::packed(Value(Array{}))}}), std::nullopt, ""},
        // The daemon sign-extends negative codes; they come back unchanged.
        {dictionary({{"errorcode", std::uint64_t{0xfffffffffffffffeu}}, {"error", "negative"}}), -2, "negative"},
        // Only the low 32 bits are the code.
        {dictionary({{"errorcode", std::uint64_t{0x100000007u}}, {"error", "seven"}}), 7, "seven"},
        // Inconsistent replies are errors, never crashes.
        {dictionary({{"error", "no code given"}}), 4, "qmd reported error without a code: no code given"},
        {dictionary({{"errorcode", std::uint64_t{0}}, {"error", "zero"}}), 4, "qmd reported error without a code: zero"},
        {dictionary({{"errorcode", "14"}}), 4, "qmd sent an error code that is not an integer: 14"},
        {Value(Array{Value(1)}), 4, "qmd sent a reply that is not a dictionary: (1)"},
        {Value("text"), 4, "qmd sent a reply that is not a dictionary: text"},
    };
    auto daemon = startDaemon([&cases](std::size_t index, std::uint64_t, const Value&) {
        return Action::answer(cases[index].reply);
    });
    auto client = connect();
    ASSERT_TRUE(client);
    for (const Case& c : cases) {
        auto reply = wait(*client, [&](auto h) { client->bulkPlugins(0, h); });
        ASSERT_TRUE(reply.ok()) << reply.error().text();
        EXPECT_EQ(*reply, c.reply);
        auto error = QMDaemonClient::errorInReply(reply);
        if (!c.code) {
            EXPECT_FALSE(error.has_value()) << c.reply.description() << " gave " << error->text();
            continue;
        }
        ASSERT_TRUE(error.has_value()) << c.reply.description();
        EXPECT_EQ(error->domain, "Quamber");
        EXPECT_EQ(error->code, *c.code) << c.reply.description();
        EXPECT_EQ(error->text(), c.message);
    }
}

TEST_F(DaemonClient, ATransportErrorBecomesCodeFourWithItsDescription) {
    qm::Result<Value> transport(qm::Error{"duct", ECONNRESET, "connection invalid: daemon closed the connection"});
    auto error = QMDaemonClient::errorInReply(transport);
    ASSERT_TRUE(error.has_value());
    EXPECT_EQ(error->domain, "Quamber");
    EXPECT_EQ(error->code, 4);
    EXPECT_EQ(error->text(), "connection invalid: daemon closed the connection");
}

TEST_F(DaemonClient, GarbageFromTheDaemonFailsEveryPendingRequest) {
    auto daemon = startDaemon([](std::size_t index, std::uint64_t id, const Value&) {
        if (index < 2) {
            return Action::ignore();
        }
        qm::Bytes garbage(qm::duct::kFrameHeaderSize);
        qm::duct::writeFrameHeader(garbage.data(), {4, 2, id});
        garbage.insert(garbage.end(), {0xde, 0xad, 0xbe, 0xef});
        return Action::raw(garbage);
    });
    auto client = connect();
    ASSERT_TRUE(client);
    std::mutex mutex;
    std::condition_variable done;
    std::vector<qm::Result<Value>> replies;
    for (int i = 0; i < 3; ++i) {
        client->bulkPlugins(0, [&](qm::Result<Value> reply) {
            std::lock_guard lock(mutex);
            replies.push_back(std::move(reply));
            done.notify_all();
        });
    }
    {
        std::unique_lock lock(mutex);
        ASSERT_TRUE(done.wait_for(lock, 5s, [&] { return replies.size() == 3; }));
    }
    for (const auto& reply : replies) {
        ASSERT_FALSE(reply.ok());
        EXPECT_EQ(reply.error().domain, "duct");
        auto error = QMDaemonClient::errorInReply(reply);
        ASSERT_TRUE(error.has_value());
        EXPECT_EQ(error->code, 4);
        EXPECT_EQ(error->text().rfind("connection invalid: undecodable reply", 0), 0u) << error->text();
    }
    bool logged = false;
    for (int i = 0; i < 500 && !logged; ++i) {
        for (const auto& line : logLines()) {
            logged = logged || line.rfind("Communications error: connection invalid: undecodable reply", 0) == 0;
        }
        std::this_thread::sleep_for(10ms);
    }
    EXPECT_TRUE(logged);
}

TEST_F(DaemonClient, ADaemonThatHangsUpMidRequestFailsItAndEveryLaterRequest) {
    auto daemon = startDaemon([](std::size_t index, std::uint64_t, const Value&) {
        return index == 0 ? Action::answer(Value(Dictionary{})) : Action::hangUp();
    });
    auto client = connect();
    ASSERT_TRUE(client);
    ASSERT_TRUE(wait(*client, [&](auto h) { client->bulkPlugins(0, h); }).ok());
    auto dying = wait(*client, [&](auto h) { client->matchPlugIns({}, 0, h); });
    ASSERT_FALSE(dying.ok());
    EXPECT_EQ(dying.error().text(), "connection invalid: daemon closed the connection");
    EXPECT_TRUE(waitForLogLine("Communications error: connection invalid: daemon closed the connection"));

    auto later = wait(*client, [&](auto h) { client->bulkPlugins(0, h); });
    ASSERT_FALSE(later.ok());
    EXPECT_EQ(later.error().text(), "connection invalid: daemon closed the connection");
    EXPECT_EQ(daemon->requests().size(), 2u);
}

TEST_F(DaemonClient, AReplyThatNeverComesIsATimeoutForTheBlockingCall) {
    auto daemon = startDaemon([](std::size_t, std::uint64_t, const Value&) { return Action::ignore(); });
    auto client = connect();
    ASSERT_TRUE(client);
    auto reply = client->sendAndWait(client->request("bulk"), 100ms);
    ASSERT_FALSE(reply.ok());
    EXPECT_EQ(reply.error().domain, "duct");
    EXPECT_EQ(reply.error().code, ETIMEDOUT);
    EXPECT_EQ(reply.error().text(), "no reply from qmd within 100 ms");
    EXPECT_EQ(QMDaemonClient::errorInReply(reply)->code, 4);
}

TEST_F(DaemonClient, AServiceThatIsNotThereCannotBeConnected) {
    auto client = QMDaemonClient::initWithServiceName("nobody.qmd");
    ASSERT_FALSE(client.ok());
    EXPECT_EQ(client.error().domain, "duct");
    EXPECT_EQ(client.error().code, ENOENT);
}

TEST_F(DaemonClient, NoServiceNameMeansTheDefaultService) {
    auto daemon = startDaemon(answerEmpty, "ovaro.quamber.qmd");
    auto client = connect(nullptr);
    ASSERT_TRUE(client);
    EXPECT_TRUE(wait(*client, [&](auto h) { client->bulkPlugins(0, h); }).ok());
}

TEST_F(DaemonClient, PackingHappensOnlyAtVersionThree) {
    Value forms(Array{dictionary({{"id", "a"}}), dictionary({{"id", "b"}, {"n", 2}})});
    EXPECT_FALSE(QMDaemonClient::convertToDuct(forms, 2).has_value());
    EXPECT_FALSE(QMDaemonClient::convertToDuct(forms, 4).has_value());
    auto packed = QMDaemonClient::convertToDuct(forms, 3);
    ASSERT_TRUE(packed.has_value());
    EXPECT_EQ(packed->type(), qm::ValueType::packed);

    auto daemon = startDaemon(answerEmpty);
    auto client = connect();
    ASSERT_TRUE(client);
    auto unpacked = client->convertFromDuct(*packed);
    ASSERT_TRUE(unpacked.has_value());
    EXPECT_EQ(*unpacked, forms);
    EXPECT_FALSE(client->convertFromDuct(forms).has_value()) << "not a packed value";
    client->setProtocolVersion(2);
    EXPECT_FALSE(client->convertFromDuct(*packed).has_value());
}

TEST_F(DaemonClient, APackedValueSurvivesTheWire) {
    Value forms(Array{dictionary({{"uuid", "x"}, {"date", qm::Date{1e9}}})});
    auto daemon = startDaemon([&forms](std::size_t, std::uint64_t, const Value&) {
        return Action::answer(dictionary({{"matches", *QMDaemonClient::convertToDuct(forms, 3)}}));
    });
    auto client = connect();
    ASSERT_TRUE(client);
    auto reply = wait(*client, [&](auto h) { client->matchPlugIns({}, 0, h); });
    ASSERT_TRUE(reply.ok());
    auto matches = client->convertFromDuct(*reply->get("matches"));
    ASSERT_TRUE(matches.has_value());
    EXPECT_EQ(*matches, forms);
}

}  // namespace
